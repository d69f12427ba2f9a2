// The user's data: moved item by item from the old container into the data
// container that the registry assigned, and the check that nothing but the
// migration's own bookkeeping is left behind afterwards.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kMigrateDataContainerFunction[] = "-[QSAppMigrator _migrateDataContainerForIdentifier:fromURL:toURL:]";
constexpr char kContainerHasMissedItemsFunction[] = "-[QSAppMigrator _containerHasMissedItems:withIdentifier:]";

// Bookkeeping items that may stay in an old container: the container marker
// and two markers of other writers, which this plug-in only tolerates.
constexpr const char* kBookkeepingItemNames[] = {
    kQSMigrationMarkerFileName,
    "com.vantrel.quill.set.migration_marker",
    "com.vantrel.quillset.placeholder",
};

bool isBookkeepingItem(const std::string& name) {
  for (const char* bookkeeping : kBookkeepingItemNames) {
    if (name == bookkeeping) return true;
  }
  return false;
}

}  // namespace

bool QSAppMigrator::_migrateDataContainerForIdentifier(const std::string& identifier, const URL& fromURL,
                                                       const URL& toURL) {
  if (!_dataFitsInContainer(identifier, fromURL, toURL)) return false;
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  // The items move as one group: names of one file in two items stay one
  // file, and what the moves need flushed is flushed once, at the end.
  QSMoveGroup moves;
  bool moved = true;
  for (const std::string& name : QSGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
    const URL source = fromURL.appending(name, true);
    const URL destination = toURL.appending(name, true);
    // What an interrupted move of this item left goes first; a source set
    // aside whose copy cannot be found stays, a missed item of the container.
    (void)fileManager.finishInterruptedMoveOfItemAtURL(source, destination);
    if (!fileManager.itemExistsAtURL(source)) continue;

    // Replace, never merge: whatever the new container holds under this name
    // goes first, unless another container moved it there in this run. A
    // removal that fails leaves the move below to report it.
    if (!_mayReplaceItemAtURL(destination)) {
      moved = false;
      break;
    }
    (void)fileManager.removeItemAtURL(destination);
    Error error;
    if (!fileManager.moveItemIfExistsAtURL(source, destination, moves, &error)) {
      QSAM_LOG(kQSLogLevelError, kMigrateDataContainerFunction,
               "QSAppMigrator: Failed to move %@ to %@ migrating for %@ : %@", source, destination, identifier, error);
      moved = false;
      break;
    }
    _noteItemMovedInRun(destination);
  }
  Error error;
  if (!fileManager.finishMoveGroup(moves, &error)) {
    QSAM_LOG(kQSLogLevelError, kMigrateDataContainerFunction,
             "QSAppMigrator: Failed to flush the data moved to %@ migrating for %@ : %@", toURL, identifier, error);
    return false;
  }
  return moved;
}

bool QSAppMigrator::_containerHasMissedItems(const URL& container, const std::string& withIdentifier) {
  Error error;
  std::optional<std::vector<URL>> items =
      QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(container, false, &error);
  if (!items) {
    // A container that cannot be looked into must be kept.
    QSAM_LOG(kQSLogLevelError, kContainerHasMissedItemsFunction,
             "QSAppMigrator: Failed to enumerate container %@ for %@ : %@", container.path(), withIdentifier, error);
    return true;
  }

  platform::Array missed;
  for (const URL& item : *items) {
    if (!isBookkeepingItem(item.lastPathComponent())) missed.emplace_back(item);
  }
  if (missed.empty()) return false;
  QSAM_LOG(kQSLogLevelError, kContainerHasMissedItemsFunction, "QSAppMigrator: Found missed items in %@ for %@: %@",
           container.path(), withIdentifier, missed);
  return true;
}
