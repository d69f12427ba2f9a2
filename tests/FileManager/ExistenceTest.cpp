

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

using qstest::fileURL;

class FileManagerExistence : public testing::Test {
 protected:
  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"existence"};
};

TEST_F(FileManagerExistence, FileDirectoryAndDanglingLinkExist) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  ASSERT_EQ(symlink("missing-target", (dir / "dangling").c_str()), 0);
  qstest::LogCapture log;
  for (const char* name : {"file", "dangling"}) {
    EXPECT_TRUE(fm.itemExistsAtURL(fileURL(dir / name))) << name;
    EXPECT_FALSE(fm.itemDoesNotExistAtURL(fileURL(dir / name))) << name;
  }
  EXPECT_TRUE(fm.itemExistsAtURL(fileURL(dir.path(), true)));
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(FileManagerExistence, MissingItemIsPositivelyAbsentWithoutLogLine) {
  qstest::LogCapture log;
  EXPECT_FALSE(fm.itemExistsAtURL(fileURL(dir / "nothing")));
  EXPECT_TRUE(fm.itemDoesNotExistAtURL(fileURL(dir / "nothing")));
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(FileManagerExistence, NotADirectoryInThePathIsNeitherPresentNorAbsent) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  platform::URL below = fileURL(dir / "file/below");
  qstest::LogCapture log;
  EXPECT_FALSE(fm.itemExistsAtURL(below));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(below));
  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  std::string expected = "Failed to determine if file://" + dir.path() + "/file/below exists: Not a directory";
  EXPECT_EQ(lines[0].message, expected);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, "-[QSFileManager itemExistsAtURL:]");
  EXPECT_EQ(lines[1].message, expected);
  EXPECT_EQ(lines[1].function, "-[QSFileManager itemDoesNotExistAtURL:]");
}

// Exit codes of the unprivileged child: one bit per failed expectation.
enum : int { kExistsAnswered = 1, kAbsentAnswered = 2, kWrongLines = 4 };

TEST_F(FileManagerExistence, PermissionDeniedOnParentAnswersFalseToBothWithOneLineEach) {
  ASSERT_TRUE(qstest::makeDirs(dir / "private", 0700));
  ASSERT_TRUE(qstest::writeFile(dir / "private/item", "x"));
  const std::string item = dir / "private/item";
  int status = qstest::runAsNobody([&] {
    qstest::LogCapture log;
    int failures = 0;
    if (fm.itemExistsAtURL(fileURL(item))) failures |= kExistsAnswered;
    if (fm.itemDoesNotExistAtURL(fileURL(item))) failures |= kAbsentAnswered;
    const std::string expected = "Failed to determine if file://" + item + " exists: Permission denied";
    auto lines = log.systemMessages();
    if (lines.size() != 2 || lines[0] != expected || lines[1] != expected) failures |= kWrongLines;
    return failures;
  });
  EXPECT_EQ(status, 0);
}

}  // namespace
