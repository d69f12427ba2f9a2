#include "Platform/Foundation/URL.h"

#include <string>
#include <vector>

#include <gtest/gtest.h>

using platform::URL;
namespace path = platform::path;

namespace {

TEST(URLPaths, SeparatorsAreCollapsedAndTrailingOneDropped) {
  EXPECT_EQ(URL::fileURL("/a//b///c/").path(), "/a/b/c");
  EXPECT_EQ(URL::fileURL("/").path(), "/");
  EXPECT_EQ(URL::fileURL("//").path(), "/");
  EXPECT_TRUE(URL::fileURL("").empty());
  EXPECT_STREQ(URL::fileURL("/a b/\xC3\xA9").fileSystemRepresentation(), "/a b/\xC3\xA9");
}

TEST(URLPaths, DirectoryFlagIsKept) {
  EXPECT_TRUE(URL::fileURL("/a", true).isDirectory());
  EXPECT_FALSE(URL::fileURL("/a/").isDirectory());
}

TEST(URLAppending, ComponentsAndPaths) {
  URL base = URL::fileURL("/private/var", true);
  EXPECT_EQ(base.appending("mobile").path(), "/private/var/mobile");
  EXPECT_EQ(base.appending("Library/Caches/x.plist").path(), "/private/var/Library/Caches/x.plist");
  EXPECT_EQ(base.appending("/leading").path(), "/private/var/leading");
  EXPECT_EQ(base.appending("trailing/").path(), "/private/var/trailing");
  EXPECT_EQ(base.appending("").path(), "/private/var");
  EXPECT_EQ(URL::fileURL("/").appending("a").path(), "/a");
  EXPECT_TRUE(base.appending("d", true).isDirectory());
  EXPECT_FALSE(base.appending("f").isDirectory());
}

TEST(URLAppending, PathExtension) {
  URL file = URL::fileURL("/a/Name");
  EXPECT_EQ(file.appendingPathExtension("app").path(), "/a/Name.app");
  EXPECT_TRUE(URL::fileURL("/a/b", true).appendingPathExtension("d").isDirectory());
}

TEST(URLComponents, LastComponentAndExtension) {
  EXPECT_EQ(URL::fileURL("/a/App.app").lastPathComponent(), "App.app");
  EXPECT_EQ(URL::fileURL("/").lastPathComponent(), "/");
  EXPECT_EQ(URL().lastPathComponent(), "");
  EXPECT_EQ(URL::fileURL("/a/App.app").pathExtension(), "app");
  EXPECT_EQ(URL::fileURL("/a/archive.tar.gz").pathExtension(), "gz");
  EXPECT_EQ(URL::fileURL("/a/.profile").pathExtension(), "");
  EXPECT_EQ(URL::fileURL("/a/name.").pathExtension(), "");
  EXPECT_EQ(URL::fileURL("/a.d/name").pathExtension(), "");
  EXPECT_EQ(URL::fileURL("/a/B.APP").pathExtension(), "APP");
}

TEST(URLComponents, ParentIsADirectory) {
  URL parent = URL::fileURL("/a/b/c.plist").deletingLastPathComponent();
  EXPECT_EQ(parent.path(), "/a/b");
  EXPECT_TRUE(parent.isDirectory());
  EXPECT_EQ(URL::fileURL("/a").deletingLastPathComponent().path(), "/");
  EXPECT_EQ(URL::fileURL("/").deletingLastPathComponent().path(), "/");
  EXPECT_TRUE(URL().deletingLastPathComponent().empty());
}

TEST(URLDescription, FileSchemeWithTrailingSlashForDirectories) {
  EXPECT_EQ(URL::fileURL("/a/b").description(), "file:///a/b");
  EXPECT_EQ(URL::fileURL("/a/b", true).description(), "file:///a/b/");
  EXPECT_EQ(URL::fileURL("/", true).description(), "file:///");
}

TEST(URLEquality, ComparesPathsOnly) {
  EXPECT_EQ(URL::fileURL("/a", true), URL::fileURL("/a/"));
  EXPECT_NE(URL::fileURL("/a"), URL::fileURL("/A"));
  EXPECT_LT(URL::fileURL("/a"), URL::fileURL("/b"));
}

TEST(PathHelpers, ComponentsAsThePlatformSplitsThem) {
  EXPECT_EQ(path::components("/a//b/"), (std::vector<std::string>{"/", "a", "b", "/"}));
  EXPECT_EQ(path::components("/"), (std::vector<std::string>{"/"}));
  EXPECT_EQ(path::components("a/b"), (std::vector<std::string>{"a", "b"}));
  EXPECT_TRUE(path::components("").empty());
}

TEST(PathHelpers, JoinUsesOneSeparator) {
  EXPECT_EQ(path::join("/a", "b"), "/a/b");
  EXPECT_EQ(path::join("/a/", "/b"), "/a/b");
  EXPECT_EQ(path::join("/a", ""), "/a");
  EXPECT_EQ(path::join("", "b"), "/b");
}

}  // namespace
