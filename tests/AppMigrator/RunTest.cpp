// The migration run: creation, the host's queries, performMigration and the
// safe harbors it registers. Whole successful runs, the order of the
// containers and an unlistable old directory are left to the end-to-end suite.
#include "FakePlatform.h"

namespace qstest {
namespace {

class MigrationRun : public MigratorTest {
 protected:
  static Value harbor(const Value& path) { return Value(Dictionary{{"HarborPathKey", path}}); }
};

TEST_F(MigrationRun, EmptyOldDirectoryGoesAtCreationAndTheRunRecordsTheSystemVersion) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  writeInstallMap();
  // An unreadable safe-harbor map is nothing to do, and stays.
  ASSERT_TRUE(makeDirs(dataDirectoryPath()) && writeFile(harborMapPath(), "<plist><array>"));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));

  // The re-listing meets ENOENT silently, so this run leaves the install map.
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_EQ(log_->count("QSAppMigrator: Failed"), 1u);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to load existing harbor map from " + harborMapPath()));
  EXPECT_TRUE(pathExists(harborMapPath()));
  EXPECT_EQ(platform_->daemon.dataProtectionCalls,
            (std::vector<Dictionary>{{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}}}));
  // The next run reads back what this one recorded.
  EXPECT_EQ(createMigrator()->lastSystemBuildVersion(), "21A100");
}

TEST_F(MigrationRun, FailedContainerFailsTheRunButOthersAndTheSafeHarborsAreStillDone) {
  // Bundles without identifiers: those containers are removed and counted by
  // introspection, before any container is migrated.
  for (const char* name : {"x", "y"}) makeBundle(makeContainer(name) + "/x.app", "");
  // Installed applications whose record cannot be found: each container
  // fails before anything of it is touched.
  for (const std::string name : {"a", "b"}) {
    makeBundleContainer(name, "com.example." + name);
    platform_->registry.addInstalledApplication("com.example." + name);
    platform_->registry.hideRecordOf.insert("com.example." + name);
  }
  // The note is removed and counted without being introspected; a link is
  // never an entry, but it is left and so keeps the old layout.
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt", "elsewhere"));
  ASSERT_EQ(symlink("/nowhere", (oldApplicationsPath() + "/Link").c_str()), 0);
  // A group-container entry of the wrong type is no map at all.
  writeInstallMap(Dictionary{{"GroupContainers", Value(platform::makeStringArray({"group.example"}))}});
  // Malformed harbor entries are skipped; the map still goes.
  writePlist(harborMapPath(), Value(Dictionary{{"com.example.array", Value(platform::makeStringArray({"/h"}))},
                                               {"com.example.number", harbor(Value(3))},
                                               {"com.example.good", harbor(Value("/harbor/good"))}}));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  std::vector<float> seen;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call == "isInstalled") seen.push_back(migrator->migrationProgress());
  };
  EXPECT_FALSE(migrator->groupContainerMap().has_value());
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(seen, (std::vector<float>{0.6f, 0.8f}));
  EXPECT_EQ(migrator->countItemsMigrated(), migrator->itemsToMigrate()->size());  // all counted, done or not
  EXPECT_FALSE(pathExists(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt"));
  EXPECT_FALSE(log_->contains("QSAppMigrator: Found regular file"));
  for (const std::string name : {"a", "b"}) {
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Migration of com.example." + name + " at " + oldApplicationsPath() + "/" +
                           name + "/com.example." + name + ".app failed"));
    EXPECT_TRUE(pathExists(oldApplicationsPath() + "/" + name));
  }
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Not removing " + oldInstallMapPath() +
                         " because 3 items remain unmigrated."));
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Returning migration failed. Please include the contents of "
                 "/var/mobile/Library/Logs/Quillset and /var/Mobile/Library/Logs/Transvale in a bug report."));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  // The daemon's update and the harbors are done even though the containers failed.
  EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
  EXPECT_EQ(platform_->daemon.safeHarborCalls, std::vector<std::string>{"com.example.good /harbor/good 2"});
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor info for identifier com.example.array"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor path from harbor entry for com.example.number : " +
                         harbor(Value(3)).description()));
  EXPECT_FALSE(pathExists(harborMapPath()));
}

TEST_F(MigrationRun, DataProtectionOrSafeHarborFailureAloneFailsTheRun) {
  for (const bool harborRefused : {false, true}) {
    SCOPED_TRACE(harborRefused ? "refused harbor" : "data protection");
    log_->clear();
    platform_->daemon.dataProtectionCalls.clear();
    platform_->daemon.dataProtectionUpdateSucceeds = harborRefused;
    if (harborRefused) {
      // The others are still tried, and the map is kept for the next run.
      writePlist(harborMapPath(), Value(Dictionary{{"com.example.a", harbor(Value("/harbor/a"))},
                                                   {"com.example.b", harbor(Value("/harbor/b"))}}));
      platform_->daemon.refuseSafeHarborOf = {"com.example.a"};
    }
    auto migrator = createMigrator();
    ASSERT_NE(migrator, nullptr);
    EXPECT_FALSE(migrator->performMigration());
    EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
    EXPECT_EQ(log_->contains("QSAppMigrator: Failed to update container data protection"), !harborRefused);
    EXPECT_FALSE(pathExists(versionRecordPath()));
  }
  EXPECT_EQ(platform_->daemon.safeHarborCalls.size(), 2u);
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Failed to migrate safe harbor for identifier com.example.a at /harbor/a : (null)"));
  EXPECT_TRUE(pathExists(harborMapPath()));
}

TEST_F(MigrationRun, UnwritableVersionRecordDoesNotFailTheRun) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  makeImmutable(dataDirectoryPath());
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to write current build info to " + versionRecordPath()));
}

}  // namespace
}  // namespace qstest
