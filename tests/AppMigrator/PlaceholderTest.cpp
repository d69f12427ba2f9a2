// Placeholder installation: the staged bundle's Info.plist and icon as the
// registry sees them, the install options, and what is left afterwards.
#include <regex>

#include "FakePlatform.h"
#include "support/ImageSupport.h"

using platform::Data;

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
    ASSERT_TRUE(makeMigrator());
    platform_->registry.observer = [this](const std::string& call, const std::string&) {
      if (call != "installBundle") return;
      stagedAtInstall_ = directoryNames(stagedPath());
      infoTextAtInstall_ = readFile(stagedPath() + "/Info.plist");
      infoAtInstall_ = readPlist(stagedPath() + "/Info.plist");
      iconAtInstall_ = decodePNGFile(stagedPath() + "/Icon.png");
    };
  }
  bool install(const std::string& identifier = kIdentifier) {
    log_->clear();
    return migrator_->_stageAndInstallPlaceholderForBundleAtURL(URL::fileURL(bundle_, true), identifier,
                                                                URL::fileURL(container_, true));
  }
  std::string stagingParent() const { return platform_->temporaryDirectory + "/com.vantrel.quill.set.migrator"; }
  std::string stagedPath() const { return stagingParent() + "/" + kIdentifier + ".app"; }
  // Installs, expecting success and a placeholder without icon.
  void expectInstalledWithoutIcon(const std::vector<std::string>& staged = {"Info.plist"}) {
    ASSERT_TRUE(install());
    EXPECT_EQ(stagedAtInstall_, staged);
    ASSERT_TRUE(infoAtInstall_);
    EXPECT_FALSE(QSValueForKey(*infoAtInstall_, platform::kBundleIconFileKey));
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Writing placeholder icon for app " + std::string(kIdentifier) +
                           " to file://" + stagedPath() + "/Icon.png failed"));
    EXPECT_TRUE(directoryNames(stagingParent()).empty());
  }

  std::string container_, bundle_;
  std::vector<std::string> stagedAtInstall_;
  std::string infoTextAtInstall_;
  std::optional<Dictionary> infoAtInstall_;
  std::optional<platform::Image> iconAtInstall_;
};

TEST_F(PlaceholderInstallation, StagesPresentKeysInOrderAndTheRenderedIconWithTheStoreMetadataAsIs) {
  static const char kRaw[] = "\x00\x01not a property list\xff";
  const std::string bytes(kRaw, sizeof kRaw - 1);
  ASSERT_TRUE(writeFile(container_ + "/VendraMetadata.plist", bytes));
  ASSERT_TRUE(install());
  EXPECT_EQ(stagedAtInstall_, (std::vector<std::string>{"Icon.png", "Info.plist"}));
  // Only the keys present are carried over, in the order they were copied, the icon entry last.
  std::vector<std::string> entries;
  const std::regex entry("<key>([^<]*)</key>\\s*<string>([^<]*)</string>");
  for (std::sregex_iterator it(infoTextAtInstall_.begin(), infoTextAtInstall_.end(), entry), end; it != end; ++it) {
    entries.push_back((*it)[1].str() + "=" + (*it)[2].str());
  }
  EXPECT_EQ(entries, (std::vector<std::string>{"RkBundleIdentifier=com.example.atlas", "RkBundleDisplayName=Atlas",
                                               "RkBundleExecutable=atlas", "RkBundleShortVersionString=4.2",
                                               "RkBundleIconFile=Icon.png"}));
  EXPECT_EQ(infoAtInstall_->size(), entries.size());
  ASSERT_TRUE(iconAtInstall_);
  EXPECT_EQ(std::pair(iconAtInstall_->width, iconAtInstall_->height),
            std::pair(platform::kHomeScreenIconSize, platform::kHomeScreenIconSize));
  EXPECT_EQ(pixelAt(*iconAtInstall_, iconAtInstall_->width / 2, iconAtInstall_->height / 2), kOpaqueBlue);

  ASSERT_EQ(platform_->registry.installCalls.size(), 1u);
  EXPECT_EQ(platform_->registry.installCalls[0].location.path(), stagedPath());
  EXPECT_EQ(Value(platform_->registry.installCalls[0].options),
            Value(Dictionary{{platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
                             {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                             {platform::kBundleIdentifierKey, Value(kIdentifier)},
                             {"SkipBlacklist", Value(true)},
                             {platform::kRegistryStoreMetadataKey, Value(Data(bytes.begin(), bytes.end()))}}));
  // The real bundle and the metadata stay where they were; nothing staged outlives the call.
  EXPECT_TRUE(pathExists(bundle_ + "/Info.plist"));
  EXPECT_EQ(readFile(container_ + "/VendraMetadata.plist"), bytes);
  EXPECT_TRUE(directoryNames(stagingParent()).empty());

  // Store metadata that cannot be read is reported and left out.
  std::filesystem::remove(container_ + "/VendraMetadata.plist");
  ASSERT_TRUE(makeDirs(container_ + "/VendraMetadata.plist"));
  ASSERT_TRUE(install());
  EXPECT_TRUE(loggedOnce(
      "QSAppMigrator: Failed to read " + container_ + "/VendraMetadata.plist : Error Domain=FileErrorDomain Code=256",
      true));
  EXPECT_EQ(platform_->registry.installCalls.at(1).options.size(), 4u);
}

TEST_F(PlaceholderInstallation, IconFailuresLeaveAPlaceholderWithoutIcon) {
  // Left over by an interrupted attempt, the staged directory is reused; a
  // directory in the icon's place makes the atomic write fail.
  ASSERT_TRUE(makeDirs(stagedPath() + "/Icon.png/occupied") && writeFile(stagedPath() + "/Info.plist", "stale"));
  expectInstalledWithoutIcon({"Icon.png", "Info.plist"});
  EXPECT_EQ(*QSStringForKey(*infoAtInstall_, platform::kBundleDisplayNameKey), "Atlas");
  platform_->imageEncoding.failFinalize = true;
  expectInstalledWithoutIcon();
  platform_->imageEncoding.failCreate = true;
  expectInstalledWithoutIcon();
  std::filesystem::remove(bundle_ + "/Icon.png");
  expectInstalledWithoutIcon();
}

TEST_F(PlaceholderInstallation, EachFailureFailsAndLeavesNothingStaged) {
  const std::string moved = scratch_->path() + "/Atlas.app";
  const std::vector<std::pair<std::function<void()>, std::string>> cases = {
      {[&] { writeFile(stagingParent(), "a file where the directory belongs"); },
       "QSAppMigrator: Failed to create staged placeholder directory at " + stagedPath() + " : "},
      // A file where the bundle should be, then a bundle without Info.plist.
      {[&] { std::filesystem::remove(stagingParent()), std::filesystem::rename(bundle_, moved), writeFile(bundle_, ""); },
       "QSAppMigrator: Failed to create RkBundle for " + bundle_},
      {[&] { std::filesystem::remove(bundle_), makeDirs(bundle_); },
       "QSAppMigrator: Failed to get bundle info dictionary for bundle " + bundle_},
      {[&] { std::filesystem::remove(bundle_), std::filesystem::rename(moved, bundle_),
             makeDirs(stagedPath() + "/Info.plist/occupied"); },
       "QSAppMigrator: Failed to write placeholder Info.plist to file://" + stagedPath() + "/Info.plist"},
      {[&] { platform_->registry.refuseInstallOf.insert(kIdentifier); },
       "QSAppMigrator: Failed to install placeholder for " + std::string(kIdentifier) +
           ": {LocalizedDescription = \"installation of " + kIdentifier + " refused\"; }"},
  };
  for (const auto& [breakIt, line] : cases) {
    breakIt();
    EXPECT_FALSE(install()) << line;
    EXPECT_TRUE(loggedOnce(line, true));
    EXPECT_TRUE(directoryNames(stagingParent()).empty()) << line;
  }
  EXPECT_EQ(platform_->registry.installCalls.size(), 1u);  // only the refused one
}

TEST_F(PlaceholderInstallation, IdentifierThatIsNotOneComponentIsRefused) {
  EXPECT_FALSE(install("../escape"));
  EXPECT_FALSE(install(""));
  EXPECT_TRUE(platform_->registry.installCalls.empty());
  EXPECT_FALSE(pathExists(platform_->temporaryDirectory + "/escape.app"));
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Refusing to stage a placeholder for identifier \"\" (not a single path component)"));
}

}  // namespace
}  // namespace qstest
