// The built-in bundle inventory: bundle maps, their caching and re-scans, the
// framework set, and the applications of mounted disk images.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include "Platform/DeviceRegistry.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Support/SupportFixtures.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;
using Keys = std::set<std::string>;

namespace {

class BundleInventory : public ::testing::Test {
 protected:
  void SetUp() override { config_.setDeviceRegistry(&registry_); }

  void app(const std::string& bundle, const std::string& identifier, const std::string& version = "1") {
    ASSERT_TRUE(supporttest::makeBundle(
        root_ / bundle,
        {{"RkBundleIdentifier", Value(identifier)}, {"RkBundleVersion", Value(version)}, {"Other", Value("dropped")}}));
  }
  static Keys keysOf(const std::optional<Dictionary>& map) {
    Keys keys;
    for (const auto& entry : map.value_or(Dictionary{})) keys.insert(entry.first);
    return keys;
  }

  supporttest::ScopedLogHandle noHandle_{std::nullopt};
  supporttest::MemoryPreferenceStore store_;
  qstest::TempDir root_{"inventory"};
  QSGlobalConfiguration config_{root_.path(), store_};
  // No disk-image controller unless a test builds one under "sys".
  platform::LinuxDeviceRegistry registry_{root_ / "sys", root_ / "mountinfo"};
  qstest::LogCapture log_;
};

TEST_F(BundleInventory, MapHoldsTheFilteredInfoOfAppBundlesWithAStringIdentifierAndTheLaterOfTwoWins) {
  app("Applications/Maps.app", "com.vantrel.maps", "7.1");
  app("Applications/B.APP", "com.example.b");
  app("Applications/C.framework", "com.example.c");
  app("Applications/First.app", "com.example.same", "1");
  app("Applications/Second.app", "com.example.same", "2");
  ASSERT_TRUE(supporttest::makeBundle(root_ / "Applications/Num.app", {{"RkBundleIdentifier", Value(5)}}));
  ASSERT_TRUE(qstest::makeDirs(root_ / "Applications/NoPlist.app"));
  std::optional<Dictionary> map = config_.systemAppBundleIDToInfoMap();
  ASSERT_EQ(keysOf(map), (Keys{"com.vantrel.maps", "com.example.same"}));
  EXPECT_EQ(
      map->at("com.vantrel.maps"),
      Value(Dictionary{{"RkBundleIdentifier", Value("com.vantrel.maps")},
                       {"RkBundleVersion", Value("7.1")},
                       {"com.vantrel.Quillset.bundleURL", Value(URL::fileURL(root_ / "Applications/Maps.app"))}}));
  // The later of the two in listing order.
  auto listing = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(config_.systemAppsDirectory(), true);
  ASSERT_TRUE(listing);
  auto position = [&](const char* name) {
    return std::find(listing->begin(), listing->end(), URL::fileURL(root_ / name));
  };
  const char* later = position("Applications/First.app") < position("Applications/Second.app") ? "2" : "1";
  EXPECT_EQ(*map->at("com.example.same").get("RkBundleVersion"), Value(later));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(BundleInventory, MissingDirectoryIsAbsentSilentlyAndAnUnlistableOneIsLogged) {
  EXPECT_EQ(config_.internalAppBundleIDToInfoMap(), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty());
  app("VantrelInternal/Applications/Tool.app", "com.vantrel.tool");
  EXPECT_EQ(keysOf(config_.internalAppBundleIDToInfoMap()), Keys{"com.vantrel.tool"});

  ASSERT_TRUE(qstest::writeFile(root_ / "Applications", "a file where a directory belongs"));
  EXPECT_EQ(config_.systemAppBundleIDToInfoMap(), std::nullopt);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration _bundleIDMapForBundlesInDirectory:withExtension:]");
  EXPECT_EQ(lines[0].message.rfind("Failed to search for apps in " + config_.systemAppsDirectory().description() +
                                       " : Error Domain=POSIXErrorDomain Code=20 ",
                                   0),
            0u)
      << lines[0].message;
}

// Each map is kept until its own re-scan; the framework set follows the system and internal re-scans.
TEST_F(BundleInventory, CachedMapsAndFrameworksAreKeptUntilTheirOwnReScan) {
  app("Applications/S.app", "s");
  app("System/Library/CoreServices/C.app", "c");
  app("VantrelInternal/Applications/I.app", "i");
  app("System/Library/Frameworks/UIKit.framework", "uikit");
  app("System/Library/PrivateFrameworks/Secret.framework", "secret");
  app("VantrelInternal/Frameworks/Inside.framework", "inside");
  app("Developer/Library/Frameworks/Dev.framework", "dev");
  app("System/Library/Frameworks/NotAFramework.app", "app");
  auto all = [this] {
    return std::vector<Keys>{keysOf(config_.systemAppBundleIDToInfoMap()),
                             keysOf(config_.coreServicesAppBundleIDToInfoMap()),
                             keysOf(config_.internalAppBundleIDToInfoMap()), config_.builtInFrameworkBundleIDs()};
  };
  EXPECT_EQ(all(), (std::vector<Keys>{{"s"}, {"c"}, {"i"}, {"uikit", "secret", "inside"}}));
  app("Applications/S2.app", "s2");
  app("System/Library/CoreServices/C2.app", "c2");
  app("VantrelInternal/Applications/I2.app", "i2");
  app("VantrelInternal/PrivateFrameworks/Late.framework", "late");
  config_.reScanCoreServicesApps();
  EXPECT_EQ(all(), (std::vector<Keys>{{"s"}, {"c", "c2"}, {"i"}, {"uikit", "secret", "inside"}}));
  config_.reScanSystemApps();
  EXPECT_EQ(all(), (std::vector<Keys>{{"s", "s2"}, {"c", "c2"}, {"i"}, {"uikit", "secret", "inside", "late"}}));
  app("System/Library/Frameworks/Later.framework", "later");
  config_.reScanInternalApps();
  EXPECT_EQ(all(),
            (std::vector<Keys>{{"s", "s2"}, {"c", "c2"}, {"i", "i2"}, {"uikit", "secret", "inside", "late", "later"}}));
  // Built-in applications leave out core services.
  EXPECT_EQ(config_.builtInApplicationBundleIDs(), (Keys{"s", "s2", "i", "i2"}));
}

// --- Disk images -----------------------------------------------------------------------

class DiskImages : public BundleInventory {
 protected:
  void loopDevice(const std::string& name, bool attached, const std::string& partition = "") {
    std::string device = root_ / ("sys/block/" + name);
    ASSERT_TRUE(qstest::makeDirs(device + (partition.empty() ? "" : "/" + partition)));
    EXPECT_TRUE(!attached ||
                (qstest::makeDirs(device + "/loop") && qstest::writeFile(device + "/loop/backing_file", "/i")));
  }
  void mountTable(const std::vector<std::pair<std::string, std::string>>& mounts) {
    std::string text = "22 27 0:21 / /proc rw,relatime - proc proc rw\n";
    for (const auto& [source, mountPoint] : mounts)
      text += "40 27 7:0 / " + mountPoint + " rw - ext4 " + source + " rw\n";
    ASSERT_TRUE(qstest::writeFile(root_ / "mountinfo", text));
  }
  URL apps(const std::string& mountPoint) { return URL::fileURL(root_ / (mountPoint + "/Applications"), true); }
};

TEST_F(DiskImages, MountedImagesAndPartitionsAreSearchedInDeviceOrderThenTheDeveloperApplications) {
  const URL developer = config_.developerAppsDirectory();
  EXPECT_EQ(config_.diskImageApplicationsDirectories(), std::vector<URL>{developer});
  loopDevice("loop0", true);
  loopDevice("loop1", false);
  loopDevice("loop2", true, "loop2p1");
  loopDevice("loop3", true);  // attached but not mounted
  loopDevice("loop4", true);
  loopDevice("loop5", true);
  mountTable({{"/dev/loop2p1", root_ / "mnt/second"},
              {"/dev/vda1", "/"},
              {"/dev/loop0", root_ / "mnt/first"},
              {"/dev/loop0", root_ / "mnt/again"},
              {"/dev/loop4", root_ / "private/var/debug_mount"},
              {"/dev/loop5", root_ / "Developer"}});
  EXPECT_EQ(config_.diskImageApplicationsDirectories(),
            (std::vector<URL>{apps("mnt/first"), apps("mnt/second"), developer}));
  // Later directories overwrite earlier identifiers; the debug mount is never searched.
  app("mnt/first/Applications/Shared.app", "com.example.shared", "1");
  app("mnt/first/Applications/Only.app", "com.example.only");
  app("private/var/debug_mount/Applications/Debug.app", "com.example.debug");
  app("Developer/Applications/Shared.app", "com.example.shared", "2");
  Dictionary map = config_.diskImageAppBundleIDToInfoMap();
  EXPECT_EQ(keysOf(map), (Keys{"com.example.shared", "com.example.only"}));
  EXPECT_EQ(*map.at("com.example.shared").get("RkBundleVersion"), Value("2"));
  EXPECT_TRUE(config_.builtInApplicationBundleIDs().count("com.example.only"));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(DiskImages, UnreadableMountTableUnknownDeviceAndUnlistableControllerAreLogged) {
  loopDevice("loop0", true);
  loopDevice("loop1", true);
  EXPECT_TRUE(config_.diskImageMountPoints().empty());
  EXPECT_EQ(log_.systemMessages(), std::vector<std::string>(2, "getmntinfo failed: No such file or directory"));
  EXPECT_EQ(log_.systemLines()[0].function, "-[QSGlobalConfiguration mountPointForDevice:]");
  log_.clear();
  mountTable({});
  EXPECT_EQ(config_.mountPointForDevice(4242), std::nullopt);
  EXPECT_EQ(log_.systemMessages(),
            std::vector<std::string>{"DvRegistryEntryCreateIterator failed for deviceObj (4242)"});

  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0700), 0);
  int status = qstest::runAsNobody([this] {
    qstest::LogCapture log;
    bool empty = config_.diskImageMountPoints().empty();
    return empty && log.systemMessages() ==
                        std::vector<std::string>{
                            "unable to create controller child iterator: "
                            "error 0xE000000D (-536870899)"}
               ? 0
               : 1;
  });
  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0755), 0);
  EXPECT_EQ(status, 0);
}

}  // namespace
