// The Linux device registry over synthetic sysfs trees and mount tables.
#include <gtest/gtest.h>

#include "Platform/DeviceRegistry.h"
#include "support/TestSupport.h"

using platform::DeviceHandle;
using platform::LinuxDeviceRegistry;

namespace {

TEST(MountInfo, ParsesSourceAndEscapedMountPointAndSkipsMalformedLines) {
  std::string text =
      "garbage\n"
      "1 2 3:4 / /no/separator rw ext4 /dev/x rw\n"
      "37 27 7:1 / /mnt/two\\040words rw master:1 shared:2 - hfs /dev/loop1p1 rw\n"
      "5 6 7:8 / /ok rw - ext4 /dev/ok rw";
  EXPECT_EQ(platform::parseMountInfo(text),
            (std::vector<platform::MountedFileSystem>{{"/dev/loop1p1", "/mnt/two words"}, {"/dev/ok", "/ok"}}));
  auto mounts = LinuxDeviceRegistry("/sys", "/proc/self/mountinfo").mountedFileSystems();
  ASSERT_TRUE(mounts.has_value());
  EXPECT_TRUE(std::any_of(mounts->begin(), mounts->end(), [](const auto& m) { return m.mountPoint == "/"; }));
  errno = 0;
  EXPECT_EQ(LinuxDeviceRegistry("/sys", "/nonexistent/mountinfo").mountedFileSystems(), std::nullopt);
  EXPECT_EQ(errno, ENOENT);
}

TEST(SyntheticSysfs, LoopDevicesInNumericOrderWithTheirMediaThenPartitions) {
  qstest::TempDir dir("sysfs");
  LinuxDeviceRegistry registry(dir.path(), dir / "mountinfo");
  EXPECT_EQ(registry.firstDiskImageController(), std::nullopt);
  for (const char* path : {"block/loop10/loop", "block/loop2", "block/loop1/loop1p2", "block/loop1/loop1p1",
                           "block/loop1/loop", "block/vda", "block/loopback"}) {
    ASSERT_TRUE(qstest::makeDirs(dir / path));
  }
  ASSERT_TRUE(qstest::writeFile(dir / "block/loop10/loop/backing_file", "/i\n"));
  ASSERT_TRUE(qstest::writeFile(dir / "block/loop1/loop/backing_file", "/i\n"));
  platform::DeviceRegistryResult result = -1;
  auto children = registry.childrenOf(registry.firstDiskImageController().value_or(0), &result);
  ASSERT_TRUE(children && children->size() == 3u);
  EXPECT_EQ(result, platform::kDeviceRegistrySuccess);
  EXPECT_EQ(registry.childrenOf(*registry.firstDiskImageController(), nullptr), children) << "handles are stable";
  const std::vector<bool> drives = {registry.isDiskImageDrive((*children)[0]),
                                    registry.isDiskImageDrive((*children)[1]),
                                    registry.isDiskImageDrive((*children)[2])};
  EXPECT_EQ(drives, (std::vector<bool>{true, false, true}));  // loop1, loop2 (nothing attached), loop10
  std::vector<std::string> names;
  for (DeviceHandle d : registry.descendantsOf(children->front(), nullptr).value_or(std::vector<DeviceHandle>{})) {
    EXPECT_TRUE(registry.isMedia(d));
    names.push_back(registry.bsdName(d).value_or("?"));
  }
  EXPECT_EQ(names, (std::vector<std::string>{"loop1", "loop1p1", "loop1p2"}));
  EXPECT_EQ(registry.descendantsOf(999, &result), std::nullopt);
  EXPECT_EQ(result, platform::deviceRegistryErrorFromErrno(EINVAL));
}

}  // namespace
