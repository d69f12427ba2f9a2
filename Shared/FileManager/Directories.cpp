// QSFileManager: directory creation and temporary directories.
#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include "Shared/FileManager/DataProtection.h"
#include "Shared/FileManager/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kCreateDirectoryFn[] =
    "-[QSFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
constexpr char kCreateTemporaryDirectoryFn[] = "-[QSFileManager createTemporaryDirectoryInDirectoryURL:error:]";
constexpr char kTemporaryDirectoryTemplate[] = "temp.XXXXXX";
constexpr char kPathSeparator = '/';

bool isDirectory(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

// mkdir that tolerates an existing directory (followed through links, as
// path resolution would follow it).
int makeOneDirectory(const std::string& path, mode_t mode) {
  if (mkdir(path.c_str(), mode) == 0) return 0;
  int errnum = errno;
  if (errnum == EEXIST && isDirectory(path)) return 0;
  return errnum;
}

// Creates `path` and every missing ancestor, each with `mode`. Returns 0 or
// the error number of the creation that failed; an existing directory is no
// failure, an existing item of another kind fails with EEXIST (at the end of
// the path) or ENOTDIR (in the middle). Works upwards only as far as needed,
// so an existing parent costs one call.
int makePath(const std::string& path, mode_t mode) {
  std::vector<size_t> missing;  // lengths of the prefixes still to create, deepest first
  size_t length = path.size();
  for (;;) {
    int errnum = makeOneDirectory(path.substr(0, length), mode);
    if (errnum == 0) break;
    if (errnum != ENOENT) return errnum;
    missing.push_back(length);
    size_t slash = path.rfind(kPathSeparator, length - 1);
    while (slash != std::string::npos && slash > 0 && path[slash - 1] == kPathSeparator) --slash;
    if (slash == std::string::npos || slash == 0) return ENOENT;  // no ancestor left to create
    length = slash;
  }
  for (auto it = missing.rbegin(); it != missing.rend(); ++it) {
    if (int errnum = makeOneDirectory(path.substr(0, *it), mode); errnum != 0) return errnum;
  }
  return 0;
}

}  // namespace

bool QSFileManager::createDirectoryAtURL(const URL& url, bool withIntermediateDirectories, mode_t mode,
                                         int32_t dataProtectionClass, Error* error) const {
  const std::string& path = url.path();
  if (withIntermediateDirectories) {
    if (int errnum = makePath(path, mode); errnum != 0) {
      return QSFail(error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "mkpath_np of %@ failed: %s", path,
                                        QSErrorText(errnum)));
    }
  } else if (mkdir(url.fileSystemRepresentation(), mode) != 0 && errno != EEXIST) {
    int errnum = errno;
    return QSFail(
        error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "mkdir of %@ failed: %s", path, QSErrorText(errnum)));
  }
  if (dataProtectionClass == kQSNoDataProtectionClass) return true;

  qsfs::ScopedDIR directory(opendir(url.fileSystemRepresentation()));
  if (!directory.valid()) {
    int errnum = errno;
    return QSFail(error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "opendir of %@ failed: %s", path,
                                      QSErrorText(errnum)));
  }
  if (int errnum = qsfs::setDataProtectionClass(dirfd(directory.get()), dataProtectionClass); errnum != 0) {
    return QSFail(error,
                  QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "Failed to setclass(%d) on directory %@: %s",
                               dataProtectionClass, path, QSErrorText(errnum)));
  }
  return true;
}

bool QSFileManager::createDirectoryAtURL(const URL& url, bool withIntermediateDirectories, mode_t mode,
                                         Error* error) const {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, kQSNoDataProtectionClass, error);
}

std::optional<URL> QSFileManager::createTemporaryDirectoryInDirectoryURL(const URL& parent, Error* error) const {
  if (error) *error = Error();
  URL templateURL = parent.appending(kTemporaryDirectoryTemplate, true);
  std::string created = templateURL.path();  // mkdtemp fills in the X's in place
  if (mkdtemp(created.data()) != nullptr) return URL::fileURL(created, true);

  Error underlying = QSPOSIXUnderlyingError(errno);
  Dictionary additions{{QSPathArgumentErrorKey, Value(templateURL)}};
  QSFail(error, _CreateAndLogError(kCreateTemporaryDirectoryFn, __LINE__, QSInstallerErrorDomain,
                                   kQSErrorCodeFileOperationFailed, &underlying, &additions,
                                   "Failed to create temp dir at path %s", templateURL.path()));
  return std::nullopt;
}
