#include "Platform/Registry/RegistryFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include "Platform/Foundation/Format.h"
#include "Platform/Foundation/Text.h"
#include "Platform/FileSystem.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;
constexpr size_t kCopyBufferSize = 1 << 16;
constexpr size_t kUUIDBytes = 16;

struct FtsCloser {
  void operator()(FTS* fts) const { fts_close(fts); }
};
using FtsHandle = std::unique_ptr<FTS, FtsCloser>;

FtsHandle openTree(const std::string& root) {
  char* roots[] = {const_cast<char*>(root.c_str()), nullptr};
  return FtsHandle(fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR, nullptr));
}

bool fail(Error* error, const std::string& what, const std::string& path, int errnum) {
  if (error) *error = posixFailure(kRegistryErrorFileOperation, what, path, errnum);
  return false;
}

bool writeAll(int fd, const uint8_t* bytes, size_t length) {
  while (length > 0) {
    ssize_t n = write(fd, bytes, length);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    bytes += n;
    length -= static_cast<size_t>(n);
  }
  return true;
}

bool copyFileContents(const std::string& source, const std::string& destination, mode_t mode, Error* error) {
  ScopedFD in(open(source.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!in.valid()) return fail(error, "open", source, errno);
  ScopedFD out(open(destination.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode & 07777));
  if (!out.valid()) return fail(error, "create", destination, errno);
  std::vector<uint8_t> buffer(kCopyBufferSize);
  for (;;) {
    ssize_t n = read(in.get(), buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return fail(error, "read", source, errno);
    if (n == 0) break;
    if (!writeAll(out.get(), buffer.data(), static_cast<size_t>(n))) return fail(error, "write", destination, errno);
  }
  if (!out.close()) return fail(error, "close", destination, errno);
  return true;
}

bool copySymbolicLink(const std::string& source, const std::string& destination, Error* error) {
  std::vector<char> target(PATH_MAX + 1);
  ssize_t n = readlink(source.c_str(), target.data(), target.size() - 1);
  if (n < 0) return fail(error, "readlink", source, errno);
  target[static_cast<size_t>(n)] = '\0';
  if (symlink(target.data(), destination.c_str()) != 0) return fail(error, "symlink", destination, errno);
  return true;
}

}  // namespace

Error posixFailure(int64_t code, const std::string& what, const std::string& path, int errnum) {
  const std::string message = Format("%s %s: %s", what, path, strerror(errnum));
  Dictionary underlying{{kLocalizedDescriptionKey, Value(message)}};
  Dictionary info{{kLocalizedDescriptionKey, Value(message)},
                  {kUnderlyingErrorKey, Value(Error(kPOSIXErrorDomain, errnum, std::move(underlying)))}};
  return Error(kRegistryErrorDomain, code, std::move(info));
}

Error registryError(int64_t code, const std::string& message) {
  return Error(kRegistryErrorDomain, code, Dictionary{{kLocalizedDescriptionKey, Value(message)}});
}

bool isDirectoryNoFollow(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::optional<std::vector<std::string>> listDirectory(const std::string& path, Error* error) {
  ScopedDIR dir(opendir(path.c_str()));
  if (!dir.valid()) {
    fail(error, "opendir", path, errno);
    return std::nullopt;
  }
  std::vector<std::string> names;
  for (;;) {
    errno = 0;
    const dirent* entry = readdir(dir.get());
    if (!entry) break;
    std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(std::move(name));
  }
  if (errno != 0) {
    fail(error, "readdir", path, errno);
    return std::nullopt;
  }
  std::sort(names.begin(), names.end());
  return names;
}

bool makeDirectories(const std::string& path, Error* error) {
  const int errnum = platform::makeDirectories(path, kDirectoryMode);
  return errnum == 0 || fail(error, "mkdir", path, errnum);
}

bool createNewDirectory(const std::string& path, Error* error) {
  size_t slash = path.find_last_of('/');
  if (slash != std::string::npos && slash > 0 && !makeDirectories(path.substr(0, slash), error)) return false;
  return mkdir(path.c_str(), kDirectoryMode) == 0 || fail(error, "mkdir", path, errno);
}

bool removeTree(const std::string& path, Error* error) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return errno == ENOENT ? true : fail(error, "lstat", path, errno);
  if (!S_ISDIR(st.st_mode)) return unlink(path.c_str()) == 0 || errno == ENOENT || fail(error, "unlink", path, errno);
  FtsHandle fts = openTree(path);
  if (!fts) return fail(error, "fts_open", path, errno);
  while (FTSENT* entry = fts_read(fts.get())) {
    switch (entry->fts_info) {
      case FTS_D:
        break;
      case FTS_DP:
        if (rmdir(entry->fts_path) != 0 && errno != ENOENT) return fail(error, "rmdir", entry->fts_path, errno);
        break;
      case FTS_DNR:
      case FTS_ERR:
      case FTS_NS:
        return fail(error, "read", entry->fts_path, entry->fts_errno);
      default:
        if (unlink(entry->fts_path) != 0 && errno != ENOENT) return fail(error, "unlink", entry->fts_path, errno);
    }
  }
  return errno == 0 || fail(error, "fts_read", path, errno);
}

bool copyTree(const std::string& source, const std::string& destination, Error* error) {
  FtsHandle fts = openTree(source);
  if (!fts) return fail(error, "fts_open", source, errno);
  while (FTSENT* entry = fts_read(fts.get())) {
    std::string target = destination + std::string(entry->fts_path).substr(source.size());
    switch (entry->fts_info) {
      case FTS_D:
        if (mkdir(target.c_str(), kDirectoryMode) != 0) return fail(error, "mkdir", target, errno);
        break;
      case FTS_DP:
        if (chmod(target.c_str(), entry->fts_statp->st_mode & 07777) != 0) return fail(error, "chmod", target, errno);
        break;
      case FTS_F:
        if (!copyFileContents(entry->fts_path, target, entry->fts_statp->st_mode, error)) return false;
        break;
      case FTS_SL:
      case FTS_SLNONE:
        if (!copySymbolicLink(entry->fts_path, target, error)) return false;
        break;
      case FTS_DNR:
      case FTS_ERR:
      case FTS_NS:
        return fail(error, "read", entry->fts_path, entry->fts_errno);
      default:
        return fail(error, "copy (unsupported file type)", entry->fts_path, ENOTSUP);
    }
  }
  return errno == 0 || fail(error, "fts_read", source, errno);
}

bool moveItem(const std::string& source, const std::string& destination, Error* error) {
  return rename(source.c_str(), destination.c_str()) == 0 ||
         fail(error, "rename", source + " to " + destination, errno);
}

bool syncFileSystems(const std::vector<std::string>& paths, Error* error) {
  std::vector<std::pair<dev_t, ScopedFD>> opened;
  for (const std::string& path : paths) {
    ScopedFD fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) return fail(error, "open", path, errno);
    struct stat st;
    if (fstat(fd.get(), &st) != 0) return fail(error, "fstat", path, errno);
    opened.emplace_back(st.st_dev, std::move(fd));
  }
  for (size_t i = 0; i < opened.size(); ++i) {
    const auto later = std::find_if(opened.begin() + static_cast<std::ptrdiff_t>(i) + 1, opened.end(),
                                    [&](const auto& entry) { return entry.first == opened[i].first; });
    if (later != opened.end()) continue;  // flushed at its last place
    if (syncfs(opened[i].second.get()) != 0) return fail(error, "syncfs", paths[i], errno);
  }
  return true;
}

bool writeNewFile(const std::string& path, const std::vector<uint8_t>& bytes, Error* error) {
  ScopedFD fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, kFileMode));
  if (!fd.valid()) return fail(error, "create", path, errno);
  if (!writeAll(fd.get(), bytes.data(), bytes.size())) return fail(error, "write", path, errno);
  if (!fd.close()) return fail(error, "close", path, errno);
  return true;
}

bool setProtectionClass(const std::string& path, int32_t protectionClass, Error* error) {
  ScopedFD fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) return fail(error, "open", path, errno);
  if (fsetxattr(fd.get(), kProtectionClassAttributeName, &protectionClass, sizeof protectionClass, 0) != 0) {
    return fail(error, "setxattr", path, errno);
  }
  return true;
}

std::optional<std::string> newUUID(Error* error) {
  uint8_t bytes[kUUIDBytes];
  size_t got = 0;
  while (got < sizeof bytes) {
    ssize_t n = getrandom(bytes + got, sizeof bytes - got, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      fail(error, "getrandom", "", errno);
      return std::nullopt;
    }
    got += static_cast<size_t>(n);
  }
  return uuidString(bytes);
}

std::optional<FileLock> FileLock::acquire(const std::string& path, Error* error) {
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, kFileMode);
  if (fd < 0) {
    fail(error, "open", path, errno);
    return std::nullopt;
  }
  FileLock lock(ScopedFD{fd});
  while (flock(fd, LOCK_EX) != 0) {
    if (errno != EINTR) {
      fail(error, "flock", path, errno);
      return std::nullopt;
    }
  }
  return lock;
}

}  // namespace platform::registry
