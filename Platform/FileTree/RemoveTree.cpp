#include "Platform/FileTree/RemoveTree.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "Platform/PosixHandles.h"
#include "Platform/FileTree/TreeWalk.h"

namespace platform::fs {

int RemovalState::setErrorCallback(RemovalErrorCallback callback) {
  if (callback == nullptr) return EINVAL;
  callback_ = callback;
  return 0;
}

int RemovalState::setErrorContext(void* context) {
  if (context == nullptr) return EINVAL;
  context_ = context;
  return 0;
}

int RemovalState::errorNumber(int* errorNumber) const {
  if (currentError_ == 0 || errorNumber == nullptr) return EINVAL;
  *errorNumber = currentError_;
  return 0;
}

namespace {

constexpr int kOpenDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr char kPathSeparator = '/';

// A directory being emptied. Its listing is taken whole when it is entered,
// so that its descriptor may be closed (to bound the open descriptors) and
// reopened without reading anything twice.
struct Frame {
  ScopedFD fd;
  dev_t device = 0;
  ino_t inode = 0;
  std::string name;       // the name in the parent (the whole path for the root)
  size_t pathLength = 0;  // length of the walk's path while this is the current directory
  std::vector<DirectoryEntry> entries;
  size_t next = 0;
  bool vanished = false;  // moved away or removed by someone else while we worked
};

}  // namespace

class TreeRemover {
 public:
  explicit TreeRemover(RemovalState& state) : state_(state) {}

  int run(const char* root) {
    struct stat status {};
    if (fstatat(AT_FDCWD, root, &status, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    removeEntry(AT_FDCWD, root, S_ISDIR(status.st_mode) ? DT_DIR : DT_UNKNOWN);
    while (!frames_.empty() && stopError_ == 0) step();
    return stopError_;
  }

 private:
  // The path of `name` inside the current directory (the root's name is its
  // whole path).
  std::string childPath(const std::string& name) const {
    if (frames_.empty()) return name;
    return path_ + kPathSeparator + name;
  }

  // Hands a failure to the callback. Returns whether the walk goes on.
  bool report(const std::string& itemPath, int errnum) {
    if (state_.callback_ == nullptr) {
      stopError_ = errnum;
      return false;
    }
    state_.currentError_ = errnum;
    RemovalDecision decision = state_.callback_(state_, itemPath.c_str(), state_.context_);
    state_.currentError_ = 0;
    if (decision == RemovalDecision::Stop) stopError_ = errnum;
    return stopError_ == 0;
  }

  void step() {
    Frame& top = frames_.back();
    if (top.vanished || top.next == top.entries.size()) {
      leaveDirectory();
      return;
    }
    // Taken out of the frame: entering a directory may grow frames_.
    DirectoryEntry entry = std::move(top.entries[top.next++]);
    removeEntry(top.fd.get(), entry.name, entry.type);
  }

  // Removes a non-directory at once; enters a directory (pushes a frame).
  void removeEntry(int parentFD, const std::string& name, unsigned char type) {
    if (type != DT_DIR) {
      if (unlinkat(parentFD, name.c_str(), 0) == 0 || errno == ENOENT) return;
      if (errno != EISDIR) {
        report(childPath(name), errno);
        return;
      }
    }
    enterDirectory(parentFD, name);
  }

  void enterDirectory(int parentFD, const std::string& name) {
    ScopedFD fd(openat(parentFD, name.c_str(), kOpenDirectoryFlags));
    if (!fd.valid()) {
      int openError = errno;
      if (openError == ENOENT) return;
      if (openError == ENOTDIR || openError == ELOOP) {
        // Replaced by a non-directory since it was listed.
        if (unlinkat(parentFD, name.c_str(), 0) != 0 && errno != ENOENT) report(childPath(name), errno);
        return;
      }
      // An unreadable directory can still be removed when it is empty.
      if (unlinkat(parentFD, name.c_str(), AT_REMOVEDIR) != 0 && errno != ENOENT) report(childPath(name), openError);
      return;
    }
    Frame frame;
    struct stat status {};
    int readError = fstat(fd.get(), &status) == 0 ? readDirectoryEntries(fd.get(), frame.entries) : errno;
    if (readError != 0) {
      report(childPath(name), readError);
      return;
    }
    frame.device = status.st_dev;
    frame.inode = status.st_ino;
    frame.fd = std::move(fd);
    frame.name = name;
    if (frames_.empty()) {
      path_ = name;
    } else {
      path_ += kPathSeparator;
      path_ += name;
    }
    frame.pathLength = path_.size();
    frames_.push_back(std::move(frame));
    if (frames_.size() > kMaxOpenDirectories) frames_[frames_.size() - 1 - kMaxOpenDirectories].fd.reset();
  }

  // The current directory is done: remove it from its parent and go back up.
  void leaveDirectory() {
    size_t index = frames_.size() - 1;
    int reopenError = index == 0 ? 0 : reopen(index - 1);
    if (reopenError > 0) report(path_.substr(0, frames_[index - 1].pathLength), reopenError);
    Frame done = std::move(frames_.back());
    frames_.pop_back();
    path_.resize(frames_.empty() ? 0 : frames_.back().pathLength);
    if (reopenError != 0) {
      // The rest of the parent cannot be reached; what we emptied stays.
      frames_.back().vanished = true;
      return;
    }
    done.fd.reset();
    if (done.vanished) return;  // whatever is at its name now is not what we emptied
    int parentFD = frames_.empty() ? AT_FDCWD : frames_.back().fd.get();
    if (unlinkat(parentFD, done.name.c_str(), AT_REMOVEDIR) != 0 && errno != ENOENT) {
      report(childPath(done.name), errno);
    }
  }

  // Makes sure frames_[index] has an open descriptor on the same directory it
  // had when it was entered. Returns 0 when it has, kGone when that directory
  // is no longer where it was, or the error number that kept it from being
  // opened.
  static constexpr int kGone = -1;
  int reopen(size_t index) {
    Frame& frame = frames_[index];
    if (frame.fd.valid()) return 0;
    // Fast way: up from the child, which is open.
    const Frame& child = frames_[index + 1];
    if (child.fd.valid()) {
      frame.fd.reset(openParentDirectory(child.fd.get(), frame.device, frame.inode));
      if (frame.fd.valid()) return 0;
    }
    // The child was moved elsewhere: walk down again by name from the nearest
    // ancestor still open, checking every step.
    size_t start = index;
    while (start > 0 && !frames_[start - 1].fd.valid()) --start;
    ScopedFD current;
    for (size_t i = start; i <= index; ++i) {
      int parentFD = i == 0 ? AT_FDCWD : (i == start ? frames_[i - 1].fd.get() : current.get());
      ScopedFD next(openat(parentFD, frames_[i].name.c_str(), kOpenDirectoryFlags));
      if (!next.valid()) return (errno == ENOENT || errno == ENOTDIR || errno == ELOOP) ? kGone : errno;
      if (!isSameItem(next.get(), frames_[i].device, frames_[i].inode)) return kGone;
      current = std::move(next);
    }
    frame.fd = std::move(current);
    return 0;
  }

  RemovalState& state_;
  std::vector<Frame> frames_;
  std::string path_;   // path of the current directory
  int stopError_ = 0;  // the failure that stopped the walk
};

int removeTree(const char* path, RemovalState& state) {
  if (path == nullptr) return EFAULT;
  TreeRemover remover(state);
  return remover.run(path);
}

}  // namespace platform::fs
