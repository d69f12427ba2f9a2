// QSGlobalConfiguration: preferences read at creation, the path layout under
// the system root, caching, and directory creation on every access.
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include <gtest/gtest.h>

#include "Shared/Support/QSGlobalConfiguration.h"
#include "Support/SupportFixtures.h"
#include "support/TestSupport.h"

using platform::URL;
using platform::Value;
using supporttest::MemoryPreferenceStore;

namespace {

constexpr char kDomain[] = "com.vantrel.quill.set";
constexpr char kInitFunction[] = "-[QSGlobalConfiguration init]";

bool isDirectory(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

class ConfigurationPreferences : public ::testing::Test {
 protected:
  MemoryPreferenceStore store_;
  qstest::LogCapture log_;
};

TEST_F(ConfigurationPreferences, DefaultsWithoutPreferencesWriteNoLine) {
  QSGlobalConfiguration config("/", store_);
  EXPECT_TRUE(config.lowerInstallPriority());
  EXPECT_FALSE(config.skipDeviceFamilyCheck());
  EXPECT_FALSE(config.skipThinningCheck());
  EXPECT_EQ(config.nSimultaneousInstallations(), 4);
  EXPECT_EQ(config.uid(), 33u);
  EXPECT_EQ(config.gid(), 33u);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ConfigurationPreferences, EveryKeyIsReadFromTheInstallerDomain) {
  QSGlobalConfiguration config("/", store_);
  std::vector<std::string> domains = store_.domainsAsked();
  ASSERT_EQ(domains.size(), 4u);
  for (const std::string& domain : domains) EXPECT_EQ(domain, kDomain);
}

TEST_F(ConfigurationPreferences, LowerInstallPriorityFalseTurnsItOffWithNotice) {
  store_.set("LowerInstallPriority", Value(false));
  QSGlobalConfiguration config("/", store_);
  EXPECT_FALSE(config.lowerInstallPriority());
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 5);
  EXPECT_EQ(lines[0].function, kInitFunction);
  EXPECT_EQ(lines[0].message, "Not running installation at background priority because of a set default");
}

TEST_F(ConfigurationPreferences, LowerInstallPriorityTrueOrOtherKindsKeepItOnSilently) {
  for (Value stored : {Value(true), Value(0), Value("NO")}) {
    MemoryPreferenceStore store;
    store.set("LowerInstallPriority", stored);
    QSGlobalConfiguration config("/", store);
    EXPECT_TRUE(config.lowerInstallPriority()) << stored.description();
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ConfigurationPreferences, SkipDeviceFamilyCheckTrueWritesNotice) {
  store_.set("SkipDeviceFamilyCheck", Value(true));
  QSGlobalConfiguration config("/", store_);
  EXPECT_TRUE(config.skipDeviceFamilyCheck());
  EXPECT_FALSE(config.skipThinningCheck());
  ASSERT_EQ(log_.systemMessages(), std::vector<std::string>{"Skipping device family check because of a set default"});
  EXPECT_EQ(log_.systemLines()[0].level, 5);
}

TEST_F(ConfigurationPreferences, SkipThinningCheckTrueWritesNotice) {
  store_.set("SkipThinningCheck", Value(true));
  QSGlobalConfiguration config("/", store_);
  EXPECT_TRUE(config.skipThinningCheck());
  EXPECT_FALSE(config.skipDeviceFamilyCheck());
  ASSERT_EQ(log_.systemMessages(),
            std::vector<std::string>{"Skipping device thinning check because of a set default"});
}

TEST_F(ConfigurationPreferences, SkipChecksIgnoreAnythingButBooleanTrue) {
  store_.set("SkipDeviceFamilyCheck", Value(1));
  store_.set("SkipThinningCheck", Value("YES"));
  QSGlobalConfiguration config("/", store_);
  EXPECT_FALSE(config.skipDeviceFamilyCheck());
  EXPECT_FALSE(config.skipThinningCheck());
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ConfigurationPreferences, SimultaneousInstallsAsStringKeepsFourSilently) {
  store_.set("SimultaneousInstallsNumber", Value("8"));
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(config.nSimultaneousInstallations(), 4);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ConfigurationPreferences, SimultaneousInstallsZeroIsTakenWithNotice) {
  store_.set("SimultaneousInstallsNumber", Value(0));
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(config.nSimultaneousInstallations(), 0);
  ASSERT_EQ(log_.systemMessages(), std::vector<std::string>{"Setting simultaneous installations allowed to 0"});
  EXPECT_EQ(log_.systemLines()[0].function, kInitFunction);
}

TEST_F(ConfigurationPreferences, SimultaneousInstallsHasNoBounds) {
  store_.set("SimultaneousInstallsNumber", Value(-3));
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(config.nSimultaneousInstallations(), -3);
  EXPECT_TRUE(log_.contains("Setting simultaneous installations allowed to -3"));
}

TEST_F(ConfigurationPreferences, AllNoticesInStepOrder) {
  store_.set("SimultaneousInstallsNumber", Value(2));
  store_.set("SkipThinningCheck", Value(true));
  store_.set("SkipDeviceFamilyCheck", Value(true));
  store_.set("LowerInstallPriority", Value(false));
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(log_.systemMessages(),
            (std::vector<std::string>{"Not running installation at background priority because of a set default",
                                      "Skipping device family check because of a set default",
                                      "Skipping device thinning check because of a set default",
                                      "Setting simultaneous installations allowed to 2"}));
}

TEST_F(ConfigurationPreferences, NoticesFollowTheLevelTest) {
  supporttest::ScopedLogHandle quiet(3);
  store_.set("SkipThinningCheck", Value(true));
  QSGlobalConfiguration config("/", store_);
  EXPECT_TRUE(config.skipThinningCheck());
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST(ConfigurationSharedInstance, IsOneObjectBuiltUnderTheBinarysRoot) {
  std::vector<QSGlobalConfiguration*> seen(4, nullptr);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&seen, i] { seen[i] = &QSGlobalConfiguration::sharedInstance(); });
  }
  for (auto& t : threads) t.join();
  for (QSGlobalConfiguration* p : seen) EXPECT_EQ(p, seen[0]);
  EXPECT_EQ(seen[0]->systemRoot(), qstest::systemRoot());
  EXPECT_EQ(seen[0]->oldContainerPath().path(), qstest::systemRoot() + "/private/var/mobile/Applications");
}

// --- Layout ------------------------------------------------------------------------

class ConfigurationLayout : public ::testing::Test {
 protected:
  MemoryPreferenceStore store_;
};

TEST_F(ConfigurationLayout, RealRootGivesTheDocumentedPaths) {
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(config.systemRoot(), "");
  EXPECT_EQ(config.oldContainerPath().path(), "/private/var/mobile/Applications");
  EXPECT_TRUE(config.oldContainerPath().isDirectory());
  EXPECT_EQ(config.oldInstallMapPath().path(), "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist");
  EXPECT_FALSE(config.oldInstallMapPath().isDirectory());
  EXPECT_EQ(config.oldDataDirectoryPath().path(), "/private/var/mobile/Library/Quillset");
  EXPECT_EQ(config.oldLoggingPath().path(), "/private/var/mobile/Library/Logs/Quillset");
  EXPECT_EQ(config.oldArchiveDirectory().path(), "/private/var/mobile/Media/ApplicationArchives");
  EXPECT_EQ(config.dataDirectoryPath().path(), "/private/var/quilld/Library/Quillset");
  EXPECT_EQ(config.roleUserMigrationMarkerFilePath().path(), "/private/var/quilld/Library/Quillset/RoleUserMigration.plist");
  EXPECT_FALSE(config.roleUserMigrationMarkerFilePath().isDirectory());
  EXPECT_EQ(config.coreServicesDirectory().path(), "/System/Library/CoreServices");
  EXPECT_EQ(config.systemAppsDirectory().path(), "/Applications");
  EXPECT_EQ(config.internalAppsDirectory().path(), "/VantrelInternal/Applications");
  EXPECT_EQ(config.developerAppsDirectory().path(), "/Developer/Applications");
  EXPECT_EQ(config.factoryMountDirectory().path(), "/private/var/factory_mount");
  EXPECT_TRUE(config.factoryMountDirectory().isDirectory());
  EXPECT_EQ(config.systemFrameworksRootDirectory().path(), "/System/Library");
  EXPECT_EQ(config.internalFrameworksRootDirectory().path(), "/VantrelInternal");
  EXPECT_EQ(config.developerFrameworksRootDirectory().path(), "/Developer");
}

TEST_F(ConfigurationLayout, RootWithTrailingSeparatorIsNormalised) {
  qstest::TempDir root("layout");
  QSGlobalConfiguration config(root.path() + "/", store_);
  EXPECT_EQ(config.systemRoot(), root.path());
  EXPECT_EQ(config.oldInstallMapPath().path(),
            root.path() + "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist");
  EXPECT_EQ(config.systemAppsDirectory().path(), root.path() + "/Applications");
}

TEST_F(ConfigurationLayout, UncachedAccessorsCreateNothing) {
  qstest::TempDir root("layout");
  QSGlobalConfiguration config(root.path(), store_);
  (void)config.oldContainerPath();
  (void)config.oldDataDirectoryPath();
  (void)config.dataDirectoryPath();
  (void)config.roleUserMigrationMarkerFilePath();
  (void)config.systemAppsDirectory();
  (void)config.factoryMountDirectory();
  EXPECT_FALSE(isDirectory(root / "private"));
  EXPECT_FALSE(isDirectory(root / "Applications"));
}

TEST_F(ConfigurationLayout, AllFrameworksDirectoriesAreTheFourSystemAndInternalOnes) {
  QSGlobalConfiguration config("/", store_);
  std::set<URL> expected{URL::fileURL("/System/Library/Frameworks", true),
                         URL::fileURL("/System/Library/PrivateFrameworks", true),
                         URL::fileURL("/VantrelInternal/Frameworks", true),
                         URL::fileURL("/VantrelInternal/PrivateFrameworks", true)};
  std::set<URL> found = config.allFrameworksDirectories();
  EXPECT_EQ(found, expected);
  for (const URL& url : found) EXPECT_TRUE(url.isDirectory()) << url.path();
  EXPECT_EQ(config.allFrameworksDirectories(), expected);
}

TEST_F(ConfigurationLayout, ItemNameListsInTheirOrder) {
  QSGlobalConfiguration config("/", store_);
  EXPECT_EQ(config.appBundleMetadataItemNames(),
            (std::vector<std::string>{"Manifest.plist", "VendraArtwork", "VendraMetadata.plist", "GeoJSON"}));
  EXPECT_EQ(config.appUserDataItemNames(), (std::vector<std::string>{"Documents", "Library", "tmp", "Tillbox"}));
}

// --- Directory creation -----------------------------------------------------------------

class ConfigurationDirectories : public ::testing::Test {
 protected:
  void SetUp() override { previousMask_ = umask(022); }
  void TearDown() override { umask(previousMask_); }

  MemoryPreferenceStore store_;
  qstest::TempDir root_{"dirs"};
  qstest::LogCapture log_;
  mode_t previousMask_ = 0;
};

TEST_F(ConfigurationDirectories, DataDirectoryIsMadeWithClassFourAndMode0755) {
  QSGlobalConfiguration config(root_.path(), store_);
  URL url = config.dataDirectory();
  EXPECT_EQ(url.path(), root_.path() + "/private/var/quilld/Library/Quillset");
  EXPECT_TRUE(url.isDirectory());
  ASSERT_TRUE(isDirectory(url.path()));
  struct stat status {};
  ASSERT_EQ(stat(url.path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0755u);
  EXPECT_EQ(supporttest::protectionClassOf(url.path()), std::optional<int32_t>(4));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ConfigurationDirectories, DataDirectoryIsMadeAgainAfterDeletion) {
  QSGlobalConfiguration config(root_.path(), store_);
  URL first = config.dataDirectory();
  ASSERT_TRUE(isDirectory(first.path()));
  ASSERT_EQ(rmdir(first.path().c_str()), 0);
  URL second = config.dataDirectory();
  EXPECT_EQ(first, second);
  EXPECT_TRUE(isDirectory(second.path()));
}

TEST_F(ConfigurationDirectories, CachesDirectoryIsMadeWithoutAClass) {
  QSGlobalConfiguration config(root_.path(), store_);
  URL url = config.cachesDirectory();
  EXPECT_EQ(url.path(), root_.path() + "/private/var/quilld/Library/Caches");
  ASSERT_TRUE(isDirectory(url.path()));
  EXPECT_EQ(supporttest::protectionClassOf(url.path()), std::nullopt);
}

TEST_F(ConfigurationDirectories, StagingRootLivesInTheCachesDirectory) {
  QSGlobalConfiguration config(root_.path(), store_);
  URL url = config.stagingRoot();
  EXPECT_EQ(url.path(), root_.path() + "/private/var/quilld/Library/Caches/com.vantrel.mobile.quilld.staging");
  ASSERT_TRUE(isDirectory(url.path()));
  EXPECT_EQ(supporttest::protectionClassOf(url.path()), std::optional<int32_t>(4));
  EXPECT_EQ(supporttest::protectionClassOf(root_.path() + "/private/var/quilld/Library/Caches"), std::nullopt);
}

TEST_F(ConfigurationDirectories, LogAndCarrierBundleDirectoriesAreMade) {
  QSGlobalConfiguration config(root_.path(), store_);
  URL logs = config.logDirectory();
  EXPECT_EQ(logs.path(), root_.path() + "/private/var/quilld/Library/Logs/Quillset");
  EXPECT_TRUE(isDirectory(logs.path()));
  EXPECT_EQ(supporttest::protectionClassOf(logs.path()), std::optional<int32_t>(4));
  ASSERT_EQ(rmdir(logs.path().c_str()), 0);
  EXPECT_TRUE(isDirectory(config.logDirectory().path()));

  URL carriers = config.carrierBundlesDirectory();
  EXPECT_EQ(carriers.path(), root_.path() + "/private/var/mobile/Library/Carrier Bundles");
  EXPECT_TRUE(isDirectory(carriers.path()));
  EXPECT_EQ(supporttest::protectionClassOf(carriers.path()), std::nullopt);
}

TEST_F(ConfigurationDirectories, FailedStagingRootCreationStillReturnsTheURL) {
  QSGlobalConfiguration config(root_.path(), store_);
  std::string caches = root_.path() + "/private/var/quilld/Library/Caches";
  ASSERT_TRUE(qstest::makeDirs(caches));
  ASSERT_TRUE(qstest::setImmutable(caches, true));
  URL url = config.stagingRoot();
  ASSERT_TRUE(qstest::setImmutable(caches, false));

  EXPECT_EQ(url.path(), caches + "/com.vantrel.mobile.quilld.staging");
  EXPECT_FALSE(isDirectory(url.path()));
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration stagingRoot]");
  std::string prefix = "Failed to create staging root at \"" + url.description() + "\": Error Domain=POSIXErrorDomain Code=1 ";
  EXPECT_EQ(lines[0].message.substr(0, prefix.size()), prefix) << lines[0].message;
}

TEST_F(ConfigurationDirectories, FailedDataDirectoryCreationLogsUnderItsOwnName) {
  QSGlobalConfiguration config(root_.path(), store_);
  std::string library = root_.path() + "/private/var/quilld/Library";
  ASSERT_TRUE(qstest::makeDirs(library));
  ASSERT_TRUE(qstest::setImmutable(library, true));
  URL data = config.dataDirectory();
  URL caches = config.cachesDirectory();
  URL logs = config.logDirectory();
  ASSERT_TRUE(qstest::setImmutable(library, false));

  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration dataDirectory]");
  EXPECT_EQ(lines[0].message.rfind("Failed to create data dir at \"" + data.description() + "\": ", 0), 0u);
  // The caches directory writes the same words as the data directory.
  EXPECT_EQ(lines[1].function, "-[QSGlobalConfiguration cachesDirectory]");
  EXPECT_EQ(lines[1].message.rfind("Failed to create data dir at \"" + caches.description() + "\": ", 0), 0u);
  EXPECT_EQ(lines[2].function, "-[QSGlobalConfiguration logDirectory]");
  EXPECT_EQ(lines[2].message.rfind("Failed to create log directory at \"" + logs.description() + "\": ", 0), 0u);
  for (const auto& line : lines) EXPECT_EQ(line.level, 3);
}

TEST_F(ConfigurationDirectories, FailedCarrierBundlesCreationIsLogged) {
  QSGlobalConfiguration config(root_.path(), store_);
  std::string library = root_.path() + "/private/var/mobile/Library";
  ASSERT_TRUE(qstest::makeDirs(library));
  ASSERT_TRUE(qstest::setImmutable(library, true));
  URL carriers = config.carrierBundlesDirectory();
  ASSERT_TRUE(qstest::setImmutable(library, false));
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration carrierBundlesDirectory]");
  EXPECT_EQ(lines[0].message.rfind("Failed to create carrier bundles directory at \"" + carriers.description() + "\": ",
                                   0),
            0u);
}

TEST_F(ConfigurationDirectories, ConcurrentFirstAccessesAgree) {
  QSGlobalConfiguration config(root_.path(), store_);
  std::vector<URL> seen(6);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&config, &seen, i] { seen[i] = config.stagingRoot(); });
  }
  for (auto& t : threads) t.join();
  for (const URL& url : seen) EXPECT_EQ(url, seen[0]);
  EXPECT_TRUE(isDirectory(seen[0].path()));
  EXPECT_TRUE(log_.systemLines().empty());
}

}  // namespace
