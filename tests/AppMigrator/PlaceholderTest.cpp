#include <filesystem>

#include <gtest/gtest.h>

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
constexpr char kPlaceholderFunction[] =
    "-[QSAppMigrator _stageAndInstallPlaceholderForBundleAtURL:withIdentifier:inContainerURL:]";
constexpr char kIconFunction[] = "-[QSAppMigrator _writeIconForBundle:toURL:]";
constexpr uint32_t kOpaqueBlue = 0x0000ffff;

class PlaceholderInstallation : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    container_ = makeContainer("C1");
    bundle_ = container_ + "/Atlas.app";
    ASSERT_TRUE(makeDirs(bundle_));
    writeInfo(Dictionary{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                         {platform::kBundleDisplayNameKey, Value("Atlas")},
                         {platform::kBundleExecutableKey, Value("atlas")},
                         {platform::kBundleVersionKey, Value("4.2.1")},
                         {platform::kBundleShortVersionStringKey, Value("4.2")},
                         {platform::kApplicationGroupsKey, Value(platform::makeStringArray({"group.atlas"}))},
                         {"RkBundleSupportedPlatforms", Value("phone")}});
    ASSERT_TRUE(writeSolidPNG(bundle_ + "/Icon.png", 76, 76, kOpaqueBlue));
    // The real renderer, so that the icon written can be checked.
    QSMigratorServices services = platform_->services();
    services.iconRenderer = &renderer_;
    migrator_ = QSAppMigrator::create(services);
    ASSERT_TRUE(migrator_);
    // Only the lines of the operation under test count.
    log_->clear();
    platform_->registry.observer = [this](const std::string& call, const std::string&) {
      if (call != "installBundle") return;
      stagedAtInstall_ = directoryNames(stagedPath());
      infoAtInstall_ = readPlist(stagedPath() + "/Info.plist");
      iconAtInstall_ = decodePNGFile(stagedPath() + "/Icon.png");
      infoTextAtInstall_ = pathExists(stagedPath() + "/Info.plist") ? readFile(stagedPath() + "/Info.plist") : "";
    };
  }
  void writeInfo(const Dictionary& info) { writePlist(bundle_ + "/Info.plist", Value(info)); }
  bool install(const std::string& identifier = kIdentifier) {
    return migrator_->_stageAndInstallPlaceholderForBundleAtURL(URL::fileURL(bundle_, true), identifier,
                                                                URL::fileURL(container_, true));
  }
  std::string stagingParent() const { return platform_->temporaryDirectory + "/com.vantrel.quill.set.migrator"; }
  std::string stagedPath(const std::string& identifier = kIdentifier) const {
    return stagingParent() + "/" + identifier + ".app";
  }
  void expectNoStagedLeftovers() {
    EXPECT_FALSE(pathExists(stagedPath()));
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

TEST_F(PlaceholderInstallation, StagesTrimmedInfoPlistAndRenderedIcon) {
  ASSERT_TRUE(install());
  EXPECT_EQ(stagedAtInstall_, (std::vector<std::string>{"Icon.png", "Info.plist"}));
  ASSERT_TRUE(infoAtInstall_);
  const Dictionary expected{
      {platform::kBundleIdentifierKey, Value(kIdentifier)},   {platform::kBundleDisplayNameKey, Value("Atlas")},
      {platform::kBundleExecutableKey, Value("atlas")},       {platform::kBundleVersionKey, Value("4.2.1")},
      {platform::kBundleShortVersionStringKey, Value("4.2")}, {platform::kBundleIconFileKey, Value("Icon.png")}};
  EXPECT_EQ(Value(*infoAtInstall_), Value(expected));
  EXPECT_EQ(infoTextAtInstall_.rfind("<?xml", 0), 0u) << "Info.plist is written as XML";
  // The keys stand in the order they were copied, the icon entry last.
  size_t previous = 0;
  for (const char* key : {platform::kBundleIdentifierKey, platform::kBundleDisplayNameKey,
                          platform::kBundleExecutableKey, platform::kBundleVersionKey,
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
  for (auto [x, y] : {std::pair{0, 0}, {last, 0}, {0, last}, {last, last}}) {
    EXPECT_EQ(pixelAt(*iconAtInstall_, x, y) & 0xff, 0u) << x << "," << y;
  }
  EXPECT_EQ(pixelAt(*iconAtInstall_, last / 2, last / 2), kOpaqueBlue);

  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Installing placeholder for " + std::string(kIdentifier)});
  EXPECT_EQ(log_->hostLines()[0].function, kPlaceholderFunction);
  expectNoStagedLeftovers();
  EXPECT_TRUE(pathExists(stagingParent()));
}

TEST_F(PlaceholderInstallation, InstallsTheStagedDirectoryWithFourOptionsWithoutStoreMetadata) {
  ASSERT_TRUE(install());
  const auto calls = platform_->registry.installCalls();
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].call, "installBundle");
  EXPECT_EQ(calls[0].location.path(), stagedPath());
  const Dictionary expected{{platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
                            {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                            {platform::kBundleIdentifierKey, Value(kIdentifier)},
                            {"SkipBlacklist", Value(true)}};
  EXPECT_EQ(Value(calls[0].options), Value(expected));
  EXPECT_TRUE(platform_->registry.storedRecord(kIdentifier)->isPlaceholder);
  // The real bundle stays where it was.
  EXPECT_TRUE(pathExists(bundle_ + "/Info.plist"));
}

TEST_F(PlaceholderInstallation, StoreMetadataBytesArePassedUnchangedAndStay) {
  static const char kRaw[] = "\x00\x01not a property list\xff";
  const std::string bytes(kRaw, sizeof kRaw - 1);
  ASSERT_TRUE(writeFile(container_ + "/VendraMetadata.plist", bytes));
  ASSERT_TRUE(install());
  const auto calls = platform_->registry.installCalls();
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].options.size(), 5u);
  const Value* metadata = QSValueForKey(calls[0].options, platform::kRegistryStoreMetadataKey);
  ASSERT_TRUE(metadata && metadata->isData());
  EXPECT_EQ(*metadata->asData(), Data(bytes.begin(), bytes.end()));
  EXPECT_EQ(readFile(container_ + "/VendraMetadata.plist"), bytes);
  EXPECT_EQ(log_->hostMessages().size(), 1u);
}

TEST_F(PlaceholderInstallation, UnreadableStoreMetadataIsReportedAndSkipped) {
  ASSERT_TRUE(makeDirs(container_ + "/VendraMetadata.plist"));
  ASSERT_TRUE(install());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0].rfind("QSAppMigrator: Failed to read " + container_ +
                                  "/VendraMetadata.plist : Error Domain=FileErrorDomain Code=256",
                              0),
            0u)
      << messages[0];
  EXPECT_EQ(platform_->registry.installCalls()[0].options.size(), 4u);
}

TEST_F(PlaceholderInstallation, OnlyPresentKeysAreCarriedOver) {
  writeInfo(Dictionary{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                       {platform::kBundleVersionKey, Value("1")},
                       {"Unrelated", Value(3)}});
  ASSERT_TRUE(install());
  ASSERT_TRUE(infoAtInstall_);
  const Dictionary expected{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                            {platform::kBundleVersionKey, Value("1")},
                            {platform::kBundleIconFileKey, Value("Icon.png")}};
  EXPECT_EQ(Value(*infoAtInstall_), Value(expected));
}

TEST_F(PlaceholderInstallation, OptionsNameTheArgumentWhileInfoPlistKeepsTheBundlesIdentifier) {
  ASSERT_TRUE(install("com.example.other"));
  const auto calls = platform_->registry.installCalls();
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].location.path(), stagedPath("com.example.other"));
  EXPECT_EQ(*QSStringForKey(calls[0].options, platform::kBundleIdentifierKey), "com.example.other");
  EXPECT_FALSE(pathExists(stagedPath("com.example.other")));
}

TEST_F(PlaceholderInstallation, IconThatCannotBeRenderedLeavesPlaceholderWithoutIcon) {
  std::filesystem::remove(bundle_ + "/Icon.png");
  ASSERT_TRUE(install());
  EXPECT_EQ(stagedAtInstall_, std::vector<std::string>{"Info.plist"});
  EXPECT_FALSE(QSValueForKey(*infoAtInstall_, platform::kBundleIconFileKey));
  const auto lines = log_->hostLines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0].message, "QSAppMigrator: Failed to create icon from bundle RkBundle " + bundle_ + " (not loaded)");
  EXPECT_EQ(lines[0].function, kIconFunction);
  EXPECT_EQ(lines[1].message, "QSAppMigrator: Writing placeholder icon for app " + std::string(kIdentifier) +
                                  " to file://" + stagedPath() + "/Icon.png failed");
  EXPECT_EQ(lines[1].function, kPlaceholderFunction);
  EXPECT_EQ(lines[1].level, 3);
}

TEST_F(PlaceholderInstallation, EncoderFailuresAreReportedAndSkipped) {
  platform_->imageEncoding.failCreate = true;
  ASSERT_TRUE(install());
  EXPECT_TRUE(
      log_->contains("QSAppMigrator: VxImageDestinationCreateWithData returned NULL vxImage from bundle RkBundle " +
                     bundle_ + " (not loaded)"));
  platform_->imageEncoding.failCreate = false;
  platform_->imageEncoding.failFinalize = true;
  log_->clear();
  ASSERT_TRUE(install());
  EXPECT_TRUE(log_->contains("QSAppMigrator: VxImageDestinationFinalize failed for icon from bundle RkBundle " +
                             bundle_ + " (not loaded)"));
  EXPECT_EQ(stagedAtInstall_, std::vector<std::string>{"Info.plist"});
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, LeftoverStagedDirectoryIsReusedAndRemoved) {
  ASSERT_TRUE(makeDirs(stagedPath()));
  ASSERT_TRUE(writeFile(stagedPath() + "/Info.plist", "stale"));
  ASSERT_TRUE(writeFile(stagedPath() + "/Stale.txt", "stale"));
  ASSERT_TRUE(install());
  ASSERT_TRUE(infoAtInstall_);
  EXPECT_EQ(*QSStringForKey(*infoAtInstall_, platform::kBundleDisplayNameKey), "Atlas");
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, IconThatCannotBeWrittenIsReported) {
  // A directory in the icon's place makes the atomic write fail.
  ASSERT_TRUE(makeDirs(stagedPath() + "/Icon.png/occupied"));
  ASSERT_TRUE(install());
  const auto messages = log_->hostMessages();
  ASSERT_GE(messages.size(), 2u);
  EXPECT_EQ(
      messages[0].rfind("QSAppMigrator: Failed to write image data to file://" + stagedPath() + "/Icon.png : ", 0), 0u)
      << messages[0];
  EXPECT_FALSE(QSValueForKey(*infoAtInstall_, platform::kBundleIconFileKey));
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, StagedDirectoryThatCannotBeCreatedFails) {
  ASSERT_TRUE(writeFile(stagingParent(), "a file where the directory belongs"));
  EXPECT_FALSE(install());
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(
      messages[0].rfind("QSAppMigrator: Failed to create staged placeholder directory at " + stagedPath() + " : ", 0),
      0u)
      << messages[0];
  std::filesystem::remove(stagingParent());
}

TEST_F(PlaceholderInstallation, UnopenableBundleFailsAndLeavesNothing) {
  platform_->bundleReader.unopenable.insert(bundle_);
  EXPECT_FALSE(install());
  EXPECT_EQ(log_->hostMessages(), std::vector<std::string>{"QSAppMigrator: Failed to create RkBundle for " + bundle_});
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, BundleWithoutInfoDictionaryFailsAndLeavesNothing) {
  platform_->bundleReader.noInfoDictionary.insert(bundle_);
  EXPECT_FALSE(install());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Failed to get bundle info dictionary for bundle " + bundle_});
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, InfoPlistThatCannotBeWrittenFailsAndLeavesNothing) {
  ASSERT_TRUE(makeDirs(stagedPath() + "/Info.plist/occupied"));
  EXPECT_FALSE(install());
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_EQ(log_->hostMessages(), std::vector<std::string>{"QSAppMigrator: Failed to write placeholder Info.plist to "
                                                           "file://" +
                                                           stagedPath() + "/Info.plist"});
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, RefusedInstallIsReportedWithTheErrorsUserInfo) {
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(install());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[1], "QSAppMigrator: Failed to install placeholder for " + std::string(kIdentifier) +
                             ": {LocalizedDescription = \"installation of " + kIdentifier + " refused\"; }");
  expectNoStagedLeftovers();
}

TEST_F(PlaceholderInstallation, IdentifierThatIsNotOneComponentIsRefused) {
  EXPECT_FALSE(install("../escape"));
  EXPECT_FALSE(install(""));
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_EQ(log_->hostLines().size(), 2u);
}

}  // namespace
}  // namespace qstest
