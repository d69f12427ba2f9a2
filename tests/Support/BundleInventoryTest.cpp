// The built-in bundle inventory: bundle maps, their caching and re-scans, the
// framework set, and the applications of mounted disk images.
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "Platform/DeviceRegistry.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Support/SupportFixtures.h"
#include "support/TestSupport.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;
using supporttest::makeBundle;

namespace {

constexpr char kMapFunction[] = "-[QSGlobalConfiguration _bundleIDMapForBundlesInDirectory:withExtension:]";

class BundleInventory : public ::testing::Test {
 protected:
  void SetUp() override { config_.setDeviceRegistry(&registry_); }

  void app(const std::string& directory, const std::string& name, const std::string& identifier,
           const std::string& version = "1") {
    ASSERT_TRUE(makeBundle(root_ / (directory + "/" + name),
                           {{"RkBundleIdentifier", identifier}, {"RkBundleVersion", version}, {"Other", "dropped"}}));
  }

  std::set<std::string> keysOf(const std::optional<Dictionary>& map) {
    std::set<std::string> keys;
    if (map) {
      for (const auto& entry : *map) keys.insert(entry.first);
    }
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

TEST_F(BundleInventory, MapHoldsFilteredInfoAndTheBundleURLOfCaseSensitiveAppBundles) {
  app("Applications", "Maps.app", "com.vantrel.maps", "7.1");
  app("Applications", "B.APP", "com.example.b");
  app("Applications", "C.framework", "com.example.c");
  std::optional<Dictionary> map = config_.systemAppBundleIDToInfoMap();
  ASSERT_TRUE(map.has_value());
  ASSERT_EQ(keysOf(map), std::set<std::string>{"com.vantrel.maps"});
  EXPECT_EQ(map->at("com.vantrel.maps"),
            Value(Dictionary{{"RkBundleIdentifier", Value("com.vantrel.maps")},
                             {"RkBundleVersion", Value("7.1")},
                             {"com.vantrel.Quillset.bundleURL", Value(URL::fileURL(root_ / "Applications/Maps.app", true))}}));
}

TEST_F(BundleInventory, BundleWithoutStringIdentifierIsSkippedWithDebugLine) {
  app("Applications", "Good.app", "com.example.good");
  ASSERT_TRUE(makeBundle(root_ / "Applications/NoID.app", {{"RkBundleVersion", "1"}}));
  ASSERT_TRUE(qstest::makeDirs(root_ / "Applications/NoPlist.app"));
  ASSERT_TRUE(qstest::makeDirs(root_ / "Applications/Num.app"));
  ASSERT_TRUE(qstest::writeFile(root_ / "Applications/Num.app/Info.plist",
                                "<plist version=\"1.0\"><dict><key>RkBundleIdentifier</key><integer>5</integer>"
                                "</dict></plist>\n"));
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()), std::set<std::string>{"com.example.good"});
  EXPECT_TRUE(log_.systemLines().empty()) << "debug lines are dropped without a handle";

  supporttest::ScopedLogHandle verbose(7);
  config_.reScanSystemApps();
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()), std::set<std::string>{"com.example.good"});
  std::string noID = URL::fileURL(root_ / "Applications/NoID.app", true).description();
  std::string noPlist = URL::fileURL(root_ / "Applications/NoPlist.app", true).description();
  size_t idLines = 0;
  size_t plistLines = 0;
  for (const auto& line : log_.systemLines()) {
    if (line.function != kMapFunction) continue;
    EXPECT_EQ(line.level, 7);
    idLines += line.message == "Failed to get RkBundleIdentifier from bundle " + noID;
    plistLines += line.message == "Failed to load Info.plist from bundle " + noPlist;
  }
  EXPECT_EQ(idLines, 1u);
  EXPECT_EQ(plistLines, 1u);
}

TEST_F(BundleInventory, MissingDirectoryIsAbsentSilentlyAndListedAgainNextTime) {
  EXPECT_EQ(config_.internalAppBundleIDToInfoMap(), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty());
  app("VantrelInternal/Applications", "Tool.app", "com.vantrel.tool");
  EXPECT_EQ(keysOf(config_.internalAppBundleIDToInfoMap()), std::set<std::string>{"com.vantrel.tool"});
}

TEST_F(BundleInventory, UnlistableDirectoryIsLogged) {
  ASSERT_TRUE(qstest::writeFile(root_ / "Applications", "a file where a directory belongs"));
  EXPECT_EQ(config_.systemAppBundleIDToInfoMap(), std::nullopt);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kMapFunction);
  std::string prefix = "Failed to search for apps in " + config_.systemAppsDirectory().description() +
                       " : Error Domain=POSIXErrorDomain Code=20 ";
  EXPECT_EQ(lines[0].message.rfind(prefix, 0), 0u) << lines[0].message;
}

TEST_F(BundleInventory, LaterBundleWithTheSameIdentifierWins) {
  app("Applications", "First.app", "com.example.same", "1");
  app("Applications", "Second.app", "com.example.same", "2");
  std::optional<Dictionary> map = config_.systemAppBundleIDToInfoMap();
  ASSERT_TRUE(map.has_value());
  ASSERT_EQ(map->size(), 1u);
  // The winner is the later of the two in listing order.
  auto listing = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(config_.systemAppsDirectory(), true);
  ASSERT_TRUE(listing && listing->size() == 2u);
  const Value* url = map->at("com.example.same").get("com.vantrel.Quillset.bundleURL");
  ASSERT_NE(url, nullptr);
  ASSERT_TRUE(url->isURL());
  EXPECT_EQ(url->asURL()->path(), listing->back().path());
}

TEST_F(BundleInventory, CachedMapIsKeptUntilItsOwnReScan) {
  app("Applications", "S.app", "com.example.s");
  app("System/Library/CoreServices", "C.app", "com.example.c");
  app("VantrelInternal/Applications", "I.app", "com.example.i");
  (void)config_.systemAppBundleIDToInfoMap();
  (void)config_.coreServicesAppBundleIDToInfoMap();
  (void)config_.internalAppBundleIDToInfoMap();
  app("Applications", "S2.app", "com.example.s2");
  app("System/Library/CoreServices", "C2.app", "com.example.c2");
  app("VantrelInternal/Applications", "I2.app", "com.example.i2");
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()), std::set<std::string>{"com.example.s"});

  config_.reScanCoreServicesApps();
  EXPECT_EQ(keysOf(config_.coreServicesAppBundleIDToInfoMap()).size(), 2u);
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()).size(), 1u);
  EXPECT_EQ(keysOf(config_.internalAppBundleIDToInfoMap()).size(), 1u);
  config_.reScanInternalApps();
  EXPECT_EQ(keysOf(config_.internalAppBundleIDToInfoMap()).size(), 2u);
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()).size(), 1u);
  config_.reScanSystemApps();
  EXPECT_EQ(keysOf(config_.systemAppBundleIDToInfoMap()), (std::set<std::string>{"com.example.s", "com.example.s2"}));
}

TEST_F(BundleInventory, FrameworkSetCoversTheFourDirectoriesAndFollowsReScans) {
  app("System/Library/Frameworks", "UIKit.framework", "com.vantrel.uikit");
  app("System/Library/PrivateFrameworks", "Secret.framework", "com.vantrel.secret");
  app("VantrelInternal/Frameworks", "Inside.framework", "com.vantrel.inside");
  app("Developer/Library/Frameworks", "Dev.framework", "com.vantrel.dev");
  app("System/Library/Frameworks", "NotAFramework.app", "com.vantrel.app");
  std::set<std::string> expected{"com.vantrel.uikit", "com.vantrel.secret", "com.vantrel.inside"};
  EXPECT_EQ(config_.builtInFrameworkBundleIDs(), expected);

  app("VantrelInternal/PrivateFrameworks", "Late.framework", "com.vantrel.late");
  EXPECT_EQ(config_.builtInFrameworkBundleIDs(), expected);
  config_.reScanCoreServicesApps();
  EXPECT_EQ(config_.builtInFrameworkBundleIDs(), expected);
  config_.reScanSystemApps();
  expected.insert("com.vantrel.late");
  EXPECT_EQ(config_.builtInFrameworkBundleIDs(), expected);

  app("System/Library/Frameworks", "Later.framework", "com.vantrel.later");
  config_.reScanInternalApps();
  expected.insert("com.vantrel.later");
  EXPECT_EQ(config_.builtInFrameworkBundleIDs(), expected);
}

TEST_F(BundleInventory, BuiltInApplicationsLeaveOutCoreServices) {
  app("Applications", "S.app", "com.example.system");
  app("VantrelInternal/Applications", "I.app", "com.example.internal");
  app("Developer/Applications", "D.app", "com.example.developer");
  app("System/Library/CoreServices", "C.app", "com.example.coreservices");
  EXPECT_EQ(config_.builtInApplicationBundleIDs(),
            (std::set<std::string>{"com.example.system", "com.example.internal", "com.example.developer"}));
}

// --- Disk images -----------------------------------------------------------------------

class DiskImages : public BundleInventory {
 protected:
  void loopDevice(const std::string& name, bool attached, const std::vector<std::string>& partitions = {}) {
    std::string device = root_ / ("sys/block/" + name);
    ASSERT_TRUE(qstest::makeDirs(device));
    if (attached) {
      ASSERT_TRUE(qstest::makeDirs(device + "/loop"));
      ASSERT_TRUE(qstest::writeFile(device + "/loop/backing_file", "/images/" + name + ".img\n"));
    }
    for (const std::string& partition : partitions) ASSERT_TRUE(qstest::makeDirs(device + "/" + partition));
  }

  void mountTable(const std::vector<std::pair<std::string, std::string>>& mounts) {
    std::string text = "22 27 0:21 / /proc rw,relatime - proc proc rw\n";
    int id = 40;
    for (const auto& [source, mountPoint] : mounts) {
      text += std::to_string(id++) + " 27 7:0 / " + mountPoint + " rw,relatime shared:1 - ext4 " + source + " rw\n";
    }
    ASSERT_TRUE(qstest::writeFile(root_ / "mountinfo", text));
  }

  URL developerApps() { return config_.developerAppsDirectory(); }
};

TEST_F(DiskImages, WithoutMountedImagesOnlyTheDeveloperApplicationsAreSearched) {
  EXPECT_TRUE(config_.diskImageMountPoints().empty());
  EXPECT_EQ(config_.diskImageApplicationsDirectories(), std::vector<URL>{developerApps()});
  loopDevice("loop0", false);
  loopDevice("loop1", false);
  mountTable({});
  EXPECT_TRUE(config_.diskImageMountPoints().empty());
  EXPECT_EQ(config_.diskImageApplicationsDirectories(), std::vector<URL>{developerApps()});
  EXPECT_TRUE(log_.systemLines().empty());
  // An image mounted on the developer directory is not listed twice.
  loopDevice("loop2", true);
  mountTable({{"/dev/loop2", root_ / "Developer"}});
  EXPECT_EQ(config_.diskImageApplicationsDirectories(), std::vector<URL>{developerApps()});
}

TEST_F(DiskImages, MountedImagesAndPartitionsAreFoundInDeviceOrder) {
  loopDevice("loop0", true);
  loopDevice("loop1", false);
  loopDevice("loop2", true, {"loop2p1"});
  loopDevice("loop3", true);  // attached but not mounted
  mountTable({{"/dev/loop2p1", root_ / "mnt/second"}, {"/dev/vda1", "/"}, {"/dev/loop0", root_ / "mnt/first"}});
  EXPECT_EQ(config_.diskImageMountPoints(), (std::vector<std::string>{root_ / "mnt/first", root_ / "mnt/second"}));
  EXPECT_EQ(config_.diskImageApplicationsDirectories(),
            (std::vector<URL>{URL::fileURL(root_ / "mnt/first/Applications", true),
                              URL::fileURL(root_ / "mnt/second/Applications", true), developerApps()}));
}

TEST_F(DiskImages, MountPointForDeviceTakesTheFirstMatchingMount) {
  loopDevice("loop0", true);
  mountTable({{"/dev/loop0", root_ / "mnt/a"}, {"/dev/loop0", root_ / "mnt/b"}});
  auto drives = registry_.childrenOf(*registry_.firstDiskImageController(), nullptr);
  ASSERT_TRUE(drives && drives->size() == 1u);
  EXPECT_EQ(config_.mountPointForDevice(drives->front()), std::optional<std::string>(root_ / "mnt/a"));
}

TEST_F(DiskImages, DebugMountIsNeverSearched) {
  loopDevice("loop0", true);
  loopDevice("loop1", true);
  std::string debugMount = root_ / "private/var/debug_mount";
  mountTable({{"/dev/loop0", debugMount}, {"/dev/loop1", root_ / "mnt/image"}});
  app("private/var/debug_mount/Applications", "Debug.app", "com.example.debug");
  app("mnt/image/Applications", "Image.app", "com.example.image");
  EXPECT_EQ(config_.diskImageMountPoints().size(), 2u);
  EXPECT_EQ(config_.diskImageApplicationsDirectories(),
            (std::vector<URL>{URL::fileURL(root_ / "mnt/image/Applications", true), developerApps()}));
  EXPECT_EQ(keysOf(config_.diskImageAppBundleIDToInfoMap()), std::set<std::string>{"com.example.image"});
}

TEST_F(DiskImages, LaterDirectoriesOverwriteEarlierIdentifiers) {
  loopDevice("loop0", true);
  mountTable({{"/dev/loop0", root_ / "mnt/image"}});
  app("mnt/image/Applications", "Shared.app", "com.example.shared", "1");
  app("mnt/image/Applications", "Only.app", "com.example.only", "1");
  app("Developer/Applications", "Shared.app", "com.example.shared", "2");
  Dictionary map = config_.diskImageAppBundleIDToInfoMap();
  EXPECT_EQ(keysOf(map), (std::set<std::string>{"com.example.shared", "com.example.only"}));
  EXPECT_EQ(*map.at("com.example.shared").get("RkBundleVersion"), Value("2"));
  EXPECT_TRUE(config_.builtInApplicationBundleIDs().count("com.example.only"));
}

TEST_F(DiskImages, ReturningLineListsTheDirectories) {
  supporttest::ScopedLogHandle verbose(7);
  (void)config_.diskImageApplicationsDirectories();
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 7);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration diskImageApplicationsDirectories]");
  EXPECT_EQ(lines[0].message, "returning: (" + developerApps().description() + ")");
}

TEST_F(DiskImages, UnreadableMountTableIsLoggedPerDrive) {
  loopDevice("loop0", true);
  loopDevice("loop1", true);
  EXPECT_TRUE(config_.diskImageMountPoints().empty());
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  for (const auto& line : lines) {
    EXPECT_EQ(line.level, 3);
    EXPECT_EQ(line.function, "-[QSGlobalConfiguration mountPointForDevice:]");
    EXPECT_EQ(line.message, "getmntinfo failed: No such file or directory");
  }
}

TEST_F(DiskImages, UnknownDeviceCannotBeIterated) {
  mountTable({});
  EXPECT_EQ(config_.mountPointForDevice(4242), std::nullopt);
  EXPECT_EQ(log_.systemMessages(), std::vector<std::string>{"DvRegistryEntryCreateIterator failed for deviceObj (4242)"});
}

TEST_F(DiskImages, UnlistableControllerIsLoggedWithItsResultCode) {
  loopDevice("loop0", true);
  mountTable({});
  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0700), 0);
  int status = qstest::runAsNobody([this] {
    qstest::LogCapture log;
    bool empty = config_.diskImageMountPoints().empty();
    auto messages = log.systemMessages();
    bool line = messages.size() == 1 &&
                messages[0] == "unable to create controller child iterator: error 0xE000000D (-536870899)";
    return empty && line ? 0 : 1;
  });
  ASSERT_EQ(chmod((root_ / "sys/block").c_str(), 0755), 0);
  EXPECT_EQ(status, 0);
}

}  // namespace
