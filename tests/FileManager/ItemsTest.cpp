// Existence, link status and listing of single items and directories.
#include <map>

#include "FileLayerTestSupport.h"

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

TEST_F(FileManagerItems, ExistenceAndLinkStatusAreThoseOfTheItemItself) {
  bool isLink = false;
  EXPECT_TRUE(fm.itemExistsAtURL(fileURL(dir / "dangling")) && !fm.itemDoesNotExistAtURL(fileURL(dir / "dangling")));
  EXPECT_TRUE(fm.isSymbolicLinkAtURL(fileURL(dir / "dangling"), &isLink) && isLink);
  EXPECT_TRUE(fm.isSymbolicLinkAtURL(fileURL(dir / "sub"), &isLink) && !isLink);
  EXPECT_TRUE(!fm.itemExistsAtURL(fileURL(dir / "nothing")) && fm.itemDoesNotExistAtURL(fileURL(dir / "nothing")));
  Error error;
  EXPECT_FALSE(fm.isSymbolicLinkAtURL(fileURL(dir / "nothing"), &isLink, &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT));
  // Neither present nor absent: a file in the middle of the path.
  EXPECT_FALSE(fm.itemExistsAtURL(fileURL(dir / "file/below")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(fileURL(dir / "file/below")));
  const std::string line = "Failed to determine if file://" + dir.path() + "/file/below exists: Not a directory";
  EXPECT_EQ(log.systemMessages(), (std::vector<std::string>{line, line})) << "and no line before";
}

// A link is never listed as a directory nor listed through: a walk built on
// the listing would leave the tree.
TEST_F(FileManagerItems, ListingFlagsOnlyRealDirectoriesAndNeverFollowsALink) {
  for (bool ignoringSymlinks : {false, true}) {
    auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), ignoringSymlinks);
    ASSERT_TRUE(urls);
    std::map<std::string, bool> listed, expected{{dir / "file", false}, {dir / "sub", true}};
    for (const URL& url : *urls) listed[url.path()] = url.isDirectory();
    if (!ignoringSymlinks) expected.insert({{dir / "link-to-dir", false}, {dir / "dangling", false}});
    EXPECT_EQ(listed, expected);
  }
  EXPECT_EQ(log.count("Ignoring symlink at " + dir / "link-to-dir"), 1u);
  Error error;
  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(fileURL(dir / "link-to-dir"), false, &error));
  EXPECT_TRUE(error.isPOSIX(ENOTDIR)) << error.description();
}

}  // namespace
