// The state one SQLiteApplicationRegistry works on: where everything lies, the
// database and the locks, shared by the registry's pieces (lookups,
// installations, the daemon calls, recovery).
//
// Locks, always taken in this order:
//   changeMutex  serialises the changes made through this object; with the
//                install lock file (FileLock) it also excludes other objects
//                and processes;
//   dbMutex      guards `db`; held only for the statements of one lookup or
//                one transaction, never while files are moved.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "Platform/Foundation/PathContainment.h"
#include "Platform/Registry/BuiltInApplications.h"
#include "Platform/Registry/RegistryDatabase.h"
#include "Platform/Registry/RegistryTables.h"

namespace platform::registry {

// Paths of the registry's layout under a system root (see SQLiteRegistry.h).
struct RegistryLayout {
  explicit RegistryLayout(const std::string& systemRoot);
  std::string systemRoot;  // "/" for the real one
  std::string databaseDirectory;
  std::string databasePath;
  std::string lockPath;
  std::string bundleContainers;
  std::string applicationDataContainers;
  std::string pluginDataContainers;
  std::string groupContainers;
  std::string systemApplications;
  // The directories above as they resolve, for the checks of where the
  // registry may act (shared by the copies of a layout).
  std::shared_ptr<path::ResolvedDirectories> resolved = std::make_shared<path::ResolvedDirectories>();
};

struct RegistryState {
  RegistryState(RegistryLayout paths, std::unique_ptr<Database> database)
      : layout(std::move(paths)), db(std::move(database)), builtIns(layout.systemApplications) {}

  const RegistryLayout layout;
  std::mutex changeMutex;
  std::mutex dbMutex;
  std::unique_ptr<Database> db;  // guarded by dbMutex
  BuiltInApplications builtIns;  // has its own lock
};

// A new container directory path <parent>/<random UUID>; none when no random
// bytes could be had.
std::optional<std::string> newContainerPath(const std::string& parent, Error* error);

// Undoes, in reverse order, the file actions of an installation that was not
// committed (moves back, removes what it made), and finishes the removals of
// one that was. Best effort: every entry is tried. False when a move or a
// creation could not be undone; a removal that fails is only logged (it
// leaves garbage, never a record without its files). `function` names the
// caller in the log.
// An entry that points outside the registry's areas (RegistryAreas.h) is not
// acted on: it counts as one that could not be undone, so the journal keeps
// it and every later installation refuses to start over it.
[[nodiscard]] bool undoJournal(const RegistryLayout& layout, const std::vector<JournalEntry>& entries, const char* function,
                 Error* error);

// Brings the files back in line with the records after an interrupted
// installation, and empties the journal. REQUIRES: changeMutex and the install
// lock held. False (the journal kept) when something could not be undone.
[[nodiscard]] bool recoverJournalLocked(RegistryState& state, const char* function, Error* error);

}  // namespace platform::registry
