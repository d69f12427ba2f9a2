// Moving the user's data into the new data container, and the check for items
// left behind.
#include <unistd.h>

#include "FakePlatform.h"

using platform::URL;

namespace qstest {
namespace {

constexpr char kMoveFunction[] = "-[QSAppMigrator _migrateDataContainerForIdentifier:fromURL:toURL:]";
constexpr char kMissedFunction[] = "-[QSAppMigrator _containerHasMissedItems:withIdentifier:]";

class DataMove : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    migrator_ = createMigrator();
    ASSERT_NE(migrator_, nullptr);
    oldContainer_ = scratch_->path() + "/old";
    newContainer_ = scratch_->path() + "/new";
    ASSERT_TRUE(makeDirs(oldContainer_));
    ASSERT_TRUE(makeDirs(newContainer_));
  }

  bool move() {
    return migrator_->_migrateDataContainerForIdentifier("com.example.a", URL::fileURL(oldContainer_, true),
                                                         URL::fileURL(newContainer_, true));
  }
  bool missed(const std::string& container) {
    return migrator_->_containerHasMissedItems(URL::fileURL(container, true), "com.example.a");
  }

  std::unique_ptr<QSAppMigrator> migrator_;
  std::string oldContainer_, newContainer_;
};

TEST_F(DataMove, ExistingItemsMoveAndAbsentOnesLeaveTheDestinationAlone) {
  ASSERT_TRUE(makeDirs(oldContainer_ + "/Documents"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/Documents/letter", "dear"));
  ASSERT_TRUE(makeDirs(oldContainer_ + "/tmp"));
  ASSERT_TRUE(makeDirs(newContainer_ + "/Library"));
  ASSERT_TRUE(writeFile(newContainer_ + "/Library/prefs", "kept"));

  EXPECT_TRUE(move());
  EXPECT_EQ(readFile(newContainer_ + "/Documents/letter"), "dear");
  EXPECT_TRUE(pathExists(newContainer_ + "/tmp"));
  EXPECT_EQ(readFile(newContainer_ + "/Library/prefs"), "kept");
  EXPECT_FALSE(pathExists(newContainer_ + "/Tillbox"));
  EXPECT_EQ(directoryNames(oldContainer_), std::vector<std::string>{});
  EXPECT_TRUE(log_->hostMessages().empty());
}

TEST_F(DataMove, DestinationItemIsReplacedNeverMerged) {
  ASSERT_TRUE(makeDirs(oldContainer_ + "/Documents"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/Documents/old", "old"));
  ASSERT_TRUE(makeDirs(newContainer_ + "/Documents/nested"));
  ASSERT_TRUE(writeFile(newContainer_ + "/Documents/fresh", "fresh"));
  ASSERT_TRUE(writeFile(newContainer_ + "/Documents/nested/deep", "deep"));

  EXPECT_TRUE(move());
  EXPECT_EQ(directoryNames(newContainer_ + "/Documents"), std::vector<std::string>{"old"});
}

TEST_F(DataMove, RegularFileUnderADataNameIsMovedToo) {
  ASSERT_TRUE(writeFile(oldContainer_ + "/Tillbox", "a file"));
  EXPECT_TRUE(move());
  EXPECT_EQ(readFile(newContainer_ + "/Tillbox"), "a file");
}

TEST_F(DataMove, FailedMoveStopsAtOnceAndKeepsWhatMoved) {
  for (const char* name : {"Documents", "Library", "tmp", "Tillbox"}) {
    ASSERT_TRUE(makeDirs(oldContainer_ + "/" + name));
    ASSERT_TRUE(writeFile(oldContainer_ + "/" + name + "/file", name));
  }
  // An immutable directory cannot be renamed.
  ASSERT_TRUE(setImmutable(oldContainer_ + "/Library", true));
  const bool result = move();
  ASSERT_TRUE(setImmutable(oldContainer_ + "/Library", false));

  EXPECT_FALSE(result);
  EXPECT_EQ(readFile(newContainer_ + "/Documents/file"), "Documents");
  EXPECT_FALSE(pathExists(newContainer_ + "/Library"));
  EXPECT_FALSE(pathExists(newContainer_ + "/tmp"));
  EXPECT_EQ(directoryNames(oldContainer_), (std::vector<std::string>{"Library", "Tillbox", "tmp"}));
  auto lines = hostMessagesStartingWith("QSAppMigrator: Failed to move file://" + oldContainer_ +
                                        "/Library/ to file://" + newContainer_ +
                                        "/Library/ migrating for com.example.a : Error Domain=POSIXErrorDomain Code=1 ");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(log_->hostLines().back().function, kMoveFunction);
  EXPECT_EQ(log_->hostLines().back().level, 3);
}

TEST_F(DataMove, DataReachesAContainerOnAnotherFileSystem) {
  TempDirOnSharedMemory other;
  ASSERT_TRUE(makeDirs(oldContainer_ + "/Documents"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/Documents/letter", "dear"));
  EXPECT_TRUE(migrator_->_migrateDataContainerForIdentifier("com.example.a", URL::fileURL(oldContainer_, true),
                                                            URL::fileURL(other.path(), true)));
  EXPECT_EQ(readFile(other.path() + "/Documents/letter"), "dear");
  EXPECT_FALSE(pathExists(oldContainer_ + "/Documents"));
}

TEST_F(DataMove, OnlyBookkeepingItemsLeftIsNoMiss) {
  ASSERT_TRUE(writeFile(oldContainer_ + "/com.vantrel.quill.set.container_migrator.plist", "x"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/com.vantrel.quill.set.migration_marker", "x"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/com.vantrel.quillset.placeholder", "x"));
  EXPECT_FALSE(missed(oldContainer_));
  EXPECT_TRUE(log_->hostMessages().empty());
}

TEST_F(DataMove, EmptyContainerIsNoMiss) { EXPECT_FALSE(missed(oldContainer_)); }

TEST_F(DataMove, SymbolicLinkIsAMissedItem) {
  ASSERT_EQ(symlink("/nowhere", (oldContainer_ + "/link").c_str()), 0);
  EXPECT_TRUE(missed(oldContainer_));
  auto lines = hostLines("QSAppMigrator: Found missed items in " + oldContainer_ + " for com.example.a: (file://" +
                         oldContainer_ + "/link)");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, kMissedFunction);
  EXPECT_EQ(lines[0].level, 3);
}

TEST_F(DataMove, BookkeepingNameInOtherCaseIsAMissedItem) {
  ASSERT_TRUE(writeFile(oldContainer_ + "/COM.vantrel.quill.set.migration_marker", "x"));
  EXPECT_TRUE(missed(oldContainer_));
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Found missed items in ").size(), 1u);
}

TEST_F(DataMove, LeftoverStagingDirectoryIsAMissedItem) {
  ASSERT_TRUE(makeDirs(oldContainer_ + "/Staging/Payload"));
  ASSERT_TRUE(writeFile(oldContainer_ + "/com.vantrel.quill.set.container_migrator.plist", "x"));
  EXPECT_TRUE(missed(oldContainer_));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Found missed items in " + oldContainer_ + " for com.example.a: (file://" +
                          oldContainer_ + "/Staging/)"),
            1u);
}

TEST_F(DataMove, MissingContainerCountsAsMissedItems) {
  const std::string gone = scratch_->path() + "/gone";
  EXPECT_TRUE(missed(gone));
  EXPECT_EQ(hostMessagesStartingWith("QSAppMigrator: Failed to enumerate container " + gone +
                                     " for com.example.a : Error Domain=POSIXErrorDomain Code=2 ")
                .size(),
            1u);
}

}  // namespace
}  // namespace qstest
