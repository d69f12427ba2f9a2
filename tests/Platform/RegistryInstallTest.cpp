// Installing packages, placeholders and built-in applications: containers,
// records, groups, VPN plug-ins and refusals.
#include <unistd.h>

#include <cstdio>
#include <functional>
#include <stdexcept>

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::BundleRecord;
using platform::Dictionary;
using platform::Error;
using platform::Value;

using RegistryInstall = RegistryTest;

TEST_F(RegistryInstall, MovesBundleAndPluginIntoNewContainersAndRemovesPackage) {
  auto registry = openRegistry();
  std::string package = makePackage("vpn", {.identifier = "com.example.vpn"}, {.identifier = "com.example.vpn.tunnel"},
                                    {"VendraMetadata.plist"});
  Error error;
  ASSERT_TRUE(install(*registry, package, "com.example.vpn", &error)) << error.description();
  EXPECT_EQ(statuses_, (std::vector<std::string>{"VerifyingApplication", "StagingFiles", "RegisteringApplication",
                                                 "CleaningUp", "Complete"}));
  for (std::thread::id id : reporterThreads_) EXPECT_NE(id, std::this_thread::get_id()) << "from the worker thread";
  EXPECT_FALSE(exists(package));

  std::optional<BundleRecord> app = registry->recordForIdentifier("com.example.vpn");
  ASSERT_TRUE(app && app->dataContainerURL && app->groupContainerURLs);
  EXPECT_EQ(app->bundleType, platform::kBundleTypeUser);
  EXPECT_EQ(app->bundleURL.path(), app->bundleContainerURL.path() + "/App.app");
  EXPECT_EQ(app->bundleContainerURL.deletingLastPathComponent().path(), bundleContainers());
  EXPECT_EQ(readFile(app->bundleURL.path() + "/main"), "executable of com.example.vpn");
  EXPECT_EQ(readFile(app->bundleContainerURL.path() + "/VendraMetadata.plist"), "metadata VendraMetadata.plist");
  EXPECT_EQ(app->dataContainerURL->deletingLastPathComponent().path(), appDataContainers());
  EXPECT_TRUE(isDirectory(app->dataContainerURL->path()));
  EXPECT_TRUE(app->groupContainerURLs->empty()) << "an installed bundle always has a group dictionary";

  std::optional<BundleRecord> plugin = registry->recordForIdentifier("com.example.vpn.tunnel");
  ASSERT_TRUE(plugin && plugin->dataContainerURL && plugin->groupContainerURLs);
  EXPECT_EQ(plugin->bundleType, platform::kBundleTypeVPNPlugin);
  EXPECT_EQ(plugin->bundleURL.lastPathComponent(), "Tunnel.vpnplugin");
  EXPECT_EQ(plugin->bundleContainerURL.deletingLastPathComponent().path(), bundleContainers());
  EXPECT_EQ(plugin->dataContainerURL->deletingLastPathComponent().lastPathComponent(), "PluginKitPlugin");
}

TEST_F(RegistryInstall, ThrowingProgressCallbackDoesNotStopTheInstallation) {
  auto registry = openRegistry();
  std::string package = makePackage("notes", {.identifier = "com.example.notes"});
  LogCapture log;
  EXPECT_TRUE(registry->installPackage(platform::URL::fileURL(package, true), customerOptions("com.example.notes"),
                                       [](const Dictionary&) { throw std::runtime_error("callback failure"); },
                                       nullptr));
  EXPECT_EQ(log.count("Progress callback threw on report"), 5u);
  EXPECT_TRUE(registry->isInstalled("com.example.notes"));
}

TEST_F(RegistryInstall, GroupContainerIsSharedByApplicationsOfTheGroupBuiltInOrNot) {
  makeBuiltIn("Photos.app", {.identifier = "com.example.photos", .groups = {"group.shared"}});
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.a", .groups = {"group.shared", "group.a"}}));
  ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.b", .groups = {"group.shared"}}));
  auto a = *registry->recordForIdentifier("com.example.a")->groupContainerURLs;
  ASSERT_EQ(a.size(), 2u);
  EXPECT_EQ(registry->recordForIdentifier("com.example.b")->groupContainerURLs->at("group.shared"), a.at("group.shared"));
  EXPECT_EQ(registry->recordForIdentifier("com.example.photos")->groupContainerURLs->at("group.shared"),
            a.at("group.shared"));
  EXPECT_EQ(a.at("group.a").deletingLastPathComponent().path(), groupContainers());
  EXPECT_TRUE(isDirectory(a.at("group.shared").path()));
  EXPECT_EQ(entries(groupContainers()).size(), 2u);
}

TEST_F(RegistryInstall, OlderOrEqualToBuiltInIsRefusedAndPackageRemovedNewerIsInstalled) {
  makeBuiltIn("Clock.app", {.identifier = "com.example.clock", .version = "2.10"});
  auto registry = openRegistry();
  for (const char* version : {"2.9", "2.10.0"}) {
    std::string package = makePackage(version, {.identifier = "com.example.clock", .version = version});
    Error error;
    EXPECT_FALSE(install(*registry, package, "com.example.clock", &error));
    EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorAlreadyInstalled)) << version;
    EXPECT_EQ(errors_, std::vector<std::string>{"ApplicationAlreadyInstalled"});
    EXPECT_FALSE(exists(package));
    EXPECT_EQ(registry->recordForIdentifier("com.example.clock")->bundleType, platform::kBundleTypeSystem);
    EXPECT_TRUE(entries(bundleContainers()).empty());
  }
  ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.clock", .version = "2.10.1"}));
  EXPECT_EQ(registry->recordForIdentifier("com.example.clock")->bundleType, platform::kBundleTypeUser);
}

// Any other refusal leaves the package as it was and makes no container.
TEST_F(RegistryInstall, BadPackagesAreRefusedAndLeftAsTheyWere) {
  const std::string plist = "/Payload/App.app/Info.plist", invalid = "InvalidPackage";
  const std::string arrayPlist = "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>a</string></array></plist>";
  const struct {
    const char* name;
    std::function<void(const std::string& package)> damage;  // none: the options claim another identifier
    int64_t code;
    std::string error;
  } cases[] = {
      {"claimed", {}, platform::kRegistryErrorIdentifierMismatch, "BundleIdentifierMismatch"},
      {"no-payload", [](auto p) { ASSERT_EQ(rename((p + "/Payload").c_str(), (p + "/P").c_str()), 0); },
       platform::kRegistryErrorInvalidPackage, invalid},
      {"broken-plist", [&](auto p) { ASSERT_TRUE(writeFile(p + plist, "<plist><dict><key>RkBundle")); },
       platform::kRegistryErrorInvalidInfoPlist, "InvalidInfoPlist"},
      {"array-plist", [&](auto p) { ASSERT_TRUE(writeFile(p + plist, arrayPlist)); },
       platform::kRegistryErrorInvalidInfoPlist, "InvalidInfoPlist"},
      {"two-apps", [&](auto p) { makeBundle(p + "/Payload/Second.app", {.identifier = "com.example.y"}); },
       platform::kRegistryErrorInvalidPackage, invalid},
      {"link",
       [&](auto p) {
         ASSERT_EQ(rename((p + "/Payload/App.app").c_str(), at("Real.app").c_str()), 0);
         ASSERT_EQ(symlink(at("Real.app").c_str(), (p + "/Payload/App.app").c_str()), 0);
       },
       platform::kRegistryErrorInvalidPackage, invalid},
  };
  auto registry = openRegistry();
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::string package = makePackage(c.name, {.identifier = "com.example.x"});
    if (c.damage) c.damage(package);
    const std::string identifier = c.damage ? "com.example.x" : "com.example.claimed";
    std::vector<std::string> before = entries(package + "/Payload");
    Error error;
    EXPECT_FALSE(install(*registry, package, identifier, &error));
    EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, c.code)) << error.description();
    EXPECT_FALSE(error.localizedDescription().empty());
    EXPECT_EQ(errors_, std::vector<std::string>{c.error});
    EXPECT_EQ(statuses_.back(), "Failed");
    EXPECT_EQ(entries(package + "/Payload"), before);
    EXPECT_EQ(allContainers(), (std::vector<std::vector<std::string>>(4)));
    EXPECT_FALSE(registry->isInstalled(identifier));
  }
  EXPECT_TRUE(exists(at("Real.app/Info.plist")));

  // A relative location, and a placeholder type for a package.
  Error error;
  const std::string package = at("packages/claimed");
  EXPECT_FALSE(registry->installPackage(platform::URL::fileURL("packages/claimed", true),
                                        customerOptions("com.example.x"), {}, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage)) << error.description();
  Dictionary options = customerOptions("com.example.x");
  options[platform::kRegistryPackageTypeKey] = Value(platform::kRegistryPackageTypePlaceholder);
  EXPECT_FALSE(registry->installPackage(platform::URL::fileURL(package, true), options, {}, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidOptions)) << error.description();
  EXPECT_TRUE(exists(package + "/Payload/App.app"));
}

class RegistryPlaceholder : public RegistryTest {
 protected:
  // Installs a copy of the bundle at `staged` as the placeholder of `identifier`.
  bool installPlaceholder(Registry& registry, const std::string& identifier,
                          const std::optional<Value>& metadata = std::nullopt, Error* error = nullptr,
                          const std::string& staged = "") {
    Dictionary options{{platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypePlaceholder},
                       {platform::kBundleIdentifierKey, identifier}};
    if (metadata) options[platform::kRegistryStoreMetadataKey] = *metadata;
    return registry.installBundle(platform::URL::fileURL(staged.empty() ? staged_ : staged, true), options, error);
  }
  TempDir staging_{"staging"};
  const std::string staged_ = staging_ / "Staged.app";
};

// The identity is the options' identifier, never the Info.plist's.
TEST_F(RegistryPlaceholder, IsCopiedWithStoreMetadataADataContainerAndNoGroups) {
  auto registry = openRegistry();
  makeBundle(staged_, {.identifier = "com.example.inner", .groups = {"group.game"}});
  Error error;
  ASSERT_TRUE(installPlaceholder(*registry, "com.example.game", Value(platform::Data{'<', 0, 0xFF}), &error))
      << error.description();
  EXPECT_FALSE(registry->isInstalled("com.example.inner"));
  std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.game");
  ASSERT_TRUE(record && record->dataContainerURL);
  EXPECT_EQ(record->bundleType, platform::kBundleTypePlaceholder);
  EXPECT_TRUE(record->isPlaceholder);
  EXPECT_FALSE(record->groupContainerURLs) << "a placeholder's record has no group dictionary";
  EXPECT_TRUE(isDirectory(record->dataContainerURL->path()));
  EXPECT_EQ(record->bundleURL.lastPathComponent(), "Staged.app");
  EXPECT_EQ(readFile(record->bundleURL.path() + "/Info.plist"), readFile(staged_ + "/Info.plist"));
  EXPECT_EQ(readFile(record->bundleContainerURL.path() + "/VendraMetadata.plist"), std::string("<\0\xFF", 3));
  EXPECT_TRUE(isDirectory(staged_)) << "the caller removes its staged directory";
  EXPECT_TRUE(entries(groupContainers()).empty());
}

// An anonymous placeholder replaced by another, then by the real
// application: the data container stays throughout; then a placeholder can
// no longer replace it.
TEST_F(RegistryPlaceholder, DataContainerOutlivesReplacementsAndOnlyAPlaceholderIsReplaceable) {
  auto registry = openRegistry();
  makeBundle(staged_, {});
  ASSERT_TRUE(installPlaceholder(*registry, "com.example.game"));
  BundleRecord first = *registry->recordForIdentifier("com.example.game");
  ASSERT_TRUE(writeFile(first.dataContainerURL->path() + "/save.dat", "level 9"));
  ASSERT_TRUE(installPlaceholder(*registry, "com.example.game"));
  BundleRecord second = *registry->recordForIdentifier("com.example.game");
  EXPECT_FALSE(exists(first.bundleContainerURL.path()));
  ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.game", .groups = {"group.game"}}));
  BundleRecord real = *registry->recordForIdentifier("com.example.game");
  EXPECT_FALSE(real.isPlaceholder);
  EXPECT_EQ(readFile(real.dataContainerURL->path() + "/save.dat"), "level 9");
  EXPECT_FALSE(exists(second.bundleContainerURL.path()));
  EXPECT_EQ(real.groupContainerURLs->size(), 1u);

  Error error;
  EXPECT_FALSE(installPlaceholder(*registry, "com.example.game", std::nullopt, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorNotReplaceable)) << error.description();
  EXPECT_FALSE(installPlaceholder(*registry, "com.example.x", std::nullopt, &error, staging_ / "missing.app"));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage)) << error.description();
  EXPECT_FALSE(installPlaceholder(*registry, "com.example.x", Value("not data"), &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidOptions)) << error.description();
  EXPECT_EQ(entries(bundleContainers()).size(), 1u);
}

TEST_F(RegistryInstall, BuiltInGetsADataContainerOnFirstLookupUnlessItHasNoneAndIsSeenWhenAddedLater) {
  std::string bundle = makeBuiltIn("Weather.app", {.identifier = "com.example.weather", .version = "3"});
  makeBuiltIn("Settings.app", {.identifier = "com.example.settings", .noDataContainer = true});
  auto registry = openRegistry();
  EXPECT_TRUE(registry->isInstalled("com.example.weather"));
  EXPECT_TRUE(entries(appDataContainers()).empty()) << "nothing is made before the first lookup";
  EXPECT_FALSE(registry->recordForIdentifier("com.example.settings")->dataContainerURL) << "RkNoDataContainer";
  std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.weather");
  ASSERT_TRUE(record && record->dataContainerURL && record->groupContainerURLs);
  EXPECT_EQ(record->bundleType, platform::kBundleTypeSystem);
  EXPECT_EQ(record->bundleURL.path(), bundle);
  EXPECT_EQ(record->version, "3");
  EXPECT_TRUE(isDirectory(record->dataContainerURL->path()));
  EXPECT_EQ(openRegistry()->recordForIdentifier("com.example.weather")->dataContainerURL, record->dataContainerURL);
  EXPECT_EQ(entries(appDataContainers()).size(), 1u);

  makeBuiltIn("Late.app", {.identifier = "com.example.late"});
  EXPECT_TRUE(registry->isInstalled("com.example.late"));
  ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.a"}));
  std::vector<std::string> all;
  for (const BundleRecord& r : registry->allRecords()) all.push_back(r.identifier);
  EXPECT_EQ(all, (std::vector<std::string>{"com.example.a", "com.example.late", "com.example.settings",
                                           "com.example.weather"}));
}

}  // namespace
}  // namespace qstest
