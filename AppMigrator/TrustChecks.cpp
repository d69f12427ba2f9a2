// Checks on what the run reads from places it does not control: the paths a
// marker records, the group containers the install map names, identifiers
// that two containers claim, and where the data of a discarded container
// goes. Each refusal leaves the files where they are and says why in one
// level-3 line.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;

namespace {

constexpr char kMarkerCheckFunction[] = "-[QSAppMigrator _migrationMarkerPathsStayInContainer:atURL:]";
constexpr char kGroupCheckFunction[] = "-[QSAppMigrator _groupContainerPathIsAcceptable:forGroup:]";
constexpr char kClaimFunction[] = "-[QSAppMigrator _claimIdentifierForRun:]";
constexpr char kReplaceFunction[] = "-[QSAppMigrator _mayReplaceItemAtURL:]";
constexpr char kRecoveryFunction[] = "-[QSAppMigrator _moveItemsToRecovery:fromContainer:]";

// A second recovery of the same container name gets a numbered directory.
constexpr int kRecoveryNameAttempts = 1000;

std::string withoutTrailingSeparators(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

}  // namespace

bool QSAppMigrator::_migrationMarkerPathsStayInContainer(const Dictionary& marker, const URL& markerURL) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  const std::string container = markerURL.deletingLastPathComponent().path();
  const std::string* recorded = QSStringForKey(marker, kQSContainerPathKey);
  if (!recorded || withoutTrailingSeparators(*recorded) != withoutTrailingSeparators(container)) {
    QSAM_LOG(kQSLogLevelError, kMarkerCheckFunction,
             "QSAppMigrator: Migration marker %@ is invalid: its container path %@ is not the container it lies in",
             markerURL.path(), QSValueForKey(marker, kQSContainerPathKey));
    return false;
  }
  const URL containerURL = URL::fileURL(container, true);
  for (const char* key : {kQSBundlePathKey, kQSSecondBundlePathKey}) {
    const std::string* bundle = QSStringForKey(marker, key);
    if (!bundle) continue;  // absence and type were checked before
    if (!fm.urlLiesInsideURL(URL::fileURL(*bundle, true), containerURL)) {
      QSAM_LOG(kQSLogLevelError, kMarkerCheckFunction,
               "QSAppMigrator: Migration marker %@ is invalid: its %s %@ does not lie inside its container",
               markerURL.path(), key, *bundle);
      return false;
    }
  }
  return true;
}

bool QSAppMigrator::_identifierIsBuiltIn(const std::string& identifier) {
  return QSGlobalConfiguration::sharedInstance().builtInApplicationBundleIDs().count(identifier) > 0;
}

bool QSAppMigrator::_groupContainerPathIsAcceptable(const URL& oldContainer, const std::string& group) {
  const char* reason = _groupContainerRefusal(oldContainer, group);
  if (!reason) return true;
  QSAM_LOG(kQSLogLevelError, kGroupCheckFunction, "QSAppMigrator: Not migrating group container %@ at %@ : %s", group,
           oldContainer.path(), reason);
  return false;
}

const std::optional<std::string>& QSAppMigrator::_resolvedInRun(const URL& url) const {
  auto found = _resolvedPathsInRun.find(url.path());
  if (found == _resolvedPathsInRun.end()) {
    found = _resolvedPathsInRun.emplace(url.path(), QSFileManager::defaultManager().resolvedPathOfURL(url)).first;
  }
  return found->second;
}

const char* QSAppMigrator::_groupContainerRefusal(const URL& oldContainer, const std::string& group) const {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  const QSFileManager& fm = QSFileManager::defaultManager();
  auto refuse = [](const char* reason) { return reason; };
  // The container itself is resolved as it is now: it is what will be moved.
  const std::optional<std::string> container = fm.resolvedPathOfURL(oldContainer);
  if (!fm.resolvedPathLiesInside(container, _resolvedInRun(configuration.rootPath()))) {
    return refuse("the path does not lie inside the system root");
  }
  // Places whose contents belong to others: applications old and new,
  // built-in bundles and the system's own directories, the migrator's own.
  const URL areas[] = {
      configuration.oldContainerPath(),          configuration.bundleContainersPath(),
      configuration.dataContainersPath(),        configuration.systemAppsDirectory(),
      configuration.internalAppsDirectory(),     configuration.developerAppsDirectory(),
      configuration.coreServicesDirectory(),     configuration.systemFrameworksRootDirectory(),
      configuration.dataDirectoryPath(),         configuration.recoveryDirectoryPath(),
      configuration.oldInstallMapPath().deletingLastPathComponent(),
  };
  for (const URL& area : areas) {
    const std::optional<std::string>& resolvedArea = _resolvedInRun(area);
    if (fm.resolvedPathLiesInside(container, resolvedArea, true)) {
      return refuse("the path lies inside an application's container, a built-in bundle or a system directory");
    }
    // The root, /private/var and the like: emptying them would take the
    // layout with them.
    if (fm.resolvedPathLiesInside(resolvedArea, container)) {
      return refuse("the path holds directories of the system's layout");
    }
  }
  if (!_groupContainerMap) return nullptr;
  for (const auto& [other, entry] : *_groupContainerMap) {
    const platform::Value* path = other == group ? nullptr : entry.get(kQSGroupContainerPathKey);
    if (path && path->isString() &&
        fm.resolvedPathLiesInside(_resolvedInRun(URL::fileURL(*path->asString(), true)), container)) {
      return refuse("the path holds another group's container");
    }
  }
  return nullptr;
}

std::optional<URL> QSAppMigrator::_movableOldGroupContainer(const std::string& group) const {
  if (!_groupContainerMap) return std::nullopt;
  const platform::Value* entry = QSValueForKey(*_groupContainerMap, group);
  const platform::Value* path = entry ? entry->get(kQSGroupContainerPathKey) : nullptr;
  if (!path || !path->isString()) return std::nullopt;
  URL oldContainer = URL::fileURL(*path->asString(), true);
  if (_groupContainerRefusal(oldContainer, group)) return std::nullopt;
  return oldContainer;
}

bool QSAppMigrator::_claimIdentifierForRun(const Dictionary& info) {
  const std::string* identifier = QSStringForKey(info, kQSBundleIdentifierKey);
  if (!identifier) return true;  // the container's own migration reports it
  if (_identifiersMigratedInRun.insert(*identifier).second) return true;
  QSAM_LOG(kQSLogLevelError, kClaimFunction,
           "QSAppMigrator: Not migrating container %@ : another container of this run was already migrated as %@",
           QSValueForKey(info, kQSContainerPathKey), *identifier);
  return false;
}

bool QSAppMigrator::_mayReplaceItemAtURL(const URL& destination) {
  if (_itemsMovedInRun.count(destination.path()) == 0) return true;
  QSAM_LOG(kQSLogLevelError, kReplaceFunction,
           "QSAppMigrator: Not replacing %@ : another container moved it there in this run", destination.path());
  return false;
}

void QSAppMigrator::_noteItemMovedInRun(const URL& destination) {
  _itemsMovedInRun.insert(destination.path());
}

bool QSAppMigrator::_moveItemsToRecovery(const std::vector<URL>& items, const URL& fromContainer) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  std::vector<URL> present;
  for (const URL& item : items) {
    if (fm.itemExistsAtURL(item)) present.push_back(item);
  }
  if (present.empty()) return true;

  const URL parent = QSGlobalConfiguration::sharedInstance().recoveryDirectoryPath();
  Error error;
  if (!fm.createDirectoryAtURL(parent, true, kQSNewDirectoryMode, &error)) {
    QSAM_LOG(kQSLogLevelError, kRecoveryFunction, "QSAppMigrator: Failed to create recovery directory %@ : %@",
             parent.path(), error);
    return false;
  }
  // A directory of its own, never one that an earlier recovery filled.
  std::optional<URL> recovery;
  const std::string name = fromContainer.lastPathComponent();
  for (int attempt = 0; attempt < kRecoveryNameAttempts && !recovery; ++attempt) {
    const URL candidate = parent.appending(attempt == 0 ? name : name + "." + std::to_string(attempt), true);
    if (fm.itemDoesNotExistAtURL(candidate) && fm.createDirectoryAtURL(candidate, false, kQSNewDirectoryMode)) {
      recovery = candidate;
    }
  }
  if (!recovery) {
    QSAM_LOG(kQSLogLevelError, kRecoveryFunction, "QSAppMigrator: Failed to create a recovery directory for %@ in %@",
             fromContainer.path(), parent.path());
    return false;
  }
  for (const URL& item : present) {
    const URL target = recovery->appending(item.lastPathComponent());
    if (!fm.moveItemAtURL(item, target, &error)) {
      QSAM_LOG(kQSLogLevelError, kRecoveryFunction, "QSAppMigrator: Failed to move %@ to %@ : %@", item.path(),
               target.path(), error);
      return false;
    }
  }
  // The moves must be on disk before the container that held the items goes.
  if (!fm.synchronizeDirectoryAtURL(*recovery, &error) || !fm.synchronizeDirectoryAtURL(parent, &error) ||
      !fm.synchronizeDirectoryAtURL(parent.deletingLastPathComponent(), &error) ||
      !fm.synchronizeDirectoryAtURL(fromContainer, &error)) {
    QSAM_LOG(kQSLogLevelError, kRecoveryFunction, "QSAppMigrator: Failed to flush %@ : %@", recovery->path(), error);
    return false;
  }
  QSAM_LOG(kQSLogLevelNotice, kRecoveryFunction, "QSAppMigrator: Moved %lu items of %@ to %@ for recovery",
           static_cast<unsigned long>(present.size()), fromContainer.path(), recovery->path());
  return true;
}
