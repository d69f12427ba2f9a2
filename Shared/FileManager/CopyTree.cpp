#include "Shared/FileManager/CopyTree.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "Shared/FileManager/PosixHandles.h"
#include "Shared/FileManager/TreeWalk.h"

namespace qsfs {

namespace {

constexpr int kOpenDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// O_NONBLOCK so that an item that became a fifo since it was examined cannot
// block the open; it has no effect on regular files.
constexpr int kOpenSourceFileFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
constexpr int kCreateFileFlags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
// New items stay private to their owner until their own mode is applied.
constexpr mode_t kPrivateFileMode = 0600;
constexpr mode_t kPrivateDirectoryMode = 0700;
constexpr mode_t kPermissionBits = 07777;
constexpr size_t kCopyChunkSize = 1 << 20;
constexpr size_t kReadWriteBufferSize = 128 * 1024;
constexpr char kProcessDescriptorDirectory[] = "/proc/self/fd/";

// ---- Extended attributes -----------------------------------------------

// Where an item's attributes are read or written: through its descriptor, or,
// for items that cannot be opened for that (links, device and fifo nodes),
// through a path on which no final link is followed.
struct AttributeTarget {
  int fd = -1;
  std::string path;

  ssize_t list(char* buffer, size_t size) const {
    return fd >= 0 ? flistxattr(fd, buffer, size) : llistxattr(path.c_str(), buffer, size);
  }
  ssize_t get(const char* name, void* buffer, size_t size) const {
    return fd >= 0 ? fgetxattr(fd, name, buffer, size) : lgetxattr(path.c_str(), name, buffer, size);
  }
  int set(const char* name, const void* value, size_t size) const {
    return fd >= 0 ? fsetxattr(fd, name, value, size, 0) : lsetxattr(path.c_str(), name, value, size, 0);
  }
};

// The path of `name` in the directory open at `directoryFD` that reaches it
// whatever the directory's own path length is.
std::string pathInDirectory(int directoryFD, const std::string& name) {
  if (directoryFD == AT_FDCWD) return name;
  return kProcessDescriptorDirectory + std::to_string(directoryFD) + "/" + name;
}

// Calls `read(buffer, size)` with a buffer grown until the value fits (the
// value may grow between the size query and the read). 0 or an error number.
template <class Read>
int readSized(std::vector<char>& buffer, const Read& read) {
  for (;;) {
    ssize_t size = read(nullptr, 0);
    if (size < 0) return errno;
    buffer.resize(static_cast<size_t>(size));
    if (size == 0) return 0;
    ssize_t got = read(buffer.data(), buffer.size());
    if (got >= 0) {
      buffer.resize(static_cast<size_t>(got));
      return 0;
    }
    if (errno != ERANGE) return errno;
  }
}

int copyExtendedAttributes(const AttributeTarget& from, const AttributeTarget& to) {
  std::vector<char> names;
  int errnum = readSized(names, [&](char* b, size_t s) { return from.list(b, s); });
  if (errnum == ENOTSUP) return 0;  // the source file system keeps none
  if (errnum != 0) return errnum;
  std::vector<char> value;
  for (size_t at = 0; at < names.size(); at += std::char_traits<char>::length(&names[at]) + 1) {
    const char* name = &names[at];
    errnum = readSized(value, [&](char* b, size_t s) { return from.get(name, b, s); });
    if (errnum == ENODATA) continue;  // removed since it was listed
    if (errnum != 0) return errnum;
    if (to.set(name, value.data(), value.size()) != 0) return errno;
  }
  return 0;
}

// ---- Data ---------------------------------------------------------------

int copyDataByReadWrite(int in, int out) {
  std::vector<char> buffer(kReadWriteBufferSize);
  for (;;) {
    ssize_t got = read(in, buffer.data(), buffer.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) return 0;
    for (ssize_t written = 0; written < got;) {
      ssize_t n = write(out, buffer.data() + written, static_cast<size_t>(got - written));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) return errno;
      written += n;
    }
  }
}

// Copies from the current offsets to the end. The kernel copy is tried first;
// where it cannot work (another file system, no support) the copy goes on
// from where it stopped with read and write.
int copyData(int in, int out) {
  for (;;) {
    ssize_t n = copy_file_range(in, nullptr, out, nullptr, kCopyChunkSize, 0);
    if (n > 0) continue;
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (errno == EXDEV || errno == ENOSYS || errno == EINVAL || errno == EOPNOTSUPP) {
      return copyDataByReadWrite(in, out);
    }
    return errno;
  }
}

// ---- Status -------------------------------------------------------------

int applyStatus(int fd, const struct stat& status) {
  if (fchown(fd, status.st_uid, status.st_gid) != 0) return errno;
  // After the owner: a change of owner clears the set-id bits.
  if (fchmod(fd, status.st_mode & kPermissionBits) != 0) return errno;
  const timespec times[2] = {status.st_atim, status.st_mtim};
  if (futimens(fd, times) != 0) return errno;
  return 0;
}

// The same for an item reached by name (links and nodes). A link's own mode
// cannot be changed on Linux, and links have no mode of their own to keep.
int applyStatusAt(int directoryFD, const std::string& name, const struct stat& status) {
  if (fchownat(directoryFD, name.c_str(), status.st_uid, status.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISLNK(status.st_mode) && fchmodat(directoryFD, name.c_str(), status.st_mode & kPermissionBits, 0) != 0) {
    return errno;
  }
  const timespec times[2] = {status.st_atim, status.st_mtim};
  if (utimensat(directoryFD, name.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  return 0;
}

// ---- Items --------------------------------------------------------------

struct Location {
  int directoryFD;   // AT_FDCWD for the top item
  std::string name;  // the whole path for the top item
};

int copyRegularFile(const Location& from, const Location& to, const struct stat& expected) {
  ScopedFD in(openat(from.directoryFD, from.name.c_str(), kOpenSourceFileFlags));
  if (!in.valid()) return errno;
  struct stat status {};
  if (fstat(in.get(), &status) != 0) return errno;
  // Replaced by another kind of item since it was examined.
  if ((status.st_mode & S_IFMT) != (expected.st_mode & S_IFMT)) return EAGAIN;
  ScopedFD out(openat(to.directoryFD, to.name.c_str(), kCreateFileFlags, kPrivateFileMode));
  if (!out.valid()) return errno;
  if (int errnum = copyData(in.get(), out.get()); errnum != 0) return errnum;
  if (int errnum = copyExtendedAttributes({in.get(), {}}, {out.get(), {}}); errnum != 0) return errnum;
  return applyStatus(out.get(), status);
}

int copySymbolicLink(const Location& from, const Location& to, const struct stat& status) {
  std::string target(static_cast<size_t>(status.st_size) + 1, '\0');
  for (;;) {
    ssize_t length = readlinkat(from.directoryFD, from.name.c_str(), target.data(), target.size());
    if (length < 0) return errno;
    if (static_cast<size_t>(length) < target.size()) {
      target.resize(static_cast<size_t>(length));
      break;
    }
    target.resize(target.size() * 2);  // the link was replaced by a longer one
  }
  if (symlinkat(target.c_str(), to.directoryFD, to.name.c_str()) != 0) return errno;
  int errnum = copyExtendedAttributes({-1, pathInDirectory(from.directoryFD, from.name)},
                                      {-1, pathInDirectory(to.directoryFD, to.name)});
  if (errnum != 0) return errnum;
  return applyStatusAt(to.directoryFD, to.name, status);
}

int copyNode(const Location& from, const Location& to, const struct stat& status) {
  if (mknodat(to.directoryFD, to.name.c_str(), (status.st_mode & S_IFMT) | kPrivateFileMode, status.st_rdev) != 0) {
    return errno;
  }
  int errnum = copyExtendedAttributes({-1, pathInDirectory(from.directoryFD, from.name)},
                                      {-1, pathInDirectory(to.directoryFD, to.name)});
  if (errnum != 0) return errnum;
  return applyStatusAt(to.directoryFD, to.name, status);
}

// ---- The walk -----------------------------------------------------------

struct Frame {
  ScopedFD source;
  ScopedFD destination;
  struct stat status {};             // of the source directory
  struct stat destinationStatus {};  // of the directory the copy made
  std::vector<DirectoryEntry> entries;
  size_t next = 0;
};

class TreeCopier {
 public:
  int run(const char* source, const char* destination) {
    struct stat status {};
    if (fstatat(AT_FDCWD, source, &status, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    int errnum = copyItem({AT_FDCWD, source}, {AT_FDCWD, destination}, status);
    while (errnum == 0 && !frames_.empty()) errnum = step();
    return errnum;
  }

 private:
  int step() {
    Frame& top = frames_.back();
    if (top.next == top.entries.size()) return leaveDirectory();
    std::string name = std::move(top.entries[top.next++].name);
    struct stat status {};
    if (fstatat(top.source.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
      return errno == ENOENT ? 0 : errno;  // vanished since the directory was read
    }
    if (S_ISDIR(status.st_mode) && status.st_dev == copyRoot_.st_dev && status.st_ino == copyRoot_.st_ino) {
      return EINVAL;  // the copy's own destination, inside its source
    }
    int sourceFD = top.source.get();
    int destinationFD = top.destination.get();
    return copyItem({sourceFD, name}, {destinationFD, name}, status);
  }

  int copyItem(const Location& from, const Location& to, const struct stat& status) {
    switch (status.st_mode & S_IFMT) {
      case S_IFREG:
        return copyRegularFile(from, to, status);
      case S_IFLNK:
        return copySymbolicLink(from, to, status);
      case S_IFDIR:
        return enterDirectory(from, to, status);
      default:
        return copyNode(from, to, status);
    }
  }

  int enterDirectory(const Location& from, const Location& to, const struct stat& expected) {
    Frame frame;
    frame.source.reset(openat(from.directoryFD, from.name.c_str(), kOpenDirectoryFlags));
    if (!frame.source.valid()) return errno;
    if (fstat(frame.source.get(), &frame.status) != 0) return errno;
    if (frame.status.st_dev != expected.st_dev || frame.status.st_ino != expected.st_ino) return EAGAIN;
    if (mkdirat(to.directoryFD, to.name.c_str(), kPrivateDirectoryMode) != 0) return errno;
    frame.destination.reset(openat(to.directoryFD, to.name.c_str(), kOpenDirectoryFlags));
    if (!frame.destination.valid()) return errno;
    if (fstat(frame.destination.get(), &frame.destinationStatus) != 0) return errno;
    if (frames_.empty()) copyRoot_ = frame.destinationStatus;
    if (int errnum = readDirectoryEntries(frame.source.get(), frame.entries); errnum != 0) return errnum;
    frames_.push_back(std::move(frame));
    if (frames_.size() > kMaxOpenDirectories) {
      Frame& distant = frames_[frames_.size() - 1 - kMaxOpenDirectories];
      distant.source.reset();
      distant.destination.reset();
    }
    return 0;
  }

  // Reopens both directories of `parent` from those of its child. A source
  // or destination directory moved away meanwhile fails the copy (EAGAIN).
  static int reopenParent(Frame& parent, const Frame& child) {
    parent.source.reset(openParentDirectory(child.source.get(), parent.status.st_dev, parent.status.st_ino));
    if (!parent.source.valid()) return errno;
    parent.destination.reset(
        openParentDirectory(child.destination.get(), parent.destinationStatus.st_dev, parent.destinationStatus.st_ino));
    if (!parent.destination.valid()) return errno;
    return 0;
  }

  // Attributes and status go on last: adding the children changes the
  // directory's times, and a default access-control list must not shape the
  // children, which get their own.
  int leaveDirectory() {
    Frame done = std::move(frames_.back());
    frames_.pop_back();
    if (!frames_.empty() && !frames_.back().source.valid()) {
      if (int errnum = reopenParent(frames_.back(), done); errnum != 0) return errnum;
    }
    int errnum = copyExtendedAttributes({done.source.get(), {}}, {done.destination.get(), {}});
    if (errnum != 0) return errnum;
    return applyStatus(done.destination.get(), done.status);
  }

  std::vector<Frame> frames_;
  struct stat copyRoot_ {};  // the destination's top directory
};

}  // namespace

int copyTree(const char* source, const char* destination) {
  if (source == nullptr || destination == nullptr) return EFAULT;
  TreeCopier copier;
  return copier.run(source, destination);
}

}  // namespace qsfs
