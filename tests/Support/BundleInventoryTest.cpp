// The built-in bundle inventory: bundle maps, their caching and re-scans, the
// framework set, and the applications of mounted disk images, found through
// the device registry.
#include <sys/stat.h>

#include <filesystem>

#include <gtest/gtest.h>

#include "Platform/DeviceRegistry.h"
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

  supporttest::MemoryPreferenceStore store_;
  qstest::TempDir root_{"inventory"};
  QSGlobalConfiguration config_{root_.path(), store_};
  // No disk-image controller unless a test builds one under "sys".
  platform::LinuxDeviceRegistry registry_{root_ / "sys", root_ / "mountinfo"};
  qstest::LogCapture log_;
};

TEST_F(BundleInventory, MapHoldsTheFilteredInfoOfAppBundlesWithAStringIdentifier) {
  app("Applications/Maps.app", "com.vantrel.maps", "7.1");
  app("Applications/B.APP", "com.example.b");
  app("Applications/C.framework", "com.example.c");
  ASSERT_TRUE(supporttest::makeBundle(root_ / "Applications/Num.app", {{"RkBundleIdentifier", Value(5)}}));
  ASSERT_TRUE(qstest::makeDirs(root_ / "Applications/NoPlist.app"));
  std::optional<Dictionary> map = config_.systemAppBundleIDToInfoMap();
  ASSERT_EQ(keysOf(map), Keys{"com.vantrel.maps"});
  EXPECT_EQ(
      map->at("com.vantrel.maps"),
      Value(Dictionary{{"RkBundleIdentifier", Value("com.vantrel.maps")},
                       {"RkBundleVersion", Value("7.1")},
                       {"com.vantrel.Quillset.bundleURL", Value(URL::fileURL(root_ / "Applications/Maps.app"))}}));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(BundleInventory, MissingDirectoryIsAbsentSilentlyAndAnUnlistableOneIsLogged) {
  EXPECT_EQ(config_.internalAppBundleIDToInfoMap(), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty());
  app("VantrelInternal/Applications/Tool.app", "com.vantrel.tool");  // an absent map is not kept
  EXPECT_EQ(keysOf(config_.internalAppBundleIDToInfoMap()), Keys{"com.vantrel.tool"});
  ASSERT_TRUE(qstest::writeFile(root_ / "Applications", "a file where a directory belongs"));
  EXPECT_EQ(config_.systemAppBundleIDToInfoMap(), std::nullopt);
  const std::string line = "Failed to search for apps in " + config_.systemAppsDirectory().description() +
                           " : Error Domain=POSIXErrorDomain Code=20 ";
  ASSERT_EQ(log_.systemLines().size(), 1u);
  EXPECT_EQ(log_.systemMessages()[0].substr(0, line.size()), line);
}

// Each map is kept until its own re-scan; the framework set follows the system and internal re-scans.
TEST_F(BundleInventory, CachedMapsAndFrameworksAreKeptUntilTheirOwnReScan) {
  for (const char* name :
       {"Applications/s.app", "System/Library/CoreServices/c.app", "VantrelInternal/Applications/i.app",
        "System/Library/Frameworks/uikit.framework", "System/Library/PrivateFrameworks/secret.framework",
        "VantrelInternal/Frameworks/inside.framework", "Developer/Library/Frameworks/dev.framework"}) {
    app(name, std::filesystem::path(name).stem());
  }
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
  // Each mount: the device under /dev and the mount point under the root.
  void mountTable(const std::vector<std::string>& mounts) {
    std::string text = "22 27 0:21 / /proc rw,relatime - proc proc rw\n";
    for (size_t i = 0; i + 1 < mounts.size(); i += 2) {
      text += "40 27 7:0 / " + root_ / mounts[i + 1] + " rw - ext4 /dev/" + mounts[i] + " rw\n";
    }
    ASSERT_TRUE(qstest::writeFile(root_ / "mountinfo", text));
  }
  URL apps(const std::string& mountPoint) { return URL::fileURL(root_ / (mountPoint + "/Applications"), true); }
};

TEST_F(DiskImages, MountedImagesAndPartitionsAreSearchedInDeviceOrderThenTheDeveloperApplications) {
  const URL developer = config_.developerAppsDirectory();
  EXPECT_EQ(config_.diskImageApplicationsDirectories(), std::vector<URL>{developer});
  // Devices in numeric order (loop2, loop5, loop10); the developer directory is not listed twice.
  for (const char* device : {"loop2", "loop3", "loop4", "loop5"}) loopDevice(device, true);  // loop3 not mounted
  loopDevice("loop1", false);
  loopDevice("loop10", true, "loop10p1");
  ASSERT_TRUE(qstest::makeDirs(root_ / "sys/block/vda") && qstest::makeDirs(root_ / "sys/block/loopback"));
  mountTable({"loop10p1", "mnt/second", "loop2", "mnt/first", "loop2", "mnt/again", "vda", "mnt/vda",  // first wins
              "loop4", "private/var/debug_mount", "loop5", "Developer"});
  EXPECT_EQ(config_.diskImageApplicationsDirectories(),
            (std::vector<URL>{apps("mnt/first"), developer, apps("mnt/second")}));
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
  log_.clear();
  mountTable({});
  EXPECT_EQ(config_.mountPointForDevice(4242), std::nullopt);
  EXPECT_EQ(log_.systemMessages(),
            std::vector<std::string>{"DvRegistryEntryCreateIterator failed for deviceObj (4242)"});

  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0700), 0);
  int status = qstest::runAsNobody([this] {
    qstest::LogCapture log;
    const std::string line = "unable to create controller child iterator: error 0xE000000D (-536870899)";
    return config_.diskImageMountPoints().empty() && log.systemMessages() == std::vector{line} ? 0 : 1;
  });
  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0755), 0);
  EXPECT_EQ(status, 0);
}

// The registry's mount-table parser; its sysfs walk and its refusals are exercised above.
TEST(DeviceRegistry, MountTableEntriesAreParsedWithTheirEscapesAndMalformedLinesSkipped) {
  std::string text =
      "garbage\n"
      "1 2 3:4 / /no/separator rw ext4 /dev/x rw\n"
      "37 27 7:1 / /mnt/two\\040words rw master:1 shared:2 - hfs /dev/loop1p1 rw\n"
      "5 6 7:8 / /ok rw - ext4 /dev/ok rw";
  EXPECT_EQ(platform::parseMountInfo(text),
            (std::vector<platform::MountedFileSystem>{{"/dev/loop1p1", "/mnt/two words"}, {"/dev/ok", "/ok"}}));
}

}  // namespace
