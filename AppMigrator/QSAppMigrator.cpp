// QSAppMigrator: creation, the host's queries and the run.
//
// The run drives three passes over the old applications directory: an
// introspection pass that turns each entry into a container description (or
// cleans it away), a migration pass over those descriptions, and a final
// re-listing that decides whether the old layout can go. Safe harbors and the
// daemon's data-protection update sit between the last two.
#include <cerrno>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kInitFunction[] = "-[QSAppMigrator init]";
constexpr char kPerformMigrationFunction[] = "-[QSAppMigrator performMigration]";

// estimatedDuration = entries * kDurationPerEntry + kBaseDuration.
constexpr float kBaseDuration = 20.0f;
constexpr float kDurationPerEntry = 2.25f;
// What migrationProgress answers when there is no list, or an empty one.
constexpr float kProgressWithoutEntries = 0.5f;
constexpr float kProgressOfEmptyList = -1.0f;

constexpr char kReturningFailedLine[] =
    "QSAppMigrator: Returning migration failed. Please include the contents of /var/mobile/Library/Logs/Quillset "
    "and /var/Mobile/Library/Logs/Transvale in a bug report.";

}  // namespace

// --- Creation -------------------------------------------------------------------

std::unique_ptr<QSAppMigrator> QSAppMigrator::create(const QSMigratorServices& services) {
  return _create(services, false);
}

std::unique_ptr<QSAppMigrator> QSAppMigrator::createForPlanning(const QSMigratorServices& services) {
  return _create(services, true);
}

std::unique_ptr<QSAppMigrator> QSAppMigrator::_create(const QSMigratorServices& services, bool planning) {
  std::unique_ptr<QSAppMigrator> migrator(new QSAppMigrator(services, planning));
  if (!migrator->_loadItemsToMigrate()) return nullptr;
  migrator->_loadHarborMap();
  migrator->_loadLastSystemVersion();
  return migrator;
}

bool QSAppMigrator::_loadItemsToMigrate() {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  const URL oldContainer = configuration.oldContainerPath();
  if (fileManager.itemDoesNotExistAtURL(oldContainer)) return true;

  Error error;
  std::optional<std::vector<URL>> items = fileManager.urlsForItemsInDirectoryAtURL(oldContainer, true, &error);
  if (!items) {
    QSAM_LOG(kQSLogLevelError, kInitFunction, "QSAppMigrator: Failed to get items at %@ : %@", oldContainer, error);
    return false;
  }
  if (items->empty()) {
    if (planning_) return true;
    // Nothing to migrate: the empty directory goes now; the install map is
    // left for a run that finds something.
    if (!fileManager.removeItemAtURL(oldContainer)) {
      QSAM_LOG(kQSLogLevelError, kInitFunction, "QSAppMigrator: Failed to remove %@", oldContainer.path());
    }
    return true;
  }
  QSAM_LOG(kQSLogLevelNotice, kInitFunction, "QSAppMigrator: %ld items to migrate", static_cast<long>(items->size()));
  _itemsToMigrate = std::move(*items);
  _loadInstallMap();
  return true;
}

void QSAppMigrator::_loadInstallMap() {
  const URL installMapURL = QSGlobalConfiguration::sharedInstance().oldInstallMapPath();
  std::optional<Dictionary> installMap = platform::plist::readDictionary(installMapURL);
  if (!installMap) {
    QSAM_LOG(kQSLogLevelNotice, kInitFunction, "QSAppMigrator: Old install map not found at %@", installMapURL.path());
    return;
  }
  _installMap = std::move(*installMap);
  _resolvedPathsInRun.clear();
  const Value* groups = QSValueForKey(*_installMap, kQSInstallMapGroupContainersKey);
  if (groups && groups->isDictionary()) {
    _groupContainerMap = *groups->asDictionary();
  } else {
    QSAM_LOG(kQSLogLevelNotice, kInitFunction, "QSAppMigrator: No group container map found in install map");
  }
}

void QSAppMigrator::_loadHarborMap() {
  const URL harborMapURL = _safeHarborMapURL();
  if (QSFileManager::defaultManager().itemDoesNotExistAtURL(harborMapURL)) return;
  _harborMap = platform::plist::readDictionary(harborMapURL);
  if (!_harborMap) {
    QSAM_LOG(kQSLogLevelError, kInitFunction, "QSAppMigrator: Failed to load existing harbor map from %@",
             harborMapURL.path());
  }
}

void QSAppMigrator::_loadLastSystemVersion() {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  // A dry run makes no directory, so it reads where the directory would be.
  const URL recordURL = (planning_ ? configuration.dataDirectoryPath() : configuration.dataDirectory())
                            .appending(kQSLastSystemVersionFileName);
  std::optional<Dictionary> record = platform::plist::readDictionary(recordURL);
  if (!record) return;
  // Kept for diagnosis only, whatever its type: nothing branches on it.
  if (const Value* build = QSValueForKey(*record, platform::kSystemVersionBuildVersionKey)) {
    _lastSystemBuildVersion = build->description();
  }
}

URL QSAppMigrator::_safeHarborMapURL() const {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  return (planning_ ? configuration.dataDirectoryPath() : configuration.dataDirectory())
      .appending(kQSSafeHarborMapFileName);
}

// --- The host's queries ---------------------------------------------------------

std::string QSAppMigrator::dataClassName() {
  return kQSDataClassName;
}

float QSAppMigrator::estimatedDuration() {
  if (!_itemsToMigrate) return kBaseDuration;
  const float entries = static_cast<float>(_itemsToMigrate->size());
  return entries * kDurationPerEntry + kBaseDuration;
}

float QSAppMigrator::migrationProgress() {
  if (!_itemsToMigrate) return kProgressWithoutEntries;
  if (_itemsToMigrate->empty()) return kProgressOfEmptyList;
  return static_cast<float>(static_cast<double>(_countItemsMigrated.load()) /
                            static_cast<double>(_itemsToMigrate->size()));
}

// --- The run --------------------------------------------------------------------

bool QSAppMigrator::performMigration() {
  bool result = true;
  if (_itemsToMigrate) {
    const std::deque<Dictionary> workList = _introspectItemsToMigrate();
    result = _migrateWorkList(workList);
  }

  // Both run whatever happened before; either can make the run fail.
  const bool harborsMigrated = _migrateSafeHarbors();
  const Dictionary dataProtectionOptions{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}};
  if (!services_.daemon->QuillsetUpdateContainerDataProtectionForMigratorOnly(dataProtectionOptions)) {
    QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, "QSAppMigrator: Failed to update container data protection");
    result = false;
  } else if (!harborsMigrated) {
    result = false;
  }

  if (!_removeOldLayoutIfEmpty()) {
    QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, kReturningFailedLine);
    return false;
  }
  if (!result) {
    QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, kReturningFailedLine);
    return false;
  }
  _recordCurrentSystemVersion();
  return true;
}

std::deque<Dictionary> QSAppMigrator::_introspectItemsToMigrate() {
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  // Application containers go to the front (so they run in reverse listing
  // order), the others to the back (in listing order).
  std::deque<Dictionary> workList;
  for (const URL& entry : *_itemsToMigrate) {
    QSAM_LOG(kQSLogLevelNotice, kPerformMigrationFunction, "QSAppMigrator: Introspecting %@", entry.path());
    if (entry.lastPathComponent() == kQSOldApplicationsNoteFileName) {
      // Not a container; whether it goes is decided by the final re-listing.
      if (services_.observer) services_.observer->entryStarted("", entry.path());
      (void)fileManager.removeItemAtURL(entry);
      _reportEntry(platform::EntryOutcome::Removed, "the previous release's note file");
      ++_countItemsMigrated;
      continue;
    }
    bool orderResultEarly = false;
    if (services_.observer) services_.observer->entryStarted("", entry.path());
    std::optional<Dictionary> info = _introspectContainer(entry, &orderResultEarly);
    if (!info) {
      ++_countItemsMigrated;
    } else if (orderResultEarly) {
      workList.push_front(std::move(*info));
    } else {
      workList.push_back(std::move(*info));
    }
  }
  if (services_.observer) {
    uint64_t bytes = 0;
    for (const Dictionary& info : workList) {
      if (const std::string* container = QSStringForKey(info, kQSContainerPathKey)) {
        const URL containerURL = URL::fileURL(*container, true);
        const platform::PlanSize size = _measureUserData(containerURL);
        _measuredInIntrospection[containerURL.path()] = size;
        bytes += size.bytes;
      }
    }
    if (_groupContainerMap) {
      for (const auto& [group, entry] : *_groupContainerMap) {
        const std::optional<URL> oldContainer = _movableOldGroupContainer(group);
        if (!oldContainer) continue;
        const platform::PlanSize size = _measureItem(*oldContainer);
        _measuredInIntrospection[oldContainer->path()] = size;
        bytes += size.bytes;
      }
    }
    services_.observer->migrationPlanned(workList.size(), bytes);
  }
  return workList;
}

bool QSAppMigrator::_migrateWorkList(const std::deque<Dictionary>& workList) {
  bool result = true;
  for (const Dictionary& info : workList) {
    const Value* identifier = QSValueForKey(info, kQSBundleIdentifierKey);
    const Value* bundlePath = QSValueForKey(info, kQSBundlePathKey);
    const std::string* container = QSStringForKey(info, kQSContainerPathKey);
    if (services_.observer) {
      services_.observer->entryStarted(identifier ? identifier->description() : "", container ? *container : "");
    }
    QSAM_LOG(kQSLogLevelNotice, kPerformMigrationFunction, "QSAppMigrator: Migrating %@ at %@", identifier, bundlePath);
    const bool migrated = _claimIdentifierForRun(info) && _migrateContainerWithInfo(info);
    if (!migrated) {
      QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, "QSAppMigrator: Migration of %@ at %@ failed", identifier,
               bundlePath);
      result = false;
    }
    if (services_.observer) {
      // A failed container that is still there is kept for the next run; one
      // that is gone failed after its data had moved.
      const bool kept = container && QSFileManager::defaultManager().itemExistsAtURL(URL::fileURL(*container, true));
      _reportEntry(migrated ? platform::EntryOutcome::Migrated
                            : kept ? platform::EntryOutcome::Kept : platform::EntryOutcome::Failed,
                   "");
    }
    ++_countItemsMigrated;
  }
  return result;
}

bool QSAppMigrator::_removeOldLayoutIfEmpty() {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  const URL oldContainer = configuration.oldContainerPath();
  const URL installMapURL = configuration.oldInstallMapPath();

  Error error;
  std::optional<std::vector<URL>> remaining = fileManager.urlsForItemsInDirectoryAtURL(oldContainer, false, &error);
  if (!remaining) {
    // ENOENT: the directory is already gone, as after a run with nothing to do.
    if (!error.isPOSIX(ENOENT)) {
      QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction,
               "QSAppMigrator: Failed to determine if any items were remaining to migrate: %@", error);
    }
    return true;
  }
  if (!remaining->empty()) {
    QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction,
             "QSAppMigrator: Not removing %@ because %lu items remain unmigrated.", installMapURL.path(),
             static_cast<unsigned long>(remaining->size()));
    return false;
  }
  for (const URL& item : {oldContainer, installMapURL}) {
    Error removalError;
    if (!fileManager.removeItemAtURL(item, &removalError)) {
      QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, "QSAppMigrator: Failed to remove %@ : %@", item.path(),
               removalError);
    }
  }
  return true;
}

void QSAppMigrator::_recordCurrentSystemVersion() {
  const URL recordURL = QSGlobalConfiguration::sharedInstance().dataDirectory().appending(kQSLastSystemVersionFileName);
  std::optional<Dictionary> systemVersion = services_.systemVersion->systemVersionDictionary();
  if (!systemVersion || !platform::plist::writeFile(Value(*systemVersion), recordURL, platform::plist::Format::XML,
                                                    /*atomically=*/true)) {
    QSAM_LOG(kQSLogLevelError, kPerformMigrationFunction, "QSAppMigrator: Failed to write current build info to %@",
             recordURL.path());
    return;
  }
  QSAM_LOG(kQSLogLevelNotice, kPerformMigrationFunction, "QSAppMigrator: Recorded current system version as %@",
           QSValueForKey(*systemVersion, platform::kSystemVersionBuildVersionKey));
}
