#include "Platform/Foundation/URL.h"

#include <gtest/gtest.h>

namespace {

using platform::URL;

TEST(URLPaths, AreNormalisedComposedAndSplitAtTheEdges) {
  const URL base = URL::fileURL("/private/var", true);
  const std::pair<std::string, std::string> cases[] = {
      {URL::fileURL("/a//b///c/").path() + URL::fileURL("//").path(), "/a/b/c/"},
      {base.appending("/leading").path() + base.appending("trailing/").path(),
       "/private/var/leading/private/var/trailing"},
      {URL::fileURL("/").appending("a").path() + URL::fileURL("/").deletingLastPathComponent().path(), "/a/"},
      {URL::fileURL("/a/archive.tar.gz").pathExtension() + URL::fileURL("/a/.profile").pathExtension(), "gz"},
      {URL::fileURL("/a/name.").pathExtension() + URL::fileURL("/a.d/name").pathExtension(), ""},
      {URL::fileURL("/a/b", true).description() + " " + URL::fileURL("/", true).description(), "file:///a/b/ file:///"},
      {platform::path::join("/a/", "/b") + platform::path::join("", "b"), "/a/b/b"},
  };
  for (const auto& [produced, expected] : cases) EXPECT_EQ(produced, expected);
  EXPECT_TRUE(URL::fileURL("/a/b/c").deletingLastPathComponent().isDirectory());
  EXPECT_FALSE(base.appending("f").isDirectory());
  EXPECT_EQ(URL::fileURL("/a", true), URL::fileURL("/a/"));
  EXPECT_EQ(platform::path::components("/a//b/"), (std::vector<std::string>{"/", "a", "b", "/"}));
}

}  // namespace
