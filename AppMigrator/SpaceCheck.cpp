// Room on the destination: before items are copied to another file system,
// the destination must hold them plus a margin, or nothing is moved. A copy
// known not to fit is never started: it would fail part way, after filling
// the destination for every other writer.
#include <map>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kFunction[] = "-[QSAppMigrator _destinationHasRoomForItems:destination:identifier:]";

// Room a tree takes on a file system of `blockSize`: each file rounded up to
// whole blocks, and one block per directory and per other item.
uint64_t roomFor(const QSItemSize& size, uint64_t fileBlocksRoundedUp, uint64_t blockSize) {
  return fileBlocksRoundedUp * blockSize + (size.directories + size.otherItems) * blockSize;
}

}  // namespace

uint64_t QSNeededRoomWithMargin(uint64_t bytes) {
  return bytes + kQSSpaceMarginBytes + bytes / kQSSpaceMarginDivisor;
}

bool QSAppMigrator::_destinationHasRoomForItems(const std::vector<URL>& items, const URL& destination,
                                                const std::string& identifier) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  QSFileSystemSpace target;
  Error error;
  if (!fm.fileSystemSpaceForURL(destination, &target, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Cannot tell how much room there is at %@ for %@ : %@",
             destination.path(), identifier, error);
    return false;
  }
  const uint64_t blockSize = target.blockSize ? target.blockSize : 1;
  uint64_t needed = 0;
  for (const URL& item : items) {
    std::optional<uint64_t> device;
    if (!fm.deviceOfItemAtURL(item, &device, &error)) {
      QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Cannot measure %@ for %@ : %@", item.path(), identifier,
               error);
      return false;
    }
    if (!device || *device == target.device) continue;  // missing, or renamed in place: takes no new room
    uint64_t fileBlocks = 0;
    QSItemSize size;
    const bool walked = fm._traverseDirectory(item, &error, [&](const QSTraversalEntry& entry, Error*) {
      switch (entry.kind) {
        case QSTraversalEntry::Kind::RegularFile:
          fileBlocks += (static_cast<uint64_t>(entry.status.st_size) + blockSize - 1) / blockSize;
          break;
        case QSTraversalEntry::Kind::DirectoryPre:
          ++size.directories;
          break;
        case QSTraversalEntry::Kind::DirectoryPost:
          break;
        default:
          ++size.otherItems;
      }
      return true;
    });
    if (!walked) {
      QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Cannot measure %@ for %@ : %@", item.path(), identifier,
               error);
      return false;
    }
    needed += roomFor(size, fileBlocks, blockSize);
  }
  if (needed == 0) return true;
  const uint64_t neededWithMargin = QSNeededRoomWithMargin(needed);
  if (neededWithMargin <= target.freeBytes) return true;
  QSAM_LOG(kQSLogLevelError, kFunction,
           "QSAppMigrator: Not enough room at %@ for %@ : %llu bytes needed (with margin), %llu bytes free; keeping "
           "its container",
           target.existingPath, identifier, static_cast<unsigned long long>(neededWithMargin),
           static_cast<unsigned long long>(target.freeBytes));
  return false;
}

bool QSAppMigrator::_dataFitsInContainer(const std::string& identifier, const URL& fromURL, const URL& toURL) {
  std::vector<URL> items;
  for (const std::string& name : QSGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
    items.push_back(fromURL.appending(name, true));
  }
  return _destinationHasRoomForItems(items, toURL, identifier);
}

bool QSAppMigrator::_groupContainersFitForIdentifier(const std::string& identifier,
                                                     const std::map<std::string, URL>& newContainers) {
  if (!_groupContainerMap) return true;
  for (const auto& [group, newContainer] : newContainers) {
    const std::optional<URL> oldContainer = _movableOldGroupContainer(group);
    if (!oldContainer) continue;  // the group step says why it moves nothing
    std::vector<URL> items;
    Error error;
    if (auto listed = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*oldContainer, false, &error)) {
      items = std::move(*listed);
    }
    if (!_destinationHasRoomForItems(items, newContainer, identifier + "[" + group + "]")) return false;
  }
  return true;
}

platform::PlanSize QSAppMigrator::_measureItem(const URL& item) {
  QSItemSize size;
  (void)QSFileManager::defaultManager().sizeOfItemAtURL(item, &size);  // what cannot be read counts as empty
  return platform::PlanSize{size.files, size.bytes, size.directories, size.otherItems};
}

platform::PlanSize QSAppMigrator::_measureUserData(const URL& container) {
  platform::PlanSize total;
  for (const std::string& name : QSGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
    const platform::PlanSize size = _measureItem(container.appending(name, true));
    total.files += size.files;
    total.bytes += size.bytes;
    total.directories += size.directories;
    total.otherItems += size.otherItems;
  }
  return total;
}

std::map<std::string, platform::PlanSize> QSAppMigrator::_measureGroupsForIdentifier(const std::string& identifier) {
  std::map<std::string, platform::PlanSize> sizes;
  if (!_groupContainerMap || _groupContainerMap->empty()) return sizes;
  const std::optional<platform::BundleRecord> record = services_.registry->recordForIdentifier(identifier);
  if (!record || !record->groupContainerURLs) return sizes;
  for (const auto& [group, newContainer] : *record->groupContainerURLs) {
    const std::optional<URL> oldContainer = _movableOldGroupContainer(group);
    if (!oldContainer) continue;
    const std::optional<platform::PlanSize> measured = _takeMeasured(*oldContainer);
    sizes[group] = measured ? *measured : _measureItem(*oldContainer);
  }
  return sizes;
}

std::optional<platform::PlanSize> QSAppMigrator::_takeMeasured(const URL& url) {
  const auto found = _measuredInIntrospection.find(url.path());
  if (found == _measuredInIntrospection.end()) return std::nullopt;
  const platform::PlanSize size = found->second;
  _measuredInIntrospection.erase(found);
  return size;
}

void QSAppMigrator::_reportEntry(platform::EntryOutcome outcome, const std::string& reason) {
  if (services_.observer) services_.observer->entryFinished(outcome, reason);
}
