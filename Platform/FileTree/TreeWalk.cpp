#include "Platform/FileTree/TreeWalk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "Platform/PosixHandles.h"

namespace platform::fs {

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
  // A stream of its own (a fresh open description, not a dup) so that the
  // caller's descriptor and its position are left alone.
  ScopedFD fd(openat(directoryFD, kCurrentDirectoryName, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  ScopedDIR stream(fdopendir(fd.get()));
  if (!stream.valid()) return errno;
  fd.release();
  for (;;) {
    errno = 0;
    const dirent* entry = readdir(stream.get());
    if (entry == nullptr) return errno;
    if (isDotOrDotDot(entry->d_name)) continue;
    entries.push_back({std::string(entry->d_name),
                       entry->d_type});
  }
}

}  // namespace platform::fs
