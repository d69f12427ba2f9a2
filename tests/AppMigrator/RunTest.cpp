// The migration run: creation, the host's queries, performMigration and the
// safe harbors it registers.
#include <algorithm>
#include <deque>

#include "FakePlatform.h"
#include "support/ImageSupport.h"

namespace qstest {
namespace {

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
  // An unreadable safe-harbor map is nothing to do, and stays.
  ASSERT_TRUE(makeDirs(dataDirectoryPath()) && writeFile(harborMapPath(), "<plist><array>"));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));

  // The re-listing meets ENOENT silently, so this run leaves the install map.
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Failed"),
            std::vector<std::string>{"QSAppMigrator: Failed to load existing harbor map from " + harborMapPath()});
  EXPECT_TRUE(pathExists(harborMapPath()));
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
  const std::string oldGroup = scratch_->path() + "/group.a";
  ASSERT_TRUE(makeDirs(oldGroup) && writeFile(oldGroup + "/shared", "s"));
  writeInstallMap(Dictionary{
      {"GroupContainers", Value(Dictionary{{"group.a", Value(Dictionary{{"Container", Value(oldGroup)}})}})}});
  platform_->registry.groupsOf["com.example.a"] = {"group.a"};
  // A VPN plug-in gets no placeholder: it must be known to the registry already.
  makeBundleContainer("B", "com.example.b", "vpnplugin");
  platform_->registry.addInstalledApplication("com.example.b");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  EXPECT_TRUE(migrator->performMigration()) << testing::PrintToString(log_->hostMessages());
  EXPECT_EQ(migrator->countItemsMigrated(), 2u);
  // Placeholder, data, bundle, then groups.
  std::vector<std::string> callsForA;
  std::ranges::copy_if(platform_->registry.calls, std::back_inserter(callsForA),
                       [](const std::string& call) { return call.ends_with(" com.example.a"); });
  EXPECT_EQ(callsForA, (std::vector<std::string>{"isInstalled com.example.a", "installBundle com.example.a",
                                                 "recordForIdentifier com.example.a", "installPackage com.example.a",
                                                 "recordForIdentifier com.example.a"}));
  const std::string data = platform_->registry.dataContainerPath("com.example.a");
  EXPECT_EQ(readFile(data + "/Documents/letter"), "dear");
  EXPECT_EQ(directoryNames(platform_->registry.records.at("com.example.a").bundleContainerURL.path()),
            (std::vector<std::string>{"Tunnel.vpnplugin", "com.example.a.app"}));
  EXPECT_EQ(
      readFile(platform_->registry.records.at("com.example.a").groupContainerURLs->at("group.a").path() + "/shared"),
      "s");
  EXPECT_FALSE(pathExists(oldGroup));
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
  std::deque<std::string> expected;
  for (const auto& entry : *migrator->itemsToMigrate()) {
    const std::string name = entry.lastPathComponent();
    const bool isApp = name == "first" || name == "third";
    const std::string line = "QSAppMigrator: Migrating com.example." + name + " at " + oldApplicationsPath() + "/" +
                             name + "/com.example." + name + (isApp ? ".app" : ".vpnplugin");
    isApp ? expected.push_front(line) : expected.push_back(line);
  }
  migrator->performMigration();
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Migrating "), std::vector(expected.begin(), expected.end()));
}

TEST_F(MigrationRun, SymbolicLinkInOldDirectoryIsNeverAnEntryButKeepsTheOldLayout) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt", "elsewhere"));
  ASSERT_EQ(symlink("/nowhere", (oldApplicationsPath() + "/Link").c_str()), 0);
  // A group-container entry of the wrong type is no map at all.
  writeInstallMap(Dictionary{{"GroupContainers", Value(platform::makeStringArray({"group.example"}))}});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  ASSERT_EQ(migrator->itemsToMigrate()->size(), 1u);
  EXPECT_FALSE(migrator->groupContainerMap().has_value());

  EXPECT_FALSE(migrator->performMigration());
  // The note is removed and counted without being introspected.
  EXPECT_EQ(migrator->countItemsMigrated(), 1u);
  EXPECT_FALSE(pathExists(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt"));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Found regular file").empty());
  EXPECT_TRUE(loggedOnce(remainLine(1)));
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Returning migration failed. Please include the contents of "
                 "/var/mobile/Library/Logs/Quillset and /var/Mobile/Library/Logs/Transvale in a bug report."));
  EXPECT_TRUE(pathExists(oldApplicationsPath() + "/Link"));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, FailedContainerFailsTheRunButOthersAreStillAttemptedAndCounted) {
  // Bundles without identifiers: those containers are removed and counted by
  // introspection, before any container is migrated.
  for (const char* name : {"x", "y"}) makeBundle(makeContainer(name) + "/x.app", "");
  makeFailingContainers({"a", "b"});
  writeInstallMap();
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

// --- Safe harbors, registered from the safe-harbor map ---------------------------

class SafeHarbors : public MigratorTest {
 protected:
  static Value entry(const Value& path) { return Value(Dictionary{{"HarborPathKey", path}}); }
  bool migrate(const Dictionary& map) {
    writePlist(harborMapPath(), Value(map));
    auto migrator = createMigrator();
    return migrator && migrator->_migrateSafeHarbors();
  }
};

TEST_F(SafeHarbors, EveryEntryIsRegisteredWithTypeTwoAndNoOptionsAndTheMapGoes) {
  EXPECT_TRUE(
      migrate(Dictionary{{"com.example.a", entry(Value("/harbor/a"))}, {"com.example.b", entry(Value("/harbor/b"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls,
            (std::vector<std::string>{"com.example.a /harbor/a 2", "com.example.b /harbor/b 2"}));
  EXPECT_FALSE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, RefusedRegistrationKeepsTheMapAndTheOthersAreStillTried) {
  platform_->daemon.refuseSafeHarborOf = {"com.example.b"};
  EXPECT_FALSE(migrate(Dictionary{{"com.example.a", entry(Value("/harbor/a"))},
                                  {"com.example.b", entry(Value("/harbor/b"))},
                                  {"com.example.c", entry(Value("/harbor/c"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls.size(), 3u);
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Failed to migrate safe harbor for identifier com.example.b at /harbor/b : (null)"));
  EXPECT_TRUE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, MalformedEntriesAreSkippedAndTheMapStillGoes) {
  EXPECT_TRUE(migrate(Dictionary{{"com.example.array", Value(platform::makeStringArray({"/harbor"}))},
                                 {"com.example.number", entry(Value(3))},
                                 {"com.example.good", entry(Value("/harbor/good"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls, std::vector<std::string>{"com.example.good /harbor/good 2"});
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor info for identifier com.example.array"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor path from harbor entry for com.example.number : " +
                         entry(Value(3)).description()));
  EXPECT_FALSE(pathExists(harborMapPath()));
}

}  // namespace
}  // namespace qstest
