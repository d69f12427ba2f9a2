
#include <thread>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/RemoveTree.h"

namespace {

using platform::Error;
using qstest::fileURL;

constexpr char kRemoveFn[] = "-[QSFileManager removeItemAtURL:error:]";
constexpr char kCallbackFn[] = "_removefile_error_callback";
constexpr rlim_t kDescriptorLimit = 256;

class FileManagerRemoval : public testing::Test {
 protected:
  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"removal"};
};

TEST_F(FileManagerRemoval, RemovesWholeTreeWithoutFollowingLinks) {
  qstest::TempDir outside{"outside"};
  ASSERT_TRUE(qstest::writeFile(outside / "keep", "keep"));
  ASSERT_TRUE(qstest::makeDirs(dir / "tree/a/b/c"));
  ASSERT_TRUE(qstest::writeFile(dir / "tree/a/file", "x"));
  ASSERT_TRUE(qstest::writeFile(dir / "tree/a/b/c/deep", "y"));
  ASSERT_EQ(symlink(outside.path().c_str(), (dir / "tree/a/link-to-outside").c_str()), 0);
  ASSERT_EQ(symlink((outside / "keep").c_str(), (dir / "tree/file-link").c_str()), 0);
  ASSERT_EQ(mkfifo((dir / "tree/a/b/fifo").c_str(), 0600), 0);
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "tree", true), &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_FALSE(qstest::exists(dir / "tree"));
  EXPECT_EQ(qstest::readFile(outside / "keep"), "keep");
}

TEST_F(FileManagerRemoval, SingleFileAndLinkAtTheTop) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  ASSERT_TRUE(qstest::makeDirs(dir / "target"));
  ASSERT_TRUE(qstest::writeFile(dir / "target/inside", "x"));
  ASSERT_EQ(symlink("target", (dir / "link").c_str()), 0);
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "file")));
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "link")));
  EXPECT_FALSE(qstest::exists(dir / "file"));
  EXPECT_FALSE(qstest::exists(dir / "link"));
  EXPECT_TRUE(qstest::exists(dir / "target/inside"));
}

TEST_F(FileManagerRemoval, AbsentItemSucceedsWithoutErrorOrLine) {
  qstest::LogCapture log;
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "never-there"), &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(FileManagerRemoval, MissingURLFailsWithBadAddress) {
  Error error;
  EXPECT_FALSE(fm.removeItemAtURL(platform::URL(), &error));
  qstest::expectPOSIXError(error, EFAULT, "nil url passed to -removeItemAtURL:error:", kRemoveFn);
}

TEST_F(FileManagerRemoval, ImmutableDirectoryKeepsFirstErrorAndRemovesTheRest) {
  ASSERT_TRUE(qstest::makeDirs(dir / "tree/locked"));
  ASSERT_TRUE(qstest::writeFile(dir / "tree/locked/file", "x"));
  for (int i = 0; i < 20; ++i) ASSERT_TRUE(qstest::writeFile(dir / ("tree/free" + std::to_string(i)), "x"));
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked", true));
  qstest::LogCapture log;
  Error error;
  bool removed = fm.removeItemAtURL(fileURL(dir / "tree", true), &error);
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked", false));

  EXPECT_FALSE(removed);
  qstest::expectPOSIXError(error, EPERM,
                           "removefile of file://" + dir.path() + "/tree/ failed: Operation not permitted", kRemoveFn);
  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0].message, "removefile hit error for " + dir.path() + "/tree/locked/file : Operation not permitted");
  EXPECT_EQ(lines[1].message, "removefile hit error for " + dir.path() + "/tree/locked : Operation not permitted");
  EXPECT_EQ(lines[2].message, "removefile hit error for " + dir.path() + "/tree : Directory not empty");
  for (const auto& line : lines) {
    EXPECT_EQ(line.function, kCallbackFn);
    EXPECT_EQ(line.level, 3);
  }
  EXPECT_TRUE(qstest::exists(dir / "tree/locked/file"));
  EXPECT_FALSE(qstest::exists(dir / "tree/free0"));
  EXPECT_FALSE(qstest::exists(dir / "tree/free19"));
}

// Far deeper than the walk keeps directories open and than PATH_MAX allows.
// On tmpfs, where deep directory removal is cheap.
TEST_F(FileManagerRemoval, VeryDeepTreeIsRemoved) {
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "deep"));
  ASSERT_NO_FATAL_FAILURE(qstest::makeChain(shm / "deep", 10000));
  const std::string deep = shm / "deep";
  // Far fewer descriptors than levels.
  int status = qstest::runWithDescriptorLimit(
      kDescriptorLimit, [&] { return QSFileManager::defaultManager().removeItemAtURL(fileURL(deep, true)) ? 0 : 1; });
  EXPECT_EQ(status, 0);
  EXPECT_FALSE(qstest::exists(deep));
}

TEST_F(FileManagerRemoval, EntriesVanishingDuringRemovalAreNoFailure) {
  constexpr int kFiles = 3000;
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "tree"));
  for (int i = 0; i < kFiles; ++i) ASSERT_TRUE(qstest::writeFile(shm / ("tree/f" + std::to_string(i)), ""));
  qstest::LogCapture log;
  std::thread rival([&] {
    for (int i = kFiles - 1; i >= 0; --i) unlink((shm / ("tree/f" + std::to_string(i))).c_str());
  });
  Error error;
  bool removed = fm.removeItemAtURL(fileURL(shm / "tree", true), &error);
  rival.join();
  EXPECT_TRUE(removed) << error.description();
  EXPECT_FALSE(qstest::exists(shm / "tree"));
  EXPECT_TRUE(log.systemLines().empty());
}

// The removal walk itself, with callbacks of the test's own.
class RemoveTree : public FileManagerRemoval {};

struct Seen {
  std::vector<std::string> paths;
  std::vector<int> numbers;
};

qsfs::RemovalDecision recordAndStop(const qsfs::RemovalState& state, const char* path, void* context) {
  auto* seen = static_cast<Seen*>(context);
  int errnum = 0;
  EXPECT_EQ(state.errorNumber(&errnum), 0);
  seen->paths.push_back(path);
  seen->numbers.push_back(errnum);
  return qsfs::RemovalDecision::Stop;
}

TEST_F(RemoveTree, CallbackThatStopsEndsTheWalkWithThatNumber) {
  ASSERT_TRUE(qstest::makeDirs(dir / "tree/locked"));
  ASSERT_TRUE(qstest::writeFile(dir / "tree/locked/file", "x"));
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked", true));
  Seen seen;
  qsfs::RemovalState state;
  ASSERT_EQ(state.setErrorCallback(recordAndStop), 0);
  ASSERT_EQ(state.setErrorContext(&seen), 0);
  int result = qsfs::removeTree((dir / "tree").c_str(), state);
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked", false));
  EXPECT_EQ(result, EPERM);
  EXPECT_EQ(seen.paths, std::vector<std::string>{dir / "tree/locked/file"});
  EXPECT_EQ(seen.numbers, std::vector<int>{EPERM});
  EXPECT_TRUE(qstest::exists(dir / "tree/locked"));
}

TEST_F(RemoveTree, WithoutCallbackStopsAtFirstFailure) {
  ASSERT_TRUE(qstest::makeDirs(dir / "tree/locked"));
  ASSERT_TRUE(qstest::writeFile(dir / "tree/locked/file", "x"));
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked/file", true));
  qsfs::RemovalState state;
  int result = qsfs::removeTree((dir / "tree").c_str(), state);
  ASSERT_TRUE(qstest::setImmutable(dir / "tree/locked/file", false));
  EXPECT_EQ(result, EPERM);
  EXPECT_TRUE(qstest::exists(dir / "tree/locked/file"));
}

// While the walk is deep below it, a directory whose descriptor the walk has
// already closed is moved elsewhere. The walk must find its way back up to
// the directories still in place, remove them, and leave the moved one alone.
struct MoveOnFirstFailure {
  std::string from, to;
  std::vector<int> numbers;
};

qsfs::RemovalDecision moveAwayAndProceed(const qsfs::RemovalState& state, const char* path, void* context) {
  (void)path;
  auto* move = static_cast<MoveOnFirstFailure*>(context);
  int errnum = 0;
  EXPECT_EQ(state.errorNumber(&errnum), 0);
  if (move->numbers.empty()) {
    EXPECT_EQ(rename(move->from.c_str(), move->to.c_str()), 0);
  }
  move->numbers.push_back(errnum);
  return qsfs::RemovalDecision::Proceed;
}

TEST_F(RemoveTree, DirectoryMovedAwayDuringTheWalkIsLeftWhereItWent) {
  constexpr int kDepth = 300;
  constexpr int kMovedLevel = 20;  // its descriptor is closed when the walk is at the bottom
  static_assert(kDepth - kMovedLevel > static_cast<int>(qsfs::kMaxOpenDirectories));
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "root"));
  ASSERT_NO_FATAL_FAILURE(qstest::makeChain(shm / "root", kDepth));
  std::string chain;
  for (int i = 0; i < kDepth; ++i) chain += "/d";
  const std::string bottomFile = shm / "root" + chain + "/locked";
  ASSERT_TRUE(qstest::writeFile(bottomFile, "x"));
  ASSERT_TRUE(qstest::setImmutable(bottomFile, true));

  MoveOnFirstFailure move{shm / "root" + chain.substr(0, 2 * kMovedLevel), shm / "moved", {}};
  qsfs::RemovalState state;
  ASSERT_EQ(state.setErrorCallback(moveAwayAndProceed), 0);
  ASSERT_EQ(state.setErrorContext(&move), 0);
  int result = qsfs::removeTree((shm / "root").c_str(), state);

  const std::string movedFile = shm / "moved" + chain.substr(2 * kMovedLevel) + "/locked";
  EXPECT_TRUE(qstest::exists(movedFile));
  if (qstest::exists(movedFile)) {
    ASSERT_TRUE(qstest::setImmutable(movedFile, false));
  }
  EXPECT_EQ(result, 0);
  ASSERT_FALSE(move.numbers.empty());
  EXPECT_EQ(move.numbers.front(), EPERM);
  EXPECT_FALSE(qstest::exists(shm / "root"));
}

}  // namespace
