// Placeholder installation: the staged bundle's Info.plist and icon as the
// registry sees them, the install options, and what is left afterwards.
#include <filesystem>

#include "FakePlatform.h"
#include "Platform/Foundation/PropertyList.h"
#include "support/ImageSupport.h"

using platform::Data;
using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kIdentifier[] = "com.example.atlas";
constexpr uint32_t kOpaqueBlue = 0x0000ffff;

class PlaceholderInstallation : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    container_ = makeContainer("C1");
    bundle_ = container_ + "/Atlas.app";
    writePlist(bundle_ + "/Info.plist",
               Value(Dictionary{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                                {platform::kBundleDisplayNameKey, Value("Atlas")},
                                {platform::kBundleExecutableKey, Value("atlas")},
                                {platform::kBundleShortVersionStringKey, Value("4.2")},
                                {platform::kApplicationGroupsKey, Value(platform::makeStringArray({"group.atlas"}))}}));
    ASSERT_TRUE(writeSolidPNG(bundle_ + "/Icon.png", 76, 76, kOpaqueBlue));
    // The real renderer, so that the icon written can be checked.
    QSMigratorServices services = platform_->services();
    services.iconRenderer = &renderer_;
    migrator_ = QSAppMigrator::create(services);
    ASSERT_TRUE(migrator_);
    log_->clear();
    platform_->registry.observer = [this](const std::string& call, const std::string&) {
      if (call != "installBundle") return;
      stagedAtInstall_ = directoryNames(stagedPath());
      infoAtInstall_ = readPlist(stagedPath() + "/Info.plist");
      iconAtInstall_ = decodePNGFile(stagedPath() + "/Icon.png");
      infoTextAtInstall_ = pathExists(stagedPath() + "/Info.plist") ? readFile(stagedPath() + "/Info.plist") : "";
    };
  }
  bool install(const std::string& identifier = kIdentifier) {
    return migrator_->_stageAndInstallPlaceholderForBundleAtURL(URL::fileURL(bundle_, true), identifier,
                                                                URL::fileURL(container_, true));
  }
  std::string stagingParent() const { return platform_->temporaryDirectory + "/com.vantrel.quill.set.migrator"; }
  std::string stagedPath() const { return stagingParent() + "/" + kIdentifier + ".app"; }
  // Installs, expecting success and a placeholder without icon.
  void expectInstalledWithoutIcon(const std::vector<std::string>& staged = {"Info.plist"}) {
    log_->clear();
    ASSERT_TRUE(install());
    EXPECT_EQ(stagedAtInstall_, staged);
    EXPECT_FALSE(QSValueForKey(*infoAtInstall_, platform::kBundleIconFileKey));
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Writing placeholder icon for app " + std::string(kIdentifier) +
                           " to file://" + stagedPath() + "/Icon.png failed"));
    EXPECT_TRUE(directoryNames(stagingParent()).empty());
  }

  platform::CairoIconRenderer renderer_;
  std::string container_;
  std::string bundle_;
  std::unique_ptr<QSAppMigrator> migrator_;
  std::vector<std::string> stagedAtInstall_;
  std::optional<Dictionary> infoAtInstall_;
  std::optional<platform::Image> iconAtInstall_;
  std::string infoTextAtInstall_;
};

TEST_F(PlaceholderInstallation, StagesPresentKeysInOrderAndTheRenderedIconAndInstallsWithFourOptions) {
  ASSERT_TRUE(install());
  EXPECT_EQ(stagedAtInstall_, (std::vector<std::string>{"Icon.png", "Info.plist"}));
  const Dictionary expected{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                            {platform::kBundleDisplayNameKey, Value("Atlas")},
                            {platform::kBundleExecutableKey, Value("atlas")},
                            {platform::kBundleShortVersionStringKey, Value("4.2")},
                            {platform::kBundleIconFileKey, Value("Icon.png")}};
  EXPECT_EQ(infoAtInstall_, expected);
  EXPECT_EQ(infoTextAtInstall_.rfind("<?xml", 0), 0u) << "Info.plist is written as XML";
  // The keys stand in the order they were copied, the icon entry last.
  size_t previous = 0;
  for (const char* key :
       {platform::kBundleIdentifierKey, platform::kBundleDisplayNameKey, platform::kBundleExecutableKey,
        platform::kBundleShortVersionStringKey, platform::kBundleIconFileKey}) {
    const size_t at = infoTextAtInstall_.find("<key>" + std::string(key) + "</key>");
    ASSERT_NE(at, std::string::npos) << key;
    EXPECT_GT(at, previous) << key << " is out of order";
    previous = at;
  }

  ASSERT_TRUE(iconAtInstall_);
  EXPECT_EQ(iconAtInstall_->width, platform::kHomeScreenIconSize);
  EXPECT_EQ(iconAtInstall_->height, platform::kHomeScreenIconSize);
  const int last = platform::kHomeScreenIconSize - 1;
  EXPECT_EQ(pixelAt(*iconAtInstall_, 0, 0) & 0xff, 0u) << "corners are transparent";
  EXPECT_EQ(pixelAt(*iconAtInstall_, last, last) & 0xff, 0u);
  EXPECT_EQ(pixelAt(*iconAtInstall_, last / 2, last / 2), kOpaqueBlue);

  const auto calls = platform_->registry.installCalls;
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].call, "installBundle");
  EXPECT_EQ(calls[0].location.path(), stagedPath());
  EXPECT_EQ(Value(calls[0].options),
            Value(Dictionary{{platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
                             {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                             {platform::kBundleIdentifierKey, Value(kIdentifier)},
                             {"SkipBlacklist", Value(true)}}));
  EXPECT_TRUE(platform_->registry.records.at(kIdentifier).isPlaceholder);
  // The real bundle stays where it was; nothing staged outlives the call.
  EXPECT_TRUE(pathExists(bundle_ + "/Info.plist"));
  EXPECT_TRUE(pathExists(stagingParent()));
  EXPECT_TRUE(directoryNames(stagingParent()).empty());
}

TEST_F(PlaceholderInstallation, StoreMetadataBytesArePassedUnchangedAndStay) {
  static const char kRaw[] = "\x00\x01not a property list\xff";
  const std::string bytes(kRaw, sizeof kRaw - 1);
  ASSERT_TRUE(writeFile(container_ + "/VendraMetadata.plist", bytes));
  ASSERT_TRUE(install());
  const auto options = platform_->registry.installCalls.at(0).options;
  EXPECT_EQ(options.size(), 5u);
  const Value* metadata = QSValueForKey(options, platform::kRegistryStoreMetadataKey);
  ASSERT_TRUE(metadata && metadata->isData());
  EXPECT_EQ(*metadata->asData(), Data(bytes.begin(), bytes.end()));
  EXPECT_EQ(readFile(container_ + "/VendraMetadata.plist"), bytes);
}

TEST_F(PlaceholderInstallation, UnreadableStoreMetadataIsReportedAndSkipped) {
  ASSERT_TRUE(makeDirs(container_ + "/VendraMetadata.plist"));
  ASSERT_TRUE(install());
  EXPECT_TRUE(loggedOnce(
      "QSAppMigrator: Failed to read " + container_ + "/VendraMetadata.plist : Error Domain=FileErrorDomain Code=256",
      true));
  EXPECT_EQ(platform_->registry.installCalls.at(0).options.size(), 4u);
}

TEST_F(PlaceholderInstallation, IconFailuresLeaveAPlaceholderWithoutIcon) {
  // A directory in the icon's place makes the atomic write fail.
  ASSERT_TRUE(makeDirs(stagedPath() + "/Icon.png/occupied"));
  expectInstalledWithoutIcon({"Icon.png", "Info.plist"});
  platform_->imageEncoding.failFinalize = true;
  expectInstalledWithoutIcon();
  platform_->imageEncoding.failCreate = true;
  expectInstalledWithoutIcon();
  std::filesystem::remove(bundle_ + "/Icon.png");
  expectInstalledWithoutIcon();
}

TEST_F(PlaceholderInstallation, LeftoverStagedDirectoryIsReusedAndRemoved) {
  ASSERT_TRUE(makeDirs(stagedPath()));
  ASSERT_TRUE(writeFile(stagedPath() + "/Info.plist", "stale") && writeFile(stagedPath() + "/Stale.txt", "stale"));
  ASSERT_TRUE(install());
  EXPECT_EQ(*QSStringForKey(*infoAtInstall_, platform::kBundleDisplayNameKey), "Atlas");
  EXPECT_TRUE(directoryNames(stagingParent()).empty());
}

TEST_F(PlaceholderInstallation, StagedDirectoryThatCannotBeCreatedFails) {
  ASSERT_TRUE(writeFile(stagingParent(), "a file where the directory belongs"));
  EXPECT_FALSE(install());
  EXPECT_TRUE(platform_->registry.installCalls.empty());
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Failed to create staged placeholder directory at " + stagedPath() + " : ", true));
}

TEST_F(PlaceholderInstallation, EachFailureFailsAndLeavesNothingStaged) {
  const std::vector<std::pair<std::function<void()>, std::string>> cases = {
      {[&] { platform_->bundleReader.unopenable.insert(bundle_); },
       "QSAppMigrator: Failed to create RkBundle for " + bundle_},
      {[&] { platform_->bundleReader.noInfoDictionary.insert(bundle_); },
       "QSAppMigrator: Failed to get bundle info dictionary for bundle " + bundle_},
      {[&] { makeDirs(stagedPath() + "/Info.plist/occupied"); },
       "QSAppMigrator: Failed to write placeholder Info.plist to file://" + stagedPath() + "/Info.plist"},
      {[&] { platform_->registry.refuseInstallOf.insert(kIdentifier); },
       "QSAppMigrator: Failed to install placeholder for " + std::string(kIdentifier) +
           ": {LocalizedDescription = \"installation of " + kIdentifier + " refused\"; }"},
  };
  for (const auto& [breakIt, line] : cases) {
    platform_->bundleReader.unopenable.clear();
    platform_->bundleReader.noInfoDictionary.clear();
    log_->clear();
    breakIt();
    EXPECT_FALSE(install()) << line;
    EXPECT_TRUE(loggedOnce(line));
    EXPECT_TRUE(directoryNames(stagingParent()).empty()) << line;
  }
  EXPECT_EQ(platform_->registry.installCalls.size(), 1u);  // only the refused one
}

TEST_F(PlaceholderInstallation, IdentifierThatIsNotOneComponentIsRefused) {
  EXPECT_FALSE(install("../escape"));
  EXPECT_FALSE(install(""));
  EXPECT_TRUE(platform_->registry.installCalls.empty());
  EXPECT_FALSE(pathExists(platform_->temporaryDirectory + "/escape.app"));
  EXPECT_EQ(log_->hostLines().size(), 2u);
}

}  // namespace
}  // namespace qstest
