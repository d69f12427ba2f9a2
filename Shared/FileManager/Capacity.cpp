// Sizes of trees and room on file systems: what a dry run reports and what a
// move across file systems checks before it copies.
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <cerrno>

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"

using platform::Error;
using platform::URL;

namespace {
constexpr char kSizeFn[] = "-[QSFileManager sizeOfItemAtURL:size:error:]";
constexpr char kSpaceFn[] = "-[QSFileManager fileSystemSpaceForURL:space:error:]";
constexpr char kDeviceFn[] = "-[QSFileManager deviceOfItemAtURL:device:error:]";
}  // namespace

bool QSFileManager::sizeOfItemAtURL(const URL& url, QSItemSize* size, Error* error) const {
  QSItemSize counted;
  if (itemDoesNotExistAtURL(url)) {
    *size = counted;
    return true;
  }
  const bool walked = _traverseDirectory(url, error, [&](const QSTraversalEntry& entry, Error* stepError) {
    switch (entry.kind) {
      case QSTraversalEntry::Kind::DirectoryPre:
        ++counted.directories;
        return true;
      case QSTraversalEntry::Kind::DirectoryPost:
        if (entry.errorNumber == 0) return true;
        *stepError = QSPOSIXError(kSizeFn, __LINE__, entry.errorNumber, "Cannot read directory %s: %s", entry.path,
                                  QSErrorText(entry.errorNumber));
        return false;
      case QSTraversalEntry::Kind::RegularFile:
        ++counted.files;
        counted.bytes += static_cast<uint64_t>(entry.status.st_size);
        return true;
      case QSTraversalEntry::Kind::SymbolicLink:
      case QSTraversalEntry::Kind::Other:
        ++counted.otherItems;
        return true;
    }
    return true;
  });
  if (!walked) return false;
  *size = counted;
  return true;
}

bool QSFileManager::deviceOfItemAtURL(const URL& url, std::optional<uint64_t>* device, Error* error) const {
  struct stat status;
  if (::lstat(url.fileSystemRepresentation(), &status) == 0) {
    *device = static_cast<uint64_t>(status.st_dev);
    return true;
  }
  const int err = errno;
  if (err == ENOENT) {
    device->reset();
    return true;
  }
  return QSFail(error, QSPOSIXError(kDeviceFn, __LINE__, err, "lstat of %s failed: %s", url.path(), QSErrorText(err)));
}

bool QSFileManager::fileSystemSpaceForURL(const URL& url, QSFileSystemSpace* space, Error* error) const {
  std::string path = url.path();
  struct stat status;
  // The item, or the nearest ancestor that exists ("/" always does).
  while (::lstat(path.c_str(), &status) != 0) {
    const int err = errno;
    if (err != ENOENT && err != ENOTDIR) {
      return QSFail(error, QSPOSIXError(kSpaceFn, __LINE__, err, "lstat of %s failed: %s", path, QSErrorText(err)));
    }
    const size_t slash = path.find_last_of('/');
    path = slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
  }
  struct statvfs fileSystem;
  if (::statvfs(path.c_str(), &fileSystem) != 0) {
    const int err = errno;
    return QSFail(error, QSPOSIXError(kSpaceFn, __LINE__, err, "statvfs of %s failed: %s", path, QSErrorText(err)));
  }
  space->device = static_cast<uint64_t>(status.st_dev);
  space->existingPath = path;
  space->freeBytes = static_cast<uint64_t>(fileSystem.f_bavail) * fileSystem.f_frsize;
  space->blockSize = fileSystem.f_frsize;
  return true;
}
