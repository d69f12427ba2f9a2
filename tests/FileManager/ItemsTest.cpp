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
    ASSERT_NO_FATAL_FAILURE(qstest::makeTree(dir.path(), {"file", "sub/"}));
    qstest::makeSymlink("sub", dir / "link-to-dir");
    qstest::makeSymlink("nowhere", dir / "dangling");
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
  Error error = qstest::kUntouched;
  for (const auto& [name, expected] :
       {std::pair{"link-to-dir", true}, {"dangling", true}, {"sub", false}, {"file", false}}) {
    bool isLink = !expected;
    EXPECT_TRUE(fm.isSymbolicLinkAtURL(fileURL(dir / name), &isLink, &error) && isLink == expected) << name;
  }
  EXPECT_TRUE(error.is("Sentinel", 99));
  bool isLink = true;
  EXPECT_FALSE(fm.isSymbolicLinkAtURL(fileURL(dir / "missing"), &isLink, &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT) && isLink) << "flag written on failure";
}

TEST_F(FileManagerItems, ListingFlagsOnlyRealDirectoriesAndCanLeaveLinksOut) {
  for (bool ignoringSymlinks : {false, true}) {
    auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), ignoringSymlinks);
    ASSERT_TRUE(urls);
    std::map<std::string, bool> listed, expected{{dir / "file", false}, {dir / "sub", true}};
    for (const URL& url : *urls) listed[url.path()] = url.isDirectory();
    if (!ignoringSymlinks) expected.insert({{dir / "link-to-dir", false}, {dir / "dangling", false}});
    EXPECT_EQ(listed, expected);
  }
  EXPECT_EQ(log.count("Ignoring symlink at " + dir / "link-to-dir"), 1u);
  EXPECT_EQ(log.count("Ignoring symlink at " + dir / "dangling"), 1u);
  EXPECT_EQ(log.systemLines().size(), 2u);
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
  for (const char* path : {"..", "a/../b", "a//.."}) EXPECT_TRUE(QuillsetAdditions::containsDotDotPathComponents(path));
  for (const char* path : {"a/...b", "..a", "a.."}) EXPECT_FALSE(QuillsetAdditions::containsDotDotPathComponents(path));
}

}  // namespace
