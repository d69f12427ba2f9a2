// Tree walks, ownership standardisation and symbolic links on real trees.

#include <map>
#include <vector>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;
using Kind = QSTraversalEntry::Kind;

namespace {

constexpr char kStepFn[] = "-[QSFileManager standardizeOwnershipAtURL:toUID:GID:validateSymlinks:error:]_block_invoke";
constexpr char kTraverseFn[] = "-[QSFileManager _traverseDirectory:error:withBlock:]";
constexpr uid_t kForeignUID = 1234;
constexpr gid_t kForeignGID = 5678;
constexpr uid_t kWantedUID = 4321;
constexpr gid_t kWantedGID = 8765;

// The status of `path`, failing the test when there is none.
struct stat statusOf(const std::string& path) {
  struct stat none {};
  auto status = qstest::lstatOf(path);
  EXPECT_TRUE(status) << path;
  return status.value_or(none);
}

mode_t permissions(const std::string& path) {
  return statusOf(path).st_mode & 07777;
}

class TraversalFixture : public testing::Test {
 protected:
  void SetUp() override {
    root_ = tmp_ / "tree";
    ASSERT_TRUE(qstest::makeDirs(root_));
  }

  URL rootURL() const { return URL::fileURL(root_, true); }

  QSFileManager& fm_ = QSFileManager::defaultManager();
  qstest::TempDir tmp_{"traversal"};
  qstest::LogCapture log_;
  std::string root_;
};

// --- The walk ---------------------------------------------------------------------

using TraversalWalk = TraversalFixture;

TEST_F(TraversalWalk, ReportsEveryKindWithFullPathsAndDirectoriesTwice) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/dir"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/dir/file", "x"));
  qstest::makeSymlink("missing", root_ + "/dangling");
  ASSERT_EQ(mkfifo((root_ + "/fifo").c_str(), 0644), 0);

  std::vector<std::pair<std::string, Kind>> seen;
  ASSERT_TRUE(fm_._traverseDirectory(rootURL(), nullptr, [&](const QSTraversalEntry& e, Error*) {
    seen.emplace_back(e.path, e.kind);
    EXPECT_EQ(e.errorNumber, 0);
    return true;
  }));
  std::map<std::string, std::vector<Kind>> byPath;
  for (auto& [path, kind] : seen) byPath[path].push_back(kind);
  EXPECT_EQ(byPath[root_], (std::vector<Kind>{Kind::DirectoryPre, Kind::DirectoryPost}));
  EXPECT_EQ(byPath[root_ + "/dir"], (std::vector<Kind>{Kind::DirectoryPre, Kind::DirectoryPost}));
  EXPECT_EQ(byPath[root_ + "/dir/file"], std::vector<Kind>{Kind::RegularFile});
  EXPECT_EQ(byPath[root_ + "/dangling"], std::vector<Kind>{Kind::SymbolicLink});
  EXPECT_EQ(byPath[root_ + "/fifo"], std::vector<Kind>{Kind::Other});
  EXPECT_EQ(seen.size(), 7u);
  // The root comes first and last; a directory's contents lie between its visits.
  EXPECT_EQ(seen.front().first, root_);
  EXPECT_EQ(seen.back().first, root_);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalWalk, OtherFileSystemsAreReportedButNotEntered) {
  // /dev/shm is a file system of its own mounted inside /dev.
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::writeFile(shm / "inside", "x"));
  struct stat dev = statusOf("/dev");
  struct stat mount = statusOf("/dev/shm");
  if (dev.st_dev == mount.st_dev) GTEST_SKIP() << "/dev/shm is not a mount point here";

  std::vector<Kind> mountVisits;
  bool entered = false;
  ASSERT_TRUE(fm_._traverseDirectory(URL::fileURL("/dev", true), nullptr, [&](const QSTraversalEntry& e, Error*) {
    if (e.path == "/dev/shm") mountVisits.push_back(e.kind);
    if (e.path.rfind("/dev/shm/", 0) == 0) entered = true;
    return true;
  }));
  EXPECT_EQ(mountVisits, (std::vector<Kind>{Kind::DirectoryPre, Kind::DirectoryPost}));
  EXPECT_FALSE(entered);
}

TEST_F(TraversalWalk, RefusingStepStopsTheWalkWithItsError) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/a/b"));
  int calls = 0;
  Error error;
  EXPECT_FALSE(fm_._traverseDirectory(rootURL(), &error, [&](const QSTraversalEntry& e, Error* stepError) {
    ++calls;
    if (e.path == root_ + "/a") {
      *stepError = Error("StepDomain", 7);
      return false;
    }
    return true;
  }));
  EXPECT_EQ(calls, 2);
  EXPECT_TRUE(error.is("StepDomain", 7));
}

TEST_F(TraversalWalk, MissingRootIsAnErrorEntry) {
  std::string missing = tmp_ / "absent";
  Error error;
  bool called = false;
  EXPECT_FALSE(fm_._traverseDirectory(URL::fileURL(missing, true), &error, [&](const QSTraversalEntry&, Error*) {
    called = true;
    return true;
  }));
  EXPECT_FALSE(called);
  EXPECT_TRUE(error.isPOSIX(ENOENT));
  EXPECT_EQ(error.localizedDescription(), "Error for path " + missing + ": No such file or directory");
  EXPECT_EQ(error.userInfo().at(QSFunctionNameErrorKey), platform::Value(kTraverseFn));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalWalk, UnopenableWalkFails) {
  Error error;
  EXPECT_FALSE(fm_._traverseDirectory(URL(), &error, [](const QSTraversalEntry&, Error*) { return true; }));
  EXPECT_TRUE(error.isPOSIX(ENOENT));
  EXPECT_EQ(error.localizedDescription(), "fts_open failed for  with error No such file or directory");
}

TEST_F(TraversalWalk, UnreadableDirectoryIsHandedToTheStep) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/closed"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/closed/hidden", "x"));
  ASSERT_EQ(chmod((root_ + "/closed").c_str(), 0700), 0);
  const std::string root = root_;
  int status = qstest::runAsNobody([&] {
    int unreadable = 0, hidden = 0;
    bool ok = QSFileManager::defaultManager()._traverseDirectory(
        URL::fileURL(root, true), nullptr, [&](const QSTraversalEntry& e, Error*) {
          if (e.path == root + "/closed" && e.kind == Kind::DirectoryPost && e.errorNumber == EACCES) ++unreadable;
          if (e.path == root + "/closed/hidden") ++hidden;
          return true;
        });
    if (!ok) return 1;
    if (unreadable != 1) return 2;
    if (hidden != 0) return 3;
    return 0;
  });
  EXPECT_EQ(status, 0);
}

// --- Ownership standardisation -------------------------------------------------------

using TraversalStandardize = TraversalFixture;

TEST_F(TraversalStandardize, StandardTreeIsLeftUntouched) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/dir"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/dir/file", "x"));
  for (const char* rel : {"", "/dir", "/dir/file"}) {
    std::string path = root_ + rel;
    ASSERT_EQ(lchown(path.c_str(), kWantedUID, kWantedGID), 0);
  }
  ASSERT_EQ(chmod((root_ + "/dir/file").c_str(), 0644), 0);
  ASSERT_EQ(chmod(root_.c_str(), 0755), 0);
  ASSERT_EQ(chmod((root_ + "/dir").c_str(), 0755), 0);
  usleep(20000);  // a change would now show as a later ctime
  std::map<std::string, struct timespec> before;
  for (const char* rel : {"", "/dir", "/dir/file"}) before[rel] = statusOf(root_ + rel).st_ctim;

  Error error;
  ASSERT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, true, &error));
  for (auto& [rel, ctime] : before) {
    struct timespec now = statusOf(root_ + rel).st_ctim;
    EXPECT_TRUE(now.tv_sec == ctime.tv_sec && now.tv_nsec == ctime.tv_nsec) << rel << " was changed";
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalStandardize, ModesAndOwnersBecomeStandard) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/private"));
  ASSERT_TRUE(qstest::makeDirs(root_ + "/sticky"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/exec", "x"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/setuid", "x"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/private/f", "x"));
  ASSERT_EQ(chmod((root_ + "/private").c_str(), 0700), 0);
  ASSERT_EQ(chmod((root_ + "/sticky").c_str(), 01777), 0);
  ASSERT_EQ(chmod((root_ + "/exec").c_str(), 0755), 0);
  ASSERT_EQ(chmod((root_ + "/setuid").c_str(), 04755), 0);
  ASSERT_EQ(chmod((root_ + "/private/f").c_str(), 0600), 0);
  for (const char* rel : {"/private", "/exec", "/private/f"}) {
    ASSERT_EQ(lchown((root_ + rel).c_str(), kForeignUID, kForeignGID), 0);
  }

  ASSERT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, false));
  EXPECT_EQ(permissions(root_ + "/private"), 0755u);
  EXPECT_EQ(permissions(root_ + "/sticky"), 0755u);
  EXPECT_EQ(permissions(root_ + "/exec"), 0644u);
  EXPECT_EQ(permissions(root_ + "/setuid"), 0644u);
  EXPECT_EQ(permissions(root_ + "/private/f"), 0644u);
  for (const char* rel : {"", "/private", "/sticky", "/exec", "/setuid", "/private/f"}) {
    struct stat st = statusOf(root_ + rel);
    EXPECT_EQ(st.st_uid, kWantedUID) << rel;
    EXPECT_EQ(st.st_gid, kWantedGID) << rel;
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalStandardize, LinkItselfIsChangedAndItsTargetNever) {
  ASSERT_TRUE(qstest::writeFile(tmp_ / "target", "x"));
  ASSERT_EQ(chmod((tmp_ / "target").c_str(), 0600), 0);
  ASSERT_EQ(chown((tmp_ / "target").c_str(), kForeignUID, kForeignGID), 0);
  qstest::makeSymlink(tmp_ / "target", root_ + "/link");

  ASSERT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, false));
  struct stat link = statusOf(root_ + "/link");
  EXPECT_EQ(link.st_uid, kWantedUID);
  EXPECT_EQ(link.st_gid, kWantedGID);
  struct stat target = statusOf(tmp_ / "target");
  EXPECT_EQ(target.st_uid, kForeignUID);
  EXPECT_EQ(target.st_gid, kForeignGID);
  EXPECT_EQ(target.st_mode & 07777, 0600u);
  // The link's own mode cannot be changed here, and that is no failure.
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalStandardize, LinksInsideTheTreePassValidation) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/a"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/b", "x"));
  qstest::makeSymlink("a/../b", root_ + "/ok");
  qstest::makeSymlink("..", root_ + "/a/up");
  Error error;
  EXPECT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, true, &error)) << error.description();
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalStandardize, LinkClimbingOutStopsTheWalkWithCode70) {
  ASSERT_EQ(chmod(root_.c_str(), 0700), 0);
  qstest::makeSymlink("../x", root_ + "/escape");
  Error error;
  EXPECT_FALSE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, true, &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeInvalidSymlink));
  EXPECT_EQ(error.localizedDescription(), "invalid symlink at " + root_ + "/escape");
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value(70));
  EXPECT_EQ(error.userInfo().at(QSFunctionNameErrorKey), platform::Value(kStepFn));
  EXPECT_EQ(error.underlyingError(), nullptr);

  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].message,
            "Rejecting " + root_ + "/escape -> /../x, as it is points outside or to the base " + root_);
  EXPECT_EQ(lines[1].function, kStepFn);
  EXPECT_EQ(lines[1].level, kQSLogLevelError);
  EXPECT_NE(lines[1].message.find(": invalid symlink at " + root_ + "/escape"), std::string::npos);
  // The root was visited first and keeps its change.
  EXPECT_EQ(permissions(root_), 0755u);
}

TEST_F(TraversalStandardize, AbsoluteLinkAnywhereStopsTheWalk) {
  ASSERT_TRUE(qstest::makeDirs(root_ + "/deep/er"));
  qstest::makeSymlink(root_ + "/deep", root_ + "/deep/er/abs");
  Error error;
  EXPECT_FALSE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, true, &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeInvalidSymlink));
  EXPECT_EQ(error.localizedDescription(), "invalid symlink at " + root_ + "/deep/er/abs");
  EXPECT_EQ(log_.count("as absolute symlinks are not allowed"), 1u);
}

TEST_F(TraversalStandardize, LinksAreNotValidatedWhenNotAsked) {
  qstest::makeSymlink("/etc", root_ + "/abs");
  qstest::makeSymlink("../x", root_ + "/up");
  EXPECT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, false));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(TraversalStandardize, UnchangeableItemIsLoggedAndPassedOver) {
  std::string stuck = root_ + "/stuck";
  ASSERT_TRUE(qstest::writeFile(stuck, "x"));
  ASSERT_TRUE(qstest::writeFile(root_ + "/other", "x"));
  ASSERT_EQ(chmod(stuck.c_str(), 0755), 0);
  ASSERT_EQ(chmod((root_ + "/other").c_str(), 0600), 0);
  ASSERT_TRUE(qstest::setImmutable(stuck, true));

  Error error;
  EXPECT_TRUE(fm_.standardizeOwnershipAtURL(rootURL(), kWantedUID, kWantedGID, true, &error));
  ASSERT_TRUE(qstest::setImmutable(stuck, false));
  EXPECT_EQ(log_.count("Could not chown " + stuck + ": Operation not permitted"), 1u);
  EXPECT_EQ(log_.count("Could not chmod " + stuck + ": Operation not permitted"), 1u);
  for (const auto& line : log_.systemLines()) {
    EXPECT_EQ(line.function, kStepFn);
    EXPECT_EQ(line.level, kQSLogLevelError);
  }
  EXPECT_EQ(log_.systemLines().size(), 2u);
  EXPECT_EQ(permissions(root_ + "/other"), 0644u);
  EXPECT_EQ(statusOf(root_ + "/other").st_uid, kWantedUID);
}

// --- Symbolic links ---------------------------------------------------------------

using TraversalSymlinks = TraversalFixture;

TEST_F(TraversalSymlinks, CreatedLinkHoldsTheDestinationPath) {
  Error error;
  ASSERT_TRUE(fm_.createSymbolicLinkAtURL(URL::fileURL(root_ + "/link"), URL::fileURL(tmp_ / "dest", true), &error));
  char text[256] = {};
  ASSERT_GT(readlink((root_ + "/link").c_str(), text, sizeof(text) - 1), 0);
  EXPECT_EQ(std::string(text), tmp_ / "dest");
}

TEST_F(TraversalSymlinks, CreatingOverAnExistingItemFails) {
  ASSERT_TRUE(qstest::writeFile(root_ + "/taken", "x"));
  Error error;
  EXPECT_FALSE(fm_.createSymbolicLinkAtURL(URL::fileURL(root_ + "/taken"), URL::fileURL("/dest"), &error));
  EXPECT_TRUE(error.isPOSIX(EEXIST));
  EXPECT_EQ(error.localizedDescription(),
            "Could not create symlink containing /dest at " + root_ + "/taken: File exists");
  EXPECT_EQ(qstest::readFile(root_ + "/taken"), "x");
}

TEST_F(TraversalSymlinks, DestinationIsTheLinkTextUnresolvedAndCutTo1024Bytes) {
  const std::pair<std::string, std::string> cases[] = {
      {"sub/../target", "sub/../target"},
      {"/abs/target", "/abs/target"},
      {std::string(1500, 'n'), std::string(1024, 'n')}};
  int n = 0;
  for (const auto& [text, expected] : cases) {
    const std::string link = root_ + "/link" + std::to_string(n++);
    qstest::makeSymlink(text, link);
    auto url = fm_.destinationOfSymbolicLinkAtURL(URL::fileURL(link));
    ASSERT_TRUE(url) << text;
    EXPECT_EQ(url->path(), expected);
    EXPECT_FALSE(url->isDirectory());
  }
}

TEST_F(TraversalSymlinks, ReadingARegularFileFailsWithInvalidArgument) {
  ASSERT_TRUE(qstest::writeFile(root_ + "/plain", "x"));
  Error error;
  EXPECT_FALSE(fm_.destinationOfSymbolicLinkAtURL(URL::fileURL(root_ + "/plain"), &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
  EXPECT_EQ(error.localizedDescription(), "Could not readlink " + root_ + "/plain : Invalid argument");
}

}  // namespace
