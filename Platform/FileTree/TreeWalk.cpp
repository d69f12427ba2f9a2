#include "Platform/FileTree/TreeWalk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "Platform/PosixHandles.h"

namespace platform::fs {

namespace {

// The listing is read in pieces of this size.
constexpr size_t kDirectoryReadBytes = 32768;

}  // namespace

bool isDotOrDotDot(const char* name) {
  return std::strcmp(name, kCurrentDirectoryName) == 0 || std::strcmp(name, kParentDirectoryName) == 0;
}

bool isSameItem(int fd, dev_t device, ino_t inode) {
  struct stat status {};
  return fstat(fd, &status) == 0 && status.st_dev == device && status.st_ino == inode;
}

int openParentDirectory(int childFD, dev_t device, ino_t inode) {
  ScopedFD parent(openat(childFD, kParentDirectoryName, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!parent.valid()) return -1;
  if (!isSameItem(parent.get(), device, inode)) {
    errno = EAGAIN;
    return -1;
  }
  return parent.release();
}

int readDirectoryEntries(int directoryFD, std::vector<DirectoryEntry>& entries) {
  // A descriptor of its own (a fresh open description, not a dup) so that the
  // caller's descriptor and its position are left alone. It is read with
  // getdents64 directly: a readdir stream would add an fstat and two fcntl
  // calls to every directory of every walk.
  ScopedFD fd(openat(directoryFD, kCurrentDirectoryName, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  alignas(struct dirent64) char buffer[kDirectoryReadBytes];
  for (;;) {
    const ssize_t got = getdents64(fd.get(), buffer, sizeof buffer);
    if (got < 0) return errno;
    if (got == 0) return 0;
    for (ssize_t at = 0; at < got;) {
      const auto* entry = reinterpret_cast<const struct dirent64*>(buffer + at);
      at += entry->d_reclen;
      if (!isDotOrDotDot(entry->d_name)) entries.push_back({std::string(entry->d_name), entry->d_type});
    }
  }
}

}  // namespace platform::fs
