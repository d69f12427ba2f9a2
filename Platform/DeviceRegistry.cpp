#include "Platform/DeviceRegistry.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <memory>

#include "Platform/FileSystem.h"
#include "Platform/PosixHandles.h"
#include "Platform/ReadOnlyFile.h"

namespace platform {

namespace {

constexpr char kDefaultSysfsRoot[] = "/sys";
constexpr char kDefaultMountInfoPath[] = "/proc/self/mountinfo";
constexpr char kSysfsRootVariable[] = "QS_SYSFS_ROOT";
constexpr char kMountInfoPathVariable[] = "QS_MOUNTINFO_PATH";
constexpr char kBlockSubsystem[] = "block";
constexpr char kLoopPrefix[] = "loop";
constexpr char kPartitionInfix[] = "p";
constexpr char kBackingFile[] = "loop/backing_file";
constexpr char kMountInfoSeparator[] = "-";
constexpr size_t kMountInfoMountPointField = 4;
constexpr size_t kMountInfoFirstOptionalField = 6;
constexpr size_t kMountTableReadChunk = 16384;

bool allDigits(std::string_view s) {
  return !s.empty() && std::all_of(s.begin(), s.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// "loop12" -> 12; "loop0p3" with prefix "loop0p" -> 3; none for anything else.
std::optional<unsigned long> numberAfter(std::string_view name, std::string_view prefix) {
  if (name.substr(0, prefix.size()) != prefix) return std::nullopt;
  std::string_view rest = name.substr(prefix.size());
  if (!allDigits(rest)) return std::nullopt;
  return std::strtoul(std::string(rest).c_str(), nullptr, 10);
}

// Names in `directory` of the form prefix + number, ordered by number; none
// with errno when the directory cannot be read.
std::optional<std::vector<std::string>> numberedEntries(const std::string& directory, const std::string& prefix) {
  ScopedDIR dir(opendir(directory.c_str()));
  if (!dir.valid()) return std::nullopt;
  std::vector<std::pair<unsigned long, std::string>> found;
  errno = 0;
  while (dirent* entry = readdir(dir.get())) {
    std::string name = entry->d_name;
    if (auto number = numberAfter(name, prefix)) found.emplace_back(*number, name);
    errno = 0;
  }
  if (errno != 0) return std::nullopt;
  std::sort(found.begin(), found.end());
  std::vector<std::string> names;
  for (auto& [number, name] : found) names.push_back(std::move(name));
  return names;
}

std::string environmentOr(const char* variable, const char* fallback) {
  const char* value = std::getenv(variable);
  return value && *value ? value : fallback;
}

// Decodes the octal escapes that mountinfo uses for blanks, tabs, newlines
// and backslashes in paths.
std::string unescapeMountField(std::string_view field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size()) {
      std::string_view digits = field.substr(i + 1, 3);
      bool octal = std::all_of(digits.begin(), digits.end(), [](char c) { return c >= '0' && c <= '7'; });
      if (octal) {
        out += static_cast<char>(((digits[0] - '0') << 6) | ((digits[1] - '0') << 3) | (digits[2] - '0'));
        i += 3;
        continue;
      }
    }
    out += field[i];
  }
  return out;
}

std::vector<std::string_view> splitFields(std::string_view line) {
  std::vector<std::string_view> fields;
  size_t pos = 0;
  while (pos < line.size()) {
    size_t end = line.find(' ', pos);
    if (end == std::string_view::npos) end = line.size();
    if (end > pos) fields.push_back(line.substr(pos, end - pos));
    pos = end + 1;
  }
  return fields;
}

}  // namespace

DeviceRegistryResult deviceRegistryErrorFromErrno(int errnum) {
  return static_cast<DeviceRegistryResult>(kDeviceRegistryErrorBase | static_cast<uint32_t>(errnum));
}

std::vector<MountedFileSystem> parseMountInfo(std::string_view text) {
  std::vector<MountedFileSystem> mounts;
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string_view::npos) end = text.size();
    std::vector<std::string_view> fields = splitFields(text.substr(pos, end - pos));
    pos = end + 1;
    // The optional fields end at the "-" separator; the type and the source follow it.
    auto separator = std::find(fields.begin() + std::min(fields.size(), kMountInfoFirstOptionalField), fields.end(),
                               std::string_view(kMountInfoSeparator));
    if (fields.size() <= kMountInfoMountPointField || separator == fields.end() ||
        std::distance(separator, fields.end()) < 3) {
      continue;
    }
    mounts.push_back({unescapeMountField(*(separator + 2)), unescapeMountField(fields[kMountInfoMountPointField])});
  }
  return mounts;
}

LinuxDeviceRegistry::LinuxDeviceRegistry(std::string sysfsRoot, std::string mountInfoPath)
    : sysfsRoot_(std::move(sysfsRoot)), mountInfoPath_(std::move(mountInfoPath)) {}

LinuxDeviceRegistry& LinuxDeviceRegistry::shared() {
  static auto* registry = new LinuxDeviceRegistry(environmentOr(kSysfsRootVariable, kDefaultSysfsRoot),
                                                  environmentOr(kMountInfoPathVariable, kDefaultMountInfoPath));
  return *registry;
}

std::string LinuxDeviceRegistry::blockDirectory() const { return sysfsRoot_ + "/" + kBlockSubsystem; }

DeviceHandle LinuxDeviceRegistry::handleFor(Kind kind, const std::string& name) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto [it, inserted] = handles_.try_emplace({kind, name}, kNoDevice);
  if (inserted) {
    nodes_.push_back({kind, name});
    it->second = static_cast<DeviceHandle>(nodes_.size());
  }
  return it->second;
}

std::optional<LinuxDeviceRegistry::Node> LinuxDeviceRegistry::nodeFor(DeviceHandle device) {
  std::lock_guard<std::mutex> lock(mutex_);
  if (device == kNoDevice || device > nodes_.size()) return std::nullopt;
  return nodes_[device - 1];
}

std::optional<DeviceHandle> LinuxDeviceRegistry::firstDiskImageController() {
  if (!isDirectory(blockDirectory())) return std::nullopt;
  return handleFor(Kind::Controller, "");
}

std::optional<std::vector<DeviceHandle>> LinuxDeviceRegistry::childrenOfNode(const Node& node,
                                                                             DeviceRegistryResult* result) {
  std::vector<DeviceHandle> children;
  switch (node.kind) {
    case Kind::Controller: {
      auto names = numberedEntries(blockDirectory(), kLoopPrefix);
      if (!names) {
        *result = deviceRegistryErrorFromErrno(errno);
        return std::nullopt;
      }
      for (const std::string& name : *names) children.push_back(handleFor(Kind::Drive, name));
      break;
    }
    case Kind::Drive:
      // Only an attached loop device carries media.
      if (isDiskImageDrive(handleFor(Kind::Drive, node.name))) {
        children.push_back(handleFor(Kind::WholeMedia, node.name));
      }
      break;
    case Kind::WholeMedia: {
      std::string deviceDirectory = blockDirectory() + "/" + node.name;
      auto names = numberedEntries(deviceDirectory, node.name + kPartitionInfix);
      if (!names) {
        *result = deviceRegistryErrorFromErrno(errno);
        return std::nullopt;
      }
      for (const std::string& name : *names) {
        if (isDirectory(deviceDirectory + "/" + name)) children.push_back(handleFor(Kind::PartitionMedia, name));
      }
      break;
    }
    case Kind::PartitionMedia:
      break;
  }
  *result = kDeviceRegistrySuccess;
  return children;
}

std::optional<std::vector<DeviceHandle>> LinuxDeviceRegistry::childrenOf(DeviceHandle device,
                                                                         DeviceRegistryResult* result) {
  DeviceRegistryResult ignored = kDeviceRegistrySuccess;
  if (!result) result = &ignored;
  std::optional<Node> node = nodeFor(device);
  if (!node) {
    *result = deviceRegistryErrorFromErrno(EINVAL);
    return std::nullopt;
  }
  return childrenOfNode(*node, result);
}

std::optional<std::vector<DeviceHandle>> LinuxDeviceRegistry::descendantsOf(DeviceHandle device,
                                                                            DeviceRegistryResult* result) {
  DeviceRegistryResult ignored = kDeviceRegistrySuccess;
  if (!result) result = &ignored;
  auto children = childrenOf(device, result);
  if (!children) return std::nullopt;
  std::vector<DeviceHandle> all;
  for (DeviceHandle child : *children) {
    all.push_back(child);
    auto below = descendantsOf(child, result);
    if (!below) return std::nullopt;
    all.insert(all.end(), below->begin(), below->end());
  }
  *result = kDeviceRegistrySuccess;
  return all;
}

bool LinuxDeviceRegistry::isDiskImageDrive(DeviceHandle device) {
  std::optional<Node> node = nodeFor(device);
  return node && node->kind == Kind::Drive && pathLeadsToItem(blockDirectory() + "/" + node->name + "/" + kBackingFile);
}

bool LinuxDeviceRegistry::isMedia(DeviceHandle device) {
  std::optional<Node> node = nodeFor(device);
  return node && (node->kind == Kind::WholeMedia || node->kind == Kind::PartitionMedia);
}

std::optional<std::string> LinuxDeviceRegistry::bsdName(DeviceHandle device) {
  if (!isMedia(device)) return std::nullopt;
  return nodeFor(device)->name;
}

std::optional<std::vector<MountedFileSystem>> LinuxDeviceRegistry::mountedFileSystems() {
  ReadOnlyFile file(mountInfoPath_.c_str());
  if (!file.isOpen()) return std::nullopt;
  // A proc file reports no size: read until the end.
  std::string text;
  char chunk[kMountTableReadChunk];
  for (;;) {
    int64_t n = file.read(chunk, sizeof chunk);
    if (n < 0) return std::nullopt;
    if (n == 0) break;
    text.append(chunk, static_cast<size_t>(n));
  }
  return parseMountInfo(text);
}

}  // namespace platform
