// Existence, link status and listing of single items and directories.
#include <map>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QuillsetAdditions.h"

namespace {

using platform::Error;
using platform::URL;
using qstest::fileURL;

// file, sub/, link-to-dir -> sub, dangling -> nowhere
class FileManagerItems : public qstest::FileLayerTest {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
    ASSERT_TRUE(qstest::makeDirs(dir / "sub"));
    qstest::makeSymlink("sub", dir / "link-to-dir");
    qstest::makeSymlink("nowhere", dir / "dangling");
  }
  // name -> is-directory flag of each listed URL
  std::optional<std::map<std::string, bool>> list(bool ignoringSymlinks) {
    auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), ignoringSymlinks);
    if (!urls) return std::nullopt;
    std::map<std::string, bool> out;
    for (const URL& u : *urls) {
      EXPECT_EQ(u.deletingLastPathComponent().path(), dir.path());
      out[u.lastPathComponent()] = u.isDirectory();
    }
    return out;
  }
};

TEST_F(FileManagerItems, ExistenceIsThatOfTheItemItselfAndUnknownWhenItCannotBeTold) {
  for (const char* name : {"file", "dangling", "sub"}) {
    EXPECT_TRUE(fm.itemExistsAtURL(fileURL(dir / name)) && !fm.itemDoesNotExistAtURL(fileURL(dir / name))) << name;
  }
  EXPECT_TRUE(!fm.itemExistsAtURL(fileURL(dir / "nothing")) && fm.itemDoesNotExistAtURL(fileURL(dir / "nothing")));
  EXPECT_TRUE(log.systemLines().empty());
  // Neither present nor absent: a file in the middle of the path.
  EXPECT_FALSE(fm.itemExistsAtURL(fileURL(dir / "file/below")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(fileURL(dir / "file/below")));
  const std::string line = "Failed to determine if file://" + dir.path() + "/file/below exists: Not a directory";
  EXPECT_EQ(log.systemMessages(), (std::vector<std::string>{line, line}));
}

TEST_F(FileManagerItems, LinkStatusIsThatOfTheItemItself) {
  Error error = qstest::untouchedSentinel();
  for (const auto& [name, expected] : {std::pair{"link-to-dir", true}, {"dangling", true}, {"sub", false}, {"file", false}}) {
    bool isLink = !expected;
    EXPECT_TRUE(fm.isSymbolicLinkAtURL(fileURL(dir / name), &isLink, &error) && isLink == expected) << name;
  }
  EXPECT_TRUE(error.is("Sentinel", 99));
  bool isLink = true;
  EXPECT_FALSE(fm.isSymbolicLinkAtURL(fileURL(dir / "missing"), &isLink, &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT) && isLink) << "flag written on failure";
}

TEST_F(FileManagerItems, ListingFlagsOnlyRealDirectoriesAndCanLeaveLinksOut) {
  EXPECT_EQ(list(false),
            (std::map<std::string, bool>{{"file", false}, {"sub", true}, {"link-to-dir", false}, {"dangling", false}}));
  EXPECT_TRUE(log.systemLines().empty());
  EXPECT_EQ(list(true), (std::map<std::string, bool>{{"file", false}, {"sub", true}}));
  EXPECT_EQ(log.count("Ignoring symlink at " + dir / "link-to-dir"), 1u);
  EXPECT_EQ(log.count("Ignoring symlink at " + dir / "dangling"), 1u);
}

TEST_F(FileManagerItems, ListingFailsOnAnythingButADirectoryWithoutALine) {
  for (const auto& [name, code] : {std::pair{"link-to-dir", ENOTDIR}, {"file", ENOTDIR}, {"none", ENOENT}}) {
    Error error;
    EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(fileURL(dir / name), false, &error).has_value());
    EXPECT_TRUE(error.isPOSIX(code)) << error.description();
  }
  EXPECT_TRUE(log.systemLines().empty());
}

TEST(QuillsetAdditions, DotDotCountsOnlyAsAWholeComponent) {
  for (const char* path : {"..", "a/../b", "a//../"}) EXPECT_TRUE(QuillsetAdditions::containsDotDotPathComponents(path));
  for (const char* path : {"", "a/...b", "..a", "a.."}) EXPECT_FALSE(QuillsetAdditions::containsDotDotPathComponents(path));
}

}  // namespace
