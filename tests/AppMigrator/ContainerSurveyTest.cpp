// Introspection of old containers and the migration marker.
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "FakePlatform.h"
#include "Shared/FileManager/QSFileManager.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kIntrospect[] = "-[QSAppMigrator _introspectContainer:orderResultEarly:]";
constexpr char kLoadMarker[] = "-[QSAppMigrator _loadAndValidateMigrationMarkerAtURL:]";
constexpr char kMarkerName[] = "com.vantrel.quill.set.container_migrator.plist";

class Introspection : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    migrator_ = createMigrator();
    ASSERT_NE(migrator_, nullptr);
    // Made after creation, which would remove it while empty.
    ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  }

  std::optional<Dictionary> introspect(const std::string& path, bool* flag) {
    *flag = false;
    return migrator_->_introspectContainer(URL::fileURL(path, true), flag);
  }

  std::unique_ptr<QSAppMigrator> migrator_;
};

TEST_F(Introspection, RegularFileIsRemoved) {
  const std::string file = oldApplicationsPath() + "/stray";
  ASSERT_TRUE(writeFile(file, "x"));
  bool flag = false;
  EXPECT_FALSE(introspect(file, &flag).has_value());
  EXPECT_FALSE(pathExists(file));
  auto lines = hostLines("QSAppMigrator: Found regular file at " + file + " ; removing");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kIntrospect);
}

TEST_F(Introspection, VanishedEntryIsIgnored) {
  const std::string gone = oldApplicationsPath() + "/gone";
  bool flag = false;
  EXPECT_FALSE(introspect(gone, &flag).has_value());
  auto lines =
      hostLines("QSAppMigrator: Got ENOENT when introspecting " + gone + " ; ignoring (likely raced with quilld)");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 5);
}

TEST_F(Introspection, UnreadableEntryIsLeftInPlace) {
  const std::string container = makeContainer("locked");
  makeBundle(container + "/a.app", "com.example.a");
  ASSERT_EQ(chmod(container.c_str(), 0700), 0);
  const int status = runAsNobody([&] {
    bool flag = false;
    log_->clear();
    if (introspect(container, &flag).has_value()) return 1;
    return hostMessagesStartingWith("QSAppMigrator: Failed to get URLs in container " + container +
                                    " : Error Domain=POSIXErrorDomain Code=13 ")
                       .size() == 1
               ? 0
               : 2;
  });
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(pathExists(container + "/a.app"));
}

TEST_F(Introspection, ChildWhoseStatusCannotBeReadLeavesContainerInPlace) {
  // Readable but not searchable: the listing works, the status of a child does not.
  const std::string container = makeContainer("unsearchable");
  makeBundle(container + "/a.app", "com.example.a");
  ASSERT_EQ(chmod(container.c_str(), 0744), 0);
  const int status = runAsNobody([&] {
    bool flag = false;
    log_->clear();
    if (introspect(container, &flag).has_value()) return 1;
    return hostLineCount("QSAppMigrator: Failed to stat path " + container + "/a.app : Permission denied") == 1 ? 0
                                                                                                              : 2;
  });
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(pathExists(container + "/a.app"));
}

TEST_F(Introspection, ApplicationAndVPNPluginInEitherListingOrder) {
  // Enough name pairs that both listing orders occur among them.
  bool sawApplicationFirst = false, sawPluginFirst = false;
  for (int i = 0; i < 16; ++i) {
    const std::string container = makeContainer("both" + std::to_string(i));
    const std::string application = container + "/Main" + std::to_string(i) + ".app";
    const std::string plugin = container + "/Tunnel" + std::to_string(i) + ".vpnplugin";
    makeBundle(application, "com.example.main");
    makeBundle(plugin, "com.example.tunnel");
    auto children = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(URL::fileURL(container, true), false);
    ASSERT_TRUE(children.has_value());
    for (const URL& child : *children) {
      if (child.pathExtension() == "app" || child.pathExtension() == "vpnplugin") {
        (child.pathExtension() == "app" ? sawApplicationFirst : sawPluginFirst) = true;
        break;
      }
    }

    bool flag = false;
    auto info = introspect(container, &flag);
    ASSERT_TRUE(info.has_value());
    EXPECT_TRUE(flag);
    EXPECT_EQ(*info, containerInfo(container, application, "com.example.main", "App", plugin));
  }
  EXPECT_TRUE(sawApplicationFirst && sawPluginFirst) << "the directory gave only one order";
}

TEST_F(Introspection, VPNPluginAloneGoesLate) {
  const std::string container = makeContainer("vpn");
  makeBundle(container + "/Tunnel.vpnplugin", "com.example.tunnel");
  makeBundle(container + "/Documents", "");
  bool flag = true;
  auto info = migrator_->_introspectContainer(URL::fileURL(container, true), &flag);
  ASSERT_TRUE(info.has_value());
  EXPECT_FALSE(flag);
  EXPECT_EQ(*info, containerInfo(container, container + "/Tunnel.vpnplugin", "com.example.tunnel", "VPNBundle"));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Found vpn plugin " + container + "/Tunnel.vpnplugin"), 1u);
}

TEST_F(Introspection, ApplicationWithoutIdentifierLeavesNoBundleAndContainerIsRemoved) {
  const std::string container = makeContainer("noid");
  makeBundle(container + "/Main.app", "");
  ASSERT_TRUE(makeDirs(container + "/Documents"));
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_FALSE(flag);
  EXPECT_FALSE(pathExists(container));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Found app " + container + "/Main.app"), 1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: Could not get identifier for bundle at " + container + "/Main.app"), 1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: No app or vpn bundle found in container " + container + " ; removing it"),
            1u);
}

TEST_F(Introspection, UnopenableVPNPluginIsPassedOverSilently) {
  const std::string container = makeContainer("vpn");
  makeBundle(container + "/Main.app", "com.example.main");
  makeBundle(container + "/Tunnel.vpnplugin", "com.example.tunnel");
  platform_->bundleReader.unopenable = {container + "/Tunnel.vpnplugin"};
  bool flag = false;
  auto info = introspect(container, &flag);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, containerInfo(container, container + "/Main.app", "com.example.main", "App"));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Could not").empty());
}

TEST_F(Introspection, ContainerWithOnlyDataIsRemoved) {
  const std::string container = makeContainer("data");
  for (const char* name : {"Documents", "Library", "tmp"}) ASSERT_TRUE(makeDirs(container + "/" + name));
  ASSERT_TRUE(writeFile(container + "/Documents/precious", "x"));
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_FALSE(pathExists(container));
  auto lines = hostLines("QSAppMigrator: No app or vpn bundle found in container " + container + " ; removing it");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
}

TEST_F(Introspection, ExtensionInCapitalsIsNoBundle) {
  const std::string container = makeContainer("caps");
  makeBundle(container + "/Main.APP", "com.example.main");
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_FALSE(pathExists(container));
}

TEST_F(Introspection, SymbolicLinkedApplicationLeavesContainerUntouched) {
  const std::string container = makeContainer("link");
  makeBundle(scratch_->path() + "/Real.app", "com.example.real");
  ASSERT_EQ(symlink((scratch_->path() + "/Real.app").c_str(), (container + "/Main.app").c_str()), 0);
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_TRUE(pathExists(container + "/Main.app"));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Skipping container with app symlink at " + container + "/Main.app"), 1u);
}

TEST_F(Introspection, SymbolicLinkedVPNPluginLeavesContainerUntouched) {
  const std::string container = makeContainer("link");
  ASSERT_EQ(symlink("/nowhere", (container + "/Tunnel.vpnplugin").c_str()), 0);
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_TRUE(pathExists(container + "/Tunnel.vpnplugin"));
  EXPECT_EQ(hostLineCount("QSAppMigrator: VPN plugin was symlink; skipping container " + container +
                          "/Tunnel.vpnplugin"),
            1u);
}

TEST_F(Introspection, SymbolicLinkedMarkerLeavesContainerUntouched) {
  const std::string container = makeContainer("link");
  makeBundle(container + "/Main.app", "com.example.main");
  ASSERT_EQ(symlink("/nowhere", (container + "/" + kMarkerName).c_str()), 0);
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_TRUE(pathExists(container + "/Main.app"));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Found migration marker " + container + "/" + kMarkerName), 1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: Migration marker was symlink; skipping container " + container + "/" +
                          kMarkerName),
            1u);
}

TEST_F(Introspection, ValidMarkerWinsOverTheChildrenAndIsReturnedAsRecorded) {
  const std::string container = makeContainer("marked");
  makeBundle(container + "/Main.app", "com.example.main");
  // Recorded elsewhere on purpose: the marker's paths are passed on unchanged.
  Dictionary marker = containerInfo("/recorded/container", "/recorded/Tunnel.vpnplugin", "com.example.recorded",
                                    "VPNBundle");
  marker["Extra"] = Value(7);
  writePlist(container + "/" + kMarkerName, Value(marker));
  bool flag = false;
  auto info = introspect(container, &flag);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, marker);
  EXPECT_FALSE(flag);
}

TEST_F(Introspection, ValidApplicationMarkerGoesEarly) {
  const std::string container = makeContainer("marked");
  const Dictionary marker = containerInfo(container, container + "/Main.app", "com.example.main", "App");
  writePlist(container + "/" + kMarkerName, Value(marker));
  bool flag = false;
  auto info = introspect(container, &flag);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, marker);
  EXPECT_TRUE(flag);
}

TEST_F(Introspection, MarkerWithNumericSecondBundlePathIsInvalidAndChildrenDecide) {
  const std::string container = makeContainer("marked");
  makeBundle(container + "/Main.app", "com.example.main");
  Dictionary marker = containerInfo("/elsewhere", "/elsewhere/Other.app", "com.example.other", "App");
  marker["SecondBundlePath"] = Value(5);
  const std::string markerPath = container + "/" + kMarkerName;
  writePlist(markerPath, Value(marker));
  bool flag = false;
  auto info = introspect(container, &flag);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, containerInfo(container, container + "/Main.app", "com.example.main", "App"));
  EXPECT_TRUE(flag);
  auto specific = hostLines("QSAppMigrator: Second bundle path was not a string: 5");
  ASSERT_EQ(specific.size(), 1u);
  EXPECT_EQ(specific[0].function, kLoadMarker);
  auto general = hostLines("QSAppMigrator: Failed to load migration marker file from file://" + markerPath);
  ASSERT_EQ(general.size(), 1u);
  EXPECT_EQ(general[0].function, kIntrospect);
}

TEST_F(Introspection, InvalidMarkerInContainerWithoutBundlesStillRemovesIt) {
  const std::string container = makeContainer("marked");
  ASSERT_TRUE(writeFile(container + "/" + kMarkerName, "garbage"));
  bool flag = false;
  EXPECT_FALSE(introspect(container, &flag).has_value());
  EXPECT_FALSE(pathExists(container));
  // Once from the loader, once from introspection.
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to load migration marker file from file://" + container + "/" +
                          kMarkerName),
            2u);
}

// Each required key of a marker, removed or given a non-string value, fails
// validation with its own line; earlier keys are checked first.
TEST_F(Introspection, MarkerValidationChecksEachKeyInOrder) {
  const std::string markerPath = scratch_->path() + "/" + kMarkerName;
  const std::vector<std::pair<std::string, std::string>> checks = {
      {"BundlePath", "QSAppMigrator: Failed to get bundle path from migration marker file "},
      {"ContainerType", "QSAppMigrator: Failed to get container type from migration marker file "},
      {"ContainerPath", "QSAppMigrator: Failed to get container path from migration marker file "},
      {"BundleIdentifier", "QSAppMigrator: Failed to get container bundle ID from migration marker file "},
  };
  for (size_t i = 0; i < checks.size(); ++i) {
    for (bool remove : {true, false}) {
      Dictionary marker = containerInfo("/c", "/c/a.app", "com.example.a", "App");
      if (remove) {
        marker.erase(checks[i].first);
      } else {
        marker[checks[i].first] = Value(1);
      }
      // Later keys broken too: only the first broken one is reported.
      for (size_t j = i + 1; j < checks.size(); ++j) marker.erase(checks[j].first);
      writePlist(markerPath, Value(marker));
      log_->clear();
      EXPECT_FALSE(migrator_->_loadAndValidateMigrationMarkerAtURL(URL::fileURL(markerPath)).has_value());
      EXPECT_EQ(log_->hostMessages(), std::vector<std::string>{checks[i].second + markerPath}) << checks[i].first;
    }
  }
}

TEST_F(Introspection, MarkerThatIsNoDictionaryFailsToLoad) {
  const std::string markerPath = scratch_->path() + "/" + kMarkerName;
  writePlist(markerPath, Value(platform::makeStringArray({"a"})));
  EXPECT_FALSE(migrator_->_loadAndValidateMigrationMarkerAtURL(URL::fileURL(markerPath)).has_value());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Failed to load migration marker file from file://" + markerPath});
}

TEST_F(Introspection, BundleIdentifierComesFromTheBundleReader) {
  makeBundle(scratch_->path() + "/A.app", "com.example.a");
  EXPECT_EQ(migrator_->_bundleIdentifierForBundle(URL::fileURL(scratch_->path() + "/A.app", true)), "com.example.a");
  EXPECT_FALSE(migrator_->_bundleIdentifierForBundle(URL::fileURL(scratch_->path() + "/missing.app", true)));
  platform_->bundleReader.unopenable = {scratch_->path() + "/A.app"};
  EXPECT_FALSE(migrator_->_bundleIdentifierForBundle(URL::fileURL(scratch_->path() + "/A.app", true)));
}

}  // namespace
}  // namespace qstest
