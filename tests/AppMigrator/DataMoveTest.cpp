// Moving the user's data into the new data container, and the check for items
// left behind.
#include <stdlib.h>

#include "FakePlatform.h"

namespace qstest {
namespace {

class DataMove : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    ASSERT_TRUE(makeMigrator());
    old_ = scratch_->path() + "/old";
    new_ = scratch_->path() + "/new";
    ASSERT_TRUE(makeDirs(old_) && makeDirs(new_));
  }
  bool move(const std::string& to) {
    return migrator_->_migrateDataContainerForIdentifier("com.example.a", URL::fileURL(old_, true),
                                                         URL::fileURL(to, true));
  }
  bool missed(const std::string& container) {
    return migrator_->_containerHasMissedItems(URL::fileURL(container, true), "com.example.a");
  }

  std::string old_, new_;
};

TEST_F(DataMove, ItemsReplaceTheirNamesakesEvenOnAnotherFileSystem) {
  ASSERT_TRUE(makeDirs(old_ + "/Documents") && writeFile(old_ + "/Documents/old", "old"));
  ASSERT_TRUE(writeFile(old_ + "/Tillbox", "a file"));
  // /dev/shm is another file system than the test root's.
  char other[] = "/dev/shm/qs-migrator.XXXXXX";
  ASSERT_TRUE(mkdtemp(other));
  const std::string to = other;
  EXPECT_TRUE(makeDirs(to + "/Documents/nested") && writeFile(to + "/Documents/nested/deep", "deep"));
  EXPECT_TRUE(makeDirs(to + "/Library") && writeFile(to + "/Library/prefs", "kept"));

  EXPECT_TRUE(move(to));
  EXPECT_EQ(directoryNames(to + "/Documents"), std::vector<std::string>{"old"});
  EXPECT_EQ(readFile(to + "/Tillbox"), "a file");
  // Absent items leave the destination's alone.
  EXPECT_EQ(readFile(to + "/Library/prefs"), "kept");
  EXPECT_EQ(directoryNames(old_), std::vector<std::string>{});
  EXPECT_TRUE(log_->hostMessages().empty());
  std::filesystem::remove_all(to);
}

TEST_F(DataMove, FailedMoveStopsAtOnceAndKeepsWhatMoved) {
  for (const char* name : {"Documents", "Library", "tmp", "Tillbox"}) {
    ASSERT_TRUE(makeDirs(old_ + "/" + name) && writeFile(old_ + "/" + name + "/file", name));
  }
  // An immutable directory cannot be renamed.
  makeImmutable(old_ + "/Library");
  EXPECT_FALSE(move(new_));
  EXPECT_EQ(readFile(new_ + "/Documents/file"), "Documents");
  EXPECT_EQ(directoryNames(new_), std::vector<std::string>{"Documents"});
  EXPECT_EQ(directoryNames(old_), (std::vector<std::string>{"Library", "Tillbox", "tmp"}));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to move file://" + old_ + "/Library/ to file://" + new_ +
                             "/Library/ migrating for com.example.a : Error Domain=POSIXErrorDomain Code=1 ",
                         true));
}

TEST_F(DataMove, OnlyBookkeepingItemsMayStayBehindInAContainerThatCanBeListed) {
  for (const char* name : {"com.vantrel.quill.set.container_migrator.plist", "com.vantrel.quill.set.migration_marker",
                           "com.vantrel.quillset.placeholder"}) {
    ASSERT_TRUE(writeFile(old_ + "/" + name, "x"));
  }
  EXPECT_FALSE(missed(old_));
  EXPECT_TRUE(log_->hostMessages().empty());

  // A link is an item like any other.
  ASSERT_EQ(symlink("/nowhere", (new_ + "/link").c_str()), 0);
  EXPECT_TRUE(missed(new_));
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Found missed items in " + new_ + " for com.example.a: (file://" + new_ + "/link)"));

  // A container that cannot be looked into must be kept.
  const std::string gone = scratch_->path() + "/gone";
  EXPECT_TRUE(missed(gone));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to enumerate container " + gone +
                             " for com.example.a : Error Domain=POSIXErrorDomain Code=2 ",
                         true));
}

}  // namespace
}  // namespace qstest
