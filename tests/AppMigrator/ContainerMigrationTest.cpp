// The per-container migration: what happens to the container, its data and
// its marker at each step and on each failure.
#include "FakePlatform.h"
#include "Shared/FileManager/QSFileManager.h"

namespace qstest {
namespace {

constexpr char kIdentifier[] = "com.example.notes";
constexpr char kMarker[] = "com.vantrel.quill.set.container_migrator.plist";

class ContainerMigration : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    container_ = makeContainer("C1");
    bundle_ = container_ + "/Notes.app";
    makeBundle(bundle_, kIdentifier);
    ASSERT_TRUE(makeDirs(container_ + "/Documents"));
    ASSERT_TRUE(writeFile(container_ + "/Documents/note.txt", "remember"));
  }
  // Creates the migrator and runs it on `info` (the application's by default).
  bool migrate(const std::optional<Dictionary>& info = std::nullopt) {
    EXPECT_TRUE(makeMigrator());
    log_->clear();
    return migrator_ && migrator_->_migrateContainerWithInfo(info ? *info : appInfo());
  }
  Dictionary appInfo() const { return containerInfo(container_, bundle_, kIdentifier, "App"); }
  void expectKeptWithMarker(const Dictionary& info) {
    ASSERT_TRUE(pathExists(container_));
    EXPECT_EQ(readPlist(container_ + "/" + kMarker), info);
  }
  std::string dataPath() const { return platform_->registry.dataContainerPath(kIdentifier); }

  std::string container_;
  std::string bundle_;
};

TEST_F(ContainerMigration, FailedPlaceholderOrRecordWithoutDataContainerKeepsContainerWithMarker) {
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(migrate());
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(container_ + "/Documents/note.txt"));
  EXPECT_TRUE(pathExists(bundle_));

  platform_->registry.addInstalledApplication(kIdentifier, false);
  EXPECT_FALSE(migrate());
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get data container URL for com.example.notes"));
  EXPECT_EQ(log_->hostMessages().back(), "QSAppMigrator: Proxy did have backing bundle");
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(container_ + "/Documents/note.txt"));
}

TEST_F(ContainerMigration, VPNContainerWithoutRecordIsKeptAndNotQueried) {
  const std::string plugin = container_ + "/Tunnel.vpnplugin";
  makeBundle(plugin, "com.example.tunnel");
  Dictionary info = containerInfo(container_, plugin, "com.example.tunnel", "VPNBundle");
  // Without the strings it needs, nothing is touched.
  info[kQSContainerPathKey] = Value(7);
  EXPECT_FALSE(migrate(info));
  EXPECT_FALSE(pathExists(container_ + "/" + kMarker));
  info[kQSContainerPathKey] = Value(container_);
  EXPECT_FALSE(migrate(info));
  EXPECT_EQ(platform_->registry.calls, std::vector<std::string>{"recordForIdentifier com.example.tunnel"});
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Failed to get bundle proxy for identifier com.example.tunnel"});
  expectKeptWithMarker(info);
}

TEST_F(ContainerMigration, PlaceholderBundleOnlyMovesDataAndAnUnwritableMarkerDoesNotStopIt) {
  ASSERT_TRUE(QSFileManager::defaultManager().markBundleAsPlaceholder(URL::fileURL(bundle_, true)));
  ASSERT_TRUE(makeDirs(container_ + "/" + kMarker + "/occupied"));
  platform_->registry.addInstalledApplication(kIdentifier);
  EXPECT_TRUE(migrate());
  EXPECT_EQ(log_->hostMessages().at(0),
            "QSAppMigrator: Failed to write out container marker dictionary... hopefully we don't need it to recover.");
  EXPECT_FALSE(pathExists(container_));
  EXPECT_EQ(readFile(dataPath() + "/Documents/note.txt"), "remember");
  EXPECT_TRUE(platform_->registry.installCalls.empty());
}

TEST_F(ContainerMigration, FailedStagingAfterDataMovedStillRemovesContainer) {
  platform_->registry.addInstalledApplication(kIdentifier);
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(migrate());
  EXPECT_FALSE(pathExists(container_));
  EXPECT_EQ(readFile(dataPath() + "/Documents/note.txt"), "remember");
}

TEST_F(ContainerMigration, FailedGroupMigrationKeepsContainerWithMarker) {
  writeInstallMap(Dictionary{{"GroupContainers", Value(Dictionary{{"group.x", Value(Dictionary{})}})}});
  platform_->registry.addInstalledApplication(kIdentifier);
  // After the installation the record loses its group-container dictionary.
  int lookups = 0;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call != "recordForIdentifier" || ++lookups != 2) return;
    platform_->registry.records.at(kIdentifier).groupContainerURLs.reset();
  };
  EXPECT_FALSE(migrate());
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get group container URLs for installed com.example.notes"));
  expectKeptWithMarker(appInfo());
}

TEST_F(ContainerMigration, MissedItemsKeepContainerWithMarker) {
  ASSERT_TRUE(writeFile(container_ + "/Unexpected.bin", "x"));
  platform_->registry.addInstalledApplication(kIdentifier);
  EXPECT_FALSE(migrate());
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(container_ + "/Unexpected.bin"));
}

}  // namespace
}  // namespace qstest
