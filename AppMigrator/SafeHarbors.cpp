// Safe harbors: every harbor recorded in the safe-harbor map is registered
// with the installation daemon; the map goes once nothing was refused.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Value;

namespace {

constexpr char kMigrateSafeHarborsFunction[] = "-[QSAppMigrator _migrateSafeHarbors]";
// The daemon's container-type code for a harbor registered by the migrator.
constexpr int kSafeHarborContainerType = 2;

}  // namespace

bool QSAppMigrator::_migrateSafeHarbors() {
  if (!_harborMap) return true;

  // Keys of a property-list dictionary are strings by construction here, so
  // every key is an identifier; only the entries need checking.
  bool result = true;
  for (const auto& [identifier, entry] : *_harborMap) {
    const platform::Dictionary* harbor = entry.asDictionary();
    if (!harbor) {
      QSAM_LOG(kQSLogLevelError, kMigrateSafeHarborsFunction,
               "QSAppMigrator: Failed to get harbor info for identifier %@", identifier);
      continue;
    }
    const std::string* path = QSStringForKey(*harbor, kQSHarborPathKey);
    if (!path) {
      QSAM_LOG(kQSLogLevelError, kMigrateSafeHarborsFunction,
               "QSAppMigrator: Failed to get harbor path from harbor entry for %@ : %@", identifier, entry);
      continue;
    }
    QSAM_LOG(kQSLogLevelNotice, kMigrateSafeHarborsFunction, "QSAppMigrator: Migrating safe harbor for %@ at %@",
             identifier, *path);
    if (!services_.daemon->QuillsetRegisterSafeHarborForContainerType(*path, identifier, kSafeHarborContainerType,
                                                                      /*options=*/nullptr)) {
      QSAM_LOG(kQSLogLevelError, kMigrateSafeHarborsFunction,
               "QSAppMigrator: Failed to migrate safe harbor for identifier %@ at %@ : %@", identifier, *path, nullptr);
      result = false;
    }
  }

  if (result) {
    // Malformed entries go with the file; a failed removal only means the
    // next run registers the same harbors again.
    (void)QSFileManager::defaultManager().removeItemAtURL(_safeHarborMapURL());
  }
  return result;
}
