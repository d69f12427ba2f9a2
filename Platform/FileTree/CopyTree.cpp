#include "Platform/FileTree/CopyTree.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/PosixHandles.h"
#include "Platform/FileTree/TreeWalk.h"

namespace platform::fs {

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
    if (std::string_view(name).starts_with(kMoveAttributePrefix)) continue;  // a move's own mark
    errnum = readSized(value, [&](char* b, size_t s) { return from.get(name, b, s); });
    if (errnum == ENODATA) continue;  // removed since it was listed
    if (errnum != 0) return errnum;
    if (to.set(name, value.data(), value.size()) != 0) return errno;
  }
  return 0;
}

// ---- Data ---------------------------------------------------------------

// How data can move between the file systems of two devices, learnt during
// one copy: a way the file systems refuse as such (not for one file) is not
// tried again for every further file.
struct DataRoute {
  dev_t from = 0;
  dev_t to = 0;
  bool cloneRefused = false;      // FICLONE
  bool rangeCopyRefused = false;  // copy_file_range
  bool sendRefused = false;       // sendfile
};

// Errors by which a file system refuses a clone or kernel copy between two
// files, as opposed to failing at it.
bool refusesForEveryFile(int errnum) {
  return errnum == EOPNOTSUPP || errnum == ENOTTY || errnum == EXDEV || errnum == ENOSYS;
}

// Copies the data of one open file to a new empty one, keeping its holes.
class FileData {
 public:
  FileData(int in, int out, DataRoute& route, std::vector<char>& buffer)
      : in_(in), out_(out), route_(route), buffer_(buffer) {}

  // `status` is that of `in`. A file with fewer blocks than its size needs
  // has holes: only its data extents are copied and the size set at the
  // end, so a hole stays a hole (trailing ones included). Other files are
  // copied to their end whatever their size was.
  int copy(const struct stat& status) {
    if (status.st_size > 0 && !route_.cloneRefused) {
      if (ioctl(out_, FICLONE, in_) == 0) return 0;
      if (refusesForEveryFile(errno)) {
        route_.cloneRefused = true;
      } else if (ftruncate(out_, 0) != 0) {  // whatever a failed clone may have left
        return errno;
      }
    }
    if (status.st_blocks * kStatBlockSize >= status.st_size) return copyRange(0, kToEndOfFile);
    for (off_t offset = 0; offset < status.st_size;) {
      off_t data = lseek(in_, offset, SEEK_DATA);
      if (data < 0 && errno == ENXIO) break;  // nothing but a hole up to the end
      if (data < 0) return errno;
      if (data >= status.st_size) break;
      off_t hole = lseek(in_, data, SEEK_HOLE);
      if (hole < 0) return errno;
      hole = std::min(hole, status.st_size);
      if (int errnum = copyRange(data, hole); errnum != 0) return errnum;
      offset = hole;
    }
    return ftruncate(out_, status.st_size) == 0 ? 0 : errno;
  }

 private:
  static constexpr off_t kToEndOfFile = -1;
  static constexpr off_t kStatBlockSize = 512;  // the unit of st_blocks
  // Large enough that a big file takes few calls; the kernel copies it in
  // pieces of its own and checks for signals between them.
  static constexpr size_t kCopyChunkSize = 8 << 20;

  // Copies bytes [offset, end) to the same offsets (end kToEndOfFile: up to
  // the end of the file). Each way is tried in turn, from where the previous
  // one stopped: the kernel copy (which can share blocks), sendfile (one
  // copy in the kernel, across any two file systems), read and write.
  int copyRange(off_t offset, off_t end) {
    bool rangeCopy = !route_.rangeCopyRefused;
    bool send = !route_.sendRefused;
    while (end == kToEndOfFile || offset < end) {
      const size_t size =
          end == kToEndOfFile ? kCopyChunkSize : static_cast<size_t>(std::min<off_t>(end - offset, kCopyChunkSize));
      ssize_t n;
      if (rangeCopy) {
        off_t inOffset = offset, outOffset = offset;
        n = copy_file_range(in_, &inOffset, out_, &outOffset, size, 0);
        if (n < 0 && (refusesForEveryFile(errno) || errno == EINVAL)) {
          if (errno != EINVAL) route_.rangeCopyRefused = true;  // EINVAL may be this file's alone
          rangeCopy = false;
          continue;
        }
      } else if (send) {
        if (outPosition_ != offset) {
          if (lseek(out_, offset, SEEK_SET) < 0) return errno;
          outPosition_ = offset;
        }
        off_t inOffset = offset;
        n = sendfile(out_, in_, &inOffset, size);
        if (n < 0 && (errno == EINVAL || errno == ENOSYS)) {
          route_.sendRefused = true;
          send = false;
          continue;
        }
        if (n > 0) outPosition_ += n;
      } else {
        n = copyByReadWrite(offset, std::min(size, kReadWriteBufferSize));
      }
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) return errno;
      if (n == 0) return 0;  // the end of the file, sooner than it was if it shrank
      offset += n;
    }
    return 0;
  }

  // One read of at most `size` bytes at `offset`, written whole at the same
  // offset. The bytes read, 0 at the end, or -1 with errno set.
  ssize_t copyByReadWrite(off_t offset, size_t size) {
    buffer_.resize(kReadWriteBufferSize);
    ssize_t got = pread(in_, buffer_.data(), size, offset);
    if (got <= 0) return got;
    for (ssize_t written = 0; written < got;) {
      ssize_t n = pwrite(out_, buffer_.data() + written, static_cast<size_t>(got - written), offset + written);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) return -1;
      written += n;
    }
    return got;
  }

  const int in_;
  const int out_;
  DataRoute& route_;
  std::vector<char>& buffer_;
  off_t outPosition_ = 0;  // of `out_`, which only sendfile moves
};

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
  std::string name;  // in its parent; the whole path for the top directory
  ScopedFD source;
  ScopedFD destination;
  struct stat status {};             // of the source directory
  struct stat destinationStatus {};  // of the directory the copy made
  std::vector<DirectoryEntry> entries;
  size_t next = 0;
};

class TreeCopier {
 public:
  explicit TreeCopier(CopyLinkTable& links) : links_(links) {}

  int run(const char* source, const char* destination) {
    struct stat status {};
    if (fstatat(AT_FDCWD, source, &status, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    destinationPath_ = destination;
    top_ = links_.tops.size();
    links_.tops.emplace_back(destination);
    int errnum = copyOrLink({AT_FDCWD, source}, {AT_FDCWD, destination}, status);
    while (errnum == 0 && !frames_.empty()) errnum = step();
    return errnum;
  }

 private:
  using ItemKey = std::pair<dev_t, ino_t>;

  // An item with several names is copied once: a name met later, in this
  // tree or in another of the table, is linked to that copy.
  int copyOrLink(const Location& from, const Location& to, const struct stat& status) {
    if (S_ISDIR(status.st_mode)) return copyItem(from, to, status);
    const ItemKey key{status.st_dev, status.st_ino};
    auto found = links_.copies.find(key);
    if (found != links_.copies.end() && (found->second.sourceSize != status.st_size ||
                                         found->second.sourceModified.tv_sec != status.st_mtim.tv_sec ||
                                         found->second.sourceModified.tv_nsec != status.st_mtim.tv_nsec)) {
      links_.copies.erase(found);  // another item on a reused inode, or one changed since its copy
      found = links_.copies.end();
    }
    if (found != links_.copies.end()) {
      if (linkToCopy(found->second, to) == 0) {
        if (--found->second.namesLeft == 0) links_.copies.erase(found);
        return 0;
      }
      return copyItem(from, to, status);  // a copy of its own, like the first
    }
    if (int errnum = copyItem(from, to, status); errnum != 0) return errnum;
    if (status.st_nlink > 1) rememberCopy(key, to, status);
    return 0;
  }

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
    return copyOrLink({top.source.get(), name}, {top.destination.get(), name}, status);
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

  int copyRegularFile(const Location& from, const Location& to, const struct stat& expected) {
    ScopedFD in(openat(from.directoryFD, from.name.c_str(), kOpenSourceFileFlags));
    if (!in.valid()) return errno;
    struct stat status {};
    if (fstat(in.get(), &status) != 0) return errno;
    // Replaced by another kind of item since it was examined.
    if ((status.st_mode & S_IFMT) != (expected.st_mode & S_IFMT)) return EAGAIN;
    ScopedFD out(openat(to.directoryFD, to.name.c_str(), kCreateFileFlags, kPrivateFileMode));
    if (!out.valid()) return errno;
    dev_t destinationDevice = 0;
    if (!frames_.empty()) {
      destinationDevice = frames_.back().destinationStatus.st_dev;
    } else if (struct stat created{}; fstat(out.get(), &created) == 0) {
      destinationDevice = created.st_dev;
    } else {
      return errno;
    }
    FileData data(in.get(), out.get(), routeBetween(status.st_dev, destinationDevice), buffer_);
    if (int errnum = data.copy(status); errnum != 0) return errnum;
    if (int errnum = copyExtendedAttributes({in.get(), {}}, {out.get(), {}}); errnum != 0) return errnum;
    return applyStatus(out.get(), status);
  }

  DataRoute& routeBetween(dev_t from, dev_t to) {
    for (DataRoute& route : routes_) {
      if (route.from == from && route.to == to) return route;
    }
    return routes_.emplace_back(DataRoute{from, to});
  }

  // Records the copy just made at `to` (an entry of the top directory) as the
  // one further names of its source are linked to.
  void rememberCopy(const ItemKey& key, const Location& to, const struct stat& source) {
    struct stat copy {};
    if (fstatat(to.directoryFD, to.name.c_str(), &copy, AT_SYMLINK_NOFOLLOW) != 0) return;  // no links to it then
    LinkedCopy linked;
    linked.top = top_;
    for (size_t level = 1; level < frames_.size(); ++level) linked.path.push_back(frames_[level].name);
    if (!frames_.empty()) linked.path.push_back(to.name);
    linked.device = copy.st_dev;
    linked.inode = copy.st_ino;
    linked.sourceSize = source.st_size;
    linked.sourceModified = source.st_mtim;
    linked.namesLeft = source.st_nlink - 1;
    links_.copies[key] = std::move(linked);
  }

  // Makes `to` another name of `copy`. Its directory is reached from the
  // deepest directory of the walk still open on both paths, else from the
  // top one by its path, one name at a time: no path longer than a name is
  // ever used, however deep the tree. 0, or an error number when the link
  // could not be made (nothing was made then).
  int linkToCopy(const LinkedCopy& copy, const Location& to) {
    if (copy.top != top_ || copy.path.empty()) return linkToCopyInAnotherTree(copy, to);
    size_t level = 0;  // of the deepest directory on both paths
    while (level + 1 < frames_.size() && level + 1 < copy.path.size() && frames_[level + 1].name == copy.path[level]) {
      ++level;
    }
    ScopedFD opened;
    int directoryFD = frames_[level].destination.get();
    if (!frames_[level].destination.valid()) {
      opened.reset(open(destinationPath_.c_str(), kOpenDirectoryFlags));
      if (!opened.valid()) return errno;
      if (!isSameItem(opened.get(), copyRoot_.st_dev, copyRoot_.st_ino)) return EAGAIN;
      directoryFD = opened.get();
      level = 0;
    }
    for (; level + 1 < copy.path.size(); ++level) {
      opened.reset(openat(directoryFD, copy.path[level].c_str(), kOpenDirectoryFlags));
      if (!opened.valid()) return errno;
      directoryFD = opened.get();
    }
    return linkAndCheck(copy, directoryFD, copy.path.back(), to);
  }

  // The same for a copy made by an earlier call: its tree is reached from
  // its top's recorded path, one name at a time.
  int linkToCopyInAnotherTree(const LinkedCopy& copy, const Location& to) {
    const std::string& top = links_.tops.at(copy.top);
    if (top.empty()) return ENOENT;
    if (copy.path.empty()) return linkAndCheck(copy, AT_FDCWD, top, to);
    ScopedFD opened(open(top.c_str(), kOpenDirectoryFlags));
    for (size_t level = 0; opened.valid() && level + 1 < copy.path.size(); ++level) {
      opened.reset(openat(opened.get(), copy.path[level].c_str(), kOpenDirectoryFlags));
    }
    if (!opened.valid()) return errno;
    return linkAndCheck(copy, opened.get(), copy.path.back(), to);
  }

  int linkAndCheck(const LinkedCopy& copy, int directoryFD, const std::string& name, const Location& to) {
    if (linkat(directoryFD, name.c_str(), to.directoryFD, to.name.c_str(), 0) != 0) return errno;
    // The copy's directories could have been renamed meanwhile: the new name
    // must be the copy, or it goes again.
    struct stat linked {};
    if (fstatat(to.directoryFD, to.name.c_str(), &linked, AT_SYMLINK_NOFOLLOW) == 0 && linked.st_dev == copy.device &&
        linked.st_ino == copy.inode) {
      return 0;
    }
    // Not removable: the copy that follows fails on the name (EEXIST).
    (void)unlinkat(to.directoryFD, to.name.c_str(), 0);
    return EAGAIN;
  }

  int enterDirectory(const Location& from, const Location& to, const struct stat& expected) {
    Frame frame;
    frame.name = to.name;
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
  std::string destinationPath_;
  CopyLinkTable& links_;
  size_t top_ = 0;  // this tree's index in links_.tops
  std::vector<DataRoute> routes_;
  std::vector<char> buffer_;  // of the read and write copies
};

}  // namespace

int copyTree(const char* source, const char* destination, CopyLinkTable* links) {
  if (source == nullptr || destination == nullptr) return EFAULT;
  CopyLinkTable own;
  TreeCopier copier(links != nullptr ? *links : own);
  return copier.run(source, destination);
}

void CopyLinkTable::topRenamed(const std::string& from, const std::string& to) {
  for (std::string& top : tops) {
    if (top == from) top = to;
  }
}

void CopyLinkTable::topRemoved(const std::string& top) { topRenamed(top, ""); }

}  // namespace platform::fs
