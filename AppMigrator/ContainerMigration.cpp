// Per-container migration. Until the installation steps exist, no container
// can be migrated: each attempt says so and fails, which keeps the container
// (and the old layout) in place for a later run.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/Support/QSLog.h"

namespace {
constexpr char kMigrateContainerFunction[] = "-[QSAppMigrator _migrateContainerWithInfo:]";
}  // namespace

bool QSAppMigrator::_migrateContainerWithInfo(const platform::Dictionary& info) {
  QSAM_LOG(kQSLogLevelError, kMigrateContainerFunction, "QSAppMigrator: Cannot migrate container %@ yet",
           QSValueForKey(info, kQSContainerPathKey));
  return false;
}
