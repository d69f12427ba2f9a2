// Crash consistency, a concurrent reader and an unwritable database.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "Platform/Foundation/Error.h"
#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::BundleRecord;
using platform::Dictionary;
using platform::Error;

class RegistryRecovery : public RegistryTest {
 protected:
  // Installs `package` in a forked child that kills itself with SIGKILL when
  // the installation reports `status`. True when the child died that way.
  bool installKilledAt(const std::string& package, const std::string& identifier, const std::string& status) {
    pid_t child = fork();
    if (child == 0) {
      auto registry = platform::SQLiteApplicationRegistry::open(root());
      if (!registry) _exit(2);
      registry->installPackage(
          platform::URL::fileURL(package, true), customerOptions(identifier),
          [&](const Dictionary& report) {
            if (report.at(platform::kRegistryProgressStatusKey).description() == status) {
              raise(SIGKILL);
            }
          },
          nullptr);
      _exit(3);  // the installation finished: the kill never came
    }
    int status_ = 0;
    if (child < 0 || waitpid(child, &status_, 0) != child) return false;
    return WIFSIGNALED(status_) && WTERMSIG(status_) == SIGKILL;
  }
};

TEST_F(RegistryRecovery, KilledBeforeTheCommitIsRolledBackWhenOpened) {
  std::string package = makePackage("notes", BundleSpec("com.example.notes").withGroups({"group.notes"}),
                                    BundleSpec("com.example.notes.tunnel"), {"VendraMetadata.plist"});
  ASSERT_TRUE(installKilledAt(package, "com.example.notes", "RegisteringApplication"));
  // The files were moved when the process died.
  EXPECT_FALSE(exists(package + "/Payload/App.app"));
  EXPECT_EQ(entries(bundleContainers()).size(), 2u);

  LogCapture log;
  auto registry = openRegistry();
  EXPECT_TRUE(log.contains("Recovered interrupted installation"));
  EXPECT_FALSE(registry->isInstalled("com.example.notes"));
  EXPECT_FALSE(registry->isInstalled("com.example.notes.tunnel"));
  EXPECT_EQ(readFile(package + "/Payload/App.app/main"), "executable of com.example.notes");
  EXPECT_TRUE(isDirectory(package + "/Payload/Tunnel.vpnplugin"));
  EXPECT_EQ(readFile(package + "/VendraMetadata.plist"), "metadata VendraMetadata.plist");
  EXPECT_TRUE(entries(bundleContainers()).empty());
  EXPECT_TRUE(entries(appDataContainers()).empty());
  EXPECT_TRUE(entries(pluginDataContainers()).empty());
  EXPECT_TRUE(entries(groupContainers()).empty());

  Error error;
  ASSERT_TRUE(install(*registry, package, "com.example.notes", &error)) << error.description();
  EXPECT_TRUE(registry->recordForIdentifier("com.example.notes")->foundBackingBundle);
  EXPECT_TRUE(registry->isInstalled("com.example.notes.tunnel"));
}

TEST_F(RegistryRecovery, KilledWhileStagingKeepsTheDataContainerOfAReinstall) {
  ASSERT_TRUE(installApp(*openRegistry(), BundleSpec("com.example.mail").withVersion("1")));
  std::string data = openRegistry()->recordForIdentifier("com.example.mail")->dataContainerURL->path();
  ASSERT_TRUE(writeFile(data + "/inbox", "mail"));
  std::string package = makePackage("v2", BundleSpec("com.example.mail").withVersion("2"));
  ASSERT_TRUE(installKilledAt(package, "com.example.mail", "StagingFiles"));

  auto registry = openRegistry();
  BundleRecord record = *registry->recordForIdentifier("com.example.mail");
  EXPECT_EQ(record.version, "1");
  EXPECT_TRUE(record.foundBackingBundle);
  EXPECT_EQ(readFile(data + "/inbox"), "mail");
  EXPECT_TRUE(isDirectory(package + "/Payload/App.app"));
  EXPECT_EQ(entries(bundleContainers()).size(), 1u);
}

TEST_F(RegistryRecovery, KilledAfterTheCommitFinishesTheRemovalsWhenOpened) {
  ASSERT_TRUE(installApp(*openRegistry(), BundleSpec("com.example.mail").withVersion("1")));
  std::string oldContainer = openRegistry()->recordForIdentifier("com.example.mail")->bundleContainerURL.path();
  std::string package = makePackage("v2", BundleSpec("com.example.mail").withVersion("2"));
  ASSERT_TRUE(installKilledAt(package, "com.example.mail", "CleaningUp"));
  EXPECT_TRUE(exists(oldContainer));
  EXPECT_TRUE(exists(package));

  auto registry = openRegistry();
  BundleRecord record = *registry->recordForIdentifier("com.example.mail");
  EXPECT_EQ(record.version, "2");
  EXPECT_TRUE(record.foundBackingBundle);
  EXPECT_FALSE(exists(oldContainer));
  EXPECT_FALSE(exists(package));
  // The caller, resuming, stages again and installs: a replay.
  ASSERT_TRUE(makeDirs(package + "/Payload"));
  Error error;
  EXPECT_TRUE(install(*registry, package, "com.example.mail", &error)) << error.description();
}

using RegistryConcurrency = RegistryTest;

TEST_F(RegistryConcurrency, ReadersSeeWholeRecordsWhileAnotherThreadInstalls) {
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.app").withVersion("0").withGroups({"group.g"})));
  const std::string data = registry->recordForIdentifier("com.example.app")->dataContainerURL->path();
  std::atomic<bool> done{false};
  std::atomic<int> inconsistent{0}, lookups{0};
  std::vector<std::thread> readers;
  for (int i = 0; i < 3; ++i) {
    readers.emplace_back([&] {
      while (!done) {
        std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.app");
        bool whole = record && record->dataContainerURL && record->dataContainerURL->path() == data &&
                     record->groupContainerURLs && record->groupContainerURLs->size() == 1 &&
                     record->bundleURL.deletingLastPathComponent() == record->bundleContainerURL &&
                     registry->isInstalled("com.example.app");
        if (!whole) ++inconsistent;
        ++lookups;
      }
    });
  }
  for (const char* v : {"1", "2", "3", "4", "5"}) {
    EXPECT_TRUE(installApp(*registry, BundleSpec("com.example.app").withVersion(v).withGroups({"group.g"})));
  }
  done = true;
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(inconsistent.load(), 0);
  EXPECT_GT(lookups.load(), 0);
  EXPECT_EQ(registry->recordForIdentifier("com.example.app")->version, "5");
  EXPECT_EQ(entries(bundleContainers()).size(), 1u);
}

using RegistryDatabase = RegistryTest;

TEST_F(RegistryDatabase, OpenFailsWhenTheDatabaseDirectoryCannotBeWrittenOrMade) {
  for (const std::string& locked : {at("private/var/db"), databaseDirectory()}) {
    ASSERT_TRUE(makeDirs(locked));
    ASSERT_TRUE(setImmutable(locked, true));
    Error error;
    EXPECT_FALSE(platform::SQLiteApplicationRegistry::open(root(), &error));
    ASSERT_TRUE(setImmutable(locked, false));
    EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorDatabase)) << error.description();
    if (locked == databaseDirectory()) {
      EXPECT_NE(error.localizedDescription().find(databaseDirectory()), std::string::npos) << error.description();
    } else {
      ASSERT_TRUE(error.underlyingError());
      EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM)) << error.description();
    }
  }
}

TEST_F(RegistryDatabase, CommitThatCannotBeWrittenLeavesNothingHalfInstalled) {
  auto registry = openRegistry();
  std::string wal = databaseDirectory() + "/registry.sqlite-wal";
  std::string package = makePackage("notes", BundleSpec("com.example.notes"), {}, {"Manifest.plist"});
  Error error;
  bool installed = registry->installPackage(
      platform::URL::fileURL(package, true), customerOptions("com.example.notes"),
      [&](const Dictionary& report) {
        reports_.push_back(report);
        if (report.at(platform::kRegistryProgressStatusKey).description() == "RegisteringApplication") {
          EXPECT_TRUE(setImmutable(wal, true));
        }
      },
      &error);
  ASSERT_TRUE(setImmutable(wal, false));
  EXPECT_FALSE(installed);
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorDatabase)) << error.description();
  EXPECT_EQ(reportedError(reports_), "DatabaseError");
  EXPECT_TRUE(isDirectory(package + "/Payload/App.app"));
  EXPECT_TRUE(exists(package + "/Manifest.plist"));
  EXPECT_TRUE(entries(bundleContainers()).empty());
  EXPECT_TRUE(entries(appDataContainers()).empty());
  EXPECT_FALSE(registry->isInstalled("com.example.notes"));

  ASSERT_TRUE(install(*registry, package, "com.example.notes", &error)) << error.description();
  EXPECT_TRUE(registry->isInstalled("com.example.notes"));
}

TEST_F(RegistryDatabase, ContainerThatCannotBeMadeLeavesThePackageWhole) {
  auto registry = openRegistry();
  ASSERT_TRUE(makeDirs(bundleContainers()));
  ASSERT_TRUE(setImmutable(bundleContainers(), true));
  std::string package = makePackage("notes", BundleSpec("com.example.notes"));
  Error error;
  EXPECT_FALSE(install(*registry, package, "com.example.notes", &error));
  ASSERT_TRUE(setImmutable(bundleContainers(), false));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorFileOperation)) << error.description();
  EXPECT_TRUE(error.underlyingError() && error.underlyingError()->isPOSIX(EPERM)) << error.description();
  EXPECT_EQ(reportedError(reports_), "FileOperationFailed");
  EXPECT_TRUE(isDirectory(package + "/Payload/App.app"));
  EXPECT_TRUE(entries(appDataContainers()).empty());
  EXPECT_FALSE(registry->isInstalled("com.example.notes"));
}

}  // namespace
}  // namespace qstest
