// QSGlobalConfiguration: preferences read at creation, the path layout under
// the system root, and directory creation on every access.
#include <sys/stat.h>
#include <sys/xattr.h>

#include <filesystem>

#include <gtest/gtest.h>

#include "Shared/Support/QSGlobalConfiguration.h"
#include "Support/SupportFixtures.h"

using platform::URL;
using platform::Value;
using supporttest::MemoryPreferenceStore;

namespace {

// Each case: the stored preferences; the settings read (lower priority, skip family, skip thinning,
// simultaneous installations); the notices written.
TEST(ConfigurationPreferences, SettingsAndNoticesFollowOnlyValuesOfTheRightKind) {
  const std::string n = "Setting simultaneous installations allowed to ";
  const struct {
    std::map<std::string, Value> stored;
    std::string settings;
    std::vector<std::string> notices;
  } cases[] = {
      {{}, "100 4", {}},
      {{{"LowerInstallPriority", Value(0)},
        {"SkipDeviceFamilyCheck", Value(1)},
        {"SkipThinningCheck", Value("YES")},
        {"SimultaneousInstallsNumber", Value("8")}},
       "100 4",
       {}},
      {{{"SimultaneousInstallsNumber", Value(0)}}, "100 0", {n + "0"}},
      {{{"SimultaneousInstallsNumber", Value(2)},
        {"SkipThinningCheck", Value(true)},
        {"SkipDeviceFamilyCheck", Value(true)},
        {"LowerInstallPriority", Value(false)}},
       "011 2",
       {"Not running installation at background priority because of a set default",
        "Skipping device family check because of a set default",
        "Skipping device thinning check because of a set default", n + "2"}},
  };
  for (const auto& [stored, settings, notices] : cases) {
    qstest::LogCapture log;
    MemoryPreferenceStore store(stored);
    QSGlobalConfiguration c("/", store);
    EXPECT_EQ(platform::Format("%d%d%d %ld", c.lowerInstallPriority(), c.skipDeviceFamilyCheck(), c.skipThinningCheck(),
                               c.nSimultaneousInstallations()),
              settings);
    EXPECT_EQ(log.systemMessages(), notices) << settings;
    for (const auto& line : log.systemLines()) EXPECT_EQ(line.level, 5);
    EXPECT_EQ(store.domains, std::vector<std::string>(4, "com.vantrel.quill.set"));
  }
}

TEST(ConfigurationLayout, PathsLieUnderTheNormalisedRootAndAccessingThemCreatesNothing) {
  MemoryPreferenceStore store;
  qstest::TempDir temp("layout");
  EXPECT_EQ(QSGlobalConfiguration::sharedInstance().oldContainerPath().path(),
            qstest::systemRoot() + "/private/var/mobile/Applications");
  for (const std::string& root : {std::string("/"), temp.path() + "//"}) {
    QSGlobalConfiguration config(root, store);
    const std::string prefix = root == "/" ? "" : temp.path();
    EXPECT_EQ(config.systemRoot(), prefix);
    const std::pair<URL, std::string> cases[] = {
        {config.oldInstallMapPath(), "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist"},
        {config.roleUserMigrationMarkerFilePath(), "/private/var/quilld/Library/Quillset/RoleUserMigration.plist"},
        {config.systemAppsDirectory(), "/Applications"},
        {config.factoryMountDirectory(), "/private/var/factory_mount"},
    };
    for (const auto& [url, path] : cases) {
      EXPECT_EQ(url.path(), prefix + path);
      EXPECT_EQ(url.isDirectory(), path.find(".plist") == std::string::npos) << path;
    }
  }
  EXPECT_TRUE(std::filesystem::is_empty(temp.path()));
}

// --- Directory creation -----------------------------------------------------------------

class ConfigurationDirectories : public ::testing::Test {
 protected:
  MemoryPreferenceStore store_;
  qstest::TempDir root_{"dirs"};
  QSGlobalConfiguration config_{root_.path(), store_};
  qstest::LogCapture log_;
};

// The class attribute of `path`, none when absent.
std::optional<int32_t> protectionClassOf(const std::string& path) {
  int32_t value = 0;
  ssize_t n = getxattr(path.c_str(), "user.com.vantrel.quilld.protection-class", &value, sizeof value);
  return n == sizeof value ? std::optional<int32_t>(value) : std::nullopt;
}

// Each case: the accessor, the directory, its class; the second access finds it removed and makes it again.
TEST_F(ConfigurationDirectories, AreMadeWithTheirClassOnEveryAccess) {
  const mode_t previousMask = umask(022);
  const std::tuple<URL (QSGlobalConfiguration::*)(), std::string, std::optional<int32_t>> cases[] = {
      {&QSGlobalConfiguration::dataDirectory, "/private/var/quilld/Library/Quillset", 4},
      {&QSGlobalConfiguration::logDirectory, "/private/var/quilld/Library/Logs/Quillset", 4},
      {&QSGlobalConfiguration::carrierBundlesDirectory, "/private/var/mobile/Library/Carrier Bundles", std::nullopt},
      {&QSGlobalConfiguration::stagingRoot, "/private/var/quilld/Library/Caches/com.vantrel.mobile.quilld.staging", 4},
  };
  for (const auto& [access, path, protectionClass] : cases) {
    for (int round = 0; round < 2; ++round) {
      URL url = (config_.*access)();
      EXPECT_EQ(url.path(), root_.path() + path);
      EXPECT_EQ(protectionClassOf(url.path()), protectionClass) << path;
      EXPECT_EQ(std::filesystem::status(url.path()).permissions(), std::filesystem::perms(0755)) << path << round;
      EXPECT_TRUE(round == 1 || rmdir(url.path().c_str()) == 0);
    }
  }
  // The caches directory made on the way to the staging root has no class of its own.
  EXPECT_EQ(protectionClassOf(root_.path() + "/private/var/quilld/Library/Caches"), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty());
  umask(previousMask);
}

// The URL still comes back when the directory cannot be made; the line says why.
TEST_F(ConfigurationDirectories, FailedCreationIsLoggedUnderTheAccessorsName) {
  const std::string quilld = "/private/var/quilld/Library";
  const std::tuple<std::string, URL (QSGlobalConfiguration::*)(), std::string, std::string> cases[] = {
      {quilld, &QSGlobalConfiguration::dataDirectory, "dataDirectory", "Failed to create data dir at"},
      {quilld, &QSGlobalConfiguration::cachesDirectory, "cachesDirectory", "Failed to create data dir at"},
      {quilld, &QSGlobalConfiguration::logDirectory, "logDirectory", "Failed to create log directory at"},
      {quilld + "/Caches", &QSGlobalConfiguration::stagingRoot, "stagingRoot", "Failed to create staging root at"},
      {"/private/var/mobile/Library", &QSGlobalConfiguration::carrierBundlesDirectory, "carrierBundlesDirectory",
       "Failed to create carrier bundles directory at"},
  };
  for (const auto& [locked, access, function, words] : cases) {
    log_.clear();
    ASSERT_TRUE(qstest::makeDirs(root_.path() + locked));
    ASSERT_TRUE(qstest::setImmutable(root_.path() + locked, true));
    URL url = (config_.*access)();
    ASSERT_TRUE(qstest::setImmutable(root_.path() + locked, false));
    auto lines = log_.systemLines();
    ASSERT_EQ(lines.size(), 1u) << function;
    EXPECT_EQ(lines[0].level, 3);
    EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration " + function + "]");
    EXPECT_EQ(lines[0].message.rfind(words + " \"" + url.description() + "\": Error Domain=", 0), 0u)
        << lines[0].message;
  }
}

}  // namespace
