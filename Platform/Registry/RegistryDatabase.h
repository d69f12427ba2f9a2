// The registry's SQLite database: an owned connection, prepared statements and
// transactions, and the schema.
//
// Every failure becomes an error record of kRegistryErrorDomain,
// kRegistryErrorDatabase, whose message names the database file, what was being
// done and SQLite's own message. Out-parameters are written only on failure.
//
// Thread safety: a Database is NOT safe for concurrent use; its owner
// serialises access (SQLiteApplicationRegistry holds its own lock around
// every use).
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

#include "Platform/Foundation/Error.h"

namespace platform::registry {

class Statement;

// When a commit reaches the disk. The connection runs in WAL mode, where every
// commit appends to one log file in order: a commit made durable also makes
// every earlier one durable.
enum class CommitDurability {
  // The commit flushes the log (synchronous=FULL) before it returns.
  Immediate,
  // The commit returns without a flush (synchronous=NORMAL, and no automatic
  // checkpoint at it); it reaches the disk with the next immediate commit or
  // a flush of the log's file system. Only for changes whose loss in a power
  // cut is harmless, or that such a flush makes durable before anything
  // depends on them.
  WithNextFlush,
};

class Database {
 public:
  // Opens (creating when needed) the database at `path` in WAL mode with
  // synchronous=FULL and creates the schema, recording its version. Null on
  // failure; a database of a newer schema version fails with
  // kRegistryErrorNewerDatabase and is not changed.
  static std::unique_ptr<Database> open(const std::string& path, Error* error);
  // Opens an existing database for reading only, changing nothing on disk
  // (not even the change time of a file: SQLite gives the files it opens to
  // the database's owner when it runs as root). Without a write-ahead log the
  // file is opened as immutable, so that no log or index file is made; with
  // one, the database and its log are read from a private copy in the
  // process's temporary directory, removed when the database is closed (a
  // writer working at that moment may leave the copy unreadable: the open
  // then fails). Null on failure, also when there is no database at `path`;
  // a database of a newer schema version fails with
  // kRegistryErrorNewerDatabase, as with open().
  static std::unique_ptr<Database> openReadOnly(const std::string& path, Error* error);
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;

  // Runs one or more statements without results.
  [[nodiscard]] bool execute(const char* sql, Error* error);
  // How the following commits reach the disk; Immediate after open().
  [[nodiscard]] bool setCommitDurability(CommitDurability durability, Error* error);
  // A statement is compiled once per connection: when a Statement ends it is
  // reset and kept for the next prepare() of the same text.
  std::optional<Statement> prepare(const char* sql, Error* error);
  const std::string& path() const { return path_; }
  // The record for the connection's last failure while `what`.
  Error failure(const std::string& what) const;

 private:
  Database(sqlite3* handle, std::string path) : handle_(handle), path_(std::move(path)) {}
  [[nodiscard]] bool createSchema(Error* error);
  // The schema version recorded in the database, or none with
  // kRegistryErrorNewerDatabase when it is newer than this build reads.
  std::optional<int64_t> readableSchemaVersion(Error* error);
  // The compiled statement for the first statement of `sql`, from the kept
  // ones or newly compiled; *tail is where the next statement begins. Null
  // with *error on failure, null without one when `sql` holds no statement.
  sqlite3_stmt* compiled(std::string_view sql, const char** tail, Error* error);
  // Takes back a statement whose Statement ended.
  void keep(sqlite3_stmt* stmt);
  friend class Statement;
  sqlite3* handle_;
  // Compiled statements not in use, by their text. The texts are the code's
  // own constants, so this holds a few dozen at most.
  std::unordered_map<std::string, sqlite3_stmt*> kept_;
  std::string path_;
  std::string privateCopy_;  // directory of the private copy, "" when there is none
  CommitDurability durability_ = CommitDurability::Immediate;
};

// A prepared statement; parameters are bound by position (1-based).
class Statement {
 public:
  Statement(Statement&& other) noexcept : db_(other.db_), stmt_(other.stmt_) { other.stmt_ = nullptr; }
  Statement& operator=(Statement&&) = delete;
  Statement(const Statement&) = delete;
  ~Statement();

  Statement& bind(int index, const std::string& text);
  Statement& bind(int index, int64_t number);
  Statement& bind(int index, const std::optional<std::string>& textOrNull);

  // Advances: true with a row, false at the end; on failure false with *error.
  // `failed` distinguishes the end from a failure.
  [[nodiscard]] bool step(bool* failed, Error* error);
  // Runs a statement that returns no rows, then resets it so that it can be
  // bound and run again.
  [[nodiscard]] bool run(Error* error);

  std::string text(int column) const;
  std::optional<std::string> optionalText(int column) const;
  int64_t integer(int column) const;

 private:
  friend class Database;
  Statement(Database* db, sqlite3_stmt* stmt) : db_(db), stmt_(stmt) {}
  Database* db_;
  sqlite3_stmt* stmt_;
};

// BEGIN IMMEDIATE on construction; rolled back on destruction unless
// committed. A transaction begun WithNextFlush puts the connection back to
// Immediate when it ends.
class Transaction {
 public:
  static std::optional<Transaction> begin(Database& db, Error* error,
                                          CommitDurability durability = CommitDurability::Immediate);
  Transaction(Transaction&& other) noexcept : db_(other.db_) { other.db_ = nullptr; }
  Transaction& operator=(Transaction&&) = delete;
  Transaction(const Transaction&) = delete;
  ~Transaction();
  [[nodiscard]] bool commit(Error* error);

 private:
  explicit Transaction(Database* db) : db_(db) {}
  Database* db_;
};

}  // namespace platform::registry
