#include <filesystem>

#include <gtest/gtest.h>

#include "FakePlatform.h"
#include "Shared/FileManager/QSFileManager.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kIdentifier[] = "com.example.notes";
constexpr char kFunction[] = "-[QSAppMigrator _migrateContainerWithInfo:]";
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
    ASSERT_TRUE(makeDirs(container_ + "/Library/Preferences"));
    platform_->registry.observer = [this](const std::string& call, const std::string& identifier) {
      calls_.push_back(call + " " + identifier);
    };
  }
  void TearDown() override {
    for (const std::string& path : immutable_) setImmutable(path, false);
    MigratorTest::TearDown();
  }
  void makeImmutable(const std::string& path) {
    ASSERT_TRUE(setImmutable(path, true));
    immutable_.push_back(path);
  }
  void create() {
    migrator_ = createMigrator();
    ASSERT_TRUE(migrator_);
    log_->clear();
  }
  Dictionary appInfo() const { return containerInfo(container_, bundle_, kIdentifier, "App"); }
  bool migrate(const Dictionary& info) { return migrator_->_migrateContainerWithInfo(info); }
  void expectKeptWithMarker(const Dictionary& info) {
    ASSERT_TRUE(pathExists(container_));
    const std::optional<Dictionary> marker = readPlist(container_ + "/" + kMarker);
    ASSERT_TRUE(marker);
    EXPECT_EQ(Value(*marker), Value(info));
  }
  std::string dataPath() const { return platform_->registry.dataContainerPath(kIdentifier); }

  std::string container_;
  std::string bundle_;
  std::unique_ptr<QSAppMigrator> migrator_;
  std::vector<std::string> calls_;
  std::vector<std::string> immutable_;
};

TEST_F(ContainerMigration, NewApplicationGetsPlaceholderThenDataThenBundleThenGroups) {
  // A group in the install map, so that the group step consults the registry.
  ASSERT_TRUE(makeDirs(scratch_->path() + "/OldGroups/group.notes"));
  ASSERT_TRUE(writeFile(scratch_->path() + "/OldGroups/group.notes/shared", "s"));
  writePlist(
      oldInstallMapPath(),
      Value(Dictionary{
          {"GroupContainers",
           Value(Dictionary{{"group.notes", Value(Dictionary{{"Container", Value(scratch_->path() +
                                                                                 "/OldGroups/group.notes")}})}})}}));
  writePlist(bundle_ + "/Info.plist",
             Value(Dictionary{{platform::kBundleIdentifierKey, Value(kIdentifier)},
                              {platform::kApplicationGroupsKey, Value(platform::makeStringArray({"group.notes"}))}}));
  create();

  ASSERT_TRUE(migrate(appInfo()));
  EXPECT_EQ(calls_,
            (std::vector<std::string>{"isInstalled com.example.notes", "installBundle com.example.notes",
                                      "recordForIdentifier com.example.notes", "installPackage com.example.notes",
                                      "recordForIdentifier com.example.notes"}));
  EXPECT_FALSE(pathExists(container_));
  EXPECT_EQ(readFile(dataPath() + "/Documents/note.txt"), "remember");
  EXPECT_TRUE(pathExists(dataPath() + "/Library/Preferences"));
  const auto record = platform_->registry.storedRecord(kIdentifier);
  ASSERT_TRUE(record);
  EXPECT_FALSE(record->isPlaceholder);
  EXPECT_TRUE(pathExists(record->bundleURL.path() + "/Info.plist"));
  const std::string newGroup = record->groupContainerURLs->at("group.notes").path();
  EXPECT_EQ(readFile(newGroup + "/shared"), "s");
  EXPECT_TRUE(log_->contains("QSAppMigrator: Moving data from container " + container_ + " to " + dataPath()));
  EXPECT_TRUE(log_->contains("QSAppMigrator: Staging and installing app com.example.notes at " + bundle_ +
                             " (and secondary (null))"));
  EXPECT_TRUE(log_->contains("QSAppMigrator: Removing container for com.example.notes at " + container_));
  for (const auto& line : log_->hostLines()) {
    if (line.message.find("group container") != std::string::npos) continue;
    if (line.message.find("placeholder") != std::string::npos) continue;
    EXPECT_EQ(line.function, kFunction) << line.message;
  }
}

TEST_F(ContainerMigration, InstalledApplicationSkipsThePlaceholder) {
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  ASSERT_TRUE(migrate(appInfo()));
  const auto messages = log_->hostMessages();
  ASSERT_FALSE(messages.empty());
  EXPECT_EQ(messages[0], "QSAppMigrator: App com.example.notes is already installed, so not creating placeholder.");
  EXPECT_EQ(log_->hostLines()[0].level, 5);
  for (const auto& call : platform_->registry.installCalls()) EXPECT_NE(call.call, "installBundle");
}

TEST_F(ContainerMigration, FailedPlaceholderKeepsContainerWithMarker) {
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  create();
  EXPECT_FALSE(migrate(appInfo()));
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(container_ + "/Documents/note.txt"));
  EXPECT_TRUE(pathExists(bundle_));
}

TEST_F(ContainerMigration, VPNContainerWithoutRecordIsKeptAndNotQueried) {
  const std::string plugin = container_ + "/Tunnel.vpnplugin";
  makeBundle(plugin, "com.example.tunnel");
  const Dictionary info = containerInfo(container_, plugin, "com.example.tunnel", "VPNBundle");
  create();
  EXPECT_FALSE(migrate(info));
  EXPECT_TRUE(platform_->registry.isInstalledQueries().empty());
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Failed to get bundle proxy for identifier com.example.tunnel"});
  expectKeptWithMarker(info);
}

TEST_F(ContainerMigration, VPNContainerWithRecordIsStagedAsIs) {
  const std::string plugin = container_ + "/Tunnel.vpnplugin";
  ASSERT_EQ(rename(bundle_.c_str(), plugin.c_str()), 0);
  makeBundle(plugin, "com.example.tunnel");
  platform_->registry.addInstalledApplication("com.example.tunnel");
  const Dictionary info = containerInfo(container_, plugin, "com.example.tunnel", "VPNBundle");
  create();
  EXPECT_TRUE(migrate(info));
  EXPECT_TRUE(platform_->registry.isInstalledQueries().empty());
  EXPECT_FALSE(pathExists(container_));
}

TEST_F(ContainerMigration, RecordWithoutDataContainerWritesSixLines) {
  platform_->registry.addInstalledApplication(kIdentifier, false);
  create();
  EXPECT_FALSE(migrate(appInfo()));
  const auto record = *platform_->registry.storedRecord(kIdentifier);
  auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 7u);
  messages.erase(messages.begin());  // the already-installed line
  EXPECT_EQ(messages, (std::vector<std::string>{
                          "QSAppMigrator: Failed to get data container URL for com.example.notes",
                          "QSAppMigrator: Proxy had bundle identifier com.example.notes",
                          "QSAppMigrator: Proxy had bundle type User",
                          "QSAppMigrator: Proxy had bundle URL " + record.bundleURL.description(),
                          "QSAppMigrator: Proxy had bundle container URL " + record.bundleContainerURL.description(),
                          "QSAppMigrator: Proxy did have backing bundle"}));
  for (size_t i = 1; i < 7; ++i) EXPECT_EQ(log_->hostLines()[i].level, 3);
  expectKeptWithMarker(appInfo());
}

TEST_F(ContainerMigration, RecordWithoutBackingBundleSaysDidNot) {
  platform::BundleRecord record = platform_->registry.addInstalledApplication(kIdentifier, false);
  record.foundBackingBundle = false;
  platform_->registry.setRecord(record);
  create();
  EXPECT_FALSE(migrate(appInfo()));
  EXPECT_EQ(log_->hostMessages().back(), "QSAppMigrator: Proxy did not have backing bundle");
}

TEST_F(ContainerMigration, FailedDataMoveKeepsContainerWithMarker) {
  platform_->registry.addInstalledApplication(kIdentifier);
  makeImmutable(container_ + "/Library");
  create();
  EXPECT_FALSE(migrate(appInfo()));
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(bundle_));
  EXPECT_TRUE(platform_->registry.installCalls().empty());
}

TEST_F(ContainerMigration, PlaceholderBundleOnlyMovesDataAndRemovesContainer) {
  ASSERT_TRUE(QSFileManager::defaultManager().markBundleAsPlaceholder(URL::fileURL(bundle_, true)));
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  EXPECT_TRUE(migrate(appInfo()));
  EXPECT_FALSE(pathExists(container_));
  EXPECT_EQ(readFile(dataPath() + "/Documents/note.txt"), "remember");
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_EQ(calls_,
            (std::vector<std::string>{"isInstalled com.example.notes", "recordForIdentifier com.example.notes"}));
}

TEST_F(ContainerMigration, FailedStagingAfterDataMovedStillRemovesContainer) {
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(migrate(appInfo()));
  EXPECT_FALSE(pathExists(container_));
  EXPECT_EQ(readFile(dataPath() + "/Documents/note.txt"), "remember");
  EXPECT_TRUE(log_->contains("QSAppMigrator: Removing container for com.example.notes at " + container_));
}

TEST_F(ContainerMigration, FailedGroupMigrationKeepsContainerWithMarker) {
  writePlist(oldInstallMapPath(),
             Value(Dictionary{{"GroupContainers", Value(Dictionary{{"group.x", Value(Dictionary{})}})}}));
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  // After the installation the record loses its group-container dictionary.
  int lookups = 0;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call != "recordForIdentifier" || ++lookups != 2) return;
    platform::BundleRecord record = *platform_->registry.storedRecord(kIdentifier);
    record.groupContainerURLs.reset();
    platform_->registry.setRecord(record);
  };
  EXPECT_FALSE(migrate(appInfo()));
  EXPECT_TRUE(log_->contains("QSAppMigrator: Failed to get group container URLs for installed com.example.notes"));
  expectKeptWithMarker(appInfo());
}

TEST_F(ContainerMigration, MissedItemsKeepContainerWithMarker) {
  ASSERT_TRUE(writeFile(container_ + "/Unexpected.bin", "x"));
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  EXPECT_FALSE(migrate(appInfo()));
  expectKeptWithMarker(appInfo());
  EXPECT_TRUE(pathExists(container_ + "/Unexpected.bin"));
  EXPECT_FALSE(log_->contains("Removing container"));
}

TEST_F(ContainerMigration, MarkerThatCannotBeWrittenDoesNotStopTheMigration) {
  ASSERT_TRUE(makeDirs(container_ + "/" + kMarker + "/occupied"));
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  EXPECT_TRUE(migrate(appInfo()));
  const auto lines = log_->hostLines();
  ASSERT_FALSE(lines.empty());
  EXPECT_EQ(lines[0].message,
            "QSAppMigrator: Failed to write out container marker dictionary... hopefully we don't need it to recover.");
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_FALSE(pathExists(container_));
}

TEST_F(ContainerMigration, ResumesWhenTheBundleAlreadyWaitsInStaging) {
  // An attempt interrupted after staging: placeholder installed, data moved,
  // bundle in the package directory.
  platform_->registry.addInstalledApplication(kIdentifier);
  ASSERT_TRUE(makeDirs(container_ + "/Staging/Payload"));
  ASSERT_EQ(rename(bundle_.c_str(), (container_ + "/Staging/Payload/Notes.app").c_str()), 0);
  writePlist(container_ + "/" + kMarker, Value(appInfo()));
  create();
  EXPECT_TRUE(migrate(appInfo()));
  EXPECT_FALSE(pathExists(container_));
  EXPECT_TRUE(pathExists(platform_->registry.storedRecord(kIdentifier)->bundleURL.path() + "/Info.plist"));
}

TEST_F(ContainerMigration, SecondBundleIsNamedInTheStagingLine) {
  const std::string plugin = container_ + "/Tunnel.vpnplugin";
  makeBundle(plugin, "com.example.tunnel");
  platform_->registry.addInstalledApplication(kIdentifier);
  create();
  const Dictionary info = containerInfo(container_, bundle_, kIdentifier, "App", plugin);
  EXPECT_TRUE(migrate(info));
  EXPECT_TRUE(log_->contains("QSAppMigrator: Staging and installing app com.example.notes at " + bundle_ +
                             " (and secondary " + plugin + ")"));
  EXPECT_TRUE(platform_->registry.storedRecord("com.example.tunnel"));
}

TEST_F(ContainerMigration, InfoWithoutRequiredStringsTouchesNothing) {
  create();
  Dictionary info = appInfo();
  info[kQSContainerPathKey] = Value(7);
  EXPECT_FALSE(migrate(info));
  EXPECT_TRUE(calls_.empty());
  EXPECT_FALSE(pathExists(container_ + "/" + kMarker));
  EXPECT_EQ(log_->hostLines().size(), 1u);
}

}  // namespace
}  // namespace qstest
