// QSGlobalConfiguration: the process-wide configuration. It reads a few
// preferences once, at creation, and owns the whole file-system layout: every
// well-known directory and file is obtained from one of its accessors and
// spelled nowhere else. It also owns the item-name lists and the inventory of
// bundles built into the system.
//
// Every layout path is built under the system root: "/" unless the
// environment variable QS_SYSTEM_ROOT names another directory when the
// configuration is created.
//
// Thread safety: sharedInstance is created once, safely under concurrent
// first calls, and never destroyed. The cached accessors, the bundle maps, the
// framework set and the re-scans run under `lock_`, a re-entrant lock that
// guards every cached field. logDirectory, the uncached accessors, the item
// lists and the six properties take no lock: they read values fixed at
// creation.
#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Platform/DeviceRegistry.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Preferences.h"

class QSGlobalConfiguration {
 public:
  // The shared instance, created on first call from QS_SYSTEM_ROOT and the
  // default preference store.
  static QSGlobalConfiguration& sharedInstance();

  // A configuration of its own (tests): the layout is built under
  // `systemRoot` ("/" for the real layout) and the preferences are read from
  // `preferences`.
  QSGlobalConfiguration(std::string systemRoot, platform::PreferenceStore& preferences);
  QSGlobalConfiguration(const QSGlobalConfiguration&) = delete;
  QSGlobalConfiguration& operator=(const QSGlobalConfiguration&) = delete;

  // The system root the layout is built under (no trailing separator, "" for
  // "/").
  const std::string& systemRoot() const { return systemRoot_; }

  // Properties fixed at creation.
  bool lowerInstallPriority() const { return _lowerInstallPriority; }
  bool skipDeviceFamilyCheck() const { return _skipDeviceFamilyCheck; }
  bool skipThinningCheck() const { return _skipThinningCheck; }
  long nSimultaneousInstallations() const { return _nSimultaneousInstallations; }
  uint32_t uid() const { return _uid; }
  uint32_t gid() const { return _gid; }

  // Uncached path accessors: build and return a URL.
  platform::URL oldContainerPath() const;
  platform::URL oldInstallMapPath() const;
  platform::URL oldDataDirectoryPath() const;
  platform::URL oldLoggingPath() const;
  platform::URL oldArchiveDirectory() const;
  platform::URL dataDirectoryPath() const;
  platform::URL roleUserMigrationMarkerFilePath() const;
  // The system root as a directory URL.
  platform::URL rootPath() const { return _rootPath; }
  // Where the data of a container removed for holding no usable bundle is
  // kept for a person to recover, one directory per container.
  platform::URL recoveryDirectoryPath() const;
  // The parents of the new layout's bundle containers and of its data, plug-in
  // and group containers.
  platform::URL bundleContainersPath() const;
  platform::URL dataContainersPath() const;

  // Cached accessors; those that create their directory do so on every call
  // (intermediates, mode 0755, class 4 where stated) and return the URL
  // whether or not creation succeeded (a failure is logged at level 3).
  platform::URL dataDirectory();
  platform::URL cachesDirectory();
  platform::URL stagingRoot();
  platform::URL carrierBundlesDirectory();
  platform::URL coreServicesDirectory();
  platform::URL systemAppsDirectory();
  platform::URL internalAppsDirectory();
  platform::URL developerAppsDirectory();
  platform::URL factoryMountDirectory();
  platform::URL systemFrameworksRootDirectory();
  platform::URL internalFrameworksRootDirectory();
  platform::URL developerFrameworksRootDirectory();
  // Uncached, unlocked, creates its directory on every call.
  platform::URL logDirectory();
  // The four framework directories, built once and cached.
  std::set<platform::URL> allFrameworksDirectories();

  // New lists on every call.
  std::vector<std::string> appBundleMetadataItemNames() const;
  std::vector<std::string> appUserDataItemNames() const;

  // Built-in bundle inventory: maps from bundle identifier to the filtered
  // Info.plist plus "com.vantrel.Quillset.bundleURL". Absent results are not
  // cached.
  std::optional<platform::Dictionary> _bundleIDMapForBundlesInDirectory(const platform::URL& directory,
                                                                        const std::string& withExtension);
  std::optional<platform::Dictionary> _bundleIDMapForAppsInDirectory(const platform::URL& directory);
  std::optional<platform::Dictionary> coreServicesAppBundleIDToInfoMap();
  std::optional<platform::Dictionary> systemAppBundleIDToInfoMap();
  std::optional<platform::Dictionary> internalAppBundleIDToInfoMap();
  platform::Dictionary diskImageAppBundleIDToInfoMap();
  std::set<std::string> builtInApplicationBundleIDs();
  std::set<std::string> builtInFrameworkBundleIDs();
  void reScanSystemApps();
  void reScanCoreServicesApps();
  void reScanInternalApps();
  std::vector<std::string> diskImageMountPoints();
  std::optional<std::string> mountPointForDevice(uint32_t device);
  std::vector<platform::URL> diskImageApplicationsDirectories();

  // The device registry that the disk-image operations ask: the process's
  // LinuxDeviceRegistry::shared() until another one is set (tests hand in
  // registries over synthetic trees). `registry` must outlive its use; null
  // restores the shared one. Any thread.
  void setDeviceRegistry(platform::DeviceRegistry* registry);

 private:
  platform::DeviceRegistry& deviceRegistry() const;
  std::optional<platform::Dictionary> cachedAppMap(std::optional<platform::Dictionary>& field,
                                                   platform::URL (QSGlobalConfiguration::*directory)());

  std::string systemRoot_;
  std::atomic<platform::DeviceRegistry*> deviceRegistry_{nullptr};

  // Fixed at creation.
  platform::URL _quilldPath;
  platform::URL _mobilePath;
  platform::URL _rootPath;

  // Guards every cached field below.
  std::recursive_mutex lock_;
  std::optional<platform::URL> _carrierBundlesDir;
  std::optional<platform::URL> _stagingRoot;
  std::optional<platform::URL> _coreServicesDir;
  std::optional<platform::URL> _systemAppsDir;
  std::optional<platform::URL> _internalAppsDir;
  std::optional<platform::URL> _developerAppsDir;
  std::optional<platform::URL> _factoryMountDir;
  std::optional<platform::URL> _systemFrameworksRootDirectory;
  std::optional<platform::URL> _internalFrameworksRootDirectory;
  std::optional<platform::URL> _developerFrameworksRootDirectory;
  std::optional<platform::URL> _dataDir;
  std::optional<platform::URL> _cachesDir;
  std::optional<std::set<platform::URL>> _allFrameworksDirectories;
  std::optional<platform::Dictionary> _systemAppBundleIDToInfoMap;
  std::optional<platform::Dictionary> _coreServicesAppBundleIDToInfoMap;
  std::optional<platform::Dictionary> _internalAppBundleIDToInfoMap;
  std::optional<std::set<std::string>> _builtInFrameworkBundleIDs;

  // Fixed at creation.
  bool _lowerInstallPriority = true;
  bool _skipDeviceFamilyCheck = false;
  bool _skipThinningCheck = false;
  long _nSimultaneousInstallations = 4;
  uint32_t _uid = 33;
  uint32_t _gid = 33;
};
