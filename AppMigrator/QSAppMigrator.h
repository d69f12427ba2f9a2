// QSAppMigrator: the application-migration plug-in's principal class.
//
// The host creates one instance (which loads everything a run needs), asks
// for dataClassName, estimatedDuration and, while it waits, migrationProgress,
// and calls performMigration once.
//
// Threading: the run is strictly sequential on the thread that calls
// performMigration. migrationProgress and estimatedDuration may be called from
// another thread at any time: they read _itemsToMigrate, which is fixed at
// creation, and _countItemsMigrated, which is atomic. The registry may call
// the installation progress callback on a thread of its own; see
// _stageAndInstallBundleAtURL.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Host/DataClassMigrator.h"
#include "Platform/Imaging.h"
#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/InstallationDaemon.h"
#include "Platform/SystemVersion.h"
#include "Shared/Support/QSLayoutNames.h"

// What the migrator needs of the operating system. The pointers are not owned
// and must outlive the migrator.
struct QSMigratorServices {
  platform::ApplicationRegistry* registry = nullptr;
  platform::InstallationDaemonClient* daemon = nullptr;
  platform::BundleReader* bundleReader = nullptr;
  platform::IconRenderer* iconRenderer = nullptr;
  platform::ImageEncoding* imageEncoding = nullptr;
  platform::SystemVersionSource* systemVersion = nullptr;
  // The process's temporary directory ($TMPDIR, else "/tmp").
  platform::URL temporaryDirectory;
};

class QSAppMigrator final : public platform::DataClassMigrator {
 public:
  // The initialiser: loads the run's state. Null when the old applications
  // directory exists but cannot be listed.
  static std::unique_ptr<QSAppMigrator> create(const QSMigratorServices& services);

  std::string dataClassName() override;
  float estimatedDuration() override;
  float migrationProgress() override;
  bool performMigration() override;

  // --- Introspection and marker -----------------------------------------
  std::optional<platform::Dictionary> _introspectContainer(const platform::URL& entry, bool* orderResultEarly);
  std::optional<platform::Dictionary> _loadAndValidateMigrationMarkerAtURL(const platform::URL& marker);
  std::optional<std::string> _bundleIdentifierForBundle(const platform::URL& bundle);

  // --- Per-container migration ----------------------------------------------
  bool _migrateContainerWithInfo(const platform::Dictionary& info);

  // --- Safe harbors ------------------------------------------------------------
  bool _migrateSafeHarbors();

  // --- Data move and missed items -----------------------------------------------
  bool _migrateDataContainerForIdentifier(const std::string& identifier, const platform::URL& fromURL,
                                          const platform::URL& toURL);
  bool _containerHasMissedItems(const platform::URL& container, const std::string& withIdentifier);

  // --- Staging and installation ------------------------------------------------
  bool _stageAndInstallBundleAtURL(const platform::URL& bundle, const std::string& withIdentifier,
                                   const std::optional<platform::URL>& andVPNPluginAtURL,
                                   const platform::URL& inContainerURL);

  // --- Placeholders ------------------------------------------------------------
  bool _stageAndInstallPlaceholderForBundleAtURL(const platform::URL& bundle, const std::string& withIdentifier,
                                                 const platform::URL& inContainerURL);
  bool _writeIconForBundle(const platform::Bundle& bundle, const platform::URL& toURL);

  // --- Group containers ---------------------------------------------------------
  bool _migrateGroupContainersForIdentifier(const std::string& identifier);
  bool _moveAllItemsInGroupContainerURL(const platform::URL& source, const platform::URL& toGroupContainerURL);

  // Read access for tests and the host.
  uint64_t countItemsMigrated() const { return _countItemsMigrated.load(); }
  const std::optional<std::vector<platform::URL>>& itemsToMigrate() const { return _itemsToMigrate; }
  const std::optional<platform::Dictionary>& groupContainerMap() const { return _groupContainerMap; }
  const std::optional<platform::Dictionary>& harborMap() const { return _harborMap; }
  const std::optional<std::string>& lastSystemBuildVersion() const { return _lastSystemBuildVersion; }

 private:
  explicit QSAppMigrator(const QSMigratorServices& services) : services_(services) {}

  // Initialisation steps. _loadItemsToMigrate is false when the old
  // applications directory exists but cannot be listed.
  bool _loadItemsToMigrate();
  void _loadInstallMap();
  void _loadHarborMap();
  void _loadLastSystemVersion();

  // Run steps. The introspection pass yields the work list (application
  // containers first); the migration pass answers whether every container
  // migrated. _removeOldLayoutIfEmpty is false when entries remain.
  std::deque<platform::Dictionary> _introspectItemsToMigrate();
  bool _migrateWorkList(const std::deque<platform::Dictionary>& workList);
  bool _removeOldLayoutIfEmpty();
  void _recordCurrentSystemVersion();

  // "SafeHarbor.plist" in the data directory.
  platform::URL _safeHarborMapURL() const;

  QSMigratorServices services_;

  // Placeholder installation once the staged directory's URL is known; the
  // caller removes the staged directory afterwards.
  bool _installPlaceholderStagedAtURL(const platform::URL& staged, const platform::URL& bundle,
                                      const std::string& identifier, const platform::URL& storeMetadataURL);
  // The per-group step of _migrateGroupContainersForIdentifier.
  void _migrateGroupContainer(const std::string& identifier, const std::string& group,
                              const platform::URL& newContainer);

  // Fields of the run, in their declared order.
  std::atomic<uint64_t> _countItemsMigrated{0};
  std::optional<std::vector<platform::URL>> _itemsToMigrate;
  std::optional<platform::Dictionary> _installMap;
  std::optional<platform::Dictionary> _harborMap;
  std::optional<platform::Dictionary> _groupContainerMap;
  std::optional<std::string> _lastSystemBuildVersion;
};

// Names and keys of the migrator's files and dictionaries.
inline constexpr char kQSDataClassName[] = "QSAppMigrator";
inline constexpr char kQSLogCategory[] = "Transvaler";
inline constexpr char kQSContainerPathKey[] = "ContainerPath";
inline constexpr char kQSBundlePathKey[] = "BundlePath";
inline constexpr char kQSBundleIdentifierKey[] = "BundleIdentifier";
inline constexpr char kQSContainerTypeKey[] = "ContainerType";
inline constexpr char kQSSecondBundlePathKey[] = "SecondBundlePath";
inline constexpr char kQSContainerTypeApp[] = "App";
inline constexpr char kQSContainerTypeVPNBundle[] = "VPNBundle";
// The layout's file names and keys are in Shared/Support/QSLayoutNames.h.

// Writes one HostLog line of the migrator: category "Transvaler", the calling
// file and line, and `function` (the operation's full name).
#define QSAM_LOG(level, function, ...) HostLog(__FILE__, (function), __LINE__, kQSLogCategory, (level), __VA_ARGS__)

// Dictionary lookups of the migrator: the value under `key`, or null when it is
// absent; the string under `key`, or null when it is absent or not a string.
inline const platform::Value* QSValueForKey(const platform::Dictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  return it == dictionary.end() ? nullptr : &it->second;
}
inline const std::string* QSStringForKey(const platform::Dictionary& dictionary, std::string_view key) {
  const platform::Value* value = QSValueForKey(dictionary, key);
  return value ? value->asString() : nullptr;
}

// Install options shared by the staged and the placeholder installation.
inline constexpr uint64_t kQSMigratorInstallType = 6;
inline constexpr char kQSInstallOptionSkipBlacklist[] = "SkipBlacklist";
inline constexpr char kQSInstallOptionVerifyForMigrator[] = "VerifyForMigrator";
// Mode of the directories the migrator creates.
inline constexpr unsigned kQSNewDirectoryMode = 0755;
