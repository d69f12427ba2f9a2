// SQLiteApplicationRegistry: the application registry and installation daemon
// of the Linux platform, kept in an SQLite database under
// <root>/private/var/db/appregistry/.
//
// Thread safety: every operation may be called from any thread; each opens
// its statements on a connection guarded by the object's own lock. Several
// processes may open the same registry; SQLite serialises their changes.
// Crash safety: each change is one transaction, and the file-system part of a
// change is journalled so that a process killed at any instant leaves the
// registry as before or after the change (recovered on the next open).
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/InstallationDaemon.h"

namespace platform {

struct SafeHarborRecord {
  std::string identifier;
  std::string path;
  int containerType = 0;
};

class SQLiteApplicationRegistry final : public ApplicationRegistry, public InstallationDaemonClient {
 public:
  // Opens (creating when needed) the registry of the system under
  // `systemRoot` ("" for "/"). Null with *error on failure.
  static std::unique_ptr<SQLiteApplicationRegistry> open(const std::string& systemRoot, Error* error = nullptr);
  ~SQLiteApplicationRegistry() override;

  bool isInstalled(const std::string& identifier) override;
  std::optional<BundleRecord> recordForIdentifier(const std::string& identifier) override;
  bool installPackage(const URL& package, const Dictionary& options, const InstallProgressCallback& progress,
                      Error* error) override;
  bool installBundle(const URL& bundle, const Dictionary& options, Error* error) override;

  bool QuillsetRegisterSafeHarborForContainerType(const std::string& path, const std::string& identifier,
                                                  int containerType, const Value* options) override;
  bool QuillsetUpdateContainerDataProtectionForMigratorOnly(const Dictionary& options) override;

  // Inspection (tools and tests): every record, built-in applications
  // included, ordered by identifier; every registered safe harbor.
  std::vector<BundleRecord> allRecords();
  std::vector<SafeHarborRecord> safeHarbors();

 private:
  struct Impl;
  explicit SQLiteApplicationRegistry(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace platform
