#include "Platform/Registry/RegistryState.h"

#include "Platform/Foundation/Format.h"
#include "Platform/Registry/RegistryAreas.h"
#include "Platform/Registry/RegistryFiles.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "Platform/SystemLog.h"

namespace platform::registry {

namespace {
constexpr char kDatabaseDirectory[] = "private/var/db/appregistry";
constexpr char kDatabaseFileName[] = "registry.sqlite";
constexpr char kLockFileName[] = "install.lock";
constexpr char kBundleContainers[] = "private/var/containers/Bundle/Application";
constexpr char kApplicationDataContainers[] = "private/var/mobile/Containers/Data/Application";
constexpr char kPluginDataContainers[] = "private/var/mobile/Containers/Data/PluginKitPlugin";
constexpr char kGroupContainers[] = "private/var/mobile/Containers/Shared/AppGroup";
constexpr char kSystemApplications[] = "Applications";

constexpr int kNoticeLevel = 5;
constexpr int kFailureLevel = 3;

std::string under(const std::string& root, const char* relative) {
  return path::join(root.empty() ? "/" : root, relative);
}

bool undoEntry(const RegistryLayout& layout, const JournalEntry& entry, Error* error) {
  if (!checkJournalEntry(layout, entry, error)) return false;
  switch (entry.kind) {
    case JournalKind::Move:
      // Moved: move it back. Not moved yet (the source is still there): nothing
      // to undo.
      if (itemExists(entry.destination) && !itemExists(entry.source)) return moveItem(entry.destination, entry.source, error);
      return true;
    case JournalKind::Create:
    case JournalKind::Remove:
      return removeTree(entry.destination, error);
  }
  return true;
}
}  // namespace

RegistryLayout::RegistryLayout(const std::string& systemRoot)
    : systemRoot(systemRoot.empty() ? "/" : systemRoot),
      databaseDirectory(under(systemRoot, kDatabaseDirectory)),
      databasePath(path::join(databaseDirectory, kDatabaseFileName)),
      lockPath(path::join(databaseDirectory, kLockFileName)),
      bundleContainers(under(systemRoot, kBundleContainers)),
      applicationDataContainers(under(systemRoot, kApplicationDataContainers)),
      pluginDataContainers(under(systemRoot, kPluginDataContainers)),
      groupContainers(under(systemRoot, kGroupContainers)),
      systemApplications(under(systemRoot, kSystemApplications)) {}

std::optional<std::string> newContainerPath(const std::string& parent, Error* error) {
  std::optional<std::string> uuid = newUUID(error);
  if (!uuid) return std::nullopt;
  return path::join(parent, *uuid);
}

bool undoJournal(const RegistryLayout& layout, const std::vector<JournalEntry>& entries, const char* function,
                 Error* error) {
  bool ok = true;
  for (auto it = entries.rbegin(); it != entries.rend(); ++it) {
    Error entryError;
    if (undoEntry(layout, *it, &entryError)) continue;
    SystemLogWrite(nullptr, kFailureLevel, function, "Could not undo or finish %s: %@", it->destination, entryError);
    if (it->kind == JournalKind::Remove && !entryError.is(kRegistryErrorDomain, kRegistryErrorOutsideAreas)) continue;
    if (ok && error) *error = entryError;
    ok = false;
  }
  return ok;
}

bool recoverJournalLocked(RegistryState& state, const char* function, Error* error) {
  std::vector<JournalEntry> entries;
  {
    std::lock_guard dbLock(state.dbMutex);
    if (!loadJournal(*state.db, &entries, error)) return false;
  }
  if (entries.empty()) return true;
  Error undoError;
  if (!undoJournal(state.layout, entries, function, &undoError)) {
    SystemLogWrite(nullptr, kFailureLevel, function, "Could not recover interrupted installation in %s: %@",
                   state.layout.databasePath, undoError);
    if (error) *error = undoError;
    return false;
  }
  SystemLogWrite(nullptr, kNoticeLevel, function, "Recovered interrupted installation (%zu journal entries) in %s",
                 entries.size(), state.layout.databasePath);
  std::lock_guard dbLock(state.dbMutex);
  return clearJournal(*state.db, error);
}

}  // namespace platform::registry
