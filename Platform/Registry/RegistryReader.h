// RegistryReader: the application registry of a system root, read and never
// changed. The inspection tool and the migrator's dry run use it: opening it
// makes no directory, no database and no log file, and a lookup makes no
// container (a built-in application's containers are made on its first real
// lookup, so here they may not exist yet).
//
// Thread safety: every member may be called from any thread; the database is
// guarded by the object's own lock.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/BuiltInApplications.h"
#include "Platform/Registry/RegistryState.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform {


class RegistryReader final : public ApplicationRegistry, public RegistryForecast {
 public:
  // Opens the registry of the system under `systemRoot` ("" for "/"). With
  // `allowMissingDatabase`, a system that has no database yet reads as one
  // with no records beyond its built-in applications; otherwise that fails
  // with kRegistryErrorNoDatabase. Other failures: kRegistryErrorDatabase.
  static std::unique_ptr<RegistryReader> open(const std::string& systemRoot, bool allowMissingDatabase,
                                              Error* error = nullptr);

  bool isInstalled(const std::string& identifier) override;
  // The record as it stands; a built-in application whose data container is
  // not made yet has none, with dataContainerToBeMade set.
  std::optional<BundleRecord> recordForIdentifier(const std::string& identifier) override;
  // Refused with kRegistryErrorReadOnly.
  bool installPackage(const URL& package, const Dictionary& options, const InstallProgressCallback& progress,
                      Error* error) override;
  bool installBundle(const URL& bundle, const Dictionary& options, Error* error) override;

  URL newDataContainerDirectory(bool vpnPlugin) override;
  URL newGroupContainerDirectory() override;
  std::optional<URL> groupContainerForGroup(const std::string& group) override;
  bool refusesAsNotNewerThanBuiltIn(const std::string& identifier, const std::string& version) override;

  // Every record (built-in applications included), ordered by identifier;
  // every registered safe harbor, ordered by identifier.
  std::vector<BundleRecord> allRecords();
  std::vector<SafeHarborRecord> safeHarbors();

  const std::string& databasePath() const { return layout_.databasePath; }

 private:
  RegistryReader(registry::RegistryLayout layout, std::unique_ptr<registry::Database> db);
  std::optional<BundleRecord> builtInRecord(const registry::BuiltInApplication& application);

  const registry::RegistryLayout layout_;
  std::mutex dbMutex_;                    // guards db_
  std::unique_ptr<registry::Database> db_;  // null: no database yet
  registry::BuiltInApplications builtIns_;
};

namespace registry {
// The record the registry reports for a stored row.
BundleRecord bundleRecordFromStored(const StoredRecord& stored);
// The record of a built-in application, without its data and group containers.
BundleRecord builtInRecordWithoutContainers(const BuiltInApplication& application);
}  // namespace registry

}  // namespace platform
