// QSGlobalConfiguration: preferences read at creation, the path layout under
// the system root, and directory creation on every access.
#include <sys/stat.h>
#include <sys/xattr.h>

#include <filesystem>

#include <gmock/gmock.h>

#include "Shared/Support/QSGlobalConfiguration.h"
#include "Support/SupportFixtures.h"

using platform::URL;
using platform::Value;
using supporttest::MemoryPreferenceStore;

namespace {

// Each case: the stored preferences (wrong kinds leave the defaults); the settings read (lower priority, skip family,
// skip thinning, simultaneous installations); the notices written.
TEST(ConfigurationPreferences, SettingsAndNoticesFollowOnlyValuesOfTheRightKind) {
  const std::string n = "Setting simultaneous installations allowed to ";
  const std::tuple<std::map<std::string, Value>, std::string, std::vector<std::string>> cases[] = {
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
    EXPECT_EQ(store.domains, std::vector<std::string>(4, "com.vantrel.quill.set"));
  }
}

TEST(ConfigurationLayout, PathsLieUnderTheNormalisedRootAndAccessingThemCreatesNothing) {
  MemoryPreferenceStore store;
  qstest::TempDir temp("layout");
  QSGlobalConfiguration atRoot("/", store), below(temp.path() + "//", store);
  EXPECT_EQ(atRoot.oldInstallMapPath().path(), "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist");
  EXPECT_EQ(below.roleUserMigrationMarkerFilePath().path(),
            temp.path() + "/private/var/quilld/Library/Quillset/RoleUserMigration.plist");
  EXPECT_EQ(atRoot.systemAppsDirectory().path() + below.factoryMountDirectory().path(),
            "/Applications" + temp.path() + "/private/var/factory_mount");
  EXPECT_TRUE(std::filesystem::is_empty(temp.path()));
  EXPECT_EQ(QSGlobalConfiguration::sharedInstance().systemRoot(), qstest::systemRoot());
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

// Each case: the accessor, the directory, its class, the words of its failure line. Every access makes
// the directory again; when it cannot (its parent immutable), the line says why and the URL still comes back.
TEST_F(ConfigurationDirectories, AreMadeWithTheirModeAndClassOnEveryAccessAndAFailureIsLogged) {
  const mode_t previousMask = umask(0);  // the mode is the accessor's, not the umask's
  const struct {
    URL (QSGlobalConfiguration::*access)();
    std::string path;
    std::optional<int32_t> protectionClass;
    std::string words;
  } cases[] = {
      {&QSGlobalConfiguration::dataDirectory, "/private/var/quilld/Library/Quillset", 4,
       "Failed to create data dir at"},
      {&QSGlobalConfiguration::logDirectory, "/private/var/quilld/Library/Logs/Quillset", 4,
       "Failed to create log directory at"},
      {&QSGlobalConfiguration::carrierBundlesDirectory, "/private/var/mobile/Library/Carrier Bundles", std::nullopt,
       "Failed to create carrier bundles directory at"},
      {&QSGlobalConfiguration::stagingRoot, "/private/var/quilld/Library/Caches/com.vantrel.mobile.quilld.staging", 4,
       "Failed to create staging root at"},
  };
  for (const auto& [access, path, protectionClass, words] : cases) {
    for (int round = 0; round < 2; ++round) {
      URL url = (config_.*access)();
      EXPECT_EQ(url.path(), root_.path() + path);
      EXPECT_EQ(protectionClassOf(url.path()), protectionClass) << path;
      EXPECT_EQ(std::filesystem::status(url.path()).permissions(), std::filesystem::perms(0755)) << path << round;
      ASSERT_EQ(rmdir(url.path().c_str()), 0);
    }
    const std::string parent = std::filesystem::path(root_.path() + path).parent_path();
    ASSERT_TRUE(qstest::setImmutable(parent, true));
    URL url = (config_.*access)();
    ASSERT_TRUE(qstest::setImmutable(parent, false));
    auto lines = log_.systemLines();
    ASSERT_EQ(lines.size(), 1u) << path;
    EXPECT_EQ(lines[0].level, 3);
    EXPECT_THAT(lines[0].message, testing::StartsWith(words + " \"" + url.description() + "\": Error Domain="));
    log_.clear();
  }
  // The caches directory made on the way to the staging root has no class of its own.
  EXPECT_EQ(protectionClassOf(root_.path() + "/private/var/quilld/Library/Caches"), std::nullopt);
  umask(previousMask);
}

}  // namespace
