// Helpers for the file layer's tests: a fixture with a fresh directory and a
// log capture, a directory on another file system (for cross-device moves),
// status and attribute probes, and error-record checks.
#pragma once

#include <fcntl.h>
#include <stdlib.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstring>

#include <gtest/gtest.h>

#include "Platform/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "support/TestSupport.h"

namespace qstest {

// A fresh directory under /dev/shm (tmpfs), on another file system than the
// test root (ext4), removed when the object goes away.
class ShmDir {
 public:
  ShmDir() { EXPECT_NE(mkdtemp(path_.data()), nullptr) << strerror(errno); }
  ~ShmDir() { EXPECT_TRUE(QSFileManager::defaultManager().removeItemAtURL(platform::URL::fileURL(path_, true))); }
  ShmDir(const ShmDir&) = delete;
  ShmDir& operator=(const ShmDir&) = delete;
  std::string operator/(const std::string& rest) const { return path_ + "/" + rest; }

 private:
  std::string path_ = "/dev/shm/qs-filelayer.XXXXXX";
};

// The shared manager, a fresh directory and a capture of both logs.
class FileLayerTest : public testing::Test {
 protected:
  QSFileManager& fm = QSFileManager::defaultManager();
  TempDir dir{"filelayer"};
  LogCapture log;
};

inline platform::URL fileURL(const std::string& path, bool isDirectory = false) {
  return platform::URL::fileURL(path, isDirectory);
}

inline std::optional<struct stat> lstatOf(const std::string& path) {
  struct stat status {};
  if (lstat(path.c_str(), &status) != 0) return std::nullopt;
  return status;
}

inline bool exists(const std::string& path) {
  return lstatOf(path).has_value();
}

// Permission bits of `path` (none for a missing item).
inline mode_t permissionsOf(const std::string& path) {
  auto status = lstatOf(path);
  return status ? status->st_mode & 07777 : 0;
}

inline std::optional<std::string> xattrOf(const std::string& path, const char* name) {
  char buffer[4096];
  ssize_t size = lgetxattr(path.c_str(), name, buffer, sizeof buffer);
  if (size < 0) return std::nullopt;
  return std::string(buffer, static_cast<size_t>(size));
}

inline void setXattr(const std::string& path, const char* name, const std::string& bytes) {
  ASSERT_EQ(lsetxattr(path.c_str(), name, bytes.data(), bytes.size(), 0), 0) << path << ": " << strerror(errno);
}

// Expects an installer record of `code` with POSIX `errnum` underneath.
inline void expectInstallerError(const platform::Error& error, int64_t code, int errnum) {
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, code)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(errnum)) << error.underlyingError()->description();
}

// Creates a symbolic link at `at` holding `text`; fails the test otherwise.
inline void makeSymlink(const std::string& text, const std::string& at) {
  ASSERT_EQ(symlink(text.c_str(), at.c_str()), 0) << at << ": " << strerror(errno);
}

// "/d" repeated `depth` times: the path of the bottom of a chain below its root.
inline std::string chainPath(int depth) {
  std::string chain;
  for (int i = 0; i < depth; ++i) chain += "/d";
  return chain;
}

// Builds a chain of `depth` directories named "d" below `root`, with an empty
// file "f" every hundred levels, without ever naming the whole path (it is far
// longer than PATH_MAX).
inline void makeChain(const std::string& root, int depth) {
  ASSERT_TRUE(makeDirs(root));
  platform::ScopedFD current(open(root.c_str(), O_RDONLY | O_DIRECTORY));
  ASSERT_TRUE(current.valid());
  for (int i = 0; i < depth; ++i) {
    ASSERT_EQ(mkdirat(current.get(), "d", 0755), 0) << "level " << i;
    if (i % 100 == 0) {
      ASSERT_TRUE(platform::ScopedFD(openat(current.get(), "f", O_WRONLY | O_CREAT, 0644)).valid());
    }
    current.reset(openat(current.get(), "d", O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(current.valid());
  }
}

// Builds items below `root` with their parents: a name ending in '/' is a
// directory, any other a file holding "x".
inline void makeTree(const std::string& root, std::initializer_list<std::string> items) {
  for (const std::string& item : items) {
    const std::string path = root + "/" + item;
    ASSERT_TRUE(makeDirs(item.back() == '/' ? path : path.substr(0, path.rfind('/')))) << item;
    if (item.back() != '/') {
      ASSERT_TRUE(writeFile(path, "x")) << item;
    }
  }
}

// Runs `fn` while `path` is immutable and returns its result.
template <class Fn>
auto whileImmutable(const std::string& path, const Fn& fn) {
  EXPECT_TRUE(setImmutable(path, true)) << path;
  auto result = fn();
  EXPECT_TRUE(setImmutable(path, false)) << path;
  return result;
}

}  // namespace qstest
