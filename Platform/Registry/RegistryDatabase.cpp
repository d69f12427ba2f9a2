#include "Platform/Registry/RegistryDatabase.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "Platform/Foundation/Format.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

namespace {

// How long a change waits for another process's transaction to end.
constexpr int kBusyTimeoutMilliseconds = 10000;
constexpr char kSQLiteResultCodeKey[] = "SQLiteResultCode";

constexpr char kConnectionSetup[] =
    "PRAGMA journal_mode=WAL;"
    "PRAGMA synchronous=FULL;"
    "PRAGMA foreign_keys=ON;";

// The layout of the tables below, kept in the database's user_version. Bump it
// with every change to them; a database of a higher version is refused, since
// this build could not read it correctly and would damage it if it wrote.
constexpr int64_t kSchemaVersion = 1;

// Group containers are shared by every application of a group, so a group's
// container lives in its own table; record_groups says which groups a record
// has. A record's has_group_dictionary is 0 for placeholders.
constexpr char kSchema[] =
    "CREATE TABLE IF NOT EXISTS records("
    "  identifier TEXT PRIMARY KEY,"
    "  bundle_type TEXT NOT NULL,"
    "  bundle_path TEXT NOT NULL,"
    "  bundle_container TEXT NOT NULL,"
    "  data_container TEXT,"
    "  is_placeholder INTEGER NOT NULL,"
    "  has_group_dictionary INTEGER NOT NULL,"
    "  version TEXT NOT NULL,"
    "  display_name TEXT NOT NULL,"
    "  package_path TEXT);"
    "CREATE TABLE IF NOT EXISTS group_containers("
    "  group_id TEXT PRIMARY KEY,"
    "  path TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS record_groups("
    "  identifier TEXT NOT NULL REFERENCES records(identifier) ON DELETE CASCADE,"
    "  group_id TEXT NOT NULL REFERENCES group_containers(group_id),"
    "  PRIMARY KEY(identifier, group_id));"
    "CREATE TABLE IF NOT EXISTS system_data_containers("
    "  identifier TEXT PRIMARY KEY,"
    "  path TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS safe_harbors("
    "  identifier TEXT PRIMARY KEY,"
    "  path TEXT NOT NULL,"
    "  container_type INTEGER NOT NULL);"
    "CREATE TABLE IF NOT EXISTS install_journal("
    "  seq INTEGER PRIMARY KEY AUTOINCREMENT,"
    "  kind TEXT NOT NULL,"
    "  source TEXT NOT NULL,"
    "  destination TEXT NOT NULL);";

// Read-only opening: the suffix of the write-ahead log, and the URI
// parameters of a database without one ("immutable" keeps SQLite from making
// a log or index file).
constexpr char kWriteAheadLogSuffix[] = "-wal";
constexpr char kReadOnlyImmutable[] = "?mode=ro&immutable=1";
// The private copy of a database with a log: <temporary directory>/<pattern>/<name>.
constexpr char kTemporaryDirectoryVariable[] = "TMPDIR";
constexpr char kDefaultTemporaryDirectory[] = "/tmp";
constexpr char kPrivateCopyPattern[] = "/registry-read.XXXXXX";
constexpr char kPrivateCopyName[] = "/registry.sqlite";

// A path as the path part of a file: URI ('?', '#' and '%' would end or
// change it).
std::string uriEscaped(const std::string& path) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  for (const char c : path) {
    if (c == '?' || c == '#' || c == '%') {
      out += '%';
      out += kHex[static_cast<unsigned char>(c) >> 4];
      out += kHex[static_cast<unsigned char>(c) & 0xF];
    } else {
      out += c;
    }
  }
  return out;
}

Error sqliteFailure(const std::string& path, const std::string& what, int resultCode, const char* message) {
  Dictionary info{
      {kLocalizedDescriptionKey, Value(Format("registry database %s: %s: %s", path, what, message ? message : ""))},
      {kSQLiteResultCodeKey, Value(resultCode)}};
  return Error(kRegistryErrorDomain, kRegistryErrorDatabase, std::move(info));
}

}  // namespace

std::unique_ptr<Database> Database::open(const std::string& path, Error* error) {
  sqlite3* handle = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &handle, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_FULLMUTEX,
                           nullptr);
  if (rc != SQLITE_OK) {
    if (error) *error = sqliteFailure(path, "open", rc, handle ? sqlite3_errmsg(handle) : sqlite3_errstr(rc));
    sqlite3_close(handle);
    return nullptr;
  }
  std::unique_ptr<Database> db(new Database(handle, path));
  sqlite3_extended_result_codes(handle, 1);
  sqlite3_busy_timeout(handle, kBusyTimeoutMilliseconds);
  if (!db->execute(kConnectionSetup, error)) return nullptr;
  // journal_mode=WAL reports the mode it got rather than failing.
  auto mode = db->prepare("PRAGMA journal_mode;", error);
  bool failed = false;
  if (!mode || !mode->step(&failed, error)) return nullptr;
  if (mode->text(0) != "wal") {
    if (error)
      *error = sqliteFailure(path, "enable WAL", SQLITE_CANTOPEN, ("journal mode is " + mode->text(0)).c_str());
    return nullptr;
  }
  mode.reset();  // a statement still stepping would keep the schema's transaction from committing
  if (!db->createSchema(error)) return nullptr;
  return db;
}

std::optional<int64_t> Database::readableSchemaVersion(Error* error) {
  std::optional<Statement> query = prepare("PRAGMA user_version;", error);
  bool failed = false;
  if (!query || !query->step(&failed, error)) return std::nullopt;
  const int64_t version = query->integer(0);
  if (version > kSchemaVersion) {
    if (error) {
      *error = Error(
          kRegistryErrorDomain, kRegistryErrorNewerDatabase,
          Dictionary{{kLocalizedDescriptionKey,
                      Value(Format("registry database %s has schema version %lld, newer than version %lld "
                                   "that this build reads; it is left untouched",
                                   path_, static_cast<long long>(version), static_cast<long long>(kSchemaVersion)))}});
    }
    return std::nullopt;
  }
  return version;
}

bool Database::createSchema(Error* error) {
  // Read and set the version in the transaction that creates the tables, so
  // that no other process can upgrade the database in between.
  std::optional<Transaction> transaction = Transaction::begin(*this, error);
  if (!transaction) return false;
  const std::optional<int64_t> version = readableSchemaVersion(error);
  if (!version) return false;
  if (!execute(kSchema, error)) return false;
  if (*version < kSchemaVersion &&
      !execute(Format("PRAGMA user_version=%lld;", static_cast<long long>(kSchemaVersion)).c_str(), error)) {
    return false;
  }
  return transaction->commit(error);
}

std::unique_ptr<Database> Database::openReadOnly(const std::string& path, Error* error) {
  struct stat status;
  const bool hasLog = ::stat((path + kWriteAheadLogSuffix).c_str(), &status) == 0;
  std::string privateCopy, opened = path;
  if (hasLog) {
    const char* temporary = std::getenv(kTemporaryDirectoryVariable);
    std::string pattern = std::string(temporary && *temporary ? temporary : kDefaultTemporaryDirectory) +
                          kPrivateCopyPattern;
    if (!::mkdtemp(pattern.data())) {
      if (error) *error = sqliteFailure(path, "make a private copy in " + pattern, SQLITE_CANTOPEN, std::strerror(errno));
      return nullptr;
    }
    privateCopy = pattern;
    opened = privateCopy + kPrivateCopyName;
    std::error_code ec;
    for (const char* suffix : {"", kWriteAheadLogSuffix}) {
      std::filesystem::copy_file(path + suffix, opened + suffix, ec);
      if (ec) break;
    }
    if (ec) {
      if (error) *error = sqliteFailure(path, "copy to " + privateCopy, SQLITE_CANTOPEN, ec.message().c_str());
      std::filesystem::remove_all(privateCopy, ec);
      return nullptr;
    }
  }
  // The private copy is ours to open for writing (SQLite builds the log's
  // index beside it); the original is only ever read.
  const std::string uri = "file:" + uriEscaped(opened) + (hasLog ? "" : kReadOnlyImmutable);
  const int flags = (hasLog ? SQLITE_OPEN_READWRITE : SQLITE_OPEN_READONLY) | SQLITE_OPEN_URI | SQLITE_OPEN_FULLMUTEX;
  sqlite3* handle = nullptr;
  int rc = sqlite3_open_v2(uri.c_str(), &handle, flags, nullptr);
  std::unique_ptr<Database> db;
  if (rc == SQLITE_OK) {
    db.reset(new Database(handle, path));
    db->privateCopy_ = privateCopy;
  } else {
    if (error) *error = sqliteFailure(path, "open for reading", rc, handle ? sqlite3_errmsg(handle) : sqlite3_errstr(rc));
    sqlite3_close(handle);
    std::error_code ec;
    if (!privateCopy.empty()) std::filesystem::remove_all(privateCopy, ec);
    return nullptr;
  }
  sqlite3_extended_result_codes(handle, 1);
  sqlite3_busy_timeout(handle, kBusyTimeoutMilliseconds);
  // A newer schema may mean something else by the same tables; reading one
  // then proves the file is a database of ours.
  if (!db->readableSchemaVersion(error)) return nullptr;
  auto check = db->prepare("SELECT count(*) FROM records;", error);
  bool failed = false;
  if (!check || (!check->step(&failed, error) && failed)) return nullptr;
  return db;
}

Database::~Database() {
  for (auto& [text, stmt] : kept_) sqlite3_finalize(stmt);
  sqlite3_close_v2(handle_);
  if (!privateCopy_.empty()) {
    std::error_code ec;
    std::filesystem::remove_all(privateCopy_, ec);  // a copy left behind is only litter in the temporary directory
  }
}

bool Database::execute(const char* sql, Error* error) {
  const char* next = sql;
  while (*next) {
    const char* tail = nullptr;
    sqlite3_stmt* stmt = compiled(next, &tail, error);
    if (!stmt) {
      if (tail == nullptr) return false;  // it did not compile
      break;                              // only white space or comments were left
    }
    next = tail;
    if (!Statement(this, stmt).run(error)) return false;
  }
  return true;
}

// A checkpoint flushes the log before it copies it into the database, which
// would make a commit durable before the barrier its caller orders after its
// own file actions. So no checkpoint runs at a commit that waits for such a
// barrier; the next immediate commit checkpoints at SQLite's default size.
constexpr char kImmediateCommits[] = "PRAGMA synchronous=FULL; PRAGMA wal_autocheckpoint=1000;";
constexpr char kCommitsWithNextFlush[] = "PRAGMA synchronous=NORMAL; PRAGMA wal_autocheckpoint=0;";

bool Database::setCommitDurability(CommitDurability durability, Error* error) {
  if (durability == durability_) return true;
  const char* pragma = durability == CommitDurability::Immediate ? kImmediateCommits : kCommitsWithNextFlush;
  if (!execute(pragma, error)) return false;
  durability_ = durability;
  return true;
}

std::optional<Statement> Database::prepare(const char* sql, Error* error) {
  const char* tail = nullptr;
  sqlite3_stmt* stmt = compiled(sql, &tail, error);
  if (!stmt) {
    if (tail != nullptr && error) *error = sqliteFailure(path_, Format("prepare \"%s\"", sql), SQLITE_MISUSE, "no statement");
    return std::nullopt;
  }
  return Statement(this, stmt);
}

sqlite3_stmt* Database::compiled(std::string_view sql, const char** tail, Error* error) {
  // A kept statement's text runs to its closing ';' (or to the end of the
  // text), so it is found by the text's first statement up to there; a ';'
  // inside a literal only costs a fresh compilation.
  const size_t end = sql.find(';');
  const auto found = kept_.find(std::string(end == std::string_view::npos ? sql : sql.substr(0, end + 1)));
  if (found != kept_.end()) {
    sqlite3_stmt* stmt = found->second;
    *tail = sql.data() + found->first.size();
    kept_.erase(found);
    return stmt;
  }
  sqlite3_stmt* stmt = nullptr;
  const int rc = sqlite3_prepare_v2(handle_, sql.data(), static_cast<int>(sql.size()), &stmt, tail);
  if (rc != SQLITE_OK) {
    if (error) *error = failure(Format("prepare \"%s\"", std::string(sql)));
    sqlite3_finalize(stmt);
    *tail = nullptr;
    return nullptr;
  }
  return stmt;
}

void Database::keep(sqlite3_stmt* stmt) {
  sqlite3_reset(stmt);
  sqlite3_clear_bindings(stmt);
  // A second statement of the same text (one that ran while the first was
  // still stepping) is not kept.
  if (!kept_.emplace(sqlite3_sql(stmt), stmt).second) sqlite3_finalize(stmt);
}

Error Database::failure(const std::string& what) const {
  return sqliteFailure(path_, what, sqlite3_extended_errcode(handle_), sqlite3_errmsg(handle_));
}

Statement::~Statement() {
  if (stmt_) db_->keep(stmt_);
}

Statement& Statement::bind(int index, const std::string& text) {
  sqlite3_bind_text(stmt_, index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
  return *this;
}

Statement& Statement::bind(int index, int64_t number) {
  sqlite3_bind_int64(stmt_, index, number);
  return *this;
}

Statement& Statement::bind(int index, const std::optional<std::string>& textOrNull) {
  if (textOrNull) return bind(index, *textOrNull);
  sqlite3_bind_null(stmt_, index);
  return *this;
}

bool Statement::step(bool* failed, Error* error) {
  int rc = sqlite3_step(stmt_);
  *failed = false;
  if (rc == SQLITE_ROW) return true;
  if (rc == SQLITE_DONE) return false;
  *failed = true;
  if (error) *error = db_->failure(Format("step \"%s\"", sqlite3_sql(stmt_)));
  return false;
}

bool Statement::run(Error* error) {
  bool failed = false;
  while (step(&failed, error)) {
  }
  sqlite3_reset(stmt_);
  return !failed;
}

std::string Statement::text(int column) const {
  const unsigned char* bytes = sqlite3_column_text(stmt_, column);
  return bytes ? std::string(reinterpret_cast<const char*>(bytes),
                             static_cast<size_t>(sqlite3_column_bytes(stmt_, column)))
               : std::string();
}

std::optional<std::string> Statement::optionalText(int column) const {
  if (sqlite3_column_type(stmt_, column) == SQLITE_NULL) return std::nullopt;
  return text(column);
}

int64_t Statement::integer(int column) const {
  return sqlite3_column_int64(stmt_, column);
}

std::optional<Transaction> Transaction::begin(Database& db, Error* error, CommitDurability durability) {
  if (!db.setCommitDurability(durability, error)) return std::nullopt;
  if (!db.execute("BEGIN IMMEDIATE;", error)) {
    (void)db.setCommitDurability(CommitDurability::Immediate, nullptr);
    return std::nullopt;
  }
  return Transaction(&db);
}

Transaction::~Transaction() {
  if (!db_) return;
  (void)db_->execute("ROLLBACK;", nullptr);  // nothing more can be done about a failed rollback
  // A connection left at WithNextFlush would weaken every later commit; the
  // pragma only fails when the connection itself is gone.
  (void)db_->setCommitDurability(CommitDurability::Immediate, nullptr);
}

bool Transaction::commit(Error* error) {
  if (!db_->execute("COMMIT;", error)) return false;  // the destructor rolls back
  (void)db_->setCommitDurability(CommitDurability::Immediate, nullptr);
  db_ = nullptr;
  return true;
}

}  // namespace platform::registry
