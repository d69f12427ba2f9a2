// The migration marker: loaded and validated (types, paths kept inside the
// container it lies in) by the migrator itself.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Platform/SystemLog.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "fuzz/FuzzFiles.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const std::string container = qsfuzz::scratchRoot() + "/private/var/mobile/Applications/C";
  static QSAppMigrator* migrator = [] {
    (void)platform::setHostLogSink([](const platform::HostLogLine&) {});  // the refusals are expected: keep the output readable
    (void)platform::setSystemLogSink([](const platform::SystemLogLine&) {});
    return QSAppMigrator::create(QSMigratorServices{}).release();
  }();
  const std::string marker = container + "/" + kQSMigrationMarkerFileName;
  if (!migrator || !qsfuzz::writeInput(marker, data, size)) return 0;
  (void)migrator->_loadAndValidateMigrationMarkerAtURL(platform::URL::fileURL(marker));
  return 0;
}
