// Rows of a damaged or planted registry database that point outside the
// registry's own directories are refused and left, never acted on.
#include <sqlite3.h>

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using namespace platform;

using RegistryAreas = RegistryTest;

// Runs SQL on the registry's database behind its back.
void plant(const std::string& root, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open((root + "/private/var/db/appregistry/registry.sqlite").c_str(), &db), SQLITE_OK);
  char* message = nullptr;
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &message), SQLITE_OK) << (message ? message : "");
  sqlite3_free(message);
  sqlite3_close(db);
}

TEST_F(RegistryAreas, JournalRowsPointingElsewhereAreRefusedAndKept) {
  const std::string sentinel = at("private/var/mobile/Documents/keep");
  ASSERT_TRUE(makeDirs(at("private/var/mobile/Documents")) && writeFile(sentinel, "mine"));
  ASSERT_TRUE(makeDirs(at("elsewhere/Payload")) && writeFile(at("elsewhere/Payload/x"), "x"));
  ASSERT_TRUE(installApp(*openRegistry(), {.identifier = "ex.before", .version = "1"}));
  const std::string container = openRegistry()->recordForIdentifier("ex.before")->bundleContainerURL.path();
  const struct {
    const char* kind;
    std::string source, destination;
  } kRows[] = {
      {"remove", "", "/"},
      {"remove", "", at("private/var/mobile")},  // inside the root, but no package
      {"remove", "", bundleContainers()},        // the area itself
      {"create", "", at("private/var/mobile/Documents")},
      {"create", "", bundleContainers() + "/../../../mobile/Documents"},
      {"move", at("private/var/mobile/Documents/keep"), "/tmp/not-the-registry"},
      {"move", "/etc/passwd", container + "/App.app"},
  };
  for (const auto& row : kRows) {
    SCOPED_TRACE(std::string(row.kind) + " " + row.source + " -> " + row.destination);
    plant(base_, "INSERT INTO install_journal(kind, source, destination) VALUES('" + std::string(row.kind) + "', '" +
                     row.source + "', '" + row.destination + "');");
    LogCapture log;
    auto registry = openRegistry();
    EXPECT_TRUE(log.contains("lies outside the registry's areas; refused and left for a person"));
    Error error;
    EXPECT_FALSE(install(*registry, makePackage("p", {.identifier = "ex.after", .version = "1"}), "ex.after", &error));
    EXPECT_TRUE(error.is(kRegistryErrorDomain, kRegistryErrorOutsideAreas)) << error.description();
    EXPECT_EQ(readFile(sentinel), "mine");
    EXPECT_THAT((std::vector{container + "/App.app", at("elsewhere/Payload/x")}), testing::Each(PathExists()));
    plant(base_, "DELETE FROM install_journal;");  // what the person does
  }
  // A package directory elsewhere in the root is a row the registry writes.
  plant(base_,
        "INSERT INTO install_journal(kind, source, destination) VALUES('remove', '', '" + at("elsewhere") + "');");
  ASSERT_TRUE(installApp(*openRegistry(), {.identifier = "ex.after", .version = "1"}));
  EXPECT_FALSE(exists(at("elsewhere")));
  // A package outside the root is not installed from (nor, later, removed).
  TempDir outside;
  makeBundle(outside / "Payload/App.app", {.identifier = "ex.outside"});
  Error error;
  EXPECT_FALSE(install(*openRegistry(), outside.path(), "ex.outside", &error));
  EXPECT_TRUE(error.is(kRegistryErrorDomain, kRegistryErrorOutsideAreas)) << error.description();
  EXPECT_TRUE(exists(outside / "Payload/App.app/Info.plist"));
}

TEST_F(RegistryAreas, RecordedContainersElsewhereStopTheInstallation) {
  ASSERT_TRUE(makeDirs(at("private/var/mobile/Documents")) && writeFile(at("private/var/mobile/Documents/k"), "k"));
  const struct {
    const char* identifier;
    std::string sql;
  } kCases[] = {
      {"ex.data", "UPDATE records SET data_container = '" + at("private/var/mobile/Documents") + "'"},
      {"ex.bundle", "UPDATE records SET bundle_container = '" + at("private/var/mobile") + "'"},
      {"ex.group", "UPDATE group_containers SET path = '/'"},
  };
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.identifier);
    ASSERT_TRUE(installApp(*openRegistry(), {.identifier = c.identifier, .version = "1", .groups = {"g"}}));
    plant(base_, c.sql + (std::string(c.identifier) == "ex.group"
                              ? ";"
                              : " WHERE identifier = '" + std::string(c.identifier) + "';"));
    Error error;
    EXPECT_FALSE(install(*openRegistry(),
                         makePackage(c.identifier, {.identifier = c.identifier, .version = "2", .groups = {"g"}}),
                         c.identifier, &error));
    EXPECT_TRUE(error.is(kRegistryErrorDomain, kRegistryErrorOutsideAreas)) << error.description();
    EXPECT_EQ(readFile(at("private/var/mobile/Documents/k")), "k");
    plant(base_, "DELETE FROM records; DELETE FROM record_groups; DELETE FROM group_containers;");
  }
}

}  // namespace
}  // namespace qstest
