#include "Platform/Registry/RegistryTables.h"

namespace platform::registry {

namespace {

constexpr char kSelectRecordColumns[] =
    "SELECT identifier, bundle_type, bundle_path, bundle_container, data_container, is_placeholder,"
    " has_group_dictionary, version, display_name, package_path FROM records";

constexpr char kJournalCreate[] = "create";
constexpr char kJournalMove[] = "move";
constexpr char kJournalRemove[] = "remove";

StoredRecord readRecordRow(const Statement& row) {
  StoredRecord record;
  record.identifier = row.text(0);
  record.bundleType = row.text(1);
  record.bundlePath = row.text(2);
  record.bundleContainer = row.text(3);
  record.dataContainer = row.optionalText(4);
  record.isPlaceholder = row.integer(5) != 0;
  record.hasGroupDictionary = row.integer(6) != 0;
  record.version = row.text(7);
  record.displayName = row.text(8);
  record.packagePath = row.optionalText(9);
  return record;
}

bool loadGroups(Database& db, StoredRecord* record, Error* error) {
  auto query = db.prepare(
      "SELECT g.group_id, g.path FROM record_groups r JOIN group_containers g ON g.group_id = r.group_id"
      " WHERE r.identifier = ?1 ORDER BY g.group_id;",
      error);
  if (!query) return false;
  query->bind(1, record->identifier);
  bool failed = false;
  while (query->step(&failed, error)) record->groups[query->text(0)] = query->text(1);
  return !failed;
}

// One optional text column of a single-row lookup.
bool loadOptionalText(Database& db, const char* sql, const std::string& key, std::optional<std::string>* out,
                      Error* error) {
  auto query = db.prepare(sql, error);
  if (!query) return false;
  query->bind(1, key);
  bool failed = false;
  *out = query->step(&failed, error) ? std::optional<std::string>(query->text(0)) : std::nullopt;
  return !failed;
}

const char* journalKindName(JournalKind kind) {
  switch (kind) {
    case JournalKind::Create:
      return kJournalCreate;
    case JournalKind::Move:
      return kJournalMove;
    case JournalKind::Remove:
      return kJournalRemove;
  }
  return kJournalCreate;
}

std::optional<JournalKind> journalKindFromName(const std::string& name) {
  if (name == kJournalCreate) return JournalKind::Create;
  if (name == kJournalMove) return JournalKind::Move;
  if (name == kJournalRemove) return JournalKind::Remove;
  return std::nullopt;
}

}  // namespace

bool loadRecord(Database& db, const std::string& identifier, std::optional<StoredRecord>* record, Error* error) {
  auto query = db.prepare((std::string(kSelectRecordColumns) + " WHERE identifier = ?1;").c_str(), error);
  if (!query) return false;
  query->bind(1, identifier);
  bool failed = false;
  if (!query->step(&failed, error)) {
    record->reset();
    return !failed;
  }
  record->emplace(readRecordRow(*query));
  return loadGroups(db, &**record, error);
}

bool loadAllRecords(Database& db, std::vector<StoredRecord>* records, Error* error) {
  auto query = db.prepare((std::string(kSelectRecordColumns) + " ORDER BY identifier;").c_str(), error);
  if (!query) return false;
  bool failed = false;
  while (query->step(&failed, error)) records->push_back(readRecordRow(*query));
  if (failed) return false;
  for (StoredRecord& record : *records) {
    if (!loadGroups(db, &record, error)) return false;
  }
  return true;
}

bool saveRecord(Database& db, const StoredRecord& record, Error* error) {
  auto upsert = db.prepare(
      "INSERT INTO records(identifier, bundle_type, bundle_path, bundle_container, data_container,"
      " is_placeholder, has_group_dictionary, version, display_name, package_path)"
      " VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10)"
      " ON CONFLICT(identifier) DO UPDATE SET bundle_type = excluded.bundle_type,"
      " bundle_path = excluded.bundle_path, bundle_container = excluded.bundle_container,"
      " data_container = excluded.data_container, is_placeholder = excluded.is_placeholder,"
      " has_group_dictionary = excluded.has_group_dictionary, version = excluded.version,"
      " display_name = excluded.display_name, package_path = excluded.package_path;",
      error);
  if (!upsert) return false;
  upsert->bind(1, record.identifier)
      .bind(2, record.bundleType)
      .bind(3, record.bundlePath)
      .bind(4, record.bundleContainer)
      .bind(5, record.dataContainer)
      .bind(6, int64_t{record.isPlaceholder})
      .bind(7, int64_t{record.hasGroupDictionary})
      .bind(8, record.version)
      .bind(9, record.displayName)
      .bind(10, record.packagePath);
  if (!upsert->run(error)) return false;
  auto forget = db.prepare("DELETE FROM record_groups WHERE identifier = ?1;", error);
  if (!forget || !forget->bind(1, record.identifier).run(error)) return false;
  auto member = db.prepare("INSERT OR IGNORE INTO record_groups(identifier, group_id) VALUES(?1, ?2);", error);
  if (!member) return false;
  for (const auto& [group, path] : record.groups) {
    (void)path;
    member->bind(1, record.identifier).bind(2, group);
    if (!member->run(error)) return false;
  }
  return true;
}

bool loadGroupContainer(Database& db, const std::string& group, std::optional<std::string>* path, Error* error) {
  return loadOptionalText(db, "SELECT path FROM group_containers WHERE group_id = ?1;", group, path, error);
}

bool saveGroupContainer(Database& db, const std::string& group, const std::string& path, Error* error) {
  auto insert = db.prepare("INSERT OR IGNORE INTO group_containers(group_id, path) VALUES(?1, ?2);", error);
  return insert && insert->bind(1, group).bind(2, path).run(error);
}

bool loadSystemDataContainer(Database& db, const std::string& identifier, std::optional<std::string>* path,
                             Error* error) {
  return loadOptionalText(db, "SELECT path FROM system_data_containers WHERE identifier = ?1;", identifier, path,
                          error);
}

bool saveSystemDataContainer(Database& db, const std::string& identifier, const std::string& path, std::string* winner,
                             Error* error) {
  auto insert = db.prepare("INSERT OR IGNORE INTO system_data_containers(identifier, path) VALUES(?1, ?2);", error);
  if (!insert || !insert->bind(1, identifier).bind(2, path).run(error)) return false;
  std::optional<std::string> recorded;
  if (!loadSystemDataContainer(db, identifier, &recorded, error)) return false;
  *winner = recorded.value_or(path);
  return true;
}

bool saveSafeHarbor(Database& db, const SafeHarborRecord& harbor, Error* error) {
  auto upsert =
      db.prepare("INSERT OR REPLACE INTO safe_harbors(identifier, path, container_type) VALUES(?1, ?2, ?3);", error);
  return upsert &&
         upsert->bind(1, harbor.identifier).bind(2, harbor.path).bind(3, int64_t{harbor.containerType}).run(error);
}

bool loadSafeHarbors(Database& db, std::vector<SafeHarborRecord>* harbors, Error* error) {
  auto query = db.prepare("SELECT identifier, path, container_type FROM safe_harbors ORDER BY identifier;", error);
  if (!query) return false;
  bool failed = false;
  while (query->step(&failed, error)) {
    harbors->push_back({query->text(0), query->text(1), static_cast<int>(query->integer(2))});
  }
  return !failed;
}

bool appendJournal(Database& db, const std::vector<JournalEntry>& entries, Error* error) {
  auto insert = db.prepare("INSERT INTO install_journal(kind, source, destination) VALUES(?1, ?2, ?3);", error);
  if (!insert) return false;
  for (const JournalEntry& entry : entries) {
    if (!insert->bind(1, std::string(journalKindName(entry.kind)))
             .bind(2, entry.source)
             .bind(3, entry.destination)
             .run(error)) {
      return false;
    }
  }
  return true;
}

bool loadJournal(Database& db, std::vector<JournalEntry>* entries, Error* error) {
  auto query = db.prepare("SELECT kind, source, destination FROM install_journal ORDER BY seq;", error);
  if (!query) return false;
  bool failed = false;
  while (query->step(&failed, error)) {
    std::optional<JournalKind> kind = journalKindFromName(query->text(0));
    // An entry of an unknown kind cannot be acted on; it is dropped with the rest.
    if (kind) entries->push_back({*kind, query->text(1), query->text(2)});
  }
  return !failed;
}

bool clearJournal(Database& db, Error* error) {
  return db.execute("DELETE FROM install_journal;", error);
}

}  // namespace platform::registry
