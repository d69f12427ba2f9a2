// Owning wrappers for file descriptors and directory streams, used by every
// layer that calls the file system directly.
//
// Each wrapper closes what it owns when it goes away, keeping errno as it
// was; moving transfers ownership. Closing on destruction ignores the outcome:
// a descriptor whose writes matter is closed with close(), which reports it.
// Not thread-safe; a wrapper belongs to one call.
#pragma once

#include <dirent.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace platform {

class ScopedFD {
 public:
  ScopedFD() = default;
  explicit ScopedFD(int fd) : fd_(fd) {}
  ScopedFD(ScopedFD&& other) noexcept : fd_(other.release()) {}
  ScopedFD& operator=(ScopedFD&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  ScopedFD(const ScopedFD&) = delete;
  ScopedFD& operator=(const ScopedFD&) = delete;
  ~ScopedFD() { reset(); }

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  // Gives up ownership without closing.
  int release() { return std::exchange(fd_, -1); }
  // Closes now and reports the outcome (a deferred write error shows here):
  // false with errno set when close(2) fails. The wrapper owns nothing after.
  [[nodiscard]] bool close() { return ::close(release()) == 0; }
  // Closes the current descriptor (keeping errno as it was) and owns `fd`.
  void reset(int fd = -1) {
    if (fd_ >= 0) {
      int saved = errno;
      ::close(fd_);
      errno = saved;
    }
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

class ScopedDIR {
 public:
  ScopedDIR() = default;
  explicit ScopedDIR(DIR* dir) : dir_(dir) {}
  ScopedDIR(ScopedDIR&& other) noexcept : dir_(std::exchange(other.dir_, nullptr)) {}
  ScopedDIR& operator=(ScopedDIR&& other) noexcept {
    if (this != &other) reset(std::exchange(other.dir_, nullptr));
    return *this;
  }
  ScopedDIR(const ScopedDIR&) = delete;
  ScopedDIR& operator=(const ScopedDIR&) = delete;
  ~ScopedDIR() { reset(); }

  DIR* get() const { return dir_; }
  bool valid() const { return dir_ != nullptr; }
  // Closes the current stream (and with it its descriptor), keeping errno.
  void reset(DIR* dir = nullptr) {
    if (dir_) {
      int saved = errno;
      ::closedir(dir_);
      errno = saved;
    }
    dir_ = dir;
  }

 private:
  DIR* dir_ = nullptr;
};

}  // namespace platform
