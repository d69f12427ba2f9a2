// QSFileManager: copy and move, with their if-exists forms.
#include <stdio.h>
#include <sys/stat.h>

#include <cerrno>

#include "Shared/FileManager/CopyTree.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kCopyItemFn[] = "-[QSFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kMoveItemFn[] = "-[QSFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";

enum class SourceState { Present, Missing, Failed };

// The source test of the if-exists forms: a missing source is no failure.
SourceState examineSource(const char* function, const URL& src, Error* error) {
  struct stat status {};
  if (lstat(src.fileSystemRepresentation(), &status) == 0) return SourceState::Present;
  int errnum = errno;
  if (errnum == ENOENT) return SourceState::Missing;
  QSFail(error, QSPOSIXError(function, __LINE__, errnum, "stat of %@ failed: %s", src, QSErrorText(errnum)));
  return SourceState::Failed;
}

}  // namespace

bool QSFileManager::_copyItemAtURL(const URL& src, const URL& dst, bool failIfSrcMissing, Error* error) const {
  if (!failIfSrcMissing) {
    SourceState state = examineSource(kCopyItemFn, src, error);
    if (state != SourceState::Present) return state == SourceState::Missing;
  }
  if (int errnum = qsfs::copyTree(src.fileSystemRepresentation(), dst.fileSystemRepresentation()); errnum != 0) {
    return QSFail(error, QSPOSIXError(kCopyItemFn, __LINE__, errnum, "copyfile of %@ to %@ failed: %s", src, dst,
                                      QSErrorText(errnum)));
  }
  return true;
}

bool QSFileManager::_moveItemAtURL(const URL& src, const URL& dst, bool failIfSrcMissing, Error* error) const {
  if (!failIfSrcMissing) {
    SourceState state = examineSource(kMoveItemFn, src, error);
    if (state != SourceState::Present) return state == SourceState::Missing;
  }
  if (rename(src.fileSystemRepresentation(), dst.fileSystemRepresentation()) == 0) return true;
  int errnum = errno;
  if (errnum != EXDEV) {
    return QSFail(error, QSPOSIXError(kMoveItemFn, __LINE__, errnum, "rename of %@ to %@ failed: %s", src, dst,
                                      QSErrorText(errnum)));
  }
  // Another file system: copy, then remove the source. Not atomic; a source
  // that cannot be removed leaves both copies and the move still succeeds.
  if (!_copyItemAtURL(src, dst, true, error)) return false;
  Error removalError;
  if (!removeItemAtURL(src, &removalError)) {
    QS_SYSLOG(kQSLogLevelError, kMoveItemFn, "Failed to remove move source after copy at %@ : %@", src.path(),
              removalError);
  }
  return true;
}

bool QSFileManager::copyItemIfExistsAtURL(const URL& src, const URL& dst, Error* error) const {
  return _copyItemAtURL(src, dst, false, error);
}

bool QSFileManager::copyItemAtURL(const URL& src, const URL& dst, Error* error) const {
  return _copyItemAtURL(src, dst, true, error);
}

bool QSFileManager::moveItemIfExistsAtURL(const URL& src, const URL& dst, Error* error) const {
  return _moveItemAtURL(src, dst, false, error);
}

bool QSFileManager::moveItemAtURL(const URL& src, const URL& dst, Error* error) const {
  return _moveItemAtURL(src, dst, true, error);
}
