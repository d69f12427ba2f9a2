// SQLiteApplicationRegistry: the application registry and installation daemon
// of the Linux platform, kept in an SQLite database under
// <root>/private/var/db/appregistry/.
//
// Layout under the system root:
//   private/var/db/appregistry/registry.sqlite      the database (WAL mode)
//   private/var/db/appregistry/install.lock         serialises changes across processes
//   private/var/containers/Bundle/Application/<UUID>/<name>.app
//                                                   bundle containers (store metadata beside the bundle)
//   private/var/mobile/Containers/Data/Application/<UUID>/      data containers of applications
//   private/var/mobile/Containers/Data/PluginKitPlugin/<UUID>/  data containers of VPN plug-ins
//   private/var/mobile/Containers/Shared/AppGroup/<UUID>/       group containers, one per group identifier
//   Applications/*.app                               built-in applications (read only); their
//                                                   records name Applications/ as bundle container
// UUIDs are random (getrandom), upper-case, 8-4-4-4-12.
//
// Built-in applications are found by reading Applications/ again whenever its
// modification time changes; their data and group containers are made on
// their first lookup (allRecords and the data-protection update look up).
//
// Installation (installPackage) runs on the registry's worker thread (started
// with the first installation, kept until the registry goes away), which
// delivers every progress report; the call returns after the last one. The
// package must lie inside the system root, outside the registry's own
// directories (else kRegistryErrorOutsideAreas). A package is its
// "Payload" directory (exactly one *.app and at most one *.vpnplugin, or a
// single *.vpnplugin alone) and store-metadata items beside "Payload", which
// are kept beside the bundle in its new container. After a successful
// installation, and after an "ApplicationAlreadyInstalled" refusal, the
// package directory is removed; after any other refusal it is left as it was.
// The registry remembers the package path each identifier was last installed
// from: installing that package again once its Payload no longer holds a
// bundle succeeds without change, so that an interrupted caller can finish.
//
// Thread safety: every operation may be called from any thread; each opens
// its statements on a connection guarded by the object's own lock, which is
// never held while files move, so lookups go on during an installation and
// see the records as before or after it. Installations (through this object,
// others of the same root, or other processes) run one at a time under the
// install lock; open() waits for a running one to end. A progress callback
// may look records up, but must not install through the same registry.
// Crash safety: each change is one transaction, and the file-system part of a
// change is journalled so that a process killed at any instant leaves the
// registry as before or after the change (recovered on the next open).
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/InstallationDaemon.h"

namespace platform {

// Codes of kRegistryErrorDomain. Every error carries a kLocalizedDescriptionKey
// message naming the path concerned and, where there is one, the POSIX or
// database error under kUnderlyingErrorKey.
inline constexpr int64_t kRegistryErrorDatabase = 1;          // the database cannot be opened, read or written
inline constexpr int64_t kRegistryErrorInvalidPackage = 2;    // no package, no Payload, wrong Payload contents
inline constexpr int64_t kRegistryErrorInvalidInfoPlist = 3;  // Info.plist unreadable, not a dictionary, no identifier
inline constexpr int64_t kRegistryErrorIdentifierMismatch = 4;  // the bundle is not the identifier of the options
inline constexpr int64_t kRegistryErrorAlreadyInstalled = 5;    // a built-in copy is equal or newer
inline constexpr int64_t kRegistryErrorFileOperation = 6;       // a container could not be made or filled
inline constexpr int64_t kRegistryErrorInvalidOptions = 7;      // options the call does not support
inline constexpr int64_t kRegistryErrorNotReplaceable = 8;      // a placeholder for an installed application
inline constexpr int64_t kRegistryErrorOutsideAreas = 9;  // a recorded path outside the registry's own directories
inline constexpr int64_t kRegistryErrorNewerDatabase = 10;       // the database was made by a newer version
inline constexpr int64_t kRegistryErrorNoDatabase = 11;          // the system root has no registry database (reader)
inline constexpr int64_t kRegistryErrorReadOnly = 12;            // a change was asked of a reader

// Values of kRegistryProgressStatusKey, in the order an installation reports
// them. "RegisteringApplication" comes after the files are in place and before
// the record is committed; "CleaningUp" after the commit, before the package
// directory and the replaced bundle container are removed.
inline constexpr char kRegistryStatusVerifying[] = "VerifyingApplication";
inline constexpr char kRegistryStatusStaging[] = "StagingFiles";
inline constexpr char kRegistryStatusRegistering[] = "RegisteringApplication";
inline constexpr char kRegistryStatusCleaningUp[] = "CleaningUp";
inline constexpr char kRegistryStatusComplete[] = "Complete";
// A replay of a package that was already installed from.
inline constexpr char kRegistryStatusAlreadyInstalledFromPackage[] = "AlreadyInstalledFromPackage";
inline constexpr char kRegistryStatusFailed[] = "Failed";

// The xattr holding an item's data-protection class (4 bytes, native order),
// and the class the migrator's update gives system data containers.
inline constexpr char kProtectionClassAttributeName[] = "user.com.vantrel.quilld.protection-class";
inline constexpr int32_t kSystemDataContainerProtectionClass = 3;

struct SafeHarborRecord {
  std::string identifier;
  std::string path;
  int containerType = 0;
};

class SQLiteApplicationRegistry final : public ApplicationRegistry, public InstallationDaemonClient {
 public:
  // Opens (creating when needed) the registry of the system under
  // `systemRoot` ("" for "/") and undoes what an interrupted installation
  // left. Null with *error (kRegistryErrorDatabase) when the database cannot
  // be created, opened or written.
  static std::unique_ptr<SQLiteApplicationRegistry> open(const std::string& systemRoot, Error* error = nullptr);
  ~SQLiteApplicationRegistry() override;

  bool isInstalled(const std::string& identifier) override;
  std::optional<BundleRecord> recordForIdentifier(const std::string& identifier) override;
  [[nodiscard]] bool installPackage(const URL& package, const Dictionary& options, const InstallProgressCallback& progress,
                      Error* error) override;
  [[nodiscard]] bool installBundle(const URL& bundle, const Dictionary& options, Error* error) override;

  bool QuillsetRegisterSafeHarborForContainerType(const std::string& path, const std::string& identifier,
                                                  int containerType, const Value* options) override;
  [[nodiscard]] bool QuillsetUpdateContainerDataProtectionForMigratorOnly(const Dictionary& options) override;

  // Inspection (tools and tests): every record, built-in applications
  // included, ordered by identifier; every registered safe harbor, ordered by
  // identifier. A database that cannot be read gives what could be read,
  // and a level-3 system log line.
  std::vector<BundleRecord> allRecords();
  std::vector<SafeHarborRecord> safeHarbors();

 private:
  struct Impl;
  explicit SQLiteApplicationRegistry(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace platform
