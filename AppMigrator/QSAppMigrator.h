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
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Host/DataClassMigrator.h"
#include "Platform/Host/MigrationPlan.h"
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
  // Dry runs only: the registry's answers about what it has not made yet.
  platform::RegistryForecast* forecast = nullptr;
  // Told about each entry as the run goes; may be null.
  platform::MigrationObserver* observer = nullptr;
};

// What introspection found in one entry of the old applications directory,
// before anything is done about it. Working it out changes nothing.
struct QSEntrySurvey {
  enum class Finding {
    Container,   // to be migrated: `info` describes it
    StrayFile,   // a file where a container should be: removed
    NoBundle,    // a container without an identifiable bundle: its data recovered, then removed
    Vanished,    // gone since the run listed it
    Unreadable,  // cannot be looked into: stays
    Unsafe,      // a bundle or marker is a symbolic link: stays untouched
  };
  Finding finding = Finding::Unreadable;
  std::optional<platform::Dictionary> info;
  bool orderEarly = false;  // an application container: migrated before the VPN-only ones
  bool fromMarker = false;  // described by the marker of an earlier attempt
  std::string reason;       // Unreadable, Unsafe: why it stays
  std::vector<platform::URL> unreadableBundles;  // NoBundle: bundles without an identifier, kept for recovery
};

// A container information dictionary with its paths as URLs.
struct QSContainerInfo {
  platform::URL container;
  platform::URL bundle;
  std::optional<platform::URL> secondBundle;
  std::string identifier;
  std::string type;
};

// What the per-container sequence will do, decided before anything changes.
struct QSContainerSteps {
  bool bundleIsPlaceholder = false;  // the old bundle carries the placeholder mark: data only
  bool needsPlaceholder = false;     // an application not installed yet: a placeholder first
  bool installsBundle() const { return !bundleIsPlaceholder; }
};

class QSAppMigrator final : public platform::DataClassMigrator {
 public:
  // The initialiser: loads the run's state. Null when the old applications
  // directory exists but cannot be listed.
  static std::unique_ptr<QSAppMigrator> create(const QSMigratorServices& services);
  // A migrator for dry runs: creating it and planning change nothing on disk
  // (the registry in `services` must be a read-only one with a forecast).
  static std::unique_ptr<QSAppMigrator> createForPlanning(const QSMigratorServices& services);

  // The dry run: what performMigration would do, worked out with the same
  // decisions and without any change.
  platform::MigrationPlan planMigration();

  std::string dataClassName() override;
  float estimatedDuration() override;
  float migrationProgress() override;
  bool performMigration() override;

  // --- Introspection and marker -----------------------------------------
  std::optional<platform::Dictionary> _introspectContainer(const platform::URL& entry, bool* orderResultEarly);
  std::optional<platform::Dictionary> _loadAndValidateMigrationMarkerAtURL(const platform::URL& marker);
  std::optional<std::string> _bundleIdentifierForBundle(const platform::URL& bundle);
  // Introspection's findings without its removals.
  QSEntrySurvey _surveyEntry(const platform::URL& entry);

  // --- Per-container migration ----------------------------------------------
  bool _migrateContainerWithInfo(const platform::Dictionary& info);
  // Its steps. _readContainerInfo logs and yields none when a required entry
  // is not a string; _decideContainerSteps only asks.
  static std::optional<QSContainerInfo> _readContainerInfo(const platform::Dictionary& info);
  QSContainerSteps _decideContainerSteps(const QSContainerInfo& in);

  // --- Safe harbors ------------------------------------------------------------
  bool _migrateSafeHarbors();

  // --- Data move and missed items -----------------------------------------------
  bool _migrateDataContainerForIdentifier(const std::string& identifier, const platform::URL& fromURL,
                                          const platform::URL& toURL);
  bool _containerHasMissedItems(const platform::URL& container, const std::string& withIdentifier);

  // --- Room on the destination ---------------------------------------------------
  // Before items move to another file system: true when the destination has
  // room for them plus kQSSpaceMargin; otherwise one level-3 line with the
  // bytes needed and free, and false (nothing is moved). Items on the
  // destination's own file system need no room and pass.
  bool _destinationHasRoomForItems(const std::vector<platform::URL>& items, const platform::URL& destination,
                                   const std::string& identifier);
  bool _dataFitsInContainer(const std::string& identifier, const platform::URL& fromURL, const platform::URL& toURL);
  bool _groupContainersFitForIdentifier(const std::string& identifier,
                                        const std::map<std::string, platform::URL>& newContainers);

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

  // --- Untrusted paths and identifiers (TrustChecks.cpp) ----------------------
  // A marker describes the container it lies in: its "ContainerPath" is that
  // container and its bundle paths lie inside it. False, with a level-3 line
  // naming the reason, otherwise.
  bool _migrationMarkerPathsStayInContainer(const platform::Dictionary& marker, const platform::URL& markerURL);
  // Whether a built-in application has this identifier.
  bool _identifierIsBuiltIn(const std::string& identifier);
  // Whether a group's old container may be emptied and removed: it lies inside
  // the system root, is no directory of the layout nor holds one, lies in no
  // application's container, built-in bundle or system directory, and holds
  // no other group's container. False with a level-3 line otherwise.
  bool _groupContainerPathIsAcceptable(const platform::URL& oldContainer, const std::string& group);
  // Why `group`'s old container at `oldContainer` must stay where it is (no
  // log line), or none when it may move. Everything that measures or moves an
  // old group container asks first: a map entry may name any directory.
  const char* _groupContainerRefusal(const platform::URL& oldContainer, const std::string& group) const;
  // A system directory or a path of the install map, resolved once per run.
  const std::optional<std::string>& _resolvedInRun(const platform::URL& url) const;
  // `group`'s old container as the map names it, when it may move.
  std::optional<platform::URL> _movableOldGroupContainer(const std::string& group) const;
  // True the first time an identifier is claimed in this run; false, with a
  // level-3 line, when another container was already migrated as it.
  bool _claimIdentifierForRun(const platform::Dictionary& info);
  // An item that a container moved in this run is never replaced by another's.
  bool _mayReplaceItemAtURL(const platform::URL& destination);
  void _noteItemMovedInRun(const platform::URL& destination);
  // Moves the items (those present) into a new directory of the recovery
  // directory named after the container, flushed, with a level-5 line. False,
  // with a level-3 line, when any could not be moved: the container must stay.
  bool _moveItemsToRecovery(const std::vector<platform::URL>& items, const platform::URL& fromContainer);
  // What of a container without a usable bundle is worth keeping: its user
  // data items (present or not) and the bundles that could not be read.
  static std::vector<platform::URL> _recoverableItems(const platform::URL& container,
                                                      const std::vector<platform::URL>& unreadableBundles);

  // Read access for tests and the host.
  uint64_t countItemsMigrated() const { return _countItemsMigrated.load(); }
  const std::optional<std::vector<platform::URL>>& itemsToMigrate() const { return _itemsToMigrate; }
  const std::optional<platform::Dictionary>& groupContainerMap() const { return _groupContainerMap; }
  const std::optional<platform::Dictionary>& harborMap() const { return _harborMap; }
  const std::optional<std::string>& lastSystemBuildVersion() const { return _lastSystemBuildVersion; }

 private:
  QSAppMigrator(const QSMigratorServices& services, bool planning) : services_(services), planning_(planning) {}
  static std::unique_ptr<QSAppMigrator> _create(const QSMigratorServices& services, bool planning);

  // The per-container steps that act, in the order the run takes them.
  void _writeContainerMarker(const platform::Dictionary& info, const QSContainerInfo& in);
  bool _ensureRecordForContainer(const QSContainerInfo& in, const QSContainerSteps& steps);
  std::optional<platform::URL> _dataContainerForIdentifier(const std::string& identifier);
  enum class InstallOutcome { Installed, FailedAfterDataMoved, KeepContainer };
  InstallOutcome _installBundleAndGroups(const QSContainerInfo& in);
  void _removeOldContainer(const QSContainerInfo& in);

  // Introspection's removals and the observer's view of the entries.
  std::optional<platform::Dictionary> _actOnSurvey(const platform::URL& entry, QSEntrySurvey survey,
                                                   bool* orderResultEarly);
  void _reportEntry(platform::EntryOutcome outcome, const std::string& reason);
  platform::PlanSize _measureUserData(const platform::URL& container);
  static platform::PlanSize _measureItem(const platform::URL& item);
  // What introspection measured at `url` (a container's user data or an old
  // group container), handed out once; none when it measured nothing there.
  std::optional<platform::PlanSize> _takeMeasured(const platform::URL& url);
  // The old group containers that `identifier`'s record names and the map
  // still holds, with their sizes.
  std::map<std::string, platform::PlanSize> _measureGroupsForIdentifier(const std::string& identifier);

  // Dry-run pieces (Plan.cpp).
  platform::PlannedContainer _planContainer(const platform::Dictionary& info, bool fromMarker,
                                            struct QSPlanState& state);

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
  const bool planning_ = false;

  // Placeholder installation once the staged directory's URL is known; the
  // caller removes the staged directory afterwards.
  bool _installPlaceholderStagedAtURL(const platform::URL& staged, const platform::URL& bundle,
                                      const std::string& identifier, const platform::URL& storeMetadataURL);
  // The per-group step of _migrateGroupContainersForIdentifier: false when
  // items of the group were left in its old container (its map entry stays).
  bool _migrateGroupContainer(const std::string& identifier, const std::string& group,
                              const platform::URL& newContainer);

  // Fields of the run, in their declared order.
  std::atomic<uint64_t> _countItemsMigrated{0};
  std::optional<std::vector<platform::URL>> _itemsToMigrate;
  std::optional<platform::Dictionary> _installMap;
  std::optional<platform::Dictionary> _harborMap;
  std::optional<platform::Dictionary> _groupContainerMap;
  std::optional<std::string> _lastSystemBuildVersion;
  // What this run has done so far: identifiers migrated and items moved into
  // new containers.
  std::set<std::string> _identifiersMigratedInRun;
  std::set<std::string> _itemsMovedInRun;
  // Sizes introspection measured for the observer, by path, until the step
  // that moves the items reports them: each tree is walked once per run.
  std::map<std::string, platform::PlanSize> _measuredInIntrospection;
  // The system's directories and the install map's group paths resolved, by
  // path: every group container is held against all of them, so resolving
  // them anew each time would cost the square of the number of groups. While
  // the run lasts nothing else changes the device, and the run itself only
  // moves items out of old containers and into new ones: a path whose
  // resolution passed through such an item lies in an area the check refuses
  // anyway.
  mutable std::map<std::string, std::optional<std::string>> _resolvedPathsInRun;
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
// Room kept free on a destination file system beyond what a move across file
// systems needs: a fixed part plus a share of the items' size.
inline constexpr uint64_t kQSSpaceMarginBytes = 1u << 20;
inline constexpr uint64_t kQSSpaceMarginDivisor = 50;  // 2 %
// The room a move across file systems of `bytes` asks for, margin included.
uint64_t QSNeededRoomWithMargin(uint64_t bytes);
// Mode of the directories the migrator creates.
inline constexpr unsigned kQSNewDirectoryMode = 0755;
