#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "support/TestSupport.h"

using platform::Data;
using platform::URL;

namespace {

std::vector<std::string> namesIn(const std::string& directory) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(directory)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

TEST(AtomicWrite, NewAndReplacingWritesLeaveOnlyTheTarget) {
  qstest::TempDir dir("atomic");
  const URL target = URL::fileURL(dir / "marker.plist");
  ASSERT_TRUE(platform::plist::writeFileBytes(Data{'a'}, target, true));
  EXPECT_EQ(qstest::readFile(target.path()), "a");
  ASSERT_EQ(chmod(target.fileSystemRepresentation(), 0600), 0);
  ASSERT_TRUE(platform::plist::writeFileBytes(Data{'b', 'c'}, target, true));
  EXPECT_EQ(qstest::readFile(target.path()), "bc");
  EXPECT_EQ(namesIn(dir.path()), std::vector<std::string>{"marker.plist"});
  struct stat st {};
  ASSERT_EQ(stat(target.fileSystemRepresentation(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u) << "a replaced file keeps its permissions";
}

TEST(AtomicWrite, FailedReplacementKeepsTheOldFileAndLeavesNothing) {
  qstest::TempDir dir("atomic");
  ASSERT_TRUE(qstest::makeDirs(dir / "occupied/child"));
  platform::Error error;
  EXPECT_FALSE(platform::plist::writeFileBytes(Data{'x'}, URL::fileURL(dir / "occupied"), true, &error));
  EXPECT_EQ(error.domain(), platform::kFileErrorDomain);
  EXPECT_EQ(namesIn(dir.path()), std::vector<std::string>{"occupied"});
  EXPECT_EQ(namesIn(dir / "occupied"), std::vector<std::string>{"child"});
}

// A writer killed at any instant leaves the old file or the new one, and no
// temporary file beside it.
TEST(AtomicWrite, WriterKilledWhileWritingLeavesNoTemporaryFile) {
  qstest::TempDir dir("atomic");
  const URL target = URL::fileURL(dir / "record.plist");
  ASSERT_TRUE(platform::plist::writeFileBytes(Data{'o', 'l', 'd'}, target, true));
  const Data big(32 << 20, 'n');
  for (int delayMs : {1, 5, 20}) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      for (;;) (void)platform::plist::writeFileBytes(big, target, true);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(delayMs));
    kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(namesIn(dir.path()), std::vector<std::string>{"record.plist"}) << "after " << delayMs << " ms";
    const auto size = std::filesystem::file_size(target.path());
    EXPECT_TRUE(size == 3 || size == big.size()) << size;
  }
}

}  // namespace
