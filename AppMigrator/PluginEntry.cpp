// The plug-in's entry point: builds the real platform services once and
// creates the migrator with them.
#include <atomic>
#include <cstdlib>
#include <mutex>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Platform/Preferences.h"
#include "Platform/Registry/RegistryReader.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "Shared/Support/QSLog.h"

namespace {

constexpr char kEntryPointFunction[] = "QSCreateDataClassMigrator";
constexpr char kTemporaryDirectoryVariable[] = "TMPDIR";
constexpr char kDefaultTemporaryDirectory[] = "/tmp";

platform::URL processTemporaryDirectory() {
  const char* fromEnvironment = std::getenv(kTemporaryDirectoryVariable);
  return platform::URL::fileURL(fromEnvironment && *fromEnvironment ? fromEnvironment : kDefaultTemporaryDirectory,
                                true);
}

// The services live for the rest of the process once made; a registry that
// cannot be opened is tried again on the next call. Guarded by servicesMutex.
std::mutex servicesMutex;
QSMigratorServices* sharedServices = nullptr;
std::atomic<platform::MigrationObserver*> observer{nullptr};

QSMigratorServices* realServices() {
  std::lock_guard<std::mutex> lock(servicesMutex);
  if (sharedServices) return sharedServices;

  const std::string& systemRoot = platform::systemRootFromEnvironment();
  platform::Error error;
  std::unique_ptr<platform::SQLiteApplicationRegistry> registry =
      platform::SQLiteApplicationRegistry::open(systemRoot, &error);
  if (!registry) {
    QSAM_LOG(kQSLogLevelError, kEntryPointFunction,
             "QSAppMigrator: Failed to open the application registry of the system at \"%s\" : %@",
             systemRoot.empty() ? "/" : systemRoot, error);
    return nullptr;
  }
  auto* services = new QSMigratorServices;
  platform::SQLiteApplicationRegistry* leakedRegistry = registry.release();
  services->registry = leakedRegistry;
  services->daemon = leakedRegistry;
  services->bundleReader = new platform::FileBundleReader;
  services->iconRenderer = new platform::CairoIconRenderer;
  services->imageEncoding = new platform::PNGImageEncoding;
  services->systemVersion = new platform::FileSystemVersionSource(systemRoot);
  services->temporaryDirectory = processTemporaryDirectory();
  sharedServices = services;
  return sharedServices;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) platform::DataClassMigrator* QSCreateDataClassMigrator() {
  QSMigratorServices* services = realServices();
  if (!services) return nullptr;
  QSMigratorServices withObserver = *services;
  withObserver.observer = observer.load();
  // Creation logs its own reason when it yields nothing.
  return QSAppMigrator::create(withObserver).release();
}

extern "C" __attribute__((visibility("default"))) void QSSetMigrationObserver(platform::MigrationObserver* next) {
  observer.store(next);
}

// The dry run reads the registry without opening it for changes: no
// directory, database or journal recovery. Its services live only for the
// call.
extern "C" __attribute__((visibility("default"))) platform::MigrationPlan* QSPlanDataClassMigration() {
  const std::string& systemRoot = platform::systemRootFromEnvironment();
  platform::Error error;
  std::unique_ptr<platform::RegistryReader> registry = platform::RegistryReader::open(systemRoot, true, &error);
  if (!registry) {
    QSAM_LOG(kQSLogLevelError, kEntryPointFunction,
             "QSAppMigrator: Failed to read the application registry of the system at \"%s\" : %@",
             systemRoot.empty() ? "/" : systemRoot, error);
    return nullptr;
  }
  platform::FileBundleReader bundleReader;
  platform::FileSystemVersionSource systemVersion(systemRoot);
  QSMigratorServices services;
  services.registry = registry.get();
  services.forecast = registry.get();
  services.bundleReader = &bundleReader;
  services.systemVersion = &systemVersion;
  services.temporaryDirectory = processTemporaryDirectory();
  std::unique_ptr<QSAppMigrator> migrator = QSAppMigrator::createForPlanning(services);
  if (!migrator) return nullptr;
  return new platform::MigrationPlan(migrator->planMigration());
}
