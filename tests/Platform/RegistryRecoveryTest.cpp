// Crash consistency, a concurrent reader, an unwritable database and one of a
// newer schema.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <sqlite3.h>

#include <atomic>
#include <functional>

#include "Platform/Registry/RegistryDatabase.h"
#include "Platform/Registry/RegistryReader.h"
#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using namespace platform;

using RegistryRecovery = RegistryTest;

// A reinstall that adds a group, a plug-in and store metadata, killed at each
// stage in turn. Opening the registry again rolls back what was not
// committed (the package whole again, nothing new left, the old record and
// its data) or finishes what was (the old container and the package gone);
// either way the caller's retry succeeds. What was committed has the new
// plug-in and the store metadata in their places. Only the stages between the
// journal's writing and its clearing leave anything to recover.
TEST_F(RegistryRecovery, ReinstallKilledAtEachStageIsRolledBackOrFinishedWhenOpened) {
  const char* stages[] = {"VerifyingApplication", "StagingFiles", "RegisteringApplication", "CleaningUp", "Complete"};
  for (size_t k = 0; k < std::size(stages); ++k) {
    SCOPED_TRACE(stages[k]);
    const bool journalled = k > 0 && k < 4, committed = k >= 3;
    const std::string id = std::string("ex.") + stages[k];
    ASSERT_TRUE(installApp(*openRegistry(), {.identifier = id, .version = "1"}));
    const BundleRecord old = *openRegistry()->recordForIdentifier(id);
    ASSERT_TRUE(writeFile(old.dataContainerURL->path() + "/inbox", "mail"));
    const auto before = allContainers();
    const std::string package = makePackage(stages[k], {.identifier = id, .version = "2", .groups = {"group." + id}},
                                            {.identifier = id + ".tunnel"}, {"VendraMetadata.plist"});
    const pid_t child = fork();
    if (child == 0) {  // the child installs and kills itself when the stage is reported
      if (auto registry = Registry::open(base_))
        install(*registry, package, id, nullptr, stages[k], [] { raise(SIGKILL); });
      _exit(3);  // the kill never came
    }
    int result = 0;
    ASSERT_GT(child, 0);
    ASSERT_EQ(waitpid(child, &result, 0), child);
    ASSERT_EQ(WIFSIGNALED(result) ? WTERMSIG(result) : -1, SIGKILL) << "exit status " << WEXITSTATUS(result);

    LogCapture log;
    auto registry = openRegistry();
    EXPECT_EQ(log.contains("Recovered interrupted installation"), journalled);
    BundleRecord record = *registry->recordForIdentifier(id);
    EXPECT_EQ(record.version, committed ? "2" : "1");
    EXPECT_TRUE(record.foundBackingBundle);
    EXPECT_EQ(record.dataContainerURL, old.dataContainerURL);
    EXPECT_EQ(readFile(old.dataContainerURL->path() + "/inbox"), "mail");
    EXPECT_EQ(registry->isInstalled(id + ".tunnel"), committed);
    EXPECT_EQ(exists(package), !committed);
    EXPECT_EQ(exists(old.bundleContainerURL.path()), !committed);
    Error error;
    if (!committed) {
      EXPECT_EQ(readFile(package + "/Payload/App.app/main") + readFile(package + "/VendraMetadata.plist"),
                "executable of " + id + "metadata VendraMetadata.plist");
      EXPECT_EQ(allContainers(), before);
      ASSERT_TRUE(install(*registry, package, id, &error)) << error.description();
      continue;
    }
    // The application and its new plug-in in containers of their own, the
    // store metadata beside the application only.
    const std::optional<BundleRecord> tunnel = registry->recordForIdentifier(id + ".tunnel");
    ASSERT_TRUE(tunnel && tunnel->dataContainerURL);
    EXPECT_THAT(tunnel->dataContainerURL->path(), PathExists());
    EXPECT_THAT(tunnel->groupContainerURLs, testing::Optional(testing::IsEmpty()))
        << "a plug-in's record has an empty group dictionary";
    EXPECT_EQ(record.bundleType + tunnel->bundleType, std::string(kBundleTypeUser) + kBundleTypeVPNPlugin);
    EXPECT_EQ(record.bundleURL.path() + tunnel->bundleURL.path(),
              record.bundleContainerURL.path() + "/App.app" + tunnel->bundleContainerURL.path() + "/Tunnel.vpnplugin");
    EXPECT_EQ(readFile(tunnel->bundleURL.path() + "/main"), "executable of " + id + ".tunnel");
    EXPECT_EQ(tunnel->dataContainerURL->deletingLastPathComponent().lastPathComponent(), "PluginKitPlugin");
    EXPECT_THAT(record.bundleContainerURL.path() + "/VendraMetadata.plist", PathExists());
    EXPECT_THAT(tunnel->bundleContainerURL.path() + "/VendraMetadata.plist", testing::Not(PathExists()));
    // Resuming, the caller finds its package gone or stages it again: a
    // replay, but not from another package or for another identifier.
    EXPECT_TRUE(install(*registry, package, id, &error)) << error.description();
    ASSERT_TRUE(makeDirs(package + "/Payload") && makeDirs(at("elsewhere/Payload")));
    for (const auto& [from, identifier] : {std::pair{at("elsewhere"), id}, {package, std::string("other")}}) {
      EXPECT_FALSE(install(*registry, from, identifier, &error)) << from << " " << identifier;
      EXPECT_EQ(registryCode(error), kRegistryErrorInvalidPackage) << error.description();
    }
    EXPECT_TRUE(install(*registry, package, id, &error)) << error.description();
    EXPECT_EQ(statuses_.back(), "AlreadyInstalledFromPackage");
    EXPECT_EQ(registry->recordForIdentifier(id)->bundleContainerURL, record.bundleContainerURL);
    EXPECT_FALSE(exists(package));
  }
}

TEST_F(RegistryRecovery, ReadersSeeWholeRecordsWhileAnotherThreadInstalls) {
  auto registry = openRegistry();
  const TestBundle app{.identifier = "ex.app", .version = "0", .groups = {"group.g"}};
  ASSERT_TRUE(installApp(*registry, app));
  const auto data = registry->recordForIdentifier(app.identifier)->dataContainerURL;
  std::atomic<int> inconsistent{0}, lookups{0}, installing{1};
  auto read = [&] {
    for (; installing; ++lookups) {
      std::optional<BundleRecord> r = registry->recordForIdentifier(app.identifier);
      inconsistent +=
          !(r && r->dataContainerURL == data && r->groupContainerURLs && r->groupContainerURLs->size() == 1 &&
            r->bundleURL.deletingLastPathComponent() == r->bundleContainerURL && registry->isInstalled(app.identifier));
    }
  };
  std::thread readers[] = {std::thread(read), std::thread(read), std::thread(read)};
  for (const char* v : {"1", "2", "3", "4", "5"}) EXPECT_TRUE(installApp(*registry, {app.identifier, v, app.groups}));
  installing = 0;
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(inconsistent.load(), 0);
  EXPECT_GT(lookups.load(), 0);
}

// Opening fails while the database's directory cannot be made or written.
// Then the commit's write fails (the database's log made immutable), and the
// bundle container cannot be made: each time the package stays whole,
// nothing is half installed, and a later attempt succeeds.
TEST_F(RegistryRecovery, UnwritableDatabaseOrContainerFailsAndLeavesThePackageWhole) {
  const std::string database = at("private/var/db/appregistry");
  Error error;
  for (const std::string& locked : {at("private/var/db"), database}) {
    ASSERT_TRUE(makeDirs(locked) && setImmutable(locked, true));
    EXPECT_FALSE(SQLiteApplicationRegistry::open(base_, &error));
    ASSERT_TRUE(setImmutable(locked, false));
    EXPECT_EQ(registryCode(error), kRegistryErrorDatabase) << error.description();
    EXPECT_TRUE(locked == database ? error.localizedDescription().find(database) != std::string::npos
                                   : error.underlyingError() && error.underlyingError()->isPOSIX(EPERM))
        << error.description();
  }

  auto registry = openRegistry();
  std::string package = makePackage("notes", {.identifier = "ex.notes"}, {}, {"Manifest.plist"});
  EXPECT_FALSE(install(*registry, package, "ex.notes", &error, "RegisteringApplication",
                       [&] { EXPECT_TRUE(setImmutable(database + "/registry.sqlite-wal", true)); }));
  ASSERT_TRUE(setImmutable(database + "/registry.sqlite-wal", false));
  EXPECT_EQ(registryCode(error), kRegistryErrorDatabase) << error.description();
  EXPECT_EQ(errors_, std::vector<std::string>{"DatabaseError"});

  ASSERT_TRUE(makeDirs(bundleContainers()) && setImmutable(bundleContainers(), true));
  EXPECT_FALSE(install(*registry, package, "ex.notes", &error));
  ASSERT_TRUE(setImmutable(bundleContainers(), false));
  EXPECT_EQ(registryCode(error), kRegistryErrorFileOperation) << error.description();
  EXPECT_TRUE(error.underlyingError() && error.underlyingError()->isPOSIX(EPERM)) << error.description();
  EXPECT_EQ(errors_, std::vector<std::string>{"FileOperationFailed"});

  EXPECT_THAT((std::vector{package + "/Payload/App.app/main", package + "/Manifest.plist"}),
              testing::Each(PathExists()));
  EXPECT_EQ(allContainers(), (std::vector<std::vector<std::string>>(4)));
  EXPECT_FALSE(registry->isInstalled("ex.notes"));
  ASSERT_TRUE(install(*registry, package, "ex.notes", &error)) << error.description();
}

// A commit that reaches the disk only with the next flush weakens that one
// transaction: it is not flushed and no checkpoint (which flushes the log)
// runs at it; whether it is committed or rolled back, every later commit on
// the connection is flushed and checkpointed again; one refused because
// another is open leaves that one flushed.
TEST_F(RegistryRecovery, CommitWithoutItsOwnFlushLastsOneTransaction) {
  using registry::CommitDurability;
  using registry::Transaction;
  Error error;
  auto db = registry::Database::open(at("registry.sqlite"), &error);
  ASSERT_TRUE(db) << error.description();
  auto setting = [&](const char* pragma) {
    auto query = db->prepare(pragma, &error);
    bool failed = false;
    return query && query->step(&failed, &error) ? query->integer(0) : -1;
  };
  // synchronous, wal_autocheckpoint
  auto durability = [&] { return std::pair(setting("PRAGMA synchronous;"), setting("PRAGMA wal_autocheckpoint;")); };
  const std::pair<int64_t, int64_t> deferred{1, 0}, immediate{2, 1000};
  EXPECT_EQ(durability(), immediate);
  const std::function<void(std::optional<Transaction>&)> endings[] = {
      [&](auto& t) { EXPECT_TRUE(db->execute("DELETE FROM install_journal;", &error) && t->commit(&error)); },
      [](auto& t) { t.reset(); },
  };
  for (size_t k = 0; k < std::size(endings); ++k) {
    SCOPED_TRACE(k);
    std::optional<Transaction> transaction = Transaction::begin(*db, &error, CommitDurability::WithNextFlush);
    ASSERT_TRUE(transaction) << error.description();
    EXPECT_EQ(durability(), deferred);
    endings[k](transaction);
    EXPECT_EQ(durability(), immediate);
  }
  std::optional<Transaction> open = Transaction::begin(*db, &error);
  ASSERT_TRUE(open) << error.description();
  EXPECT_FALSE(Transaction::begin(*db, &error, CommitDurability::WithNextFlush));
  EXPECT_EQ(durability(), immediate);
}

// The schema version of the database at `path`, after setting it to `set` when given.
int64_t userVersion(const std::string& path, std::optional<int> set = std::nullopt) {
  sqlite3* db = nullptr;
  int64_t version = -1;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) == SQLITE_OK &&
      (!set || sqlite3_exec(db, ("PRAGMA user_version=" + std::to_string(*set)).c_str(), nullptr, nullptr, nullptr) ==
                   SQLITE_OK)) {
    sqlite3_stmt* query = nullptr;
    if (sqlite3_prepare_v2(db, "PRAGMA user_version;", -1, &query, nullptr) == SQLITE_OK &&
        sqlite3_step(query) == SQLITE_ROW) {
      version = sqlite3_column_int64(query, 0);
    }
    sqlite3_finalize(query);
  }
  sqlite3_close(db);
  return version;
}

// A new database records its schema version; one of an older version (0: made
// before versions were kept) is brought up to it; one of a newer version is
// refused, naming both versions, and left as it was, also by a read-only open.
TEST_F(RegistryRecovery, DatabaseOfANewerSchemaVersionIsRefusedAndLeftUntouched) {
  const std::string database = at("private/var/db/appregistry/registry.sqlite");
  openRegistry().reset();
  ASSERT_EQ(userVersion(database), 1);
  ASSERT_EQ(userVersion(database, 0), 0);
  openRegistry().reset();
  EXPECT_EQ(userVersion(database), 1);

  ASSERT_EQ(userVersion(database, 7), 7);
  // The read-only open (appregistry, the plan) refuses it alike.
  const std::pair<const char*, std::function<bool(Error*)>> opens[] = {
      {"read-write", [&](Error* e) { return SQLiteApplicationRegistry::open(base_, e) != nullptr; }},
      {"read-only", [&](Error* e) { return platform::RegistryReader::open(base_, false, e) != nullptr; }},
  };
  for (const auto& [name, open] : opens) {
    Error error;
    EXPECT_FALSE(open(&error)) << name;
    EXPECT_EQ(registryCode(error), kRegistryErrorNewerDatabase) << name << ": " << error.description();
    EXPECT_EQ(error.localizedDescription(), "registry database " + database +
                                                " has schema version 7, newer than version 1 that this build "
                                                "reads; it is left untouched")
        << name;
  }
  EXPECT_EQ(userVersion(database), 7);
}

}  // namespace
}  // namespace qstest
