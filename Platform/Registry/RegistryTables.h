// The registry's tables: records, group containers, data containers of
// built-in applications, safe harbors and the installation journal.
//
// Every function runs its statements on the given database and fails with the
// database's error record (kRegistryErrorDatabase). Changes are made inside the
// caller's transaction.
//
// Thread safety: none of its own; the caller holds the database's lock.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Registry/RegistryDatabase.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

// One row of the records table with its groups.
struct StoredRecord {
  std::string identifier;
  std::string bundleType;
  std::string bundlePath;
  std::string bundleContainer;
  std::optional<std::string> dataContainer;
  bool isPlaceholder = false;
  // False for placeholders: their records have no group dictionary at all.
  bool hasGroupDictionary = false;
  std::string version;
  std::string displayName;
  // The package directory the record was last installed from (none for
  // bundles installed by installBundle).
  std::optional<std::string> packagePath;
  // Group identifier to the group's container path.
  std::map<std::string, std::string> groups;
};

// What a recorded file action of an installation was.
enum class JournalKind {
  // `destination` was made by the installation: removed when rolling back.
  Create,
  // `source` was moved to `destination`: moved back when rolling back.
  Move,
  // After the commit: `destination` is to be removed (rolled forward).
  Remove,
};

struct JournalEntry {
  JournalKind kind = JournalKind::Create;
  std::string source;
  std::string destination;
};

[[nodiscard]] bool loadRecord(Database& db, const std::string& identifier, std::optional<StoredRecord>* record, Error* error);
[[nodiscard]] bool loadAllRecords(Database& db, std::vector<StoredRecord>* records, Error* error);
// Inserts or replaces the record and its group memberships; every group of the
// record must already have its container (saveGroupContainer).
[[nodiscard]] bool saveRecord(Database& db, const StoredRecord& record, Error* error);

[[nodiscard]] bool loadGroupContainer(Database& db, const std::string& group, std::optional<std::string>* path, Error* error);
// Records the container of a group that has none yet.
[[nodiscard]] bool saveGroupContainer(Database& db, const std::string& group, const std::string& path, Error* error);

[[nodiscard]] bool loadSystemDataContainer(Database& db, const std::string& identifier, std::optional<std::string>* path,
                             Error* error);
// Records the data container of a built-in application unless one is already
// recorded (another process may have been first): *winner is what is recorded
// afterwards.
[[nodiscard]] bool saveSystemDataContainer(Database& db, const std::string& identifier, const std::string& path, std::string* winner,
                             Error* error);

[[nodiscard]] bool saveSafeHarbor(Database& db, const SafeHarborRecord& harbor, Error* error);
[[nodiscard]] bool loadSafeHarbors(Database& db, std::vector<SafeHarborRecord>* harbors, Error* error);

// The journal, in the order entries were appended.
[[nodiscard]] bool appendJournal(Database& db, const std::vector<JournalEntry>& entries, Error* error);
[[nodiscard]] bool loadJournal(Database& db, std::vector<JournalEntry>* entries, Error* error);
[[nodiscard]] bool clearJournal(Database& db, Error* error);

}  // namespace platform::registry
