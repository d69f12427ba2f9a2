#include <sys/sysmacros.h>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/TreeWalk.h"

namespace {

using platform::Error;
using qstest::fileURL;

constexpr char kCopyFn[] = "-[QSFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kMoveFn[] = "-[QSFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr uid_t kOwner = 1234;
constexpr gid_t kGroup = 5678;
constexpr time_t kMTime = 1000000000;  // 2001-09-09

// A POSIX access ACL with an extra named-user entry, in the kernel's
// extended-attribute layout (version 2; entries sorted by tag).
std::string accessACL() {
  struct Entry {
    uint16_t tag, perm;
    uint32_t id;
  };
  const uint32_t version = 2;
  const Entry entries[] = {
      {0x01, 6, UINT32_MAX}, {0x02, 4, 4321}, {0x04, 4, UINT32_MAX}, {0x10, 4, UINT32_MAX}, {0x20, 0, UINT32_MAX}};
  std::string out(reinterpret_cast<const char*>(&version), sizeof version);
  out.append(reinterpret_cast<const char*>(entries), sizeof entries);
  return out;
}

void setTimes(const std::string& path, time_t seconds) {
  const timespec times[2] = {{seconds - 100, 0}, {seconds, 123456789}};
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
}

class FileManagerCopy : public testing::Test {
 protected:
  // src/ (0750, owned 1234:5678, xattrs)
  //   data      (0640, owned 1234:5678, user and trusted xattrs, an access ACL)
  //   sub/big   (3 MiB)
  //   sub/fifo
  //   link      -> data (owned 1234:5678)
  //   dangling  -> nowhere
  void buildSource(const std::string& src) {
    ASSERT_TRUE(qstest::makeDirs(src + "/sub"));
    ASSERT_TRUE(qstest::writeFile(src + "/data", "payload"));
    std::string big(3 << 20, '\0');
    for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7 + i / 4096);
    ASSERT_TRUE(qstest::writeFile(src + "/sub/big", big));
    ASSERT_EQ(mkfifo((src + "/sub/fifo").c_str(), 0604), 0);
    ASSERT_EQ(symlink("data", (src + "/link").c_str()), 0);
    ASSERT_EQ(symlink("nowhere", (src + "/dangling").c_str()), 0);
    ASSERT_EQ(lsetxattr((src + "/data").c_str(), "user.note", "hello", 5, 0), 0);
    ASSERT_EQ(lsetxattr((src + "/data").c_str(), "trusted.secret", "s", 1, 0), 0);
    std::string acl = accessACL();
    ASSERT_EQ(lsetxattr((src + "/data").c_str(), "system.posix_acl_access", acl.data(), acl.size(), 0), 0);
    ASSERT_EQ(lsetxattr(src.c_str(), "user.dir", "d", 1, 0), 0);
    for (const char* item : {"", "/data", "/link", "/sub/big"}) {
      ASSERT_EQ(lchown((src + item).c_str(), kOwner, kGroup), 0) << item;
    }
    ASSERT_EQ(chmod((src + "/data").c_str(), 0640), 0);
    ASSERT_EQ(chmod(src.c_str(), 0750), 0);
    for (const char* item : {"/data", "/link", "/dangling", "/sub/big", "/sub/fifo", "/sub", ""})
      setTimes(src + item, kMTime);
  }

  void expectSameItem(const std::string& src, const std::string& dst) {
    auto a = qstest::lstatOf(src);
    auto b = qstest::lstatOf(dst);
    ASSERT_TRUE(a) << src;
    ASSERT_TRUE(b) << dst;
    EXPECT_EQ(a->st_mode, b->st_mode) << dst;
    EXPECT_EQ(a->st_uid, b->st_uid) << dst;
    EXPECT_EQ(a->st_gid, b->st_gid) << dst;
    EXPECT_EQ(a->st_mtim.tv_sec, b->st_mtim.tv_sec) << dst;
    EXPECT_EQ(a->st_mtim.tv_nsec, b->st_mtim.tv_nsec) << dst;
  }

  void expectCopied(const std::string& src, const std::string& dst) {
    for (const char* item : {"", "/data", "/link", "/dangling", "/sub", "/sub/big", "/sub/fifo"}) {
      expectSameItem(src + item, dst + item);
    }
    EXPECT_EQ(qstest::readFile(dst + "/data"), "payload");
    EXPECT_EQ(qstest::readFile(dst + "/sub/big"), qstest::readFile(src + "/sub/big"));
    char target[64] = {};
    ASSERT_GT(readlink((dst + "/link").c_str(), target, sizeof target), 0);
    EXPECT_STREQ(target, "data");
    EXPECT_EQ(qstest::xattrOf(dst + "/data", "user.note"), "hello");
    EXPECT_EQ(qstest::xattrOf(dst + "/data", "trusted.secret"), "s");
    EXPECT_EQ(qstest::xattrOf(dst + "/data", "system.posix_acl_access"),
              qstest::xattrOf(src + "/data", "system.posix_acl_access"));
    EXPECT_EQ(qstest::xattrOf(dst, "user.dir"), "d");
  }

  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"copy"};
};

TEST_F(FileManagerCopy, TreeKeepsDataAttributesOwnersModesTimesAndLinks) {
  ASSERT_NO_FATAL_FAILURE(buildSource(dir / "src"));
  Error error = qstest::untouchedSentinel();
  ASSERT_TRUE(fm.copyItemAtURL(fileURL(dir / "src", true), fileURL(dir / "dst", true), &error)) << error.description();
  EXPECT_TRUE(error.is("Sentinel", 99));
  expectCopied(dir / "src", dir / "dst");
  EXPECT_TRUE(qstest::exists(dir / "src/data")) << "a copy leaves its source";
}

TEST_F(FileManagerCopy, ExistingDestinationFailsWithFileExists) {
  ASSERT_TRUE(qstest::writeFile(dir / "src", "new"));
  ASSERT_TRUE(qstest::writeFile(dir / "dst", "old"));
  ASSERT_TRUE(qstest::makeDirs(dir / "srcdir"));
  ASSERT_TRUE(qstest::makeDirs(dir / "dstdir"));
  Error error;
  EXPECT_FALSE(fm.copyItemAtURL(fileURL(dir / "src"), fileURL(dir / "dst"), &error));
  qstest::expectPOSIXError(
      error, EEXIST, "copyfile of file://" + dir.path() + "/src to file://" + dir.path() + "/dst failed: File exists",
      kCopyFn);
  EXPECT_EQ(qstest::readFile(dir / "dst"), "old");
  EXPECT_FALSE(fm.copyItemAtURL(fileURL(dir / "srcdir", true), fileURL(dir / "dstdir", true), &error));
  EXPECT_TRUE(error.isPOSIX(EEXIST));
}

TEST_F(FileManagerCopy, AbsentSourceIsNoFailureOnlyForTheIfExistsForm) {
  qstest::LogCapture log;
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.copyItemIfExistsAtURL(fileURL(dir / "none"), fileURL(dir / "dst"), &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_FALSE(qstest::exists(dir / "dst"));
  EXPECT_FALSE(fm.copyItemAtURL(fileURL(dir / "none"), fileURL(dir / "dst"), &error));
  qstest::expectPOSIXError(
      error, ENOENT,
      "copyfile of file://" + dir.path() + "/none to file://" + dir.path() + "/dst failed: No such file or directory",
      kCopyFn);
  EXPECT_FALSE(qstest::exists(dir / "dst"));
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(FileManagerCopy, DirectoryIntoItselfFails) {
  ASSERT_TRUE(qstest::makeDirs(dir / "src/sub"));
  Error error;
  EXPECT_FALSE(fm.copyItemAtURL(fileURL(dir / "src", true), fileURL(dir / "src/sub/copy", true), &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL)) << error.description();
}

TEST_F(FileManagerCopy, UnreadableFileStopsTheCopyAndKeepsWhatWasCopied) {
  ASSERT_TRUE(qstest::makeDirs(dir / "src"));
  ASSERT_TRUE(qstest::writeFile(dir / "src/secret", "x"));
  ASSERT_EQ(chmod((dir / "src/secret").c_str(), 0600), 0);
  ASSERT_EQ(chmod(dir.path().c_str(), 0777), 0);
  const std::string root = dir.path();
  int status = qstest::runAsNobody([&] {
    Error error;
    if (QSFileManager::defaultManager().copyItemAtURL(fileURL(root + "/src", true), fileURL(root + "/dst", true),
                                                      &error)) {
      return 1;
    }
    if (!error.isPOSIX(EACCES)) return 2;
    struct stat st {};
    return stat((root + "/dst").c_str(), &st) == 0 && S_ISDIR(st.st_mode) ? 0 : 3;
  });
  EXPECT_EQ(status, 0);
}

TEST_F(FileManagerCopy, SourceStatusFailureIsReportedByTheIfExistsForm) {
  ASSERT_TRUE(qstest::makeDirs(dir / "private", 0700));
  ASSERT_TRUE(qstest::writeFile(dir / "private/item", "x"));
  const std::string item = dir / "private/item";
  const std::string dst = dir / "dst";
  int status = qstest::runAsNobody([&] {
    Error copyError, moveError;
    auto& manager = QSFileManager::defaultManager();
    if (manager.copyItemIfExistsAtURL(fileURL(item), fileURL(dst), &copyError)) return 1;
    if (manager.moveItemIfExistsAtURL(fileURL(item), fileURL(dst), &moveError)) return 2;
    const std::string expected = "stat of file://" + item + " failed: Permission denied";
    if (!copyError.isPOSIX(EACCES) || copyError.localizedDescription() != expected) return 3;
    if (!moveError.isPOSIX(EACCES) || moveError.localizedDescription() != expected) return 4;
    if (qstest::functionNameOf(copyError) != kCopyFn || qstest::functionNameOf(moveError) != kMoveFn) return 5;
    return 0;
  });
  EXPECT_EQ(status, 0);
}

TEST_F(FileManagerCopy, TreeDeeperThanTheDescriptorLimitIsCopied) {
  constexpr int kDepth = 1000;
  // The copy keeps two descriptors for each of its open levels; one pair per
  // level of this tree would need 2,000.
  constexpr rlim_t kDescriptorLimit = 2 * qsfs::kMaxOpenDirectories + 64;
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "src"));
  ASSERT_NO_FATAL_FAILURE(qstest::makeChain(shm / "src", kDepth));
  std::string chain;
  for (int i = 0; i < kDepth; ++i) chain += "/d";
  ASSERT_TRUE(qstest::writeFile(shm / "src" + chain + "/bottom", "deep"));
  ASSERT_EQ(chmod((shm / "src" + chain.substr(0, 100)).c_str(), 0705), 0);
  const std::string src = shm / "src";
  const std::string dst = shm / "dst";
  int status = qstest::runWithDescriptorLimit(kDescriptorLimit, [&] {
    return QSFileManager::defaultManager().copyItemAtURL(fileURL(src, true), fileURL(dst, true)) ? 0 : 1;
  });
  EXPECT_EQ(status, 0);
  EXPECT_EQ(qstest::readFile(dst + chain + "/bottom"), "deep");
  EXPECT_EQ(qstest::readFile(dst + chain.substr(0, 1000) + "/f"), "");
  auto copiedMode = qstest::lstatOf(dst + chain.substr(0, 100));
  ASSERT_TRUE(copiedMode);
  EXPECT_EQ(copiedMode->st_mode & 07777, 0705u) << "status is applied to levels that were reopened";
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(dst, true)));
  EXPECT_TRUE(fm.removeItemAtURL(fileURL(src, true)));
}

class FileManagerMove : public FileManagerCopy {};

TEST_F(FileManagerMove, RenameWithinTheFileSystem) {
  ASSERT_TRUE(qstest::makeDirs(dir / "src/sub"));
  ASSERT_TRUE(qstest::writeFile(dir / "src/sub/file", "x"));
  ino_t inode = qstest::lstatOf(dir / "src")->st_ino;
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(dir / "dst", true), &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_FALSE(qstest::exists(dir / "src"));
  EXPECT_EQ(qstest::lstatOf(dir / "dst")->st_ino, inode);
  EXPECT_EQ(qstest::readFile(dir / "dst/sub/file"), "x");
}

TEST_F(FileManagerMove, AbsentSourceIsNoFailureOnlyForTheIfExistsForm) {
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.moveItemIfExistsAtURL(fileURL(dir / "none"), fileURL(dir / "dst"), &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_FALSE(qstest::exists(dir / "dst"));
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "none"), fileURL(dir / "dst"), &error));
  qstest::expectPOSIXError(
      error, ENOENT,
      "rename of file://" + dir.path() + "/none to file://" + dir.path() + "/dst failed: No such file or directory",
      kMoveFn);
}

TEST_F(FileManagerMove, RenameFailureOtherThanCrossDeviceIsReported) {
  ASSERT_TRUE(qstest::makeDirs(dir / "src"));
  ASSERT_TRUE(qstest::makeDirs(dir / "dst/occupied"));
  Error error;
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(dir / "dst", true), &error));
  qstest::expectPOSIXError(
      error, ENOTEMPTY,
      "rename of file://" + dir.path() + "/src/ to file://" + dir.path() + "/dst/ failed: Directory not empty",
      kMoveFn);
  EXPECT_TRUE(qstest::exists(dir / "src"));
}

TEST_F(FileManagerMove, CrossDeviceCopiesThenRemovesTheSource) {
  qstest::ShmDir shm;
  ASSERT_NO_FATAL_FAILURE(buildSource(dir / "src"));
  ASSERT_NO_FATAL_FAILURE(buildSource(dir / "reference"));
  qstest::LogCapture log;
  Error error = qstest::untouchedSentinel();
  ASSERT_TRUE(fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(shm / "dst", true), &error)) << error.description();
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_FALSE(qstest::exists(dir / "src"));
  expectCopied(dir / "reference", shm / "dst");
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(FileManagerMove, CrossDeviceKeepsDestinationWhenSourceRemovalFails) {
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(dir / "src/locked"));
  ASSERT_TRUE(qstest::writeFile(dir / "src/locked/file", "kept"));
  ASSERT_TRUE(qstest::setImmutable(dir / "src/locked", true));
  qstest::LogCapture log;
  Error error = qstest::untouchedSentinel();
  bool moved = fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(shm / "dst", true), &error);
  ASSERT_TRUE(qstest::setImmutable(dir / "src/locked", false));
  EXPECT_TRUE(moved);
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_EQ(qstest::readFile(shm / "dst/locked/file"), "kept");
  EXPECT_EQ(qstest::readFile(dir / "src/locked/file"), "kept");

  std::vector<platform::SystemLogLine> moveLines;
  for (const auto& line : log.systemLines()) {
    if (line.function == kMoveFn) moveLines.push_back(line);
  }
  ASSERT_EQ(moveLines.size(), 1u);
  EXPECT_EQ(moveLines[0].level, 3);
  const std::string prefix = "Failed to remove move source after copy at " + dir.path() + "/src : ";
  EXPECT_EQ(moveLines[0].message.substr(0, prefix.size()), prefix);
  EXPECT_NE(moveLines[0].message.find("Error Domain=POSIXErrorDomain Code=1 \"removefile of file://" + dir.path() +
                                      "/src/ failed: Operation not permitted\""),
            std::string::npos)
      << moveLines[0].message;
}

TEST_F(FileManagerMove, CrossDeviceCopyFailureIsTheMovesFailureAndKeepsTheSource) {
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::writeFile(dir / "src", "x"));
  ASSERT_TRUE(qstest::writeFile(shm / "dst", "there"));
  Error error;
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "src"), fileURL(shm / "dst"), &error));
  qstest::expectPOSIXError(
      error, EEXIST, "copyfile of file://" + dir.path() + "/src to file://" + shm.path() + "/dst failed: File exists",
      kCopyFn);
  EXPECT_EQ(qstest::readFile(dir / "src"), "x");
  EXPECT_EQ(qstest::readFile(shm / "dst"), "there");
}

}  // namespace
