#include "Platform/ReadOnlyFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace platform {

// O_NONBLOCK: a FIFO at the path must not hold the caller up in open().
ReadOnlyFile::ReadOnlyFile(const char* path) : fd_(::open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK)) {}

ReadOnlyFile::~ReadOnlyFile() {
  if (fd_ < 0) return;
  // Keep the caller's errno: the close of a read-only descriptor reports nothing worth knowing.
  int saved = errno;
  ::close(fd_);
  errno = saved;
}

bool ReadOnlyFile::size(int64_t* bytes) const {
  struct stat status {};
  if (::fstat(fd_, &status) != 0) return false;
  *bytes = static_cast<int64_t>(status.st_size);
  return true;
}

int64_t ReadOnlyFile::read(void* buffer, size_t length) {
  for (;;) {
    ssize_t n = ::read(fd_, buffer, length);
    if (n < 0 && errno == EINTR) continue;
    return static_cast<int64_t>(n);
  }
}

}  // namespace platform
