// The migration run: creation, the host's queries and performMigration.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <thread>

#include "FakePlatform.h"
#include "Platform/Registry/InstallationDaemon.h"

using platform::Dictionary;
using platform::Value;

namespace qstest {
namespace {

constexpr char kReturningFailed[] =
    "QSAppMigrator: Returning migration failed. Please include the contents of /var/mobile/Library/Logs/Quillset "
    "and /var/Mobile/Library/Logs/Transvale in a bug report.";
constexpr char kPerformMigration[] = "-[QSAppMigrator performMigration]";
constexpr char kInit[] = "-[QSAppMigrator init]";

class MigrationRun : public MigratorTest {
 protected:
  std::string versionRecordPath() const { return dataDirectoryPath() + "/AppMigratorLastSystemVersion.plist"; }
  std::string harborMapPath() const { return dataDirectoryPath() + "/SafeHarbor.plist"; }

  // A container holding an application bundle `identifier`.app.
  std::string makeAppContainer(const std::string& name, const std::string& identifier) {
    const std::string container = makeContainer(name);
    makeBundle(container + "/" + identifier + ".app", identifier);
    return container;
  }
  std::string makeVPNContainer(const std::string& name, const std::string& identifier) {
    const std::string container = makeContainer(name);
    makeBundle(container + "/" + identifier + ".vpnplugin", identifier);
    return container;
  }
  void writeInstallMap(const Dictionary& map) { writePlist(oldInstallMapPath(), Value(map)); }
};

// --- Creation ------------------------------------------------------------------------

TEST_F(MigrationRun, CreationWithoutOldApplicationsDirectoryHasNoEntries) {
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->itemsToMigrate().has_value());
  EXPECT_FALSE(migrator->groupContainerMap().has_value());
  EXPECT_FALSE(migrator->harborMap().has_value());
  EXPECT_EQ(migrator->dataClassName(), "QSAppMigrator");
  EXPECT_EQ(migrator->estimatedDuration(), 20.0f);
  EXPECT_EQ(migrator->migrationProgress(), 0.5f);
}

TEST_F(MigrationRun, CreationRemovesEmptyOldApplicationsDirectoryButLeavesInstallMap) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  writeInstallMap(Dictionary{});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->itemsToMigrate().has_value());
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));

  // The re-listing meets ENOENT silently, so this run leaves the map too.
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Failed").empty());
  EXPECT_EQ(migrator->migrationProgress(), 0.5f);
}

TEST_F(MigrationRun, CreationFailsWhenOldApplicationsDirectoryCannotBeListed) {
  // A regular file where the directory should be: it exists but cannot be listed.
  ASSERT_TRUE(makeDirs(std::filesystem::path(oldApplicationsPath()).parent_path().string()));
  ASSERT_TRUE(writeFile(oldApplicationsPath(), "not a directory"));
  EXPECT_EQ(createMigrator(), nullptr);
  auto lines = hostMessagesStartingWith("QSAppMigrator: Failed to get items at file://" + oldApplicationsPath() +
                                        "/ : Error Domain=POSIXErrorDomain Code=20 ");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(log_->hostLines().front().function, kInit);
  EXPECT_EQ(log_->hostLines().front().level, 3);
}

TEST_F(MigrationRun, CreationReportsEntriesAndLoadsGroupContainerMap) {
  makeAppContainer("A", "com.example.a");
  makeAppContainer("B", "com.example.b");
  const Dictionary groups{{"group.example", Value(Dictionary{{"Container", Value("/somewhere/group")}})}};
  writeInstallMap(Dictionary{{"GroupContainers", Value(groups)}, {"Other", Value(1)}});

  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  ASSERT_TRUE(migrator->itemsToMigrate().has_value());
  EXPECT_EQ(migrator->itemsToMigrate()->size(), 2u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: 2 items to migrate"), 1u);
  ASSERT_TRUE(migrator->groupContainerMap().has_value());
  EXPECT_EQ(*migrator->groupContainerMap(), groups);
}

TEST_F(MigrationRun, CreationWithoutInstallMapSaysSo) {
  makeAppContainer("A", "com.example.a");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->groupContainerMap().has_value());
  EXPECT_EQ(hostLineCount("QSAppMigrator: Old install map not found at " + oldInstallMapPath()), 1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: No group container map found in install map"), 0u);
}

TEST_F(MigrationRun, CreationWithInstallMapWhoseGroupContainersIsNotADictionary) {
  makeAppContainer("A", "com.example.a");
  writeInstallMap(Dictionary{{"GroupContainers", Value(platform::makeStringArray({"group.example"}))}});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->groupContainerMap().has_value());
  auto lines = hostLines("QSAppMigrator: No group container map found in install map");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 5);
  EXPECT_EQ(lines[0].category, "Transvaler");
  EXPECT_EQ(lines[0].function, kInit);
}

TEST_F(MigrationRun, CreationSkipsSymbolicLinksAmongEntries) {
  makeAppContainer("A", "com.example.a");
  ASSERT_EQ(symlink("A", (oldApplicationsPath() + "/Link").c_str()), 0);
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  ASSERT_EQ(migrator->itemsToMigrate()->size(), 1u);
  EXPECT_EQ(migrator->itemsToMigrate()->front().lastPathComponent(), "A");
}

TEST_F(MigrationRun, CreationReadsLastSystemVersionRecord) {
  writePlist(versionRecordPath(), Value(Dictionary{{"BuildVersion", Value("20Z999")}}));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_EQ(migrator->lastSystemBuildVersion(), "20Z999");
}

TEST_F(MigrationRun, UnreadableHarborMapIsReportedAndKept) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  ASSERT_TRUE(writeFile(harborMapPath(), "<plist><array>"));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->harborMap().has_value());
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to load existing harbor map from " + harborMapPath()), 1u);

  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(pathExists(harborMapPath()));
  EXPECT_TRUE(platform_->daemon.safeHarborCalls.empty());
}

// --- The host's queries ------------------------------------------------------------------

TEST_F(MigrationRun, EstimatedDurationGrowsByEntry) {
  for (int i = 0; i < 10; ++i) makeAppContainer("C" + std::to_string(i), "com.example.c" + std::to_string(i));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_EQ(migrator->estimatedDuration(), 42.5f);
  EXPECT_EQ(migrator->migrationProgress(), 0.0f);
}

// --- The run -------------------------------------------------------------------------------

TEST_F(MigrationRun, RunWithoutOldLayoutSucceedsAndRecordsSystemVersion) {
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());

  ASSERT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
  EXPECT_EQ(platform_->daemon.dataProtectionCalls[0],
            (Dictionary{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}}));
  EXPECT_EQ(readPlist(versionRecordPath()), platform_->systemVersion.dictionary);
  auto lines = hostLines("QSAppMigrator: Recorded current system version as 21A100");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, kPerformMigration);
  EXPECT_EQ(lines[0].level, 5);
  EXPECT_EQ(hostLineCount(kReturningFailed), 0u);
}

TEST_F(MigrationRun, SuccessfulRunMovesEverythingAndRemovesTheOldLayout) {
  const std::string container = makeAppContainer("A", "com.example.a");
  ASSERT_TRUE(makeDirs(container + "/Documents"));
  ASSERT_TRUE(writeFile(container + "/Documents/letter", "dear"));
  // A VPN plug-in gets no placeholder: it must be known to the registry already.
  makeVPNContainer("B", "com.example.b");
  platform_->registry.addInstalledApplication("com.example.b");
  writeInstallMap(Dictionary{});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  EXPECT_TRUE(migrator->performMigration()) << testing::PrintToString(log_->hostMessages());
  EXPECT_EQ(migrator->countItemsMigrated(), 2u);
  EXPECT_EQ(readFile(platform_->registry.dataContainerPath("com.example.a") + "/Documents/letter"), "dear");
  for (const char* identifier : {"com.example.a", "com.example.b"}) {
    auto record = platform_->registry.storedRecord(identifier);
    ASSERT_TRUE(record.has_value()) << identifier;
    EXPECT_FALSE(record->isPlaceholder) << identifier;
  }
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
  EXPECT_FALSE(pathExists(oldInstallMapPath()));
  EXPECT_EQ(readPlist(versionRecordPath()), platform_->systemVersion.dictionary);
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Failed").empty());
}

TEST_F(MigrationRun, NoteFileAloneIsRemovedAndOldLayoutGoes) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt", "elsewhere"));
  writeInstallMap(Dictionary{});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_EQ(migrator->countItemsMigrated(), 1u);
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
  EXPECT_FALSE(pathExists(oldInstallMapPath()));
  EXPECT_TRUE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, NoteFileNameIsComparedExactly) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/wheredidmyapplicationsgo.txt", "elsewhere"));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  // Not the note: introspected as an entry, found to be a stray file and removed.
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_EQ(hostLineCount("QSAppMigrator: Found regular file at " + oldApplicationsPath() +
                          "/wheredidmyapplicationsgo.txt ; removing"),
            1u);
}

TEST_F(MigrationRun, ApplicationContainersRunFirstInReverseListingOrderThenVPNContainers) {
  makeAppContainer("first", "com.example.first");
  makeVPNContainer("second", "com.example.second");
  makeAppContainer("third", "com.example.third");
  makeVPNContainer("fourth", "com.example.fourth");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  // Expected order from the listing order the migrator saw.
  std::vector<std::string> applications, vpnPlugins;
  for (const auto& entry : *migrator->itemsToMigrate()) {
    const std::string name = entry.lastPathComponent();
    (name == "first" || name == "third" ? applications : vpnPlugins).push_back(name);
  }
  std::reverse(applications.begin(), applications.end());
  std::vector<std::string> expected;
  for (const auto& list : {applications, vpnPlugins}) {
    for (const std::string& name : list) {
      const std::string suffix = name == "first" || name == "third" ? ".app" : ".vpnplugin";
      expected.push_back("QSAppMigrator: Migrating com.example." + name + " at " + oldApplicationsPath() + "/" + name +
                         "/com.example." + name + suffix);
    }
  }

  migrator->performMigration();
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Migrating "), expected);
}

TEST_F(MigrationRun, SymbolicLinkInOldDirectoryIsNeverAnEntryButKeepsTheOldLayout) {
  ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  ASSERT_TRUE(writeFile(oldApplicationsPath() + "/WhereDidMyApplicationsGo.txt", "elsewhere"));
  ASSERT_EQ(symlink("/nowhere", (oldApplicationsPath() + "/Link").c_str()), 0);
  writeInstallMap(Dictionary{});
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(migrator->countItemsMigrated(), 1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: Not removing " + oldInstallMapPath() +
                          " because 1 items remain unmigrated."),
            1u);
  EXPECT_EQ(hostLineCount(kReturningFailed), 1u);
  EXPECT_TRUE(pathExists(oldApplicationsPath() + "/Link"));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, FailedContainerFailsTheRunButOthersAreStillAttempted) {
  makeAppContainer("A", "com.example.a");
  makeAppContainer("B", "com.example.b");
  writeInstallMap(Dictionary{});
  // Both are known to the registry but their records cannot be found: each
  // container fails early and is kept.
  platform_->registry.addInstalledApplication("com.example.a");
  platform_->registry.addInstalledApplication("com.example.b");
  platform_->registry.hideRecordOf = {"com.example.a", "com.example.b"};
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(migrator->countItemsMigrated(), 2u);
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
  for (const char* name : {"a", "b"}) {
    const std::string id = std::string("com.example.") + name;
    const std::string bundle = oldApplicationsPath() + "/" + (name[0] == 'a' ? "A" : "B") + "/" + id + ".app";
    auto failed = hostLines("QSAppMigrator: Migration of " + id + " at " + bundle + " failed");
    ASSERT_EQ(failed.size(), 1u) << id;
    EXPECT_EQ(failed[0].level, 3);
    EXPECT_EQ(failed[0].function, kPerformMigration);
  }
  EXPECT_EQ(hostLineCount("QSAppMigrator: Not removing " + oldInstallMapPath() +
                          " because 2 items remain unmigrated."),
            1u);
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_TRUE(pathExists(oldApplicationsPath() + "/A"));
  EXPECT_TRUE(pathExists(oldApplicationsPath() + "/B"));
  // The daemon's update is made even though the containers failed.
  EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
}

TEST_F(MigrationRun, DataProtectionUpdateFailureAloneFailsTheRun) {
  platform_->daemon.dataProtectionUpdateSucceeds = false;
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  auto lines = hostLines("QSAppMigrator: Failed to update container data protection");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(hostLineCount(kReturningFailed), 1u);
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, RefusedSafeHarborFailsTheRunAfterTheDataProtectionUpdate) {
  writePlist(harborMapPath(), Value(Dictionary{{"com.example.a", Value(Dictionary{{"HarborPathKey", Value("/h")}})}}));
  platform_->daemon.refuseSafeHarborOf = {"com.example.a"};
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(platform_->daemon.dataProtectionCalls.size(), 1u);
  EXPECT_EQ(hostLineCount(kReturningFailed), 1u);
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, UnwritableVersionRecordDoesNotFailTheRun) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  ASSERT_TRUE(setImmutable(dataDirectoryPath(), true));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  const bool result = migrator->performMigration();
  ASSERT_TRUE(setImmutable(dataDirectoryPath(), false));
  EXPECT_TRUE(result);
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to write current build info to " + versionRecordPath()), 1u);
  EXPECT_FALSE(pathExists(versionRecordPath()));
}

TEST_F(MigrationRun, MissingSystemVersionDoesNotFailTheRun) {
  platform_->systemVersion.dictionary.reset();
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to write current build info to " + versionRecordPath()), 1u);
}

TEST_F(MigrationRun, VanishedOldDirectoryAtReListingIsSilent) {
  makeAppContainer("A", "com.example.a");
  platform_->registry.addInstalledApplication("com.example.a");
  platform_->registry.hideRecordOf = {"com.example.a"};
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call == "isInstalled") std::filesystem::remove_all(oldApplicationsPath());
  };
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Failed to determine").empty());
  EXPECT_TRUE(hostMessagesStartingWith("QSAppMigrator: Not removing").empty());
}

TEST_F(MigrationRun, UnlistableOldDirectoryAtReListingIsReportedAndNothingRemoved) {
  makeAppContainer("A", "com.example.a");
  writeInstallMap(Dictionary{});
  platform_->registry.addInstalledApplication("com.example.a");
  platform_->registry.hideRecordOf = {"com.example.a"};
  const std::string movedAway = scratch_->path() + "/Applications";
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call != "isInstalled") return;
    std::filesystem::rename(oldApplicationsPath(), movedAway);
    writeFile(oldApplicationsPath(), "a file now");
  };
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_FALSE(migrator->performMigration());
  auto lines = hostMessagesStartingWith(
      "QSAppMigrator: Failed to determine if any items were remaining to migrate: Error Domain=POSIXErrorDomain "
      "Code=20 ");
  EXPECT_EQ(lines.size(), 1u);
  EXPECT_TRUE(pathExists(oldApplicationsPath()));
  EXPECT_TRUE(pathExists(oldInstallMapPath()));
  EXPECT_EQ(hostLineCount(kReturningFailed), 1u);
}

TEST_F(MigrationRun, ProgressDuringIntrospectionCountsFinishedEntries) {
  // Bundles without identifiers: each container is removed by introspection
  // and counted there.
  for (const char* name : {"A", "B", "C", "D"}) makeBundle(makeContainer(name) + "/x.app", "");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  std::vector<float> seen;
  platform_->bundleReader.onOpen = [&](const platform::URL&) { seen.push_back(migrator->migrationProgress()); };

  EXPECT_TRUE(migrator->performMigration());
  EXPECT_EQ(seen, (std::vector<float>{0.0f, 0.25f, 0.5f, 0.75f}));
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
  EXPECT_FALSE(pathExists(oldApplicationsPath()));
}

TEST_F(MigrationRun, ProgressDuringMigrationCountsFinishedContainers) {
  for (const char* name : {"A", "B", "C", "D"}) {
    const std::string id = std::string("com.example.") + name;
    makeAppContainer(name, id);
    platform_->registry.addInstalledApplication(id);
    platform_->registry.hideRecordOf.insert(id);
  }
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  std::vector<float> seen;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call == "isInstalled") seen.push_back(migrator->migrationProgress());
  };
  EXPECT_FALSE(migrator->performMigration());
  EXPECT_EQ(seen, (std::vector<float>{0.0f, 0.25f, 0.5f, 0.75f}));
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
}

TEST_F(MigrationRun, ProgressCanBeReadFromAnotherThreadWhileRunning) {
  constexpr int kEntries = 40;
  for (int i = 0; i < kEntries; ++i) makeBundle(makeContainer("C" + std::to_string(i)) + "/x.app", "");
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);

  std::atomic<bool> done{false};
  std::vector<float> seen;
  std::thread reader([&] {
    while (!done.load()) seen.push_back(migrator->migrationProgress());
  });
  const bool result = migrator->performMigration();
  done = true;
  reader.join();

  EXPECT_TRUE(result);
  ASSERT_FALSE(seen.empty());
  EXPECT_TRUE(std::is_sorted(seen.begin(), seen.end()));
  EXPECT_GE(seen.front(), 0.0f);
  EXPECT_LE(seen.back(), 1.0f);
  EXPECT_EQ(migrator->migrationProgress(), 1.0f);
}

}  // namespace
}  // namespace qstest
