// Recursive removal on real trees: links, provoked failures, depth and races.
#include <thread>

#include "FileLayerTestSupport.h"
#include "Platform/FileTree/RemoveTree.h"

namespace {

using platform::Error;
using qstest::exists;
using qstest::fileURL;

using FileManagerRemoval = qstest::FileLayerTest;

TEST_F(FileManagerRemoval, RemovesWholeTreesAndNeverFollowsLinks) {
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(dir.path(), {"outside/keep", "tree/a/b/c/deep"}));
  qstest::makeSymlink(dir / "outside", dir / "tree/a/link-to-outside");
  qstest::makeSymlink(dir / "outside", dir / "top-link");
  Error error;
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "tree", true)));
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "top-link")));
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dir / "never-there"))) << "an absent item is no failure";
  EXPECT_FALSE(exists(dir / "tree") || exists(dir / "top-link"));
  EXPECT_EQ(qstest::readFile(dir / "outside/keep"), "x");
  EXPECT_TRUE(log.systemLines().empty());
  EXPECT_FALSE(fm.removeItemAtURL(platform::URL(), &error));
  EXPECT_TRUE(error.isPOSIX(EFAULT)) << error.description();
}

TEST_F(FileManagerRemoval, ImmutableDirectoryKeepsFirstErrorAndRemovesTheRest) {
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(dir / "tree", {"locked/file", "free0", "free1", "free2"}));
  Error error;
  int unattended = 0;
  EXPECT_FALSE(qstest::whileImmutable(dir / "tree/locked", [&] {
    bool result = fm.removeItemAtURL(fileURL(dir / "tree", true), &error);
    platform::fs::RemovalState bare;  // without a callback the walk stops at the first failure
    unattended = platform::fs::removeTree((dir / "tree").c_str(), bare);
    return result;
  }));
  EXPECT_EQ(unattended, EPERM);
  EXPECT_TRUE(error.isPOSIX(EPERM)) << error.description();
  EXPECT_EQ(log.systemMessages(),
            (std::vector<std::string>{
                "removefile hit error for " + dir.path() + "/tree/locked/file : Operation not permitted",
                "removefile hit error for " + dir.path() + "/tree/locked : Operation not permitted",
                "removefile hit error for " + dir.path() + "/tree : Directory not empty"}));
  EXPECT_TRUE(exists(dir / "tree/locked/file"));
  EXPECT_FALSE(exists(dir / "tree/free0") || exists(dir / "tree/free2"));
}

TEST_F(FileManagerRemoval, EntriesVanishingDuringRemovalAreNoFailure) {
  constexpr int kFiles = 3000;
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "tree"));
  for (int i = 0; i < kFiles; ++i) ASSERT_TRUE(qstest::writeFile(shm / ("tree/f" + std::to_string(i)), ""));
  std::thread rival([&] {
    for (int i = kFiles - 1; i >= 0; --i) unlink((shm / ("tree/f" + std::to_string(i))).c_str());
  });
  Error error;
  bool removed = fm.removeItemAtURL(fileURL(shm / "tree", true), &error);
  rival.join();
  EXPECT_TRUE(removed) << error.description();
  EXPECT_FALSE(exists(shm / "tree"));
  EXPECT_TRUE(log.systemLines().empty());
}

// A removal callback that moves a directory away at the first failure,
// keeps that failure's number and lets the walk go on.
struct MoveOnFirstFailure {
  std::string from, to;
  int firstError = 0;
};

platform::fs::RemovalDecision moveAwayAndProceed(const platform::fs::RemovalState& state, const char*, void* context) {
  auto* move = static_cast<MoveOnFirstFailure*>(context);
  if (move->firstError == 0 && state.errorNumber(&move->firstError) == 0) {
    EXPECT_EQ(rename(move->from.c_str(), move->to.c_str()), 0);
  }
  return platform::fs::RemovalDecision::Proceed;
}

// While the walk is deep below it, a directory whose descriptor the walk has
// already closed is moved elsewhere. The walk must find its way back up to
// the directories still in place, remove them, and leave the moved one alone.
TEST_F(FileManagerRemoval, DirectoryMovedAwayDuringTheWalkIsLeftWhereItWent) {
  constexpr int kDepth = 300;
  constexpr int kMovedLevel = 20;  // its descriptor is closed when the walk is at the bottom
  static_assert(kDepth - kMovedLevel > static_cast<int>(platform::fs::kMaxOpenDirectories));
  qstest::ShmDir shm;
  const std::string chain = qstest::chainPath(kDepth);
  ASSERT_NO_FATAL_FAILURE(qstest::makeChain(shm / "root", kDepth));
  ASSERT_TRUE(qstest::writeFile(shm / "root" + chain + "/locked", "x"));
  ASSERT_TRUE(qstest::setImmutable(shm / "root" + chain + "/locked", true));
  MoveOnFirstFailure move{shm / "root" + chain.substr(0, 2 * kMovedLevel), shm / "moved"};
  platform::fs::RemovalState state;
  ASSERT_EQ(state.setErrorCallback(moveAwayAndProceed), 0);
  ASSERT_EQ(state.setErrorContext(&move), 0);
  int result = platform::fs::removeTree((shm / "root").c_str(), state);
  const std::string movedFile = shm / "moved" + chain.substr(2 * kMovedLevel) + "/locked";
  ASSERT_TRUE(qstest::setImmutable(movedFile, false)) << "the moved directory is where it went";
  EXPECT_EQ(result, 0);
  EXPECT_EQ(move.firstError, EPERM);
  EXPECT_FALSE(exists(shm / "root"));
}

}  // namespace
