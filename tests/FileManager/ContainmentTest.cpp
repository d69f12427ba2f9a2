// Path containment on real trees with real links.
#include <limits.h>

#include <cstdint>
#include <random>
#include <vector>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/QuillsetAdditions.h"
#include "Shared/Support/QSLog.h"

using platform::URL;

namespace {

constexpr char kRealPathFn[] = "-[QSFileManager realPathForURL:ifChildOfURL:]";

std::string realPathOf(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? std::string(buf) : std::string();
}

bool isInside(const std::string& path, const std::string& base) {
  return path == base || path.rfind(base + "/", 0) == 0;
}

// Installs a log handle for the scope so that level-7 lines are written.
class DebugLogHandle {
 public:
  explicit DebugLogHandle(int level) {
    handle_.level = level;
    previous_ = gLogHandle.exchange(&handle_);
  }
  ~DebugLogHandle() { gLogHandle.store(previous_); }

 private:
  platform::LogHandle handle_;
  platform::LogHandle* previous_ = nullptr;
};

class Containment : public testing::Test {
 protected:
  void SetUp() override {
    base_ = tmp_ / "base";
    ASSERT_TRUE(qstest::makeDirs(base_));
    baseReal_ = realPathOf(base_);
    ASSERT_FALSE(baseReal_.empty());
  }

  std::optional<URL> check(const std::string& suspicious, const std::string& base) {
    return fm_.realPathForURL(URL::fileURL(suspicious), URL::fileURL(base, true));
  }
  std::optional<URL> check(const std::string& suspicious) { return check(suspicious, base_); }

  // The only level-3 line of realPathForURL, which must be the last line.
  std::string lastLine() {
    auto lines = log_.systemLines();
    if (lines.empty()) return "";
    EXPECT_EQ(lines.back().function, kRealPathFn);
    EXPECT_EQ(lines.back().level, kQSLogLevelError);
    return lines.back().message;
  }

  QSFileManager& fm_ = QSFileManager::defaultManager();
  qstest::TempDir tmp_{"containment"};
  qstest::LogCapture log_;
  std::string base_;
  std::string baseReal_;
};

// --- The depth check ----------------------------------------------------------

using ContainmentDepth = Containment;

TEST_F(ContainmentDepth, CountsNamesLessParentsFromZero) {
  std::string path = "/a/b/./c/../d";
  uint32_t depth = 99;
  EXPECT_TRUE(fm_._validateSymlink(&path, 0, &depth));
  EXPECT_EQ(depth, 3u);
}

TEST_F(ContainmentDepth, ClimbingBelowTheStartFailsWithoutWritingTheEndingDepth) {
  std::string path = "/a/../../b/c/d";
  uint32_t depth = 99;
  EXPECT_FALSE(fm_._validateSymlink(&path, 5, &depth));
  EXPECT_EQ(depth, 99u);
}

TEST_F(ContainmentDepth, TheFirstStepBelowFailsEvenWhenLaterStepsClimbBack) {
  std::string path = "../a/b";
  EXPECT_FALSE(fm_._validateSymlink(&path, 1, nullptr));
}

TEST_F(ContainmentDepth, StartingDepthIsComparedAsSigned) {
  // 0xFFFFFFFF is -1: a single ".." goes to -2, below the start.
  std::string up = "/..";
  EXPECT_FALSE(fm_._validateSymlink(&up, UINT32_MAX, nullptr));
  std::string name = "/x";
  uint32_t depth = 99;
  EXPECT_TRUE(fm_._validateSymlink(&name, UINT32_MAX, &depth));
  EXPECT_EQ(depth, 0u);
}

// --- Textual layers -----------------------------------------------------------

using ContainmentText = Containment;

TEST_F(ContainmentText, MissingArgumentIsRejected) {
  EXPECT_FALSE(fm_.realPathForURL(URL(), URL::fileURL(base_, true)));
  EXPECT_EQ(lastLine(), "The base path file://" + base_ + "/ and/or suspicious path (null) were nil");
  EXPECT_FALSE(fm_.realPathForURL(URL::fileURL(base_ + "/x"), URL()));
  EXPECT_EQ(lastLine(), "The base path (null) and/or suspicious path file://" + base_ + "/x were nil");
}

TEST_F(ContainmentText, PrivatePrefixIsDroppedFromBothPaths) {
  ASSERT_TRUE(qstest::writeFile(base_ + "/f", "x"));
  auto result = check("/private" + base_ + "/f", "/private" + base_);
  ASSERT_TRUE(result);
  EXPECT_EQ(result->path(), baseReal_ + "/f");
  EXPECT_FALSE(result->isDirectory());

  // Messages show the paths without the prefix.
  EXPECT_FALSE(check("/private" + tmp_.path() + "/elsewhere", base_));
  EXPECT_EQ(lastLine(),
            "supiscious path " + tmp_.path() + "/elsewhere does not contain base path " + base_ + " as a prefix");
}

// --- Symbolic links -------------------------------------------------------------

using ContainmentLinks = Containment;

TEST_F(ContainmentLinks, ParentAfterALinkedDirectoryInTheTextIsRejectedByItsRealPath) {
  // Each link passes the textual check on its own, but "a/sub" is itself a
  // link to the base, so "a/sub/.." is the directory above the base.
  ASSERT_TRUE(qstest::makeDirs(base_ + "/a"));
  qstest::makeSymlink("..", base_ + "/a/sub");
  qstest::makeSymlink("a/sub/..", base_ + "/escape");
  EXPECT_FALSE(check(base_ + "/escape"));
  EXPECT_NE(lastLine().find("because base component count is greater than child component count"), std::string::npos);
}

TEST_F(ContainmentLinks, LinkLoopFailsToResolve) {
  qstest::makeSymlink("loop2", base_ + "/loop1");
  qstest::makeSymlink("loop1", base_ + "/loop2");
  std::string suspicious = base_ + "/loop1";
  EXPECT_FALSE(check(suspicious));
  auto messages = log_.systemMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0].rfind("Failed to realpath " + suspicious + " : Too many levels of symbolic links at ", 0), 0u);
  EXPECT_EQ(messages[1], "Failed to retrieve realpath for suspicious path " + suspicious);
}

// --- Real paths -------------------------------------------------------------------

using ContainmentRealPaths = Containment;

TEST_F(ContainmentRealPaths, MissingTailIsAppendedToTheRealPathOfWhatExists) {
  DebugLogHandle debug(kQSLogLevelDebug);
  auto result = check(base_ + "/new/file");
  ASSERT_TRUE(result);
  EXPECT_EQ(result->path(), baseReal_ + "/new/file");
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, kQSLogLevelDebug);
  EXPECT_EQ(lines[0].function, "-[QSFileManager _realPathWhatExistsInPath:]");
  EXPECT_EQ(lines[0].message, "Realpathed " + baseReal_ + " ; appending non-existing components new/file");
}

TEST_F(ContainmentRealPaths, MissingBaseIsRejected) {
  std::string base = tmp_ / "absent";
  EXPECT_FALSE(check(base + "/x", base));
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].function, "-[QSFileManager _realPathForURL:allowNonExistentPathComponents:]");
  EXPECT_EQ(lines[0].message.rfind("Failed to realpath " + base + " : No such file or directory at ", 0), 0u);
  EXPECT_EQ(lines[1].message, "Failed to retrieve realpath for base path " + base + " ");
}

// --- Tables: trees of directories, files and links, and one path to check ------
//
// In every text {B} is the base, {R} its real path, {T} the directory holding
// the base and {X} the real path of {T}. Relative item paths lie below the base.

struct Tree {
  std::vector<std::string> dirs{}, files{};
  std::vector<std::pair<std::string, std::string>> links{};  // text, place
};

struct Rejection {
  Tree tree;
  std::string suspicious, base, message;
};

struct Acceptance {
  Tree tree;
  std::string suspicious, result;
  bool quiet = false;  // no line at all
};

class ContainmentTable : public Containment {
 protected:
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
  std::string place(const std::string& item) const {
    std::string path = expand(item);
    return path.front() == '/' ? path : base_ + "/" + path;
  }
  void build(const Tree& tree) {
    for (const auto& d : tree.dirs) ASSERT_TRUE(qstest::makeDirs(place(d))) << d;
    for (const auto& f : tree.files) ASSERT_TRUE(qstest::writeFile(place(f), "x")) << f;
    for (const auto& [text, at] : tree.links) qstest::makeSymlink(expand(text), place(at));
  }
};

TEST_F(ContainmentTable, RejectionsNameTheirReason) {
  const Rejection cases[] = {
      {{}, "{T}/other/x", "{B}", "supiscious path {T}/other/x does not contain base path {B} as a prefix"},
      {{{"sub"}}, "{B}/sub/../sub", "{B}", "The suspicious path {B}/sub/../sub contains '..' paths, which are invalid"},
      // "/private" alone is kept as it is; here it does not exist.
      {{}, "/private", "/", "Failed to retrieve realpath for suspicious path /private"},
      {{{}, {"inside"}, {{"{B}/inside", "abs"}}},
       "{B}/abs", "{B}", "Rejecting {B}/abs -> {B}/inside, as absolute symlinks are not allowed"},
      {{{}, {}, {{"../d", "up"}}},
       "{B}/up", "{B}", "Rejecting {B}/up -> /../d, as it is points outside or to the base {B}"},
      // The target is the link's directory inside the base followed by the text.
      {{{"c"}, {}, {{"../../d", "c/link"}}},
       "{B}/c/link", "{B}", "Rejecting {B}/c/link -> /c/../../d, as it is points outside or to the base {B}"},
      {{{}, {"file"}}, "{B}/file/x", "{B}", "Readlink failed: Not a directory"},
      // A chain ending in an absolute link is caught by its real path.
      {{{"{T}/outside"}, {}, {{"second", "first"}, {"{T}/outside", "second"}}},
       "{B}/first", "{B}",
       "Rejecting {B}/first with base {B} (reals {X}/outside ; {R}) because components diverge at base != outside"},
      // A sibling with the base as text prefix diverges at the last base component.
      {{{"{B}x"}, {"{B}x/f"}},
       "{B}x/f", "{B}",
       "Rejecting {B}x/f with base {B} (reals {R}x/f ; {R}) because components diverge at base != basex"},
      {{{}, {}, {{"/", "root"}}},
       "{B}/root/tmp", "{B}",
       "Rejecting {B}/root/tmp with base {B} because base component count is greater than child component count "
       "(reals /tmp ; {R})"},
      {{{}, {"f"}},
       "{B}/f", "/",
       "Rejecting {B}/f with base / because real component counts don't make sense (reals {R}/f ; /)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.message);
    qstest::TempDir round("round");
    base_ = round / "base";
    ASSERT_TRUE(qstest::makeDirs(base_));
    baseReal_ = realPathOf(base_);
    ASSERT_NO_FATAL_FAILURE(build(c.tree));
    log_.clear();
    EXPECT_FALSE(check(expand(c.suspicious), expand(c.base)));
    EXPECT_EQ(lastLine(), expand(c.message));
  }
}

TEST_F(ContainmentTable, AcceptedLinksResolveToTheirRealPlace) {
  const Acceptance cases[] = {
      {{{"sub/e"}, {"sub/f"}, {{"e/../f", "sub/link"}}}, "{B}/sub/link", "{R}/sub/f", true},
      {{{"sub"}, {}, {{"..", "sub/top"}}}, "{B}/sub/top", "{R}"},
      {{{}, {}, {{"not-yet", "dangling"}}}, "{B}/dangling", "{R}/dangling"},
      // A dangling absolute link cannot be resolved: the longest prefix that can is used.
      {{{}, {}, {{"{T}/nowhere", "dangling"}}}, "{B}/dangling/x", "{R}/dangling/x"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.suspicious);
    qstest::TempDir round("round");
    base_ = round / "base";
    ASSERT_TRUE(qstest::makeDirs(base_));
    baseReal_ = realPathOf(base_);
    ASSERT_NO_FATAL_FAILURE(build(c.tree));
    log_.clear();
    auto result = check(expand(c.suspicious));
    ASSERT_TRUE(result);
    EXPECT_EQ(result->path(), expand(c.result));
    EXPECT_TRUE(!c.quiet || log_.systemLines().empty());
  }
}

// --- Property: what is accepted lies inside the base -------------------------------

class ContainmentProperty : public Containment {
 protected:
  // A random tree under the base: directories, files and links whose texts
  // mix names, ".", "..", missing names and absolute paths inside and
  // outside the base. Returns every path created.
  std::vector<std::string> buildTree(std::mt19937& rng) {
    std::vector<std::string> dirs{base_};
    std::vector<std::string> all{base_};
    std::vector<std::string> names{"a", "b", "c", "d"};
    const std::string outside = tmp_ / "outside";
    qstest::makeDirs(outside + "/o");
    auto pick = [&](const std::vector<std::string>& v) { return v[rng() % v.size()]; };
    for (int i = 0; i < 24; ++i) {
      std::string parent = pick(dirs);
      std::string path = parent + "/" + pick(names) + std::to_string(i % 3);
      struct stat st;
      if (lstat(path.c_str(), &st) == 0) continue;
      switch (rng() % 4) {
        case 0:
          if (mkdir(path.c_str(), 0755) == 0) dirs.push_back(path);
          break;
        case 1:
          qstest::writeFile(path, "x");
          break;
        default: {
          std::string text;
          switch (rng() % 5) {
            case 0:
              text = pick(rng() % 2 ? dirs : all);
              break;
            case 1:
              text = outside + (rng() % 2 ? "/o" : "");
              break;
            default: {
              int parts = 1 + rng() % 4;
              for (int p = 0; p < parts; ++p) {
                static const char* const kParts[] = {"..", ".", "a0", "b1", "c2", "d0", "missing"};
                text += (p ? "/" : "") + std::string(kParts[rng() % 7]);
              }
            }
          }
          (void)symlink(text.c_str(), path.c_str());  // a collision just leaves fewer links
          break;
        }
      }
      all.push_back(path);
    }
    return all;
  }

  std::string randomSuspicious(std::mt19937& rng, const std::vector<std::string>& all) {
    std::string path = all[rng() % all.size()];
    int extra = rng() % 3;
    static const char* const kParts[] = {"a0", "b1", "c2", "new", "..", "."};
    for (int i = 0; i < extra; ++i) path += "/" + std::string(kParts[rng() % 6]);
    return path;
  }
};

TEST_F(ContainmentProperty, AcceptedPathsResolveInsideTheBase) {
  size_t accepted = 0;
  size_t rejected = 0;
  for (uint32_t seed = 1; seed <= 60; ++seed) {
    qstest::TempDir round("round");
    base_ = round / "base";
    ASSERT_TRUE(qstest::makeDirs(base_));
    baseReal_ = realPathOf(base_);
    std::mt19937 rng(seed);
    std::vector<std::string> all = buildTree(rng);
    for (int i = 0; i < 60; ++i) {
      std::string suspicious = randomSuspicious(rng, all);
      auto result = check(suspicious);
      if (!result) {
        ++rejected;
        continue;
      }
      ++accepted;
      EXPECT_TRUE(isInside(result->path(), baseReal_))
          << "seed " << seed << ": " << suspicious << " accepted as " << result->path();
      std::string real = realPathOf(suspicious);
      if (!real.empty()) {
        EXPECT_TRUE(isInside(real, baseReal_)) << "seed " << seed << ": " << suspicious << " really is " << real;
        EXPECT_EQ(real, result->path()) << "seed " << seed << ": " << suspicious;
      }
    }
    log_.clear();
  }
  // Both outcomes must actually occur for the property to mean anything.
  EXPECT_GT(accepted, 100u);
  EXPECT_GT(rejected, 100u);
}

}  // namespace
