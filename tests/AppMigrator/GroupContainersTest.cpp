#include <unistd.h>

#include <filesystem>

#include <gtest/gtest.h>

#include "FakePlatform.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kGroupFunction[] = "-[QSAppMigrator _migrateGroupContainersForIdentifier:]";
constexpr char kMoveAllFunction[] = "-[QSAppMigrator _moveAllItemsInGroupContainerURL:toGroupContainerURL:]";

class GroupContainerMigration : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    // The map is loaded only when there is something to migrate.
    makeContainer("C1");
    oldGroups_ = scratch_->path() + "/OldGroups";
    newGroups_ = scratch_->path() + "/NewGroups";
  }
  void TearDown() override {
    for (const std::string& path : immutable_) setImmutable(path, false);
    MigratorTest::TearDown();
  }
  void makeImmutable(const std::string& path) {
    ASSERT_TRUE(setImmutable(path, true));
    immutable_.push_back(path);
  }
  // An old group container with `files`, recorded in the install map.
  std::string addOldGroup(const std::string& group, const std::vector<std::string>& files) {
    const std::string path = oldGroups_ + "/" + group;
    EXPECT_TRUE(makeDirs(path));
    for (const std::string& file : files) EXPECT_TRUE(writeFile(path + "/" + file, "old " + file));
    groupMap_[group] = Value(Dictionary{{"Container", Value(path)}, {"Owner", Value("ignored")}});
    return path;
  }
  void createWithMap(std::optional<Dictionary> groupMap) {
    Dictionary installMap{{"User", Value(Dictionary{})}};
    if (groupMap) installMap["GroupContainers"] = Value(*groupMap);
    writePlist(oldInstallMapPath(), Value(installMap));
    migrator_ = createMigrator();
    ASSERT_TRUE(migrator_);
  }
  // An installed application whose record names these groups' new containers.
  void installWithGroups(const std::string& identifier, const std::vector<std::string>& groups) {
    platform::BundleRecord record = platform_->registry.addInstalledApplication(identifier);
    std::map<std::string, URL> urls;
    for (const std::string& group : groups) {
      EXPECT_TRUE(makeDirs(newGroups_ + "/" + group));
      urls[group] = URL::fileURL(newGroups_ + "/" + group, true);
    }
    record.groupContainerURLs = urls;
    platform_->registry.setRecord(record);
  }
  bool mapHas(const std::string& group) const { return migrator_->groupContainerMap()->count(group) != 0; }

  std::string oldGroups_, newGroups_;
  Dictionary groupMap_;
  std::unique_ptr<QSAppMigrator> migrator_;
  std::vector<std::string> immutable_;
};

TEST_F(GroupContainerMigration, EmptiedMapAsksNothingMore) {
  addOldGroup("group.a", {"f"});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  installWithGroups("com.example.b", {"group.a"});
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  int registryCalls = 0;
  platform_->registry.observer = [&](const std::string&, const std::string&) { ++registryCalls; };
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.b"));
  EXPECT_EQ(registryCalls, 0);
  EXPECT_TRUE(log_->hostLines().empty());
}

TEST_F(GroupContainerMigration, WithoutAMapNothingIsAskedOrLogged) {
  createWithMap(std::nullopt);
  int registryCalls = 0;
  platform_->registry.observer = [&](const std::string&, const std::string&) { ++registryCalls; };
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(registryCalls, 0);
  EXPECT_TRUE(log_->hostLines().empty());
}

TEST_F(GroupContainerMigration, MissingRecordOrGroupURLsFail) {
  addOldGroup("group.a", {"f"});
  createWithMap(groupMap_);
  log_->clear();
  EXPECT_FALSE(migrator_->_migrateGroupContainersForIdentifier("com.example.none"));
  platform::BundleRecord record = platform_->registry.addInstalledApplication("com.example.placeholder");
  record.groupContainerURLs.reset();
  platform_->registry.setRecord(record);
  EXPECT_FALSE(migrator_->_migrateGroupContainersForIdentifier("com.example.placeholder"));
  EXPECT_EQ(log_->hostMessages(),
            (std::vector<std::string>{
                "QSAppMigrator: Failed to get bundle proxy for com.example.none",
                "QSAppMigrator: Failed to get group container URLs for installed com.example.placeholder"}));
  EXPECT_EQ(log_->hostLines()[1].level, 3);
  EXPECT_EQ(log_->hostLines()[1].function, kGroupFunction);
  EXPECT_TRUE(mapHas("group.a"));
}

TEST_F(GroupContainerMigration, ApplicationWithoutGroupsSucceeds) {
  addOldGroup("group.a", {"f"});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {});
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: No group containers to migrate for com.example.a"});
  EXPECT_EQ(log_->hostLines()[0].level, 5);
}

TEST_F(GroupContainerMigration, ItemsReplaceNeverMergeAndOldContainerGoes) {
  const std::string old = addOldGroup("group.a", {"shared.db", "notes.txt"});
  ASSERT_TRUE(makeDirs(old + "/Library/Caches"));
  ASSERT_TRUE(writeFile(old + "/Library/Caches/old.cache", "old"));
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  const std::string fresh = newGroups_ + "/group.a";
  ASSERT_TRUE(writeFile(fresh + "/shared.db", "new"));
  ASSERT_TRUE(makeDirs(fresh + "/Library/Preferences"));
  log_->clear();

  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(readFile(fresh + "/shared.db"), "old shared.db");
  EXPECT_EQ(readFile(fresh + "/notes.txt"), "old notes.txt");
  EXPECT_EQ(directoryNames(fresh + "/Library"), std::vector<std::string>{"Caches"});
  EXPECT_FALSE(pathExists(old));
  EXPECT_FALSE(mapHas("group.a"));
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Migrating group container group.a at file://" + old +
                                     "/ to file://" + fresh + "/"});
}

TEST_F(GroupContainerMigration, GroupSharedByTwoApplicationsIsMovedOnce) {
  const std::string old = addOldGroup("group.shared", {"data"});
  // A group no application names keeps the map from running empty.
  addOldGroup("group.unclaimed", {});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.shared"});
  installWithGroups("com.example.b", {"group.shared"});
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  ASSERT_TRUE(writeFile(newGroups_ + "/group.shared/written-after", "x"));
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.b"));
  EXPECT_EQ(
      log_->hostMessages(),
      std::vector<std::string>{"QSAppMigrator: No group container entry to migrate for com.example.b[group.shared]"});
  EXPECT_EQ(log_->hostLines()[0].level, 5);
  EXPECT_EQ(directoryNames(newGroups_ + "/group.shared"), (std::vector<std::string>{"data", "written-after"}));
  EXPECT_FALSE(pathExists(old));
}

TEST_F(GroupContainerMigration, SymbolicLinkIsMovedAsALink) {
  const std::string old = addOldGroup("group.a", {});
  ASSERT_EQ(symlink("../elsewhere/target", (old + "/link").c_str()), 0);
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  const std::string moved = newGroups_ + "/group.a/link";
  ASSERT_TRUE(std::filesystem::is_symlink(moved));
  EXPECT_EQ(std::filesystem::read_symlink(moved).string(), "../elsewhere/target");
}

TEST_F(GroupContainerMigration, MissingSourceKeepsTheEntry) {
  const std::string old = addOldGroup("group.a", {});
  std::filesystem::remove(old);
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(log_->hostMessages(), std::vector<std::string>{"QSAppMigrator: Missing source group container at " + old});
  EXPECT_EQ(log_->hostLines()[0].level, 3);
  EXPECT_TRUE(mapHas("group.a"));
}

TEST_F(GroupContainerMigration, EntriesOfTheWrongShapeAreSkipped) {
  const std::string old = addOldGroup("group.number", {"f"});
  groupMap_["group.number"] = Value(Dictionary{{"Container", Value(42)}});
  groupMap_["group.dict"] = Value(Dictionary{{"Container", Value(Dictionary{{"Path", Value(old)}})}});
  groupMap_["group.string"] = Value(old);
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.number", "group.dict", "group.string"});
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(
      log_->hostMessages(),
      (std::vector<std::string>{"QSAppMigrator: Failed to get path to group container for com.example.a[group.dict]",
                                "QSAppMigrator: Failed to get path to group container for com.example.a[group.number]",
                                "QSAppMigrator: No group container entry to migrate for com.example.a[group.string]"}));
  EXPECT_TRUE(pathExists(old + "/f"));
}

TEST_F(GroupContainerMigration, ItemThatCannotMoveKeepsTheOldContainer) {
  const std::string old = addOldGroup("group.a", {"movable", "stuck"});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  makeImmutable(old + "/stuck");
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(readFile(newGroups_ + "/group.a/movable"), "old movable");
  EXPECT_EQ(readFile(old + "/stuck"), "old stuck");
  EXPECT_FALSE(mapHas("group.a"));
  const auto lines = log_->hostLines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[1].message.rfind("QSAppMigrator: Failed to move item " + old + "/stuck to " + newGroups_ +
                                       "/group.a/stuck : Error Domain=",
                                   0),
            0u)
      << lines[1].message;
  EXPECT_EQ(lines[1].function, kMoveAllFunction);
  EXPECT_EQ(lines[2].message, "QSAppMigrator: Keeping old group container at " + old + " : 1 items could not be moved");
}

TEST_F(GroupContainerMigration, UnlistableSourceKeepsEntryAndContainer) {
  const std::string old = oldGroups_ + "/group.a";
  ASSERT_TRUE(makeDirs(oldGroups_));
  ASSERT_TRUE(writeFile(old, "a file, not a container"));
  groupMap_["group.a"] = Value(Dictionary{{"Container", Value(old)}});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  const auto lines = log_->hostLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[1].message.rfind("QSAppMigrator: Failed to get all urls in source group container " + old + " : ", 0),
            0u)
      << lines[1].message;
  EXPECT_TRUE(mapHas("group.a"));
  EXPECT_TRUE(pathExists(old));
  EXPECT_FALSE(migrator_->_moveAllItemsInGroupContainerURL(URL::fileURL(old), URL::fileURL(newGroups_)));
}

TEST_F(GroupContainerMigration, OldContainerThatCannotBeRemovedStillLosesItsEntry) {
  const std::string old = addOldGroup("group.a", {"f"});
  createWithMap(groupMap_);
  installWithGroups("com.example.a", {"group.a"});
  makeImmutable(oldGroups_);
  log_->clear();
  EXPECT_TRUE(migrator_->_migrateGroupContainersForIdentifier("com.example.a"));
  EXPECT_EQ(readFile(newGroups_ + "/group.a/f"), "old f");
  EXPECT_FALSE(mapHas("group.a"));
  EXPECT_TRUE(pathExists(old));
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[1].rfind("QSAppMigrator: Failed to remove old group container at " + old + " : ", 0), 0u)
      << messages[1];
}

}  // namespace
}  // namespace qstest
