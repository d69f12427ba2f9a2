// The device registry and the table of mounted file systems: what the
// built-in bundle inventory needs to find the disk images mounted right now.
//
// The registry is a tree of services. The disk-image controller's children
// are disk-image drives; below a drive sits its whole-disk media object and
// below that its partitions, each media object with a BSD device name
// ("loop0", "loop0p1"). Handles are small non-zero numbers, stable for the
// life of the registry object.
//
// On Linux, disk images are loop devices: the controller is the block
// subsystem of sysfs (<sysfs>/block), its children the devices "loopN" there,
// a drive counts as a disk-image drive when it has a backing file
// (<sysfs>/block/loopN/loop/backing_file), and its partitions are the
// "loopNpM" directories inside it. The mounted file systems come from
// /proc/self/mountinfo. Both locations can be replaced so that tests supply
// synthetic trees: QS_SYSFS_ROOT and QS_MOUNTINFO_PATH for the shared
// registry, or the constructor's arguments.
//
// Thread safety: LinuxDeviceRegistry may be used from any thread; its handle
// table is guarded by its own mutex. Every query reads sysfs afresh.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

using DeviceHandle = uint32_t;
inline constexpr DeviceHandle kNoDevice = 0;

// Result codes of the registry: 0 for success, else the error base with the
// operating system's error number in the low bits.
using DeviceRegistryResult = int32_t;
inline constexpr DeviceRegistryResult kDeviceRegistrySuccess = 0;
inline constexpr uint32_t kDeviceRegistryErrorBase = 0xE0000000u;
DeviceRegistryResult deviceRegistryErrorFromErrno(int errnum);

// One mounted file system.
struct MountedFileSystem {
  std::string source;      // the device or source it was mounted from ("/dev/loop0")
  std::string mountPoint;  // where it is mounted
  bool operator==(const MountedFileSystem&) const = default;
};

class DeviceRegistry {
 public:
  virtual ~DeviceRegistry() = default;

  // The first service of the disk-image controller class, or none.
  virtual std::optional<DeviceHandle> firstDiskImageController() = 0;
  // The direct children of `device`, in registry order; none, with *result
  // set (when `result` is not null), when the iteration cannot be created.
  virtual std::optional<std::vector<DeviceHandle>> childrenOf(DeviceHandle device, DeviceRegistryResult* result) = 0;
  // Every descendant of `device`, depth first, parents before children; none,
  // with *result set (when `result` is not null), when the iteration cannot
  // be created.
  virtual std::optional<std::vector<DeviceHandle>> descendantsOf(DeviceHandle device,
                                                                 DeviceRegistryResult* result) = 0;
  virtual bool isDiskImageDrive(DeviceHandle device) = 0;
  virtual bool isMedia(DeviceHandle device) = 0;
  // The BSD device name of a media object, or none.
  virtual std::optional<std::string> bsdName(DeviceHandle device) = 0;

  // The mounted file systems, in the table's order, without waiting for
  // their statistics; none with errno set when the table cannot be read.
  virtual std::optional<std::vector<MountedFileSystem>> mountedFileSystems() = 0;
};

class LinuxDeviceRegistry final : public DeviceRegistry {
 public:
  // `sysfsRoot` is where sysfs is mounted ("/sys"), `mountInfoPath` the
  // mount table ("/proc/self/mountinfo").
  LinuxDeviceRegistry(std::string sysfsRoot, std::string mountInfoPath);

  // The process-wide registry, created on first use from QS_SYSFS_ROOT and
  // QS_MOUNTINFO_PATH (else the real locations); never destroyed.
  static LinuxDeviceRegistry& shared();

  std::optional<DeviceHandle> firstDiskImageController() override;
  std::optional<std::vector<DeviceHandle>> childrenOf(DeviceHandle device, DeviceRegistryResult* result) override;
  std::optional<std::vector<DeviceHandle>> descendantsOf(DeviceHandle device, DeviceRegistryResult* result) override;
  bool isDiskImageDrive(DeviceHandle device) override;
  bool isMedia(DeviceHandle device) override;
  std::optional<std::string> bsdName(DeviceHandle device) override;
  std::optional<std::vector<MountedFileSystem>> mountedFileSystems() override;

 private:
  enum class Kind { Controller, Drive, WholeMedia, PartitionMedia };
  struct Node {
    Kind kind;
    std::string name;  // device name for drives and media, "" for the controller
  };

  DeviceHandle handleFor(Kind kind, const std::string& name);
  std::optional<Node> nodeFor(DeviceHandle device);
  std::optional<std::vector<DeviceHandle>> childrenOfNode(const Node& node, DeviceRegistryResult* result);
  std::string blockDirectory() const;

  const std::string sysfsRoot_;
  const std::string mountInfoPath_;
  std::mutex mutex_;  // guards nodes_ and handles_
  std::vector<Node> nodes_;  // handle h is nodes_[h - 1]
  std::map<std::pair<Kind, std::string>, DeviceHandle> handles_;
};

// Parses the text of a mountinfo table: one mount a line, the mount point in
// the fifth field and the source after the " - " separator and the file
// system type; octal escapes ("\040") are decoded. Malformed lines are
// skipped.
std::vector<MountedFileSystem> parseMountInfo(std::string_view text);

}  // namespace platform
