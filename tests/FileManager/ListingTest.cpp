#include <dirent.h>

#include <algorithm>
#include <set>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/QuillsetAdditions.h"

namespace {

using platform::Error;
using platform::URL;
using qstest::fileURL;

constexpr char kListFn[] = "-[QSFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]";

class FileManagerListing : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
    ASSERT_TRUE(qstest::makeDirs(dir / "sub"));
    ASSERT_EQ(symlink("sub", (dir / "link-to-dir").c_str()), 0);
    ASSERT_EQ(symlink("nowhere", (dir / "dangling").c_str()), 0);
  }
  // name -> is-directory flag of the listed URL
  static std::map<std::string, bool> flags(const std::vector<URL>& urls) {
    std::map<std::string, bool> out;
    for (const URL& u : urls) out[u.lastPathComponent()] = u.isDirectory();
    return out;
  }
  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"listing"};
};

TEST_F(FileManagerListing, ListsChildrenWithDirectoryFlagOnlyOnRealDirectories) {
  Error error = qstest::untouchedSentinel();
  auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), false, &error);
  ASSERT_TRUE(urls.has_value());
  EXPECT_EQ(flags(*urls),
            (std::map<std::string, bool>{{"file", false}, {"sub", true}, {"link-to-dir", false}, {"dangling", false}}));
  for (const URL& u : *urls) EXPECT_EQ(u.deletingLastPathComponent().path(), dir.path());
  EXPECT_TRUE(error.is("Sentinel", 99));
}

TEST_F(FileManagerListing, IgnoringSymlinksLeavesThemOutWithNoticeLines) {
  qstest::LogCapture log;
  auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), true);
  ASSERT_TRUE(urls.has_value());
  EXPECT_EQ(flags(*urls), (std::map<std::string, bool>{{"file", false}, {"sub", true}}));
  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  std::set<std::string> messages;
  for (const auto& line : lines) {
    EXPECT_EQ(line.level, 5);
    EXPECT_EQ(line.function, kListFn);
    messages.insert(line.message);
  }
  EXPECT_EQ(messages, (std::set<std::string>{"Ignoring symlink at " + dir.path() + "/link-to-dir",
                                             "Ignoring symlink at " + dir.path() + "/dangling"}));
}

TEST_F(FileManagerListing, OrderIsTheDirectorysOwnOrder) {
  for (int i = 0; i < 200; ++i) ASSERT_TRUE(qstest::writeFile(dir / ("n" + std::to_string(i)), ""));
  std::vector<std::string> expected;
  DIR* d = opendir(dir.path().c_str());
  ASSERT_NE(d, nullptr);
  while (const dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name != "." && name != "..") expected.push_back(name);
  }
  closedir(d);
  auto urls = fm.urlsForItemsInDirectoryAtURL(fileURL(dir.path(), true), false);
  ASSERT_TRUE(urls.has_value());
  std::vector<std::string> names;
  for (const URL& u : *urls) names.push_back(u.lastPathComponent());
  EXPECT_EQ(names, expected);
}

TEST_F(FileManagerListing, SymbolicLinkToDirectoryIsNotListedThrough) {
  Error error;
  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(fileURL(dir / "link-to-dir"), false, &error).has_value());
  qstest::expectPOSIXError(error, ENOTDIR,
                           "_IterateDirectory for " + dir.path() + "/link-to-dir returned Not a directory", kListFn);
}

TEST_F(FileManagerListing, RegularFileAndMissingPathFailWithTheirErrorNumbers) {
  Error error;
  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(fileURL(dir / "file"), false, &error).has_value());
  qstest::expectPOSIXError(error, ENOTDIR, "_IterateDirectory for " + dir.path() + "/file returned Not a directory",
                           kListFn);
  qstest::LogCapture log;
  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(fileURL(dir / "none"), false, &error).has_value());
  qstest::expectPOSIXError(error, ENOENT,
                           "_IterateDirectory for " + dir.path() + "/none returned No such file or directory", kListFn);
  EXPECT_TRUE(log.systemLines().empty()) << "listing failures are not logged";
}

TEST_F(FileManagerListing, UnreadableDirectoryFailsWithPermissionDenied) {
  ASSERT_EQ(chmod(dir.path().c_str(), 0700), 0);
  const std::string path = dir.path();
  int status = qstest::runAsNobody([&] {
    Error error;
    if (fm.urlsForItemsInDirectoryAtURL(fileURL(path, true), false, &error)) return 1;
    if (!error.isPOSIX(EACCES)) return 2;
    return error.localizedDescription() == "_IterateDirectory for " + path + " returned Permission denied" ? 0 : 3;
  });
  EXPECT_EQ(status, 0);
}

TEST(QuillsetAdditions, DotDotCountsOnlyAsAWholeComponent) {
  for (const char* path : {"..", "a/../b", "/..", "../a", "a/..", "a//../"}) {
    EXPECT_TRUE(QuillsetAdditions::containsDotDotPathComponents(path)) << path;
  }
  for (const char* path : {"", "a/...b", "...", "..a", "a..", "a/.b/.", "/a/b/"}) {
    EXPECT_FALSE(QuillsetAdditions::containsDotDotPathComponents(path)) << path;
  }
}

}  // namespace
