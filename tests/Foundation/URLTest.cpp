#include "Platform/Foundation/URL.h"

#include <string>
#include <vector>

#include <gtest/gtest.h>

using platform::URL;
namespace path = platform::path;

namespace {

TEST(URLPaths, AreNormalisedAndComposed) {
  const URL base = URL::fileURL("/private/var", true);
  const std::pair<std::string, std::string> cases[] = {
      {URL::fileURL("/a//b///c/").path(), "/a/b/c"},
      {URL::fileURL("//").path(), "/"},
      {base.appending("Library/Caches/x.plist").path(), "/private/var/Library/Caches/x.plist"},
      {base.appending("/leading").path(), "/private/var/leading"},
      {base.appending("trailing/").path(), "/private/var/trailing"},
      {base.appending("").path(), "/private/var"},
      {URL::fileURL("/").appending("a").path(), "/a"},
      {URL::fileURL("/a/Name").appendingPathExtension("app").path(), "/a/Name.app"},
      {URL::fileURL("/a/b/c.plist").deletingLastPathComponent().path(), "/a/b"},
      {URL::fileURL("/a").deletingLastPathComponent().path(), "/"},
      {URL::fileURL("/").deletingLastPathComponent().path(), "/"},
      {URL::fileURL("/").lastPathComponent(), "/"},
      {URL().lastPathComponent(), ""},
      {URL::fileURL("/a/archive.tar.gz").pathExtension(), "gz"},
      {URL::fileURL("/a/.profile").pathExtension(), ""},
      {URL::fileURL("/a/name.").pathExtension(), ""},
      {URL::fileURL("/a.d/name").pathExtension(), ""},
      {URL::fileURL("/a/B.APP").pathExtension(), "APP"},
      {URL::fileURL("/a/b").description(), "file:///a/b"},
      {URL::fileURL("/a/b", true).description(), "file:///a/b/"},
      {URL::fileURL("/", true).description(), "file:///"},
      {path::join("/a/", "/b"), "/a/b"},
      {path::join("/a", ""), "/a"},
      {path::join("", "b"), "/b"},
  };
  for (const auto& [produced, expected] : cases) EXPECT_EQ(produced, expected);
  EXPECT_TRUE(URL::fileURL("").empty());
  EXPECT_TRUE(URL().deletingLastPathComponent().empty());
  EXPECT_STREQ(URL::fileURL("/a b/\xC3\xA9").fileSystemRepresentation(), "/a b/\xC3\xA9");
}

TEST(URLPaths, DirectoryFlagFollowsTheOperationButNotEquality) {
  EXPECT_FALSE(URL::fileURL("/a/").isDirectory());
  EXPECT_TRUE(URL::fileURL("/private/var").appending("d", true).isDirectory());
  EXPECT_FALSE(URL::fileURL("/private/var", true).appending("f").isDirectory());
  EXPECT_TRUE(URL::fileURL("/a/b", true).appendingPathExtension("d").isDirectory());
  EXPECT_TRUE(URL::fileURL("/a/b/c").deletingLastPathComponent().isDirectory());
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

}  // namespace
