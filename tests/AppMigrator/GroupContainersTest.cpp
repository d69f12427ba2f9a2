// Group containers: emptied into the new ones the registry names, removed, and
// dropped from the map, without ever losing an item that could not be moved.
#include <sys/xattr.h>

#include "FakePlatform.h"
#include "Platform/FileTree/CopyTree.h"
#include "Shared/FileManager/QSFileManager.h"

namespace qstest {
namespace {

class GroupContainerMigration : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    // The map is loaded only when there is something to migrate.
    makeContainer("C1");
    oldGroups_ = scratch_->path() + "/OldGroups";
    newGroups_ = scratch_->path() + "/containers/Shared";  // where the registry makes them
  }
  // An old group container with `files`, recorded in the install map.
  std::string addOldGroup(const std::string& group, const std::vector<std::string>& files) {
    const std::string path = oldGroups_ + "/" + group;
    EXPECT_TRUE(makeDirs(path));
    for (const std::string& file : files) EXPECT_TRUE(writeFile(path + "/" + file, "old " + file));
    groupMap_[group] = Value(Dictionary{{"Container", Value(path)}, {"Owner", Value("ignored")}});
    return path;
  }
  // Creates the migrator with groupMap_ and installs `identifier` with these groups.
  void createAndInstall(const std::string& identifier, const std::vector<std::string>& groups) {
    writeInstallMap(Dictionary{{"GroupContainers", Value(groupMap_)}});
    ASSERT_TRUE(makeMigrator());
    platform_->registry.groupsOf[identifier] = groups;
    platform_->registry.addInstalledApplication(identifier);
    log_->clear();
  }
  bool migrate(const std::string& identifier) { return migrator_->_migrateGroupContainersForIdentifier(identifier); }
  bool mapHas(const std::string& group) const { return migrator_->groupContainerMap()->count(group) != 0; }

  std::string oldGroups_, newGroups_;
  Dictionary groupMap_;
};

TEST_F(GroupContainerMigration, ItemsReplaceNeverMergeAndOldContainerGoes) {
  const std::string old = addOldGroup("group.a", {"shared.db", "notes.txt"});
  ASSERT_TRUE(makeDirs(old + "/Library/Caches") && writeFile(old + "/Library/Caches/old.cache", "old"));
  createAndInstall("com.example.a", {"group.a"});
  const std::string fresh = newGroups_ + "/group.a";
  ASSERT_TRUE(writeFile(fresh + "/shared.db", "new"));
  ASSERT_TRUE(makeDirs(fresh + "/Library/Preferences"));

  EXPECT_TRUE(migrate("com.example.a"));
  EXPECT_EQ(readFile(fresh + "/shared.db"), "old shared.db");
  EXPECT_EQ(readFile(fresh + "/notes.txt"), "old notes.txt");
  EXPECT_EQ(directoryNames(fresh + "/Library"), std::vector<std::string>{"Caches"});
  EXPECT_FALSE(pathExists(old));
  EXPECT_FALSE(mapHas("group.a"));
}

TEST_F(GroupContainerMigration, EntriesThatCannotBeMovedAreSkippedAndKept) {
  // Entries without a container (or already gone) are met by the end-to-end
  // suite, where groups are shared.
  const std::string number = addOldGroup("group.number", {"f"});
  groupMap_["group.number"] = Value(Dictionary{{"Container", Value(42)}});
  // A file where the group container should be: it cannot be listed.
  const std::string file = oldGroups_ + "/group.file";
  ASSERT_TRUE(writeFile(file, "a file, not a container"));
  groupMap_["group.file"] = Value(Dictionary{{"Container", Value(file)}});
  createAndInstall("com.example.a", {"group.number", "group.file"});

  // The unlistable container keeps the application's container (false).
  EXPECT_FALSE(migrate("com.example.a"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get path to group container for com.example.a[group.number]"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get all urls in source group container " + file + " : ", true));
  EXPECT_TRUE(pathExists(number + "/f"));
  EXPECT_TRUE(pathExists(file));
  EXPECT_TRUE(mapHas("group.number") && mapHas("group.file"));
  EXPECT_FALSE(migrator_->_moveAllItemsInGroupContainerURL(URL::fileURL(file), URL::fileURL(newGroups_)));

  // An application without groups has nothing to migrate; one without a record fails.
  platform_->registry.addInstalledApplication("com.example.b");
  EXPECT_TRUE(migrate("com.example.b"));
  platform_->registry.hideRecordOf.insert("com.example.b");
  EXPECT_FALSE(migrate("com.example.b"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get bundle proxy for com.example.b"));
}

TEST_F(GroupContainerMigration, ItemThatCannotMoveKeepsTheGroupRecordedUntilALaterAttemptMovesIt) {
  const std::string old = addOldGroup("group.a", {"movable", "stuck"});
  createAndInstall("com.example.a", {"group.a"});
  // What a move killed after it set its source aside leaves: the aside, and
  // its complete copy in the new container.
  const std::string fresh = newGroups_ + "/group.a";
  const std::string aside = old + "/" + kQSMoveOutgoingPrefix + "done";
  ASSERT_TRUE(writeFile(aside, "old done") && writeFile(fresh + "/done", "old done"));
  const std::string token = "t1", mark = std::string(platform::fs::kMoveAttributePrefix) + "aside",
                    ticket = std::string(platform::fs::kMoveAttributePrefix) + "ticket";
  ASSERT_EQ(lsetxattr(aside.c_str(), mark.c_str(), token.data(), token.size(), 0), 0) << strerror(errno);
  ASSERT_EQ(lsetxattr((fresh + "/done").c_str(), ticket.c_str(), token.data(), token.size(), 0), 0);
  ASSERT_TRUE(setImmutable(old + "/stuck", true));  // cleared below, or by the scratch directory
  EXPECT_FALSE(migrate("com.example.a"));
  EXPECT_EQ(readFile(fresh + "/movable"), "old movable");
  EXPECT_EQ(readFile(old + "/stuck"), "old stuck");
  EXPECT_EQ(directoryNames(old), std::vector<std::string>{"stuck"});
  EXPECT_EQ(readFile(fresh + "/done"), "old done");
  EXPECT_FALSE(pathExists(fresh + "/" + kQSMoveOutgoingPrefix + "done"));
  EXPECT_TRUE(mapHas("group.a"));
  EXPECT_TRUE(loggedOnce(
      "QSAppMigrator: Failed to move item " + old + "/stuck to " + fresh + "/stuck : Error Domain=", true));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Keeping old group container at " + old + " : 1 items could not be moved"));

  ASSERT_TRUE(setImmutable(old + "/stuck", false));
  EXPECT_TRUE(migrate("com.example.a"));
  EXPECT_EQ(readFile(fresh + "/stuck"), "old stuck");
  EXPECT_FALSE(pathExists(old) || mapHas("group.a"));
}

}  // namespace
}  // namespace qstest
