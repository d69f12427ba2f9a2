#include "Shared/Support/QSGlobalConfiguration.h"

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLayoutNames.h"
#include "Shared/Support/QSLog.h"

using platform::URL;
using platform::Value;

namespace {

// --- Preferences ---------------------------------------------------------------
constexpr char kPreferencesDomain[] = "com.vantrel.quill.set";
constexpr char kLowerInstallPriorityKey[] = "LowerInstallPriority";
constexpr char kSkipDeviceFamilyCheckKey[] = "SkipDeviceFamilyCheck";
constexpr char kSkipThinningCheckKey[] = "SkipThinningCheck";
constexpr char kSimultaneousInstallsNumberKey[] = "SimultaneousInstallsNumber";
constexpr long kDefaultSimultaneousInstallations = 4;
constexpr uint32_t kInstallerUserID = 33;
constexpr uint32_t kInstallerGroupID = 33;

// --- Layout ----------------------------------------------------------------------
constexpr char kQuilldBase[] = "/private/var/quilld/";
constexpr char kMobileBase[] = "/private/var/mobile/";
constexpr char kVolumeRoot[] = "/";

constexpr char kOldContainerRelativePath[] = "Applications";
constexpr char kOldInstallMapRelativePath[] = "Library/Caches/com.vantrel.quill.set.plist";
constexpr char kOldDataDirectoryRelativePath[] = "Library/Quillset";
constexpr char kOldLoggingRelativePath[] = "Library/Logs/Quillset";
constexpr char kOldArchiveRelativePath[] = "Media/ApplicationArchives";
constexpr char kDataDirectoryRelativePath[] = "Library/Quillset";
constexpr char kRecoveryDirectoryRelativePath[] = "Library/Quillset/Recovered";
constexpr char kBundleContainersRelativePath[] = "private/var/containers";
constexpr char kDataContainersRelativePath[] = "Containers";
constexpr char kRoleUserMigrationMarkerName[] = "RoleUserMigration.plist";
constexpr char kCachesRelativePath[] = "Library/Caches";
constexpr char kStagingRootName[] = "com.vantrel.mobile.quilld.staging";
constexpr char kLogDirectoryRelativePath[] = "Library/Logs/Quillset";
constexpr char kCarrierBundlesRelativePath[] = "Library/Carrier Bundles";
constexpr char kCoreServicesRelativePath[] = "System/Library/CoreServices";
constexpr char kSystemAppsRelativePath[] = "Applications";
constexpr char kInternalAppsRelativePath[] = "VantrelInternal/Applications";
constexpr char kDeveloperAppsRelativePath[] = "Developer/Applications";
constexpr char kFactoryMountRelativePath[] = "private/var/factory_mount/";
constexpr char kSystemFrameworksRootRelativePath[] = "System/Library";
constexpr char kInternalFrameworksRootRelativePath[] = "VantrelInternal";
constexpr char kDeveloperFrameworksRootRelativePath[] = "Developer";
constexpr char kFrameworksName[] = "Frameworks";
constexpr char kPrivateFrameworksName[] = "PrivateFrameworks";

constexpr char kDocumentsItemName[] = "Documents";
constexpr char kLibraryItemName[] = "Library";
constexpr char kTmpItemName[] = "tmp";
constexpr char kTillboxItemName[] = "Tillbox";

// --- Directory creation ------------------------------------------------------------
constexpr mode_t kDirectoryMode = 0755;
constexpr int32_t kLayoutDataProtectionClass = 4;

// --- Function names of the log lines --------------------------------------------------
constexpr char kInitFunction[] = "-[QSGlobalConfiguration init]";

// How a creating accessor makes its directory and what it writes when it cannot.
struct DirectoryCreation {
  const char* function;
  int32_t dataProtectionClass;  // kQSNoDataProtectionClass: none given
  const char* failureFormat;
};

constexpr DirectoryCreation kDataDirectoryCreation{"-[QSGlobalConfiguration dataDirectory]", kLayoutDataProtectionClass,
                                                   "Failed to create data dir at \"%@\": %@"};
constexpr DirectoryCreation kCachesDirectoryCreation{"-[QSGlobalConfiguration cachesDirectory]",
                                                     kQSNoDataProtectionClass,
                                                     "Failed to create data dir at \"%@\": %@"};
constexpr DirectoryCreation kStagingRootCreation{"-[QSGlobalConfiguration stagingRoot]", kLayoutDataProtectionClass,
                                                 "Failed to create staging root at \"%@\": %@"};
constexpr DirectoryCreation kLogDirectoryCreation{"-[QSGlobalConfiguration logDirectory]", kLayoutDataProtectionClass,
                                                  "Failed to create log directory at \"%@\": %@"};
constexpr DirectoryCreation kCarrierBundlesCreation{"-[QSGlobalConfiguration carrierBundlesDirectory]",
                                                    kQSNoDataProtectionClass,
                                                    "Failed to create carrier bundles directory at \"%@\": %@"};

// Makes `url` (with intermediates, mode 0755, the class where one is given);
// a failure is logged and otherwise ignored: the caller meets it at its next
// file operation.
void createDirectory(const URL& url, const DirectoryCreation& creation) {
  QSFileManager& manager = QSFileManager::defaultManager();
  platform::Error error;
  bool created = creation.dataProtectionClass == kQSNoDataProtectionClass
                     ? manager.createDirectoryAtURL(url, true, kDirectoryMode, &error)
                     : manager.createDirectoryAtURL(url, true, kDirectoryMode, creation.dataProtectionClass, &error);
  if (!created) QS_SYSLOG(kQSLogLevelError, creation.function, creation.failureFormat, url, error);
}

// The cached URL in `field`, built by `build` on first use. REQUIRES: the
// configuration's lock is held.
template <class Build>
URL cached(std::optional<URL>& field, Build build) {
  if (!field) field = build();
  return *field;
}

}  // namespace

QSGlobalConfiguration& QSGlobalConfiguration::sharedInstance() {
  static auto* store = new platform::FilePreferenceStore(platform::systemRootFromEnvironment());
  static auto* instance = new QSGlobalConfiguration(platform::systemRootFromEnvironment(), *store);
  return *instance;
}

QSGlobalConfiguration::QSGlobalConfiguration(std::string systemRoot, platform::PreferenceStore& preferences)
    : systemRoot_(platform::normalizedSystemRoot(systemRoot)) {
  std::optional<Value> lowerPriority = preferences.copyValue(kLowerInstallPriorityKey, kPreferencesDomain);
  if (lowerPriority && *lowerPriority == Value(false)) {
    QS_SYSLOG(kQSLogLevelNotice, kInitFunction, "Not running installation at background priority because of a set default");
    _lowerInstallPriority = false;
  }

  std::optional<Value> skipFamily = preferences.copyValue(kSkipDeviceFamilyCheckKey, kPreferencesDomain);
  if (skipFamily && *skipFamily == Value(true)) {
    QS_SYSLOG(kQSLogLevelNotice, kInitFunction, "Skipping device family check because of a set default");
    _skipDeviceFamilyCheck = true;
  }

  std::optional<Value> skipThinning = preferences.copyValue(kSkipThinningCheckKey, kPreferencesDomain);
  if (skipThinning && *skipThinning == Value(true)) {
    QS_SYSLOG(kQSLogLevelNotice, kInitFunction, "Skipping device thinning check because of a set default");
    _skipThinningCheck = true;
  }

  _nSimultaneousInstallations = kDefaultSimultaneousInstallations;
  std::optional<Value> simultaneous = preferences.copyValue(kSimultaneousInstallsNumberKey, kPreferencesDomain);
  if (simultaneous && simultaneous->isNumber()) {
    long count = static_cast<long>(simultaneous->int64Value());
    QS_SYSLOG(kQSLogLevelNotice, kInitFunction, "Setting simultaneous installations allowed to %ld", count);
    _nSimultaneousInstallations = count;
  }

  _quilldPath = URL::fileURL(systemRoot_ + kQuilldBase, true);
  _mobilePath = URL::fileURL(systemRoot_ + kMobileBase, true);
  _rootPath = URL::fileURL(systemRoot_.empty() ? std::string(kVolumeRoot) : systemRoot_, true);
  _uid = kInstallerUserID;
  _gid = kInstallerGroupID;
}

// --- Uncached accessors ------------------------------------------------------------

URL QSGlobalConfiguration::oldContainerPath() const { return _mobilePath.appending(kOldContainerRelativePath, true); }

URL QSGlobalConfiguration::oldInstallMapPath() const {
  return _mobilePath.appending(kOldInstallMapRelativePath, false);
}

URL QSGlobalConfiguration::oldDataDirectoryPath() const {
  return _mobilePath.appending(kOldDataDirectoryRelativePath, true);
}

URL QSGlobalConfiguration::oldLoggingPath() const { return _mobilePath.appending(kOldLoggingRelativePath, true); }

URL QSGlobalConfiguration::oldArchiveDirectory() const { return _mobilePath.appending(kOldArchiveRelativePath, true); }

URL QSGlobalConfiguration::dataDirectoryPath() const {
  return _quilldPath.appending(kDataDirectoryRelativePath, true);
}

URL QSGlobalConfiguration::recoveryDirectoryPath() const {
  return _mobilePath.appending(kRecoveryDirectoryRelativePath, true);
}

URL QSGlobalConfiguration::bundleContainersPath() const {
  return _rootPath.appending(kBundleContainersRelativePath, true);
}

URL QSGlobalConfiguration::dataContainersPath() const {
  return _mobilePath.appending(kDataContainersRelativePath, true);
}

URL QSGlobalConfiguration::roleUserMigrationMarkerFilePath() const {
  return dataDirectoryPath().appending(kRoleUserMigrationMarkerName, false);
}

URL QSGlobalConfiguration::logDirectory() {
  URL url = _quilldPath.appending(kLogDirectoryRelativePath, true);
  createDirectory(url, kLogDirectoryCreation);
  return url;
}

// --- Cached accessors that create their directory -----------------------------------

URL QSGlobalConfiguration::dataDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  URL url = cached(_dataDir, [this] { return dataDirectoryPath(); });
  createDirectory(url, kDataDirectoryCreation);
  return url;
}

URL QSGlobalConfiguration::cachesDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  URL url = cached(_cachesDir, [this] { return _quilldPath.appending(kCachesRelativePath, true); });
  createDirectory(url, kCachesDirectoryCreation);
  return url;
}

URL QSGlobalConfiguration::stagingRoot() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  URL url = cached(_stagingRoot, [this] { return cachesDirectory().appending(kStagingRootName, true); });
  createDirectory(url, kStagingRootCreation);
  return url;
}

URL QSGlobalConfiguration::carrierBundlesDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  URL url = cached(_carrierBundlesDir, [this] { return _mobilePath.appending(kCarrierBundlesRelativePath, true); });
  createDirectory(url, kCarrierBundlesCreation);
  return url;
}

// --- Cached accessors of the system volume --------------------------------------------

URL QSGlobalConfiguration::coreServicesDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_coreServicesDir, [this] { return _rootPath.appending(kCoreServicesRelativePath, true); });
}

URL QSGlobalConfiguration::systemAppsDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_systemAppsDir, [this] { return _rootPath.appending(kSystemAppsRelativePath, true); });
}

URL QSGlobalConfiguration::internalAppsDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_internalAppsDir, [this] { return _rootPath.appending(kInternalAppsRelativePath, true); });
}

URL QSGlobalConfiguration::developerAppsDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_developerAppsDir, [this] { return _rootPath.appending(kDeveloperAppsRelativePath, true); });
}

URL QSGlobalConfiguration::factoryMountDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_factoryMountDir, [this] { return _rootPath.appending(kFactoryMountRelativePath, true); });
}

URL QSGlobalConfiguration::systemFrameworksRootDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_systemFrameworksRootDirectory,
                [this] { return _rootPath.appending(kSystemFrameworksRootRelativePath, true); });
}

URL QSGlobalConfiguration::internalFrameworksRootDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_internalFrameworksRootDirectory,
                [this] { return _rootPath.appending(kInternalFrameworksRootRelativePath, true); });
}

URL QSGlobalConfiguration::developerFrameworksRootDirectory() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return cached(_developerFrameworksRootDirectory,
                [this] { return _rootPath.appending(kDeveloperFrameworksRootRelativePath, true); });
}

std::set<URL> QSGlobalConfiguration::allFrameworksDirectories() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (!_allFrameworksDirectories) {
    URL system = systemFrameworksRootDirectory();
    URL internal = internalFrameworksRootDirectory();
    _allFrameworksDirectories = std::set<URL>{
        system.appending(kFrameworksName, true),
        system.appending(kPrivateFrameworksName, true),
        internal.appending(kFrameworksName, true),
        internal.appending(kPrivateFrameworksName, true),
    };
  }
  return *_allFrameworksDirectories;
}

// --- Item names ------------------------------------------------------------------------

std::vector<std::string> QSGlobalConfiguration::appBundleMetadataItemNames() const {
  return {kQSStoreManifestItemName, kQSStoreArtworkItemName, kQSStoreMetadataItemName, kQSStoreGeoJSONItemName};
}

std::vector<std::string> QSGlobalConfiguration::appUserDataItemNames() const {
  return {kDocumentsItemName, kLibraryItemName, kTmpItemName, kTillboxItemName};
}
