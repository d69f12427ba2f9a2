// What a migration will do, worked out without changing anything (the
// plug-in's dry run), and what the host learns while a run goes on. Both
// cross from the plug-in to the host as plain data.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace platform {

struct PlanSize {
  uint64_t files = 0;
  uint64_t bytes = 0;
  uint64_t directories = 0;
  uint64_t otherItems = 0;  // links and anything that is neither file nor directory
};

// Where moved items go: an existing directory, or a new one the registry
// will make inside `path`.
struct PlanDestination {
  std::string path;
  bool toBeMade = false;
  bool crossesFileSystem = false;  // a copy, then the removal of the source
};

struct PlannedGroup {
  std::string identifier;
  std::string oldPath;
  PlanSize size;
  PlanDestination destination;
};

// What happens to one old container.
enum class PlannedAction {
  PlaceholderThenInstall,  // not installed yet: a placeholder first, the staged bundle then
  PlaceholderOnly,         // the old bundle is itself a placeholder: a placeholder and the data
  AlreadyInstalled,        // installed: data moved, the bundle installed again over it
  RefusedByBuiltIn,        // an equal or newer built-in copy: data goes to it, the bundle is refused
  VPNPluginOnly,           // only a VPN plug-in: data goes to the plug-in's record
  Kept,                    // stays in the old layout; `reason` says why
};

struct PlannedContainer {
  std::string identifier;  // "" when it could not be determined
  std::string containerPath;
  std::string bundlePath;
  std::optional<std::string> secondBundlePath;
  PlannedAction action = PlannedAction::Kept;
  bool resumedFromMarker = false;
  std::string reason;  // Kept: why
  PlanSize data;       // the user's data items
  PlanDestination dataDestination;
  std::vector<PlannedGroup> groups;
};

// Something the run removes for good, with everything in it.
enum class PlannedDiscardKind {
  ContainerWithoutBundle,  // no identifiable application or VPN plug-in: removed, its data items recovered first
  StrayFile,               // a regular file among the containers
  NoteFile,                // the previous release's note among the containers
};

struct PlannedDiscard {
  PlannedDiscardKind kind = PlannedDiscardKind::StrayFile;
  std::string path;
  PlanSize size;
  std::vector<std::string> items;  // a container's own entries (names)
  // Of a container without a bundle: the entries moved into a directory of
  // their own under `recoveryDirectory` before the container is removed.
  std::vector<std::string> recoveredItems;
  std::string recoveryDirectory;
};

struct PlannedHarbor {
  std::string identifier;
  std::string path;
  std::string problem;  // "" when the registry will take it
};

// Room needed on one destination file system, against its free room.
struct PlannedFileSystem {
  uint64_t device = 0;
  std::string path;  // a directory on it
  uint64_t neededBytes = 0;
  uint64_t freeBytes = 0;
};

struct MigrationPlan {
  std::string systemRoot;
  std::string oldApplicationsPath;
  bool hasOldLayout = false;  // an old applications directory with entries
  std::vector<PlannedContainer> containers;  // in the order the run takes them
  std::vector<PlannedDiscard> discards;
  std::vector<PlannedHarbor> harbors;
  std::vector<PlannedFileSystem> fileSystems;
  uint64_t entries = 0;  // entries of the old applications directory
  PlanSize totalData;    // data and group items to move
  double estimatedSeconds = 0;
};

// What a run reports as it goes (the host's observer). Called on the thread
// that runs the migration.
enum class EntryOutcome { Migrated, Kept, Failed, Removed };

class MigrationObserver {
 public:
  virtual ~MigrationObserver() = default;
  // After introspection: the containers to migrate and the bytes of their data.
  virtual void migrationPlanned(uint64_t containers, uint64_t bytes) = 0;
  virtual void entryStarted(const std::string& identifier, const std::string& path) = 0;
  // Items of the current entry that have arrived in their new place.
  virtual void itemsMoved(uint64_t files, uint64_t bytes) = 0;
  // `reason` is "" for a migrated entry.
  virtual void entryFinished(EntryOutcome outcome, const std::string& reason) = 0;
};

}  // namespace platform

// Further entry points of the plug-in: the dry run (a plan the caller owns
// and deletes, null when the old layout cannot be read), and the observer of
// the migrators created afterwards (null for none; it must outlive them).
inline constexpr char kMigrationPlanEntryPoint[] = "QSPlanDataClassMigration";
inline constexpr char kMigrationObserverEntryPoint[] = "QSSetMigrationObserver";
extern "C" {
typedef platform::MigrationPlan* (*QSPlanDataClassMigrationFunction)(void);
typedef void (*QSSetMigrationObserverFunction)(platform::MigrationObserver*);
}
