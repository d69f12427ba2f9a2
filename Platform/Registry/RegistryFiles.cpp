#include "Platform/Registry/RegistryFiles.h"

#include <dirent.h>
#include <fcntl.h>
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
#include "Platform/FileTree/CopyTree.h"
#include "Platform/FileTree/RemoveTree.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;
constexpr size_t kUUIDBytes = 16;

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

// Keeps the path of the item a removal could not remove, and stops it.
platform::fs::RemovalDecision keepFailedPath(const platform::fs::RemovalState&, const char* path, void* context) {
  *static_cast<std::string*>(context) = path;
  return platform::fs::RemovalDecision::Stop;
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

std::optional<std::vector<std::string>> listDirectory(const std::string& path, Error* error) {
  std::vector<std::string> names;
  if (const int errnum = platform::listDirectory(path, &names); errnum != 0) {
    fail(error, "list", path, errnum);
    return std::nullopt;
  }
  return names;
}

bool makeDirectories(const std::string& path, Error* error) {
  const int errnum = platform::makeDirectories(path, kDirectoryMode);
  return errnum == 0 || fail(error, "mkdir", path, errnum);
}

bool createNewDirectory(const std::string& path, Error* error) {
  // The parents are nearly always there already: they are made only when the
  // first attempt says one is missing.
  if (mkdir(path.c_str(), kDirectoryMode) == 0) return true;
  const size_t slash = path.find_last_of('/');
  if (errno != ENOENT || slash == std::string::npos || slash == 0) return fail(error, "mkdir", path, errno);
  if (!makeDirectories(path.substr(0, slash), error)) return false;
  return mkdir(path.c_str(), kDirectoryMode) == 0 || fail(error, "mkdir", path, errno);
}

bool removeTree(const std::string& path, Error* error) {
  std::string failedPath = path;
  platform::fs::RemovalState state;
  (void)state.setErrorCallback(&keepFailedPath);
  (void)state.setErrorContext(&failedPath);
  const int errnum = platform::fs::removeTree(path.c_str(), state);
  return errnum == 0 || errnum == ENOENT || fail(error, "remove", failedPath, errnum);
}

bool copyTree(const std::string& source, const std::string& destination, Error* error) {
  const int errnum = platform::fs::copyTree(source.c_str(), destination.c_str());
  return errnum == 0 || fail(error, "copy to " + destination + " from", source, errnum);
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
