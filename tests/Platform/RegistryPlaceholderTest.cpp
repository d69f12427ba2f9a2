// Placeholders and built-in applications.
#include "Platform/BundleReader.h"
#include "Platform/Foundation/Error.h"
#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::BundleRecord;
using platform::Dictionary;
using platform::Error;
using platform::Value;

class RegistryPlaceholder : public RegistryTest {
 protected:
  // A staged placeholder directory outside the system root's layout.
  std::string stagePlaceholder(const BundleSpec& bundle) {
    std::string path = staging_ / (bundle.identifier.empty() ? "unnamed.app" : bundle.identifier + ".app");
    makeBundle(path, bundle);
    return path;
  }
  bool installPlaceholder(platform::SQLiteApplicationRegistry& registry, const std::string& bundle,
                          const std::string& identifier, const platform::Data* metadata = nullptr,
                          Error* error = nullptr) {
    Dictionary options{{platform::kRegistryInstallTypeKey, Value(6u)},
                       {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                       {platform::kBundleIdentifierKey, Value(identifier)},
                       {"SkipBlacklist", Value(true)}};
    if (metadata) options[platform::kRegistryStoreMetadataKey] = Value(*metadata);
    return registry.installBundle(platform::URL::fileURL(bundle, true), options, error);
  }
  TempDir staging_{"staging"};
};

TEST_F(RegistryPlaceholder, IsCopiedWithStoreMetadataDataContainerAndNoGroups) {
  auto registry = openRegistry();
  std::string staged = stagePlaceholder(BundleSpec("com.example.game").withGroups({"group.game"}));
  const platform::Data metadata{'<', 'p', 0, 0xFF, '>'};
  Error error;
  ASSERT_TRUE(installPlaceholder(*registry, staged, "com.example.game", &metadata, &error)) << error.description();

  std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.game");
  ASSERT_TRUE(record);
  EXPECT_EQ(record->bundleType, platform::kBundleTypePlaceholder);
  EXPECT_TRUE(record->isPlaceholder);
  EXPECT_FALSE(record->groupContainerURLs) << "a placeholder's record has no group dictionary";
  ASSERT_TRUE(record->dataContainerURL);
  EXPECT_TRUE(isDirectory(record->dataContainerURL->path()));
  EXPECT_EQ(record->bundleURL.lastPathComponent(), "com.example.game.app");
  EXPECT_EQ(readFile(record->bundleURL.path() + "/Info.plist"), readFile(staged + "/Info.plist"));
  EXPECT_EQ(readFile(record->bundleContainerURL.path() + "/VendraMetadata.plist"), std::string("<p\0\xFF>", 5));
  EXPECT_TRUE(isDirectory(staged)) << "the caller removes its staged directory";
  EXPECT_TRUE(registry->isInstalled("com.example.game"));
  EXPECT_TRUE(entries(groupContainers()).empty());
}

TEST_F(RegistryPlaceholder, RealInstallationKeepsItsDataContainer) {
  auto registry = openRegistry();
  ASSERT_TRUE(installPlaceholder(*registry, stagePlaceholder(BundleSpec("com.example.game")), "com.example.game"));
  BundleRecord placeholder = *registry->recordForIdentifier("com.example.game");
  ASSERT_TRUE(writeFile(placeholder.dataContainerURL->path() + "/save.dat", "level 9"));

  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.game").withGroups({"group.game"})));
  BundleRecord real = *registry->recordForIdentifier("com.example.game");
  EXPECT_EQ(real.bundleType, platform::kBundleTypeUser);
  EXPECT_FALSE(real.isPlaceholder);
  EXPECT_EQ(real.dataContainerURL->path(), placeholder.dataContainerURL->path());
  EXPECT_EQ(readFile(real.dataContainerURL->path() + "/save.dat"), "level 9");
  EXPECT_FALSE(exists(placeholder.bundleContainerURL.path()));
  ASSERT_TRUE(real.groupContainerURLs);
  EXPECT_EQ(real.groupContainerURLs->size(), 1u);
}

TEST_F(RegistryPlaceholder, IdentityIsTheOptionsIdentifier) {
  auto registry = openRegistry();
  ASSERT_TRUE(installPlaceholder(*registry, stagePlaceholder(BundleSpec("com.example.inner")), "com.example.outer"));
  EXPECT_TRUE(registry->isInstalled("com.example.outer"));
  EXPECT_FALSE(registry->isInstalled("com.example.inner"));
  std::string anonymous = stagePlaceholder({});
  ASSERT_TRUE(installPlaceholder(*registry, anonymous, "com.example.anonymous"));
  EXPECT_TRUE(registry->recordForIdentifier("com.example.anonymous")->isPlaceholder);
}

TEST_F(RegistryPlaceholder, ReplacesAnEarlierPlaceholderButNotAnInstalledApplication) {
  auto registry = openRegistry();
  std::string staged = stagePlaceholder(BundleSpec("com.example.game"));
  ASSERT_TRUE(installPlaceholder(*registry, staged, "com.example.game"));
  BundleRecord first = *registry->recordForIdentifier("com.example.game");
  ASSERT_TRUE(installPlaceholder(*registry, staged, "com.example.game"));
  BundleRecord second = *registry->recordForIdentifier("com.example.game");
  EXPECT_EQ(second.dataContainerURL->path(), first.dataContainerURL->path());
  EXPECT_FALSE(exists(first.bundleContainerURL.path()));

  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.game")));
  Error error;
  EXPECT_FALSE(installPlaceholder(*registry, staged, "com.example.game", nullptr, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorNotReplaceable)) << error.description();
  EXPECT_FALSE(registry->recordForIdentifier("com.example.game")->isPlaceholder);
}

TEST_F(RegistryPlaceholder, MissingBundleOrBadMetadataIsRefused) {
  auto registry = openRegistry();
  Error error;
  EXPECT_FALSE(installPlaceholder(*registry, staging_ / "missing.app", "com.example.x", nullptr, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage)) << error.description();

  Dictionary options{{platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                     {platform::kBundleIdentifierKey, Value("com.example.x")},
                     {platform::kRegistryStoreMetadataKey, Value("not data")}};
  EXPECT_FALSE(registry->installBundle(platform::URL::fileURL(stagePlaceholder(BundleSpec("com.example.x")), true),
                                       options, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidOptions)) << error.description();
  EXPECT_FALSE(registry->isInstalled("com.example.x"));
  EXPECT_TRUE(entries(bundleContainers()).empty());
}

using RegistryBuiltIn = RegistryTest;

TEST_F(RegistryBuiltIn, IsInstalledWithADataContainerMadeOnFirstLookupUnlessItHasNone) {
  std::string bundle = makeBuiltIn("Weather.app", BundleSpec("com.example.weather").withVersion("3"));
  makeBuiltIn("Settings.app", BundleSpec("com.example.settings").withoutDataContainer());
  auto registry = openRegistry();
  ASSERT_TRUE(registry->recordForIdentifier("com.example.settings"));
  EXPECT_FALSE(registry->recordForIdentifier("com.example.settings")->dataContainerURL) << "RkNoDataContainer";
  EXPECT_TRUE(registry->isInstalled("com.example.weather"));
  EXPECT_TRUE(entries(appDataContainers()).empty()) << "nothing is made before the first lookup";

  std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.weather");
  ASSERT_TRUE(record);
  EXPECT_EQ(record->bundleType, platform::kBundleTypeSystem);
  EXPECT_EQ(record->bundleURL.path(), bundle);
  EXPECT_EQ(record->version, "3");
  EXPECT_TRUE(record->foundBackingBundle);
  ASSERT_TRUE(record->dataContainerURL);
  EXPECT_TRUE(isDirectory(record->dataContainerURL->path()));
  ASSERT_TRUE(record->groupContainerURLs);
  EXPECT_TRUE(record->groupContainerURLs->empty());

  auto reopened = openRegistry();
  EXPECT_EQ(reopened->recordForIdentifier("com.example.weather")->dataContainerURL->path(),
            record->dataContainerURL->path());
  EXPECT_EQ(entries(appDataContainers()).size(), 1u);
}

TEST_F(RegistryBuiltIn, ApplicationAddedLaterIsSeenAndAllRecordsListsEveryone) {
  auto registry = openRegistry();
  EXPECT_FALSE(registry->isInstalled("com.example.late"));
  makeBuiltIn("Late.app", BundleSpec("com.example.late"));
  EXPECT_TRUE(registry->isInstalled("com.example.late"));
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.a")));
  std::vector<BundleRecord> all = registry->allRecords();
  ASSERT_EQ(all.size(), 2u);
  EXPECT_EQ(all[0].identifier, "com.example.a");
  EXPECT_EQ(all[1].identifier, "com.example.late");
  EXPECT_EQ(all[1].bundleType, platform::kBundleTypeSystem);
}

}  // namespace
}  // namespace qstest
