// The Linux device registry over synthetic sysfs trees and mount tables.
#include <gtest/gtest.h>

#include "Platform/DeviceRegistry.h"
#include "support/TestSupport.h"

using platform::DeviceHandle;
using platform::LinuxDeviceRegistry;
using platform::MountedFileSystem;

namespace {

TEST(MountInfo, ParsesSourceAndMountPointAndSkipsMalformedLines) {
  std::string text =
      "22 27 0:21 / /proc rw,relatime - proc proc rw\n"
      "garbage\n"
      "1 2 3:4 / /no/separator rw ext4 /dev/x rw\n"
      "\n"
      "37 27 7:1 / /mnt/two\\040words rw master:1 shared:2 - hfs /dev/loop1p1 rw\n"
      "1 2 3:4 / /a\\x\\1 rw - t /dev/s rw\n"
      "5 6 7:8 / /ok rw - ext4 /dev/ok rw";
  EXPECT_EQ(platform::parseMountInfo(text), (std::vector<MountedFileSystem>{{"proc", "/proc"},
                                                                             {"/dev/loop1p1", "/mnt/two words"},
                                                                             {"/dev/s", "/a\\x\\1"},
                                                                             {"/dev/ok", "/ok"}}));
}

TEST(MountInfo, RealTableHasTheRootMountAndAMissingOneFailsWithErrno) {
  auto mounts = LinuxDeviceRegistry("/sys", "/proc/self/mountinfo").mountedFileSystems();
  ASSERT_TRUE(mounts.has_value());
  bool root = false;
  for (const auto& mount : *mounts) root = root || mount.mountPoint == "/";
  EXPECT_TRUE(root);

  qstest::TempDir dir("mounts");
  errno = 0;
  EXPECT_EQ(LinuxDeviceRegistry(dir.path(), dir / "missing").mountedFileSystems(), std::nullopt);
  EXPECT_EQ(errno, ENOENT);
}

class SyntheticSysfs : public ::testing::Test {
 protected:
  void loopDevice(const std::string& name, bool attached, std::vector<std::string> partitions = {}) {
    std::string device = dir_ / ("block/" + name);
    ASSERT_TRUE(qstest::makeDirs(device));
    ASSERT_TRUE(qstest::writeFile(device + "/size", "0\n"));
    if (attached) {
      ASSERT_TRUE(qstest::makeDirs(device + "/loop"));
      ASSERT_TRUE(qstest::writeFile(device + "/loop/backing_file", "/images/" + name + ".img\n"));
    }
    for (const std::string& partition : partitions) {
      ASSERT_TRUE(qstest::makeDirs(device + "/" + partition));
      ASSERT_TRUE(qstest::writeFile(device + "/" + partition + "/partition", "1\n"));
    }
  }
  std::vector<DeviceHandle> drives() {
    auto controller = registry_.firstDiskImageController();
    EXPECT_TRUE(controller.has_value());
    platform::DeviceRegistryResult result = -1;
    auto children = controller ? registry_.childrenOf(*controller, &result) : std::nullopt;
    EXPECT_TRUE(children.has_value());
    EXPECT_EQ(result, platform::kDeviceRegistrySuccess);
    return children.value_or(std::vector<DeviceHandle>{});
  }

  qstest::TempDir dir_{"sysfs"};
  LinuxDeviceRegistry registry_{dir_.path(), dir_ / "mountinfo"};
};

TEST_F(SyntheticSysfs, ControllerChildrenAreLoopDevicesInNumericOrder) {
  EXPECT_EQ(registry_.firstDiskImageController(), std::nullopt);
  loopDevice("loop10", true);
  loopDevice("loop2", false);
  loopDevice("loop1", true);
  ASSERT_TRUE(qstest::makeDirs(dir_ / "block/vda"));
  ASSERT_TRUE(qstest::makeDirs(dir_ / "block/loopback"));
  std::vector<DeviceHandle> children = drives();
  ASSERT_EQ(children.size(), 3u);
  EXPECT_TRUE(registry_.isDiskImageDrive(children[0]));   // loop1
  EXPECT_FALSE(registry_.isDiskImageDrive(children[1]));  // loop2, nothing attached
  EXPECT_TRUE(registry_.isDiskImageDrive(children[2]));   // loop10
  for (DeviceHandle child : children) {
    EXPECT_FALSE(registry_.isMedia(child));
    EXPECT_EQ(registry_.bsdName(child), std::nullopt);
  }
  EXPECT_EQ(drives(), children) << "handles are stable across queries";
  auto detached = registry_.descendantsOf(children[1], nullptr);
  ASSERT_TRUE(detached.has_value());
  EXPECT_TRUE(detached->empty());
}

TEST_F(SyntheticSysfs, DriveDescendantsAreWholeMediaThenPartitions) {
  loopDevice("loop0", true, {"loop0p2", "loop0p1"});
  std::vector<DeviceHandle> children = drives();
  ASSERT_EQ(children.size(), 1u);
  auto descendants = registry_.descendantsOf(children.front(), nullptr);
  ASSERT_TRUE(descendants.has_value());
  std::vector<std::string> names;
  for (DeviceHandle d : *descendants) {
    EXPECT_TRUE(registry_.isMedia(d));
    EXPECT_FALSE(registry_.isDiskImageDrive(d));
    names.push_back(registry_.bsdName(d).value_or("?"));
  }
  EXPECT_EQ(names, (std::vector<std::string>{"loop0", "loop0p1", "loop0p2"}));
}

TEST_F(SyntheticSysfs, UnknownHandleCannotBeIterated) {
  platform::DeviceRegistryResult result = platform::kDeviceRegistrySuccess;
  EXPECT_EQ(registry_.descendantsOf(999, &result), std::nullopt);
  EXPECT_EQ(result, platform::deviceRegistryErrorFromErrno(EINVAL));
  EXPECT_EQ(registry_.childrenOf(platform::kNoDevice, &result), std::nullopt);
  EXPECT_FALSE(registry_.isDiskImageDrive(999));
  EXPECT_FALSE(registry_.isMedia(999));
  EXPECT_EQ(static_cast<uint32_t>(platform::deviceRegistryErrorFromErrno(EACCES)), 0xE000000Du);
}

}  // namespace
