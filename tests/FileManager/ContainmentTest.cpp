// Path containment on real trees with real links.
#include <limits.h>

#include <random>

#include "FileLayerTestSupport.h"

using platform::URL;

namespace {

std::string realPathOf(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? std::string(buf) : std::string();
}

// In every text {B} is the base, {R} its real path, {T} the directory holding
// the base and {X} the real path of {T}.
class Containment : public qstest::FileLayerTest {
 protected:
  // A fresh base (in a directory of its own) for the next case.
  void newBase() {
    base_ = dir / ("round" + std::to_string(rounds_++) + "/base");
    ASSERT_TRUE(qstest::makeDirs(base_));
    baseReal_ = realPathOf(base_);
    log.clear();
  }
  std::string expand(std::string text) const {
    const std::string top = base_.substr(0, base_.rfind('/'));
    const std::pair<const char*, std::string> keys[] = {
        {"{B}", base_}, {"{R}", baseReal_}, {"{T}", top}, {"{X}", realPathOf(top)}};
    for (const auto& [key, value] : keys) {
      for (size_t at = text.find(key); at != std::string::npos; at = text.find(key, at + value.size()))
        text.replace(at, 3, value);
    }
    return text;
  }
  // Items in order, relative to the base unless absolute: "name/" is a
  // directory, "name -> text" a link, anything else a file.
  void build(const std::vector<std::string>& items) {
    for (const std::string& item : items) {
      const size_t arrow = item.find(" -> ");
      std::string path = expand(item.substr(0, arrow));
      if (path.front() != '/') path = base_ + "/" + path;
      if (arrow != std::string::npos) {
        qstest::makeSymlink(expand(item.substr(arrow + 4)), path);
      } else {
        ASSERT_TRUE(item.back() == '/' ? qstest::makeDirs(path) : qstest::writeFile(path, "x")) << item;
      }
    }
  }
  std::optional<URL> check(const std::string& suspicious, const std::string& base) {
    return fm.realPathForURL(URL::fileURL(expand(suspicious)), URL::fileURL(expand(base), true));
  }
  std::string base_, baseReal_;
  int rounds_ = 0;
};

TEST_F(Containment, RejectionsNameTheirReason) {
  const struct {
    std::vector<std::string> tree;
    std::string suspicious, base, message;
  } cases[] = {
      {{}, "", "{B}", "The base path file://{B}/ and/or suspicious path (null) were nil"},
      // A leading "/private" is dropped from both paths, and from the line.
      {{}, "/private{T}/elsewhere", "/private{B}",
       "supiscious path {T}/elsewhere does not contain base path {B} as a prefix"},
      {{"sub/"}, "{B}/sub/../sub", "{B}", "The suspicious path {B}/sub/../sub contains '..' paths, which are invalid"},
      // "/private" alone is kept as it is; here it does not exist.
      {{}, "/private", "/", "Failed to retrieve realpath for suspicious path /private"},
      {{"inside", "abs -> {B}/inside"}, "{B}/abs", "{B}",
       "Rejecting {B}/abs -> {B}/inside, as absolute symlinks are not allowed"},
      {{"up -> ../d"}, "{B}/up", "{B}", "Rejecting {B}/up -> /../d, as it is points outside or to the base {B}"},
      {{"file"}, "{B}/file/x", "{B}", "Readlink failed: Not a directory"},
      {{}, "{T}/absent/x", "{T}/absent", "Failed to retrieve realpath for base path {T}/absent "},
      // A chain ending in an absolute link is caught by its real path.
      {{"{T}/outside/", "first -> second", "second -> {T}/outside"}, "{B}/first", "{B}",
       "Rejecting {B}/first with base {B} (reals {X}/outside ; {R}) because components diverge at base != outside"},
      // Each link passes the textual check, but "a/sub" is a link to the base,
      // so "a/sub/.." is the directory above it.
      {{"a/", "a/sub -> ..", "escape -> a/sub/.."}, "{B}/escape", "{B}",
       "Rejecting {B}/escape with base {B} because base component count is greater than child component count "
       "(reals {X} ; {R})"},
      // A sibling with the base as text prefix diverges at the last base component.
      {{"{B}x/", "{B}x/f"}, "{B}x/f", "{B}",
       "Rejecting {B}x/f with base {B} (reals {R}x/f ; {R}) because components diverge at base != basex"},
      {{"f"}, "{B}/f", "/",
       "Rejecting {B}/f with base / because real component counts don't make sense (reals {R}/f ; /)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.message);
    ASSERT_NO_FATAL_FAILURE(newBase());
    ASSERT_NO_FATAL_FAILURE(build(c.tree));
    EXPECT_FALSE(check(c.suspicious, c.base));
    ASSERT_FALSE(log.systemLines().empty());
    EXPECT_EQ(log.systemMessages().back(), expand(c.message)) << "the last line says why";
  }
}

TEST_F(Containment, AcceptedPathsResolveToTheirRealPlace) {
  const struct {
    std::vector<std::string> tree;
    std::string suspicious, result, base = "{B}";
  } cases[] = {
      {{"sub/e/", "sub/f", "sub/link -> e/../f"}, "{B}/sub/link", "{R}/sub/f"},
      {{"sub/", "sub/top -> .."}, "{B}/sub/top", "{R}"},
      {{"dangling -> not-yet"}, "{B}/dangling", "{R}/dangling"},
      // A missing tail is appended to the real path of what exists.
      {{}, "{B}/new/file", "{R}/new/file"},
      {{"f"}, "/private{B}/f", "{R}/f", "/private{B}"},
      {{"..a/", "..a/b.."}, "{B}/..a/b..", "{R}/..a/b.."},  // names that only begin or end with ".."
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.suspicious);
    ASSERT_NO_FATAL_FAILURE(newBase());
    ASSERT_NO_FATAL_FAILURE(build(c.tree));
    auto result = check(c.suspicious, c.base);
    ASSERT_TRUE(result);
    EXPECT_EQ(result->path(), expand(c.result));
  }
}

// Random trees of directories, files and links whose texts mix names, ".",
// "..", missing names and absolute paths inside and outside the base: what is
// accepted lies inside the base and is the path's real place.
TEST_F(Containment, RandomTreesNeverLetAPathOut) {
  const std::string outside = dir / "outside";
  ASSERT_TRUE(qstest::makeDirs(outside));
  static const char* const kNames[] = {"a0", "b1", "c2", "d0", "new", "missing", "..", "."};
  size_t accepted = 0, rejected = 0;
  for (uint32_t seed = 1; seed <= 40; ++seed) {
    ASSERT_NO_FATAL_FAILURE(newBase());
    std::mt19937 rng(seed);
    auto pick = [&](const std::vector<std::string>& v) { return v[rng() % v.size()]; };
    auto name = [&](unsigned among) { return std::string(kNames[rng() % among]); };
    std::vector<std::string> dirs{base_}, all{base_};
    for (int i = 0; i < 24; ++i) {
      const std::string path = pick(dirs) + "/" + name(4);
      if (qstest::exists(path)) continue;
      const unsigned kind = rng() % 6;  // directory, file, absolute link inside or out, relative link
      if (kind == 0 && mkdir(path.c_str(), 0755) == 0) dirs.push_back(path);
      if (kind == 1) qstest::writeFile(path, "x");
      std::string text = kind == 2 ? pick(all) : kind == 3 ? outside : "";
      for (unsigned p = kind < 4 ? 0 : 1 + rng() % 4; p > 0; --p) text += (text.empty() ? "" : "/") + name(8);
      if (kind >= 2) qstest::makeSymlink(text, path);
      all.push_back(path);
    }
    for (int i = 0; i < 60; ++i) {
      std::string suspicious = pick(all);
      for (unsigned extra = rng() % 3; extra > 0; --extra) suspicious += "/" + name(8);
      auto result = fm.realPathForURL(URL::fileURL(suspicious), URL::fileURL(base_, true));
      ++(result ? accepted : rejected);
      if (!result) continue;
      const std::string real = realPathOf(suspicious);
      const bool inside = result->path() == baseReal_ || result->path().rfind(baseReal_ + "/", 0) == 0;
      EXPECT_TRUE(inside && (real.empty() || real == result->path()))
          << "seed " << seed << ": " << suspicious << " -> " << result->path() << " (really " << real << ")";
    }
  }
  // Both outcomes must actually occur for the property to mean anything.
  EXPECT_GT(accepted, 100u);
  EXPECT_GT(rejected, 100u);
}

}  // namespace
