// QSFileManager: copy and move, with their if-exists forms.
//
// A move within one file system is a rename. A move to another file system
// copies, and is built so that a process killed, or a machine that loses
// power, at any instant leaves every item complete at its old path or at its
// new one:
//
//   1. copy the source into a hidden sibling of the destination
//      (kQSMoveIncomingPrefix + name);
//   2. make that copy durable with one flush of the destination's file system;
//   3. rename it into place and flush the destination's directory;
//   4. rename the source aside under a hidden name in its own directory
//      (kQSMoveOutgoingPrefix + name) and flush that directory;
//   5. remove the source set aside.
//
// A hidden copy therefore only exists while the source is still in place, and
// a source set aside only once its complete copy is durable at the
// destination. finishInterruptedMoveOfItemAtURL relies on exactly that to
// clean what an interrupted move left.
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>

#include "Shared/FileManager/CopyTree.h"
#include "Shared/FileManager/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kCopyItemFn[] = "-[QSFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kMoveItemFn[] = "-[QSFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kFinishMoveFn[] = "-[QSFileManager finishInterruptedMoveOfItemAtURL:toURL:error:]";

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

bool present(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0;
}

// The hidden sibling of `url` in its own directory, or "" when the name
// would be too long for the file system.
std::string hiddenSibling(const URL& url, const char* prefix) {
  std::string name = prefix + url.lastPathComponent();
  if (name.size() > NAME_MAX) return "";
  return url.deletingLastPathComponent().appending(name).path();
}

// Makes the data and metadata of every file of the file system that holds
// `directory` durable (the copy just written among them), or 0.
int flushFileSystemOf(const std::string& directory) {
  qsfs::ScopedFD fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  return syncfs(fd.get()) == 0 ? 0 : errno;
}

// Makes the entries of `directory` durable, or 0. A file system that cannot
// flush directories (EINVAL) has nothing to flush.
int flushDirectory(const std::string& directory) {
  qsfs::ScopedFD fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  return fsync(fd.get()) == 0 || errno == EINVAL ? 0 : errno;
}

// The removal of an item this file layer made itself (a hidden copy, a
// source set aside): 0, or the error number of the first item that stayed.
int removeHidden(const std::string& path) {
  Error error;
  if (QSFileManager::defaultManager().removeItemAtURL(URL::fileURL(path), &error)) return 0;
  return static_cast<int>(error.code());
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
  return _moveItemAcrossFileSystems(src, dst, error);
}

bool QSFileManager::_moveItemAcrossFileSystems(const URL& src, const URL& dst, Error* error) const {
  const std::string incoming = hiddenSibling(dst, kQSMoveIncomingPrefix);
  const std::string outgoing = hiddenSibling(src, kQSMoveOutgoingPrefix);
  const std::string dstDirectory = dst.deletingLastPathComponent().path();
  const auto copyFailure = [&](int errnum) {
    return QSFail(error, QSPOSIXError(kCopyItemFn, __LINE__, errnum, "copyfile of %@ to %@ failed: %s", src, dst,
                                      QSErrorText(errnum)));
  };
  if (incoming.empty() || outgoing.empty()) return copyFailure(ENAMETOOLONG);
  // rename reports EXDEV before it looks for the source.
  if (!present(src.path())) return copyFailure(ENOENT);
  // A copy that an interrupted attempt left is incomplete: the source is
  // still here, so it is started again.
  if (int errnum = removeHidden(incoming); errnum != 0) return copyFailure(errnum);

  // Steps 1 to 3. A copy that fails or cannot be made durable is removed, so
  // that nothing of it takes space on the destination.
  int errnum = qsfs::copyTree(src.fileSystemRepresentation(), incoming.c_str());
  if (errnum == 0) errnum = flushFileSystemOf(dstDirectory);
  if (errnum == 0) {
    // Nothing is replaced: what is at the destination stays.
    errnum = renameat2(AT_FDCWD, incoming.c_str(), AT_FDCWD, dst.fileSystemRepresentation(), RENAME_NOREPLACE) == 0
                 ? 0
                 : errno;
  }
  if (errnum != 0) {
    (void)removeHidden(incoming);
    return copyFailure(errnum);
  }
  if (errnum = flushDirectory(dstDirectory); errnum != 0) {
    // The copy is in place but may not survive a power cut: the source
    // stays where it is, and the move fails.
    return QSFail(error, QSPOSIXError(kMoveItemFn, __LINE__, errnum, "fsync of %s failed: %s", dstDirectory.c_str(),
                                      QSErrorText(errnum)));
  }

  // Steps 4 and 5. From here on the destination is complete: whatever fails
  // leaves the source (or what is left of it) beside it, as a removal of the
  // source that fails always has.
  Error removalError;
  if (renameat2(AT_FDCWD, src.fileSystemRepresentation(), AT_FDCWD, outgoing.c_str(), RENAME_NOREPLACE) != 0) {
    errnum = errno;
    removalError = QSPOSIXError(kMoveItemFn, __LINE__, errnum, "rename of %@ to %s failed: %s", src,
                                outgoing.c_str(), QSErrorText(errnum));
  } else if (errnum = flushDirectory(src.deletingLastPathComponent().path()); errnum != 0) {
    removalError = QSPOSIXError(kMoveItemFn, __LINE__, errnum, "fsync of %@ failed: %s",
                                src.deletingLastPathComponent(), QSErrorText(errnum));
  } else if (!removeItemAtURL(URL::fileURL(outgoing, src.isDirectory()), &removalError)) {
    // removeItemAtURL wrote the record.
  } else {
    return true;
  }
  QS_SYSLOG(kQSLogLevelError, kMoveItemFn, "Failed to remove move source after copy at %@ : %@", src.path(),
            removalError);
  return true;
}

bool QSFileManager::finishInterruptedMoveOfItemAtURL(const URL& src, const URL& dst, Error* error) const {
  const std::string incoming = hiddenSibling(dst, kQSMoveIncomingPrefix);
  const std::string outgoing = hiddenSibling(src, kQSMoveOutgoingPrefix);
  if (!outgoing.empty() && present(outgoing)) {
    // Set aside only once its copy was durable at the destination: while
    // that copy is there, the source set aside is a second one.
    if (!present(dst.path())) {
      QS_SYSLOG(kQSLogLevelError, kFinishMoveFn, "Keeping %s : the move it was set aside for left nothing at %@",
                outgoing.c_str(), dst.path());
      return QSFail(error, QSPOSIXError(kFinishMoveFn, __LINE__, ENOENT, "no copy of %s at %@", outgoing.c_str(),
                                        dst.path()));
    }
    QS_SYSLOG(kQSLogLevelNotice, kFinishMoveFn, "Removing %s, moved to %@ by an interrupted move", outgoing.c_str(),
              dst.path());
    if (int errnum = removeHidden(outgoing); errnum != 0) {
      return QSFail(error, QSPOSIXError(kFinishMoveFn, __LINE__, errnum, "removefile of %s failed: %s",
                                        outgoing.c_str(), QSErrorText(errnum)));
    }
  }
  // A hidden copy exists only while its source is in place; without the
  // source it is left alone.
  if (!incoming.empty() && present(incoming) && present(src.path())) {
    QS_SYSLOG(kQSLogLevelNotice, kFinishMoveFn, "Removing %s, the unfinished copy of an interrupted move of %@",
              incoming.c_str(), src.path());
    if (int errnum = removeHidden(incoming); errnum != 0) {
      return QSFail(error, QSPOSIXError(kFinishMoveFn, __LINE__, errnum, "removefile of %s failed: %s",
                                        incoming.c_str(), QSErrorText(errnum)));
    }
  }
  return true;
}

bool QSFileManager::isInterruptedMoveItemName(std::string_view name) {
  return name.starts_with(kQSMoveIncomingPrefix) || name.starts_with(kQSMoveOutgoingPrefix);
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
