// The migration run: creation, the host's queries and performMigration.
#include <algorithm>

#include "FakePlatform.h"
#include "support/ImageSupport.h"

namespace qstest {
namespace {

constexpr char kReturningFailed[] =
    "QSAppMigrator: Returning migration failed. Please include the contents of /var/mobile/Library/Logs/Quillset "
    "and /var/Mobile/Library/Logs/Transvale in a bug report.";

class MigrationRun : public MigratorTest {
 protected:
  // Containers whose application is installed but whose record cannot be
  // found: each fails before anything of it is touched.
  void makeFailingContainers(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
      makeBundleContainer(name, "com.example." + name);
      platform_->registry.addInstalledApplication("com.example." + name);
      platform_->registry.hideRecordOf.insert("com.example." + name);
    }
  }
  std::string remainLine(int count) const {
    return "QSAppMigrator: Not removing " + oldInstallMapPath() + " because " + std::to_string(count) +
           " items remain unmigrated.";
  }
};

TEST_F(MigrationRun, EmptyOldDirectoryGoesAtCreationAndTheRunRecordsTheSystemVersion) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  writeInstallMap();
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
  EXPECT_EQ(migrator->migrationProgress(), 0.5f);

  // The re-listing meets ENOENT silently, so this run leaves the install map.
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Failed").empty());
  EXPECT_EQ(platform_->daemon.dataProtectionCalls,
            (std::vector<Dictionary>{{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}}}));
  EXPECT_EQ(readPlist(versionRecordPath()), platform_->systemVersion.dictionary);
  // The next run reads back what this one recorded.
  EXPECT_EQ(createMigrator()->lastSystemBuildVersion(), "21A100");
}

TEST_F(MigrationRun, CreationFailsWhenOldApplicationsDirectoryCannotBeListed) {
  // A regular file where the directory should be: it exists but cannot be listed.
  ASSERT_TRUE(makeDirs(std::filesystem::path(oldApplicationsPath()).parent_path().string()));
  ASSERT_TRUE(writeFile(oldApplicationsPath(), "not a directory"));
  EXPECT_EQ(createMigrator(), nullptr);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get items at file://" + oldApplicationsPath() +
                             "/ : Error Domain=POSIXErrorDomain Code=20 ",
                         true));
  EXPECT_TRUE(pathExists(oldApplicationsPath()));
}

TEST_F(MigrationRun, SuccessfulRunMovesEverythingAndRemovesTheOldLayout) {
  const std::string container = makeBundleContainer("A", "com.example.a");
  makeBundle(container + "/Tunnel.vpnplugin", "com.example.a.tunnel");
  ASSERT_TRUE(writeSolidPNG(container + "/com.example.a.app/Icon.png", 8, 8, 0xff0000ff));
  ASSERT_TRUE(makeDirs(container + "/Documents") && writeFile(container + "/Documents/letter", "dear"));
  // A VPN plug-in gets no placeholder: it must be known to the registry already.
  makeBundleContainer("B", "com.example.b", "vpnplugin");
  platform_->registry.addInstalledApplication("com.example.b");
  // A group-container entry of the wrong type is no map at all.
  writeInstallMap(Dictionary{{"GroupContainers", Value(platform::makeStringArray({"group.example"}))}});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->groupContainerMap().has_value());

  EXPECT_TRUE(migrator->performMigration()) << testing::PrintToString(log_->hostMessages());
  EXPECT_EQ(migrator->countItemsMigrated(), 2u);
  EXPECT_EQ(readFile(platform_->registry.dataContainerPath("com.example.a") + "/Documents/letter"), "dear");
  EXPECT_EQ(directoryNames(platform_->registry.bundleContainerPath("com.example.a")),
            (std::vector<std::string>{"Tunnel.vpnplugin", "com.example.a.app"}));
  EXPECT_FALSE(platform_->registry.records.at("com.example.a").isPlaceholder);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
  EXPECT_FALSE(pathExists(oldInstallMapPath()));
  EXPECT_TRUE(pathExists(versionRecordPath()));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Failed").empty());
}

TEST_F(MigrationRun, ApplicationContainersRunFirstInReverseListingOrderThenVPNContainers) {
  for (const std::string name : {"first", "third"}) makeBundleContainer(name, "com.example." + name);
  for (const std::string name : {"second", "fourth"}) makeBundleContainer(name, "com.example." + name, "vpnplugin");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  // Expected order from the listing order the migrator saw.
  std::vector<std::string> applications, vpnPlugins;
  for (const auto& entry : *migrator->itemsToMigrate()) {
    const std::string name = entry.lastPathComponent();
    const bool isApp = name == "first" || name == "third";
    (isApp ? applications : vpnPlugins)
        .push_back("QSAppMigrator: Migrating com.example." + name + " at " + oldApplicationsPath() + "/" + name +
                   "/com.example." + name + (isApp ? ".app" : ".vpnplugin"));
  }
  std::reverse(applications.begin(), applications.end());
  applications.insert(applications.end(), vpnPlugins.begin(), vpnPlugins.end());

  migrator->performMigration();
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Migrating "), applications);
}

TEST_F(MigrationRun, SymbolicLinkInOldDirectoryIsNeverAnEntryButKeepsTheOldLayout) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt", "elsewhere"));
  ASSERT_EQ(symlink("/nowhere", (oldApplicationsPath() + "/Link").c_str()), 0);
  writeInstallMap();
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  ASSERT_EQ(migrator->itemsToMigrate()->size(), 1u);

  EXPECT_FALSE(migrator->performMigration());
  // The note is removed and counted without being introspected.
  EXPECT_EQ(migrator->countItemsMigrated(), 1u);
  EXPECT_FALSE(pathExists(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt"));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Found regular file").empty());
  EXPECT_TRUE(loggedOnce(remainLine(1)));
  EXPECT_TRUE(loggedOnce(kReturningFailed));
  EXPECT_TRUE(pathExists(oldApplicationsPath() + "/Link"));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, FailedContainerFailsTheRunButOthersAreStillAttempted) {
  makeFailingContainers({"a", "b"});
  writeInstallMap();
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  for (const std::string name : {"a", "b"}) {
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Migration of com.example." + name + " at " + oldApplicationsPath() + "/" +
                           name + "/com.example." + name + ".app failed"));
    EXPECT_TRUE(pathExists(oldApplicationsPath() + "/" + name));
  }
  EXPECT_TRUE(loggedOnce(remainLine(2)));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  // The daemon's update is made even though the containers failed.
  EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
}

TEST_F(MigrationRun, DataProtectionOrSafeHarborFailureAloneFailsTheRun) {
  for (const bool harborRefused : {false, true}) {
    SCOPED_TRACE(harborRefused ? "refused harbor" : "data protection");
    log_->clear();
    platform_->daemon.dataProtectionCalls.clear();
    platform_->daemon.dataProtectionUpdateSucceeds = harborRefused;
    if (harborRefused) {
      writePlist(harborMapPath(),
                 Value(Dictionary{{"com.example.a", Value(Dictionary{{"HarborPathKey", Value("/h")}})}}));
      platform_->daemon.refuseSafeHarborOf = {"com.example.a"};
    }
    auto migrator = createMigrator();
    ASSERT_NE(migrator, nullptr);
    EXPECT_FALSE(migrator->performMigration());
    EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
    EXPECT_EQ(log_->contains("QSAppMigrator: Failed to update container data protection"), !harborRefused);
    EXPECT_FALSE(pathExists(versionRecordPath()));
  }
}

TEST_F(MigrationRun, UnwritableVersionRecordDoesNotFailTheRun) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  makeImmutable(dataDirectoryPath());
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to write current build info to " + versionRecordPath()));
}

TEST_F(MigrationRun, UnlistableOldDirectoryAtReListingIsReportedAndNothingRemoved) {
  makeFailingContainers({"a"});
  writeInstallMap();
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call != "isInstalled") return;
    std::filesystem::rename(oldApplicationsPath(), scratch_->path() + "/Applications");
    writeFile(oldApplicationsPath(), "a file now");
  };
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Failed to determine if any items were remaining to migrate: Error "
                 "Domain=POSIXErrorDomain Code=20 ",
                 true));
  EXPECT_TRUE(pathExists(oldApplicationsPath()));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
}

TEST_F(MigrationRun, ProgressCountsEntriesRemovedByIntrospectionAndFinishedContainers) {
  // Bundles without identifiers: those containers are removed and counted by
  // introspection, before any container is migrated.
  for (const char* name : {"x", "y"}) makeBundle(makeContainer(name) + "/x.app", "");
  makeFailingContainers({"a", "b"});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_EQ(migrator->estimatedDuration(), 29.0f);
  EXPECT_EQ(migrator->migrationProgress(), 0.0f);
  std::vector<float> seen;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call == "isInstalled") seen.push_back(migrator->migrationProgress());
  };
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(seen, (std::vector<float>{0.5f, 0.75f}));
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
}

}  // namespace
}  // namespace qstest
