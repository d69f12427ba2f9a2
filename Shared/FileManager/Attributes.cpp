// Per-item metadata: data-protection classes and the extended attributes kept
// on application bundles.
#include <fcntl.h>
#include <sys/types.h>
#include <sys/xattr.h>

#include <cerrno>
#include <cstdint>

#include "Shared/FileManager/DataProtection.h"
#include "Platform/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kClassOfItemFn[] = "-[QSFileManager dataProtectionClassOfItemAtURL:class:error:]";
constexpr char kSetClassOfItemFn[] = "-[QSFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]";
constexpr char kMarkPlaceholderFn[] = "-[QSFileManager markBundleAsPlaceholder:withError:]";
constexpr char kSetInstallTypeFn[] = "-[QSFileManager setInstallType:onBundle:error:]";
constexpr char kInstallTypeFn[] = "-[QSFileManager installTypeForBundle:error:]";

// The placeholder mark is a 32-bit 1 in native byte order; any 4-byte value
// reads as a mark.
constexpr uint32_t kPlaceholderMarkValue = 1;
constexpr size_t kPlaceholderMarkSize = sizeof(uint32_t);
constexpr size_t kInstallTypeSize = sizeof(uint64_t);

// Read-only without following a link at the path. O_NONBLOCK keeps the open
// of a FIFO from waiting for a writer; it changes nothing for files and
// directories.
constexpr int kClassOpenFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

// Opens `url` for a class operation; on failure writes the open's record.
platform::ScopedFD openForClass(const URL& url, const char* function, Error* error) {
  platform::ScopedFD fd(open(url.fileSystemRepresentation(), kClassOpenFlags));
  if (!fd.valid()) {
    int err = errno;
    QSFail(error, QSPOSIXError(function, __LINE__, err, "Failed to open %s : %s", url.path(), QSErrorText(err)));
  }
  return fd;
}

// Reads the class through `fd`; on failure writes the read's record.
bool readClass(int fd, const URL& url, const char* function, int32_t* dataProtectionClass, Error* error) {
  if (int err = platform::fs::getDataProtectionClass(fd, dataProtectionClass); err != 0) {
    return QSFail(error, QSPOSIXError(function, __LINE__, err, "Failed to getclass of file %s: %s", url.path(),
                                      QSErrorText(err)));
  }
  return true;
}

// The record of a failed attribute call: code 4 in the installer domain with
// the POSIX error underneath, logged when it is made.
template <class... Args>
Error attributeError(const char* function, int32_t line, int err, const char* format, const Args&... args) {
  Error underlying = QSPOSIXUnderlyingError(err);
  return _CreateAndLogError(function, line, QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed, &underlying,
                            nullptr, format, args...);
}

}  // namespace

bool QSFileManager::dataProtectionClassOfItemAtURL(const URL& url, int32_t* dataProtectionClass, Error* error) const {
  platform::ScopedFD fd = openForClass(url, kClassOfItemFn, error);
  if (!fd.valid()) return false;
  int32_t current = 0;
  if (!readClass(fd.get(), url, kClassOfItemFn, &current, error)) return false;
  if (dataProtectionClass) *dataProtectionClass = current;
  return true;
}

bool QSFileManager::setDataProtectionClassOfItemAtURL(const URL& url, int32_t toClass,
                                                      const QSDataProtectionPredicate& ifPredicate,
                                                      Error* error) const {
  platform::ScopedFD fd = openForClass(url, kSetClassOfItemFn, error);
  if (!fd.valid()) return false;
  if (ifPredicate) {
    int32_t current = 0;
    if (!readClass(fd.get(), url, kSetClassOfItemFn, &current, error)) return false;
    if (!ifPredicate(current)) return true;
  }
  if (int err = platform::fs::setDataProtectionClass(fd.get(), toClass); err != 0) {
    return QSFail(error, QSPOSIXError(kSetClassOfItemFn, __LINE__, err, "Failed to setclass(%d) on file %s: %s",
                                      toClass, url.path(), QSErrorText(err)));
  }
  return true;
}

bool QSFileManager::markBundleAsPlaceholder(const URL& bundle, Error* withError) const {
  const uint32_t mark = kPlaceholderMarkValue;
  if (lsetxattr(bundle.fileSystemRepresentation(), kQSPlaceholderAttributeName, &mark, sizeof(mark), 0) != 0) {
    int err = errno;
    return QSFail(withError,
                  attributeError(kMarkPlaceholderFn, __LINE__, err, "Could't set placeholder EA on \"%s\": %s",
                                 bundle.path(), QSErrorText(err)));
  }
  return true;
}

bool QSFileManager::bundleAtURLIsPlaceholder(const URL& bundle) const {
  uint32_t mark = 0;
  ssize_t size = lgetxattr(bundle.fileSystemRepresentation(), kQSPlaceholderAttributeName, &mark, sizeof(mark));
  return size == static_cast<ssize_t>(kPlaceholderMarkSize);
}

bool QSFileManager::setInstallType(const Value& installType, const URL& onBundle, Error* error) const {
  const uint64_t value = installType.uint64Value();
  if (lsetxattr(onBundle.fileSystemRepresentation(), kQSInstallTypeAttributeName, &value, sizeof(value), 0) != 0) {
    int err = errno;
    return QSFail(error, attributeError(kSetInstallTypeFn, __LINE__, err, "Could't set installType EA on \"%s\": %s",
                                        onBundle.path(), QSErrorText(err)));
  }
  return true;
}

std::optional<Value> QSFileManager::installTypeForBundle(const URL& bundle, Error* error) const {
  uint64_t value = 0;
  ssize_t size = lgetxattr(bundle.fileSystemRepresentation(), kQSInstallTypeAttributeName, &value, sizeof(value));
  if (size < 0) {
    int err = errno;
    // Linux reports a missing attribute as ENODATA.
    if (err == ENODATA) return Value(static_cast<uint64_t>(0));
    QSFail(error, attributeError(kInstallTypeFn, __LINE__, err, "Couldn't get installType EA from \"%s\": %s",
                                 bundle.path(), QSErrorText(err)));
    return std::nullopt;
  }
  if (static_cast<size_t>(size) != kInstallTypeSize) {
    QSFail(error, _CreateAndLogError(kInstallTypeFn, __LINE__, QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed,
                                     nullptr, nullptr, "getxattr for installType EA on %s returned %zd (expected %zu)",
                                     bundle.path(), size, kInstallTypeSize));
    return std::nullopt;
  }
  return Value(value);
}
