// Group containers: the old container of each application group, recorded in
// the old install map, is emptied into the new group container that the
// registry reports for the installed application, then removed.
#include <algorithm>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kMigrateFunction[] = "-[QSAppMigrator _migrateGroupContainersForIdentifier:]";
constexpr char kMoveAllFunction[] = "-[QSAppMigrator _moveAllItemsInGroupContainerURL:toGroupContainerURL:]";

// The order in which the items of a group container move: an item named
// like the aside of another (an application's own, or the aside of an
// interrupted move) before the others, so that it is resolved before the
// item whose aside name it holds moves; an item named like the hidden copy of
// another after all others, and only once that other has left (see
// moveAllItems).
int moveRank(const std::string& name) {
  if (name.starts_with(kQSMoveOutgoingPrefix)) return 0;
  if (name.starts_with(kQSMoveIncomingPrefix)) return 2;
  return 1;
}

// Moves every item of `source` into `destination`, replacing (never merging)
// an item of the same name. False only when `source` cannot be listed;
// otherwise *failedItems is the number of items that could not be moved.
bool moveAllItems(const URL& source, const URL& destination, size_t* failedItems) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  Error error;
  auto items = fm.urlsForItemsInDirectoryAtURL(source, false, &error);
  if (!items) {
    QSAM_LOG(kQSLogLevelError, kMoveAllFunction,
             "QSAppMigrator: Failed to get all urls in source group container %@ : %@", source.path(), error);
    return false;
  }
  std::stable_sort(items->begin(), items->end(), [](const URL& a, const URL& b) {
    return moveRank(a.lastPathComponent()) < moveRank(b.lastPathComponent());
  });
  *failedItems = 0;
  // Items an interrupted run moved before it could take the move's ticket
  // off their copy: only the new container still has them.
  if (const auto moved = fm.urlsForItemsInDirectoryAtURL(destination, false)) {
    for (const URL& item : *moved) {
      const std::string name = item.lastPathComponent();
      if (std::none_of(items->begin(), items->end(), [&](const URL& old) { return old.lastPathComponent() == name; })) {
        (void)fm.finishInterruptedMoveOfItemAtURL(source.appending(name), item);
      }
    }
  }
  // Names of one file in two items stay one file; the flushes the moves
  // need are made once, at the end.
  QSMoveGroup moves;
  for (const URL& item : *items) {
    const std::string name = item.lastPathComponent();
    if (name.starts_with(kQSMoveOutgoingPrefix)) {
      // An item an interrupted run had already moved, set aside for removal:
      // it goes once its copy is found in the new container, else it stays.
      // An item of that name that no move set aside moves like any other.
      const std::string moved = name.substr(std::string_view(kQSMoveOutgoingPrefix).size());
      if (!fm.finishInterruptedMoveOfItemAtURL(source.appending(moved), destination.appending(moved))) {
        ++*failedItems;
        continue;
      }
      if (!fm.itemExistsAtURL(item)) continue;
    } else if (name.starts_with(kQSMoveIncomingPrefix) &&
               fm.itemExistsAtURL(source.appending(name.substr(std::string_view(kQSMoveIncomingPrefix).size())))) {
      // In the new container it would pass for the unfinished copy of that
      // item, which a later attempt removes: it waits until the item left.
      ++*failedItems;
      continue;
    }
    const URL target = destination.appending(name);
    (void)fm.finishInterruptedMoveOfItemAtURL(item, target);
    // The outcome is not tested: the move that follows fails if the old item
    // is still in the way.
    (void)fm.removeItemAtURL(target);
    if (!fm.moveItemIfExistsAtURL(item, target, moves, &error)) {
      QSAM_LOG(kQSLogLevelError, kMoveAllFunction, "QSAppMigrator: Failed to move item %@ to %@ : %@", item.path(),
               target.path(), error);
      ++*failedItems;
    } else if (fm.itemExistsAtURL(item)) {
      // Copied to another file system, but the source could not be set
      // aside: it is still the item of the old container.
      ++*failedItems;
    }
  }
  if (!fm.finishMoveGroup(moves, &error)) {
    QSAM_LOG(kQSLogLevelError, kMoveAllFunction, "QSAppMigrator: Failed to flush the items moved to %@ : %@",
             destination.path(), error);
    ++*failedItems;
  }
  return true;
}

}  // namespace

bool QSAppMigrator::_migrateGroupContainersForIdentifier(const std::string& identifier) {
  if (!_groupContainerMap || _groupContainerMap->empty()) return true;

  const std::optional<platform::BundleRecord> record = services_.registry->recordForIdentifier(identifier);
  if (!record) {
    QSAM_LOG(kQSLogLevelError, kMigrateFunction, "QSAppMigrator: Failed to get bundle proxy for %@", identifier);
    return false;
  }
  if (!record->groupContainerURLs) {
    QSAM_LOG(kQSLogLevelError, kMigrateFunction, "QSAppMigrator: Failed to get group container URLs for installed %@",
             identifier);
    return false;
  }
  if (record->groupContainerURLs->empty()) {
    QSAM_LOG(kQSLogLevelNotice, kMigrateFunction, "QSAppMigrator: No group containers to migrate for %@", identifier);
    return true;
  }
  if (!_groupContainersFitForIdentifier(identifier, *record->groupContainerURLs)) return false;
  // The record's dictionary is walked while the map loses entries. A group
  // whose items did not all move keeps this application's container, and
  // with it the record of what is left, for a later run.
  bool everyGroupMoved = true;
  for (const auto& [group, newContainer] : *record->groupContainerURLs) {
    if (!_migrateGroupContainer(identifier, group, newContainer)) everyGroupMoved = false;
  }
  return everyGroupMoved;
}

bool QSAppMigrator::_migrateGroupContainer(const std::string& identifier, const std::string& group,
                                           const URL& newContainer) {
  const auto entry = _groupContainerMap->find(group);
  const platform::Dictionary* entryDictionary =
      entry == _groupContainerMap->end() ? nullptr : entry->second.asDictionary();
  if (!entryDictionary) {
    QSAM_LOG(kQSLogLevelNotice, kMigrateFunction, "QSAppMigrator: No group container entry to migrate for %@[%@]",
             identifier, group);
    return true;
  }
  const platform::Value* path = entry->second.get(kQSGroupContainerPathKey);
  if (!path || !path->isString()) {
    QSAM_LOG(kQSLogLevelNotice, kMigrateFunction, "QSAppMigrator: Failed to get path to group container for %@[%@]",
             identifier, group);
    return true;
  }
  const URL oldContainer = URL::fileURL(*path->asString(), true);
  if (!_groupContainerPathIsAcceptable(oldContainer, group)) return true;  // left where it is, logged
  const QSFileManager& fm = QSFileManager::defaultManager();
  if (!fm.itemExistsAtURL(oldContainer)) {
    QSAM_LOG(kQSLogLevelError, kMigrateFunction, "QSAppMigrator: Missing source group container at %@",
             oldContainer.path());
    return true;
  }
  QSAM_LOG(kQSLogLevelNotice, kMigrateFunction, "QSAppMigrator: Migrating group container %@ at %@ to %@", group,
           oldContainer, newContainer);
  size_t failedItems = 0;
  // A container that cannot be listed keeps everything, as one whose items
  // did not all move.
  if (!moveAllItems(oldContainer, newContainer, &failedItems)) return false;

  // Items that could not be moved are still in the old group container: it
  // keeps them, and its map entry keeps pointing at it, so that the next
  // attempt (of this application, kept for it, or of another member of the
  // group) moves them.
  if (failedItems > 0) {
    QSAM_LOG(kQSLogLevelError, kMigrateFunction,
             "QSAppMigrator: Keeping old group container at %@ : %lu items could not be moved", oldContainer.path(),
             static_cast<unsigned long>(failedItems));
    return false;
  }
  _groupContainerMap->erase(entry);
  Error error;
  if (!fm.removeItemAtURL(oldContainer, &error)) {
    QSAM_LOG(kQSLogLevelError, kMigrateFunction, "QSAppMigrator: Failed to remove old group container at %@ : %@",
             oldContainer.path(), error);
  }
  return true;
}

bool QSAppMigrator::_moveAllItemsInGroupContainerURL(const URL& source, const URL& toGroupContainerURL) {
  size_t failedItems = 0;
  return moveAllItems(source, toGroupContainerURL, &failedItems);
}
