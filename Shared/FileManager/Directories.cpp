// QSFileManager: directory creation and temporary directories.
#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include "Platform/FileSystem.h"
#include "Shared/FileManager/DataProtection.h"
#include "Platform/PosixHandles.h"
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

}  // namespace

bool QSFileManager::createDirectoryAtURL(const URL& url, bool withIntermediateDirectories, mode_t mode,
                                         int32_t dataProtectionClass, Error* error) const {
  const std::string& path = url.path();
  if (withIntermediateDirectories) {
    if (int errnum = platform::makeDirectories(path, mode); errnum != 0) {
      return QSFail(error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "mkpath_np of %@ failed: %s", path,
                                        QSErrorText(errnum)));
    }
  } else if (mkdir(url.fileSystemRepresentation(), mode) != 0 && errno != EEXIST) {
    int errnum = errno;
    return QSFail(
        error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "mkdir of %@ failed: %s", path, QSErrorText(errnum)));
  }
  if (dataProtectionClass == kQSNoDataProtectionClass) return true;

  platform::ScopedDIR directory(opendir(url.fileSystemRepresentation()));
  if (!directory.valid()) {
    int errnum = errno;
    return QSFail(error, QSPOSIXError(kCreateDirectoryFn, __LINE__, errnum, "opendir of %@ failed: %s", path,
                                      QSErrorText(errnum)));
  }
  if (int errnum = platform::fs::setDataProtectionClass(dirfd(directory.get()), dataProtectionClass); errnum != 0) {
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
