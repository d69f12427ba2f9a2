// QSGlobalConfiguration: preferences read at creation, the path layout under
// the system root, caching, and directory creation on every access.
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <map>
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

// Each case: the stored preferences, the settings read, the notices written.
TEST_F(ConfigurationPreferences, SettingsAndNoticesFollowTheStoredValues) {
  const std::string lower = "Not running installation at background priority because of a set default";
  const std::string family = "Skipping device family check because of a set default";
  const std::string thinning = "Skipping device thinning check because of a set default";
  const struct {
    std::map<std::string, Value> stored;
    bool lowerPriority, skipFamily, skipThinning;
    int installs;
    std::vector<std::string> notices;
  } cases[] = {
      {{}, true, false, false, 4, {}},
      {{{"LowerInstallPriority", Value(false)}}, false, false, false, 4, {lower}},
      {{{"LowerInstallPriority", Value(true)}}, true, false, false, 4, {}},
      {{{"LowerInstallPriority", Value(0)}}, true, false, false, 4, {}},
      {{{"LowerInstallPriority", Value("NO")}}, true, false, false, 4, {}},
      {{{"SkipDeviceFamilyCheck", Value(true)}}, true, true, false, 4, {family}},
      {{{"SkipThinningCheck", Value(true)}}, true, false, true, 4, {thinning}},
      {{{"SkipDeviceFamilyCheck", Value(1)}, {"SkipThinningCheck", Value("YES")}}, true, false, false, 4, {}},
      {{{"SimultaneousInstallsNumber", Value("8")}}, true, false, false, 4, {}},
      {{{"SimultaneousInstallsNumber", Value(0)}}, true, false, false, 0,
       {"Setting simultaneous installations allowed to 0"}},
      {{{"SimultaneousInstallsNumber", Value(-3)}}, true, false, false, -3,
       {"Setting simultaneous installations allowed to -3"}},
      {{{"SimultaneousInstallsNumber", Value(2)},
        {"SkipThinningCheck", Value(true)},
        {"SkipDeviceFamilyCheck", Value(true)},
        {"LowerInstallPriority", Value(false)}},
       false, true, true, 2, {lower, family, thinning, "Setting simultaneous installations allowed to 2"}},
  };
  for (const auto& c : cases) {
    log_.clear();
    MemoryPreferenceStore store;
    for (const auto& [key, value] : c.stored) store.set(key, value);
    QSGlobalConfiguration config("/", store);
    const std::string label = Value(platform::Dictionary(c.stored.begin(), c.stored.end())).description();
    EXPECT_EQ(config.lowerInstallPriority(), c.lowerPriority) << label;
    EXPECT_EQ(config.skipDeviceFamilyCheck(), c.skipFamily) << label;
    EXPECT_EQ(config.skipThinningCheck(), c.skipThinning) << label;
    EXPECT_EQ(config.nSimultaneousInstallations(), c.installs) << label;
    EXPECT_EQ(config.uid(), 33u);
    EXPECT_EQ(config.gid(), 33u);
    EXPECT_EQ(log_.systemMessages(), c.notices) << label;
    for (const auto& line : log_.systemLines()) {
      EXPECT_EQ(line.level, 5);
      EXPECT_EQ(line.function, kInitFunction);
    }
    std::vector<std::string> domains = store.domainsAsked();
    EXPECT_EQ(domains, std::vector<std::string>(4, kDomain));
  }
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

TEST_F(ConfigurationLayout, PathsLieUnderTheNormalisedRootAndAccessingThemCreatesNothing) {
  qstest::TempDir temp("layout");
  for (const std::string& root : {std::string("/"), temp.path() + "/"}) {
    QSGlobalConfiguration config(root, store_);
    const std::string prefix = root == "/" ? "" : temp.path();
    EXPECT_EQ(config.systemRoot(), prefix);
    const std::pair<URL, std::string> cases[] = {
        {config.oldContainerPath(), "/private/var/mobile/Applications"},
        {config.oldInstallMapPath(), "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist"},
        {config.oldDataDirectoryPath(), "/private/var/mobile/Library/Quillset"},
        {config.oldLoggingPath(), "/private/var/mobile/Library/Logs/Quillset"},
        {config.oldArchiveDirectory(), "/private/var/mobile/Media/ApplicationArchives"},
        {config.dataDirectoryPath(), "/private/var/quilld/Library/Quillset"},
        {config.roleUserMigrationMarkerFilePath(), "/private/var/quilld/Library/Quillset/RoleUserMigration.plist"},
        {config.coreServicesDirectory(), "/System/Library/CoreServices"},
        {config.systemAppsDirectory(), "/Applications"},
        {config.internalAppsDirectory(), "/VantrelInternal/Applications"},
        {config.developerAppsDirectory(), "/Developer/Applications"},
        {config.factoryMountDirectory(), "/private/var/factory_mount"},
        {config.systemFrameworksRootDirectory(), "/System/Library"},
        {config.internalFrameworksRootDirectory(), "/VantrelInternal"},
        {config.developerFrameworksRootDirectory(), "/Developer"},
    };
    for (const auto& [url, path] : cases) {
      EXPECT_EQ(url.path(), prefix + path);
      EXPECT_EQ(url.isDirectory(), path.find(".plist") == std::string::npos) << path;
    }
  }
  EXPECT_FALSE(isDirectory(temp / "private"));
  EXPECT_FALSE(isDirectory(temp / "Applications"));
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

TEST_F(ConfigurationDirectories, AreMadeWithTheirClassOnEveryAccess) {
  QSGlobalConfiguration config(root_.path(), store_);
  const struct {
    std::function<URL()> access;
    std::string path;
    std::optional<int32_t> protectionClass;
  } cases[] = {
      {[&] { return config.stagingRoot(); },
       "/private/var/quilld/Library/Caches/com.vantrel.mobile.quilld.staging", 4},
      {[&] { return config.dataDirectory(); }, "/private/var/quilld/Library/Quillset", 4},
      {[&] { return config.cachesDirectory(); }, "/private/var/quilld/Library/Caches", std::nullopt},
      {[&] { return config.logDirectory(); }, "/private/var/quilld/Library/Logs/Quillset", 4},
      {[&] { return config.carrierBundlesDirectory(); }, "/private/var/mobile/Library/Carrier Bundles",
       std::nullopt},
  };
  for (const auto& c : cases) {
    for (int round = 0; round < 2; ++round) {
      URL url = c.access();
      EXPECT_EQ(url.path(), root_.path() + c.path);
      EXPECT_TRUE(url.isDirectory());
      ASSERT_TRUE(isDirectory(url.path())) << c.path << " round " << round;
      EXPECT_EQ(supporttest::protectionClassOf(url.path()), c.protectionClass) << c.path;
      struct stat status {};
      ASSERT_EQ(stat(url.path().c_str(), &status), 0);
      EXPECT_EQ(status.st_mode & 07777, 0755u);
      if (c.path.find("staging") != std::string::npos) {
        // The caches directory made on the way has no class of its own.
        EXPECT_EQ(supporttest::protectionClassOf(url.deletingLastPathComponent().path()), std::nullopt);
      } else if (round == 0 && c.path.find("Caches") == std::string::npos) {
        ASSERT_EQ(rmdir(url.path().c_str()), 0);
      }
    }
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

// The URL still comes back when the directory cannot be made; the line says why.
TEST_F(ConfigurationDirectories, FailedCreationIsLoggedUnderTheAccessorsName) {
  const std::string quilld = "/private/var/quilld/Library";
  const struct {
    std::string locked;
    URL (QSGlobalConfiguration::*access)();
    std::string function, words, cause;
  } cases[] = {
      {quilld, &QSGlobalConfiguration::dataDirectory, "dataDirectory", "Failed to create data dir at", ""},
      // The caches directory writes the same words as the data directory.
      {quilld, &QSGlobalConfiguration::cachesDirectory, "cachesDirectory", "Failed to create data dir at", ""},
      {quilld, &QSGlobalConfiguration::logDirectory, "logDirectory", "Failed to create log directory at", ""},
      {quilld + "/Caches", &QSGlobalConfiguration::stagingRoot, "stagingRoot", "Failed to create staging root at",
       "Error Domain=POSIXErrorDomain Code=1 "},
      {"/private/var/mobile/Library", &QSGlobalConfiguration::carrierBundlesDirectory, "carrierBundlesDirectory",
       "Failed to create carrier bundles directory at", ""},
  };
  for (const auto& c : cases) {
    log_.clear();
    QSGlobalConfiguration config(root_.path(), store_);
    ASSERT_TRUE(qstest::makeDirs(root_.path() + c.locked));
    ASSERT_TRUE(qstest::setImmutable(root_.path() + c.locked, true));
    URL url = (config.*c.access)();
    ASSERT_TRUE(qstest::setImmutable(root_.path() + c.locked, false));
    EXPECT_FALSE(isDirectory(url.path()));
    auto lines = log_.systemLines();
    ASSERT_EQ(lines.size(), 1u) << c.function;
    EXPECT_EQ(lines[0].level, 3);
    EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration " + c.function + "]");
    std::string prefix = c.words + " \"" + url.description() + "\": " + c.cause;
    EXPECT_EQ(lines[0].message.rfind(prefix, 0), 0u) << lines[0].message;
  }
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
