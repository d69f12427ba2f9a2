// isSymbolicLinkAtURL: the status of an item itself, links not followed.
#include <unistd.h>

#include <cerrno>

#include <gtest/gtest.h>

#include "Shared/FileManager/QSFileManager.h"
#include "support/TestSupport.h"

using platform::Error;
using platform::URL;

namespace {

class FileManagerStatus : public testing::Test {
 protected:
  qstest::TempDir dir_;
  const QSFileManager& fm_ = QSFileManager::defaultManager();
};

TEST_F(FileManagerStatus, OnlyTheItemItselfIsLookedAt) {
  ASSERT_TRUE(qstest::makeDirs(dir_ / "directory"));
  ASSERT_TRUE(qstest::writeFile(dir_ / "file", "x"));
  ASSERT_EQ(symlink("directory", (dir_ / "link").c_str()), 0);
  ASSERT_EQ(symlink("nowhere", (dir_ / "dangling").c_str()), 0);
  for (const auto& [name, expected] : {std::pair{"link", true}, {"dangling", true}, {"directory", false},
                                       {"file", false}}) {
    bool isLink = !expected;
    Error untouched("untouched", 1);
    EXPECT_TRUE(fm_.isSymbolicLinkAtURL(URL::fileURL(dir_ / name), &isLink, &untouched)) << name;
    EXPECT_EQ(isLink, expected) << name;
    EXPECT_TRUE(untouched.is("untouched", 1)) << "error written on success";
  }
}

TEST_F(FileManagerStatus, MissingItemFailsWithPOSIXError) {
  bool isLink = true;
  Error error;
  EXPECT_FALSE(fm_.isSymbolicLinkAtURL(URL::fileURL(dir_ / "missing"), &isLink, &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT)) << error.description();
  EXPECT_EQ(error.localizedDescription(), "lstat of " + (dir_ / "missing") + " failed: No such file or directory");
  EXPECT_TRUE(isLink) << "flag written on failure";
}

TEST_F(FileManagerStatus, UnsearchableParentFailsWithPermissionError) {
  ASSERT_TRUE(qstest::makeDirs(dir_ / "closed"));
  ASSERT_TRUE(qstest::writeFile(dir_ / "closed/file", "x"));
  ASSERT_EQ(chmod((dir_ / "closed").c_str(), 0700), 0);
  const std::string path = dir_ / "closed/file";
  const int status = qstest::runAsNobody([&] {
    Error error;
    if (QSFileManager::defaultManager().isSymbolicLinkAtURL(URL::fileURL(path), nullptr, &error)) return 1;
    return error.isPOSIX(EACCES) ? 0 : 2;
  });
  EXPECT_EQ(status, 0);
}

}  // namespace
