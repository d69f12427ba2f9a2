// Whole-file reading and (atomic) writing of bytes: readFileBytes and
// writeFileBytes of PropertyList.h.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <string>
#include <vector>

#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/PosixHandles.h"

namespace platform::plist {

namespace {

// Permissions of a file that did not exist before it was written.
constexpr mode_t kNewFileMode = 0644;
constexpr mode_t kPermissionBits = 07777;
constexpr size_t kReadChunk = 64 * 1024;
// The temporary file is "." + the target's name (cut to this length) + a
// unique suffix, so that it stays within NAME_MAX and is hidden.
constexpr size_t kTempNameStemLimit = 200;
constexpr char kTempSuffix[] = ".XXXXXX";

// The close error of a write must be checked: use close().
using UniqueFd = ScopedFD;

// A file that is unlinked when the object goes away, unless kept.
class TempFileGuard {
 public:
  explicit TempFileGuard(std::string path) : path_(std::move(path)) {}
  ~TempFileGuard() {
    if (!path_.empty()) ::unlink(path_.c_str());
  }
  TempFileGuard(const TempFileGuard&) = delete;
  TempFileGuard& operator=(const TempFileGuard&) = delete;
  const std::string& path() const { return path_; }
  void keep() { path_.clear(); }

 private:
  std::string path_;
};

// A failed call: the POSIX record of `call` on `path` wrapped in the write
// failure of `url`.
bool writeFailure(Error* error, const URL& url, const char* call, const std::string& path) {
  int errnum = errno;
  Error posix = POSIXCallError(errnum, call, path);
  return failWith(error, FileWriteError(url, std::string(call) + " failed: " + errnoText(errnum), &posix));
}

std::optional<Data> readFailure(Error* error, const URL& url, const char* call, int errnum) {
  Error posix = POSIXCallError(errnum, call, url.path());
  std::string reason = errnum == ENOENT  ? "no such file"
                       : errnum == ELOOP ? "a symbolic link, which this reader does not follow"
                                         : std::string(call) + " failed: " + errnoText(errnum);
  failWith(error, FileReadError(url, reason, &posix));
  return std::nullopt;
}

std::optional<Data> tooLarge(Error* error, const URL& url, uint64_t size, size_t limit) {
  failWith(error, FileReadError(url, "the file holds at least " + std::to_string(size) + " bytes, more than the " +
                                         std::to_string(limit) + " this reader takes"));
  return std::nullopt;
}

// Writes every byte, retrying interrupted and partial writes. errno is set
// on failure.
bool writeAll(int fd, const Data& data) {
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = ::write(fd, data.data() + done, data.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    done += static_cast<size_t>(n);
  }
  return true;
}

// The permissions the written file gets: those of the file it replaces, or
// the default for a new one.
mode_t modeForReplacing(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode)) return st.st_mode & kPermissionBits;
  return kNewFileMode;
}

std::string tempTemplateFor(const URL& url) {
  std::string stem = "." + url.lastPathComponent().substr(0, kTempNameStemLimit);
  return path::join(url.deletingLastPathComponent().path(), stem + kTempSuffix);
}

// Flushes the directory so that the rename itself survives a crash. A file
// system that cannot flush directories (EINVAL) has nothing to flush.
bool syncDirectory(const std::string& directory) {
  UniqueFd dir(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir.valid()) return false;
  return ::fsync(dir.get()) == 0 || errno == EINVAL;
}

// Fills `fd` with the data and the target's permissions and flushes it
// unless the write is scratch.
bool fillAndFlush(int fd, const Data& data, const URL& url, const std::string& shownPath, Durability durability,
                  Error* error) {
  if (!writeAll(fd, data)) return writeFailure(error, url, "write", shownPath);
  if (::fchmod(fd, modeForReplacing(url.path())) != 0) return writeFailure(error, url, "fchmod", shownPath);
  if (durability != Durability::Scratch && ::fsync(fd) != 0) return writeFailure(error, url, "fsync", shownPath);
  return true;
}

bool syncDirectoryOf(const URL& url, Durability durability, Error* error) {
  const std::string directory = url.deletingLastPathComponent().path();
  if (durability == Durability::Flushed && !syncDirectory(directory)) {
    return writeFailure(error, url, "fsync", directory);
  }
  return true;
}

// The portable way: a named temporary file, renamed over the target. A
// process killed before the rename leaves the temporary file behind.
bool writeThroughNamedTempFile(const Data& data, const URL& url, Durability durability, Error* error) {
  std::string tmpl = tempTemplateFor(url);
  UniqueFd fd(::mkostemp(tmpl.data(), O_CLOEXEC));
  if (!fd.valid()) return writeFailure(error, url, "mkstemp", tmpl);
  TempFileGuard temp(tmpl);

  if (!fillAndFlush(fd.get(), data, url, temp.path(), durability, error)) return false;
  if (!fd.close()) return writeFailure(error, url, "close", temp.path());
  if (::rename(temp.path().c_str(), url.fileSystemRepresentation()) != 0) {
    return writeFailure(error, url, "rename", url.path());
  }
  temp.keep();
  return syncDirectoryOf(url, durability, error);
}

// A fresh name for the temporary link of a replacing write.
std::string uniqueTempName(const URL& url) {
  static std::atomic<uint64_t> counter{0};
  std::string name = tempTemplateFor(url);
  name.resize(name.size() - (sizeof kTempSuffix - 2));
  return name + std::to_string(::getpid()) + "-" + std::to_string(counter.fetch_add(1));
}

// The data goes into an unnamed file in the target's directory (O_TMPFILE),
// which vanishes by itself if the process dies before it is done. It is
// linked in place when the target does not exist yet; otherwise it gets a
// unique name only for the instant between the link and the rename over the
// target. So a process killed while writing leaves no temporary file beside
// the target (a stray file in an application container would otherwise count
// as a missed item for ever). Falls back to a named temporary file where
// unnamed files or /proc are not available.
bool writeAtomically(const Data& data, const URL& url, Durability durability, Error* error) {
  const std::string directory = url.deletingLastPathComponent().path();
  UniqueFd fd(::open(directory.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, kNewFileMode));
  if (!fd.valid()) {
    if (errno == EOPNOTSUPP || errno == EISDIR) return writeThroughNamedTempFile(data, url, durability, error);
    return writeFailure(error, url, "open", directory);
  }
  if (!fillAndFlush(fd.get(), data, url, directory, durability, error)) return false;
  const std::string procPath = "/proc/self/fd/" + std::to_string(fd.get());
  auto linkTo = [&](const std::string& path) {
    return ::linkat(AT_FDCWD, procPath.c_str(), AT_FDCWD, path.c_str(), AT_SYMLINK_FOLLOW) == 0;
  };
  if (!linkTo(url.path())) {
    if (errno == ENOENT) return writeThroughNamedTempFile(data, url, durability, error);  // no /proc
    if (errno != EEXIST) return writeFailure(error, url, "linkat", url.path());
    std::string tempPath = uniqueTempName(url);
    while (!linkTo(tempPath)) {
      if (errno != EEXIST) return writeFailure(error, url, "linkat", tempPath);
      tempPath = uniqueTempName(url);
    }
    TempFileGuard temp(tempPath);
    if (::rename(temp.path().c_str(), url.fileSystemRepresentation()) != 0) {
      return writeFailure(error, url, "rename", url.path());
    }
    temp.keep();
  }
  if (!fd.close()) return writeFailure(error, url, "close", directory);
  return syncDirectoryOf(url, durability, error);
}

bool writeInPlace(const Data& data, const URL& url, Error* error) {
  UniqueFd fd(::open(url.fileSystemRepresentation(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kNewFileMode));
  if (!fd.valid()) return writeFailure(error, url, "open", url.path());
  if (!writeAll(fd.get(), data)) return writeFailure(error, url, "write", url.path());
  if (!fd.close()) return writeFailure(error, url, "close", url.path());
  return true;
}

}  // namespace

std::optional<Data> readFileBytes(const URL& url, Error* error) {
  return readFileBytes(url, ReadOptions{}, error);
}

std::optional<Data> readFileBytes(const URL& url, const ReadOptions& options, Error* error) {
  // O_NONBLOCK keeps a FIFO (or a link to one) from blocking the open; only
  // regular files are read (a device could be endless).
  int flags = O_RDONLY | O_CLOEXEC | O_NONBLOCK;
  if (options.finalLink == FinalLink::Refuse) flags |= O_NOFOLLOW;
  UniqueFd fd(::open(url.fileSystemRepresentation(), flags));
  if (!fd.valid()) return readFailure(error, url, "open", errno);
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return readFailure(error, url, "fstat", errno);
  if (S_ISDIR(st.st_mode)) return readFailure(error, url, "read", EISDIR);
  if (!S_ISREG(st.st_mode)) {
    failWith(error, FileReadError(url, "not a regular file"));
    return std::nullopt;
  }
  // The size is only a hint (a sparse file claims what it likes, a file can
  // grow while it is read): nothing is reserved beyond the limit, and reading
  // stops as soon as the limit is passed.
  const uint64_t claimed = static_cast<uint64_t>(st.st_size);
  if (claimed > options.sizeLimit) return tooLarge(error, url, claimed, options.sizeLimit);

  Data bytes;
  bytes.reserve(static_cast<size_t>(claimed));
  for (;;) {
    size_t used = bytes.size();
    bytes.resize(used + kReadChunk);
    ssize_t n = ::read(fd.get(), bytes.data() + used, kReadChunk);
    if (n < 0 && errno == EINTR) {
      bytes.resize(used);
      continue;
    }
    if (n < 0) return readFailure(error, url, "read", errno);
    bytes.resize(used + static_cast<size_t>(n));
    if (n == 0) return bytes;
    if (bytes.size() > options.sizeLimit) return tooLarge(error, url, bytes.size(), options.sizeLimit);
  }
}

bool writeFileBytes(const Data& data, const URL& url, bool atomically, Error* error, Durability durability) {
  if (url.empty()) return failWith(error, FileWriteError(url, "no path given"));
  return atomically ? writeAtomically(data, url, durability, error) : writeInPlace(data, url, error);
}

}  // namespace platform::plist
