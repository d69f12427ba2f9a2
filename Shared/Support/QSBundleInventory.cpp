// The inventory of bundles built into the system: the applications of the
// system, core-services and internal directories, the frameworks, and the
// applications on mounted disk images.
#include <algorithm>
#include <cerrno>

#include "Platform/BundleReader.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"
#include "Shared/Support/QSUtilities.h"

using platform::DeviceHandle;
using platform::DeviceRegistry;
using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace {

constexpr char kBundleURLInfoKey[] = "com.vantrel.Quillset.bundleURL";
constexpr char kFrameworkExtension[] = "framework";
constexpr char kApplicationsDirectoryName[] = "Applications";
constexpr char kDebugMountRelativePath[] = "private/var/debug_mount";
constexpr char kDeviceNodeFormat[] = "/dev/%@";

constexpr char kBundleMapFunction[] = "-[QSGlobalConfiguration _bundleIDMapForBundlesInDirectory:withExtension:]";
constexpr char kDiskImageDirectoriesFunction[] = "-[QSGlobalConfiguration diskImageApplicationsDirectories]";
constexpr char kDiskImageMountPointsFunction[] = "-[QSGlobalConfiguration diskImageMountPoints]";
constexpr char kMountPointForDeviceFunction[] = "-[QSGlobalConfiguration mountPointForDevice:]";

const std::set<std::string>& bundleInfoFilterKeys() {
  static const auto* keys = new std::set<std::string>{platform::kBundleIdentifierKey, platform::kBundleVersionKey};
  return *keys;
}

void mergeInto(Dictionary& target, const Dictionary& source) {
  for (const auto& [key, value] : source) target.insert_or_assign(key, value);
}

}  // namespace

void QSGlobalConfiguration::setDeviceRegistry(DeviceRegistry* registry) { deviceRegistry_.store(registry); }

DeviceRegistry& QSGlobalConfiguration::deviceRegistry() const {
  DeviceRegistry* registry = deviceRegistry_.load();
  return registry ? *registry : platform::LinuxDeviceRegistry::shared();
}

// --- Bundle maps ----------------------------------------------------------------------

std::optional<Dictionary> QSGlobalConfiguration::_bundleIDMapForBundlesInDirectory(const URL& directory,
                                                                                   const std::string& withExtension) {
  platform::Error error;
  auto items = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, true, &error);
  if (!items) {
    // A directory that is not there is the normal case on most systems: nothing to say.
    if (!error.isPOSIX(ENOENT)) {
      QS_SYSLOG(kQSLogLevelError, kBundleMapFunction, "Failed to search for apps in %@ : %@", directory, error);
    }
    return std::nullopt;
  }
  Dictionary map;
  for (const URL& item : *items) {
    if (item.pathExtension() != withExtension) continue;
    std::optional<Dictionary> info = QSLoadInfoPlist(item, &bundleInfoFilterKeys());
    if (!info) {
      QS_SYSLOG(kQSLogLevelDebug, kBundleMapFunction, "Failed to load Info.plist from bundle %@", item);
      continue;
    }
    const Value* identifier = info->count(platform::kBundleIdentifierKey) ? &info->at(platform::kBundleIdentifierKey)
                                                                          : nullptr;
    if (!identifier || !identifier->isString()) {
      QS_SYSLOG(kQSLogLevelDebug, kBundleMapFunction, "Failed to get RkBundleIdentifier from bundle %@", item);
      continue;
    }
    std::string key = *identifier->asString();
    (*info)[kBundleURLInfoKey] = Value(item);
    map.insert_or_assign(std::move(key), Value(std::move(*info)));
  }
  return map;
}

std::optional<Dictionary> QSGlobalConfiguration::_bundleIDMapForAppsInDirectory(const URL& directory) {
  return _bundleIDMapForBundlesInDirectory(directory, platform::kApplicationBundleExtension);
}

std::optional<Dictionary> QSGlobalConfiguration::cachedAppMap(std::optional<Dictionary>& field,
                                                              URL (QSGlobalConfiguration::*directory)()) {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  // An absent result is not kept, so a failed build is tried again next time.
  if (!field) field = _bundleIDMapForAppsInDirectory((this->*directory)());
  return field;
}

std::optional<Dictionary> QSGlobalConfiguration::coreServicesAppBundleIDToInfoMap() {
  return cachedAppMap(_coreServicesAppBundleIDToInfoMap, &QSGlobalConfiguration::coreServicesDirectory);
}

std::optional<Dictionary> QSGlobalConfiguration::systemAppBundleIDToInfoMap() {
  return cachedAppMap(_systemAppBundleIDToInfoMap, &QSGlobalConfiguration::systemAppsDirectory);
}

std::optional<Dictionary> QSGlobalConfiguration::internalAppBundleIDToInfoMap() {
  return cachedAppMap(_internalAppBundleIDToInfoMap, &QSGlobalConfiguration::internalAppsDirectory);
}

Dictionary QSGlobalConfiguration::diskImageAppBundleIDToInfoMap() {
  Dictionary merged;
  for (const URL& directory : diskImageApplicationsDirectories()) {
    if (std::optional<Dictionary> map = _bundleIDMapForAppsInDirectory(directory)) mergeInto(merged, *map);
  }
  return merged;
}

std::set<std::string> QSGlobalConfiguration::builtInApplicationBundleIDs() {
  std::set<std::string> identifiers;
  auto addKeys = [&identifiers](const std::optional<Dictionary>& map) {
    if (!map) return;
    for (const auto& entry : *map) identifiers.insert(entry.first);
  };
  addKeys(systemAppBundleIDToInfoMap());
  addKeys(internalAppBundleIDToInfoMap());
  addKeys(diskImageAppBundleIDToInfoMap());
  return identifiers;
}

std::set<std::string> QSGlobalConfiguration::builtInFrameworkBundleIDs() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (!_builtInFrameworkBundleIDs) {
    std::set<std::string> identifiers;
    for (const URL& directory : allFrameworksDirectories()) {
      std::optional<Dictionary> map = _bundleIDMapForBundlesInDirectory(directory, kFrameworkExtension);
      if (!map) continue;
      for (const auto& entry : *map) identifiers.insert(entry.first);
    }
    _builtInFrameworkBundleIDs = std::move(identifiers);
  }
  return *_builtInFrameworkBundleIDs;
}

void QSGlobalConfiguration::reScanSystemApps() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  _systemAppBundleIDToInfoMap.reset();
  _builtInFrameworkBundleIDs.reset();
}

void QSGlobalConfiguration::reScanCoreServicesApps() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  _coreServicesAppBundleIDToInfoMap.reset();
}

void QSGlobalConfiguration::reScanInternalApps() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  _internalAppBundleIDToInfoMap.reset();
  _builtInFrameworkBundleIDs.reset();
}

// --- Disk images -------------------------------------------------------------------------

std::vector<URL> QSGlobalConfiguration::diskImageApplicationsDirectories() {
  const std::string debugMount = _rootPath.appending(kDebugMountRelativePath, true).path();
  std::vector<URL> directories;
  for (const std::string& mountPoint : diskImageMountPoints()) {
    if (mountPoint.compare(0, debugMount.size(), debugMount) == 0) continue;
    directories.push_back(URL::fileURL(mountPoint, true).appending(kApplicationsDirectoryName, true));
  }
  URL developerApps = developerAppsDirectory();
  if (std::find(directories.begin(), directories.end(), developerApps) == directories.end()) {
    directories.push_back(developerApps);
  }
  QS_SYSLOG(kQSLogLevelDebug, kDiskImageDirectoriesFunction, "returning: %@",
            Value(platform::Array(directories.begin(), directories.end())));
  return directories;
}

std::vector<std::string> QSGlobalConfiguration::diskImageMountPoints() {
  DeviceRegistry& registry = deviceRegistry();
  std::vector<std::string> mountPoints;
  std::optional<DeviceHandle> controller = registry.firstDiskImageController();
  if (!controller) return mountPoints;
  platform::DeviceRegistryResult result = platform::kDeviceRegistrySuccess;
  auto children = registry.childrenOf(*controller, &result);
  if (!children) {
    QS_SYSLOG(kQSLogLevelError, kDiskImageMountPointsFunction,
              "unable to create controller child iterator: error 0x%08X (%d)", result, result);
    return mountPoints;
  }
  for (DeviceHandle child : *children) {
    if (registry.isDiskImageDrive(child)) {
      if (std::optional<std::string> mountPoint = mountPointForDevice(child)) mountPoints.push_back(*mountPoint);
      continue;
    }
    auto descendants = registry.descendantsOf(child, &result);
    if (!descendants) continue;
    for (DeviceHandle descendant : *descendants) {
      if (!registry.isDiskImageDrive(descendant)) continue;
      if (std::optional<std::string> mountPoint = mountPointForDevice(descendant)) {
        mountPoints.push_back(*mountPoint);
        break;
      }
    }
  }
  return mountPoints;
}

std::optional<std::string> QSGlobalConfiguration::mountPointForDevice(uint32_t device) {
  DeviceRegistry& registry = deviceRegistry();
  auto mounts = registry.mountedFileSystems();
  if (!mounts) {
    QS_SYSLOG(kQSLogLevelError, kMountPointForDeviceFunction, "getmntinfo failed: %s", QSErrorText(errno));
    return std::nullopt;
  }
  auto descendants = registry.descendantsOf(device, nullptr);
  if (!descendants) {
    QS_SYSLOG(kQSLogLevelError, kMountPointForDeviceFunction, "DvRegistryEntryCreateIterator failed for deviceObj (%u)",
              device);
    return std::nullopt;
  }
  for (DeviceHandle descendant : *descendants) {
    if (!registry.isMedia(descendant)) continue;
    std::optional<std::string> name = registry.bsdName(descendant);
    if (!name) continue;
    const std::string devicePath = platform::Format(kDeviceNodeFormat, *name);
    for (const platform::MountedFileSystem& mount : *mounts) {
      if (mount.source == devicePath) return mount.mountPoint;
    }
  }
  return std::nullopt;
}
