// QSFileManager: copy and move, with their if-exists forms.
//
// A move within one file system is a rename. A move to another file system
// copies, and is built so that a process killed, or a machine that loses
// power, at any instant leaves every item complete at its old path or at its
// new one:
//
//   1. copy the source into a hidden sibling of the destination
//      (kQSMoveIncomingPrefix + name) and give the copy a ticket: an
//      attribute holding a token new to this move;
//   2. make that copy durable with one flush of the destination's file system;
//   3. rename it into place and flush the destination's directory;
//   4. mark the source with the same token and rename it aside under a
//      hidden name in its own directory (kQSMoveOutgoingPrefix + name), then
//      flush that directory;
//   5. remove the source set aside; once that removal is durable (a flush of
//      its directory, or of a whole QSMoveGroup's), take the ticket off.
//
// A hidden copy therefore only exists while the source is still in place, and
// a source set aside only once its complete copy, ticket included, is durable
// at the destination. finishInterruptedMoveOfItemAtURL relies on exactly that
// to clean what an interrupted move left: an item at the aside's name is the
// source of a move only when it carries the mark, and its copy is the
// destination that carries the same token. Both attributes are in the
// trusted namespace, which only a privileged process can write, and copies
// never carry them over (see CopyTree.h).
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <random>

#include "Platform/FileTree/CopyTree.h"
#include "Platform/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kCopyItemFn[] = "-[QSFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kMoveItemFn[] = "-[QSFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kFinishMoveFn[] = "-[QSFileManager finishInterruptedMoveOfItemAtURL:toURL:error:]";
constexpr char kFinishGroupFn[] = "-[QSFileManager finishMoveGroup:error:]";

// The token of a move across file systems: the ticket on its copy, the mark
// on its source once it is set aside.
const std::string kTicketAttribute = std::string(platform::fs::kMoveAttributePrefix) + "ticket";
const std::string kAsideAttribute = std::string(platform::fs::kMoveAttributePrefix) + "aside";
constexpr size_t kTokenWords = 4;  // of 32 bits
constexpr size_t kAttributeValueLimit = 64;

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
  platform::ScopedFD fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  return syncfs(fd.get()) == 0 ? 0 : errno;
}

// Makes the entries of `directory` durable, or 0. A file system that cannot
// flush directories (EINVAL) has nothing to flush.
int flushDirectory(const std::string& directory) {
  platform::ScopedFD fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  return fsync(fd.get()) == 0 || errno == EINVAL ? 0 : errno;
}

// A token no other move has: random, as hexadecimal text.
std::string newToken() {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::random_device random;
  std::string token;
  for (size_t word = 0; word < kTokenWords; ++word) {
    for (uint32_t value = random(), digit = 0; digit < 8; ++digit, value >>= 4) token += kDigits[value & 0xf];
  }
  return token;
}

// The value of the move's attribute `name` on the item at `path` (a final
// link not followed), or "" when it has none.
std::string moveAttributeOf(const std::string& path, const std::string& name) {
  char value[kAttributeValueLimit];
  ssize_t size = lgetxattr(path.c_str(), name.c_str(), value, sizeof value);
  return size > 0 ? std::string(value, static_cast<size_t>(size)) : std::string();
}

int setMoveAttribute(const std::string& path, const std::string& name, const std::string& value) {
  return lsetxattr(path.c_str(), name.c_str(), value.data(), value.size(), 0) == 0 ? 0 : errno;
}

// Takes the ticket off a copy whose source set aside is gone, once that
// removal is durable: were the ticket's removal to persist without it, the
// aside could no longer be told from an item of its own.
void removeTicketAfterFlushing(const std::string& sourceDirectory, const std::string& copy) {
  if (flushDirectory(sourceDirectory) == 0) (void)lremovexattr(copy.c_str(), kTicketAttribute.c_str());
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
  if (int errnum = platform::fs::copyTree(src.fileSystemRepresentation(), dst.fileSystemRepresentation()); errnum != 0) {
    return QSFail(error, QSPOSIXError(kCopyItemFn, __LINE__, errnum, "copyfile of %@ to %@ failed: %s", src, dst,
                                      QSErrorText(errnum)));
  }
  return true;
}

QSMoveGroup::QSMoveGroup() : links_(std::make_unique<platform::fs::CopyLinkTable>()) {}
QSMoveGroup::~QSMoveGroup() = default;

bool QSFileManager::_moveItemAtURL(const URL& src, const URL& dst, bool failIfSrcMissing, Error* error) const {
  return _moveItem(src, dst, failIfSrcMissing, nullptr, error);
}

bool QSFileManager::_moveItem(const URL& src, const URL& dst, bool failIfSrcMissing, QSMoveGroup* group,
                              Error* error) const {
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
  return _moveItemAcrossFileSystems(src, dst, group, error);
}

bool QSFileManager::_moveItemAcrossFileSystems(const URL& src, const URL& dst, QSMoveGroup* group,
                                               Error* error) const {
  const std::string incoming = hiddenSibling(dst, kQSMoveIncomingPrefix);
  const std::string outgoing = hiddenSibling(src, kQSMoveOutgoingPrefix);
  const std::string dstDirectory = dst.deletingLastPathComponent().path();
  const std::string srcDirectory = src.deletingLastPathComponent().path();
  const auto copyFailure = [&](int errnum) {
    return QSFail(error, QSPOSIXError(kCopyItemFn, __LINE__, errnum, "copyfile of %@ to %@ failed: %s", src, dst,
                                      QSErrorText(errnum)));
  };
  if (incoming.empty() || outgoing.empty()) return copyFailure(ENAMETOOLONG);
  // rename reports EXDEV before it looks for the source.
  if (!present(src.path())) return copyFailure(ENOENT);
  // The source's aside name must be free: whatever has that name (an item
  // of the application's own) is neither replaced nor taken for an aside.
  if (present(outgoing)) {
    return QSFail(error, QSPOSIXError(kMoveItemFn, __LINE__, EEXIST, "rename of %@ to %s failed: %s", src,
                                      outgoing.c_str(), QSErrorText(EEXIST)));
  }
  // A copy that an interrupted attempt left is incomplete: the source is
  // still here, so it is started again.
  if (int errnum = removeHidden(incoming); errnum != 0) return copyFailure(errnum);

  // Steps 1 to 3. A copy that fails or cannot be made durable is removed, so
  // that nothing of it takes space on the destination.
  platform::fs::CopyLinkTable* links = group != nullptr ? group->links_.get() : nullptr;
  const std::string token = newToken();
  int errnum = platform::fs::copyTree(src.fileSystemRepresentation(), incoming.c_str(), links);
  if (errnum == 0) errnum = setMoveAttribute(incoming, kTicketAttribute, token);
  if (errnum == 0) errnum = flushFileSystemOf(dstDirectory);
  if (errnum == 0) {
    // Nothing is replaced: what is at the destination stays.
    errnum = renameat2(AT_FDCWD, incoming.c_str(), AT_FDCWD, dst.fileSystemRepresentation(), RENAME_NOREPLACE) == 0
                 ? 0
                 : errno;
  }
  if (errnum != 0) {
    (void)removeHidden(incoming);
    if (links != nullptr) links->topRemoved(incoming);
    return copyFailure(errnum);
  }
  if (links != nullptr) links->topRenamed(incoming, dst.path());
  if (errnum = flushDirectory(dstDirectory); errnum != 0) {
    // The copy is in place but may not survive a power cut: the source
    // stays where it is, and the move fails.
    return QSFail(error, QSPOSIXError(kMoveItemFn, __LINE__, errnum, "fsync of %s failed: %s", dstDirectory.c_str(),
                                      QSErrorText(errnum)));
  }

  // Steps 4 and 5. From here on the destination is complete: whatever fails
  // leaves the source (or what is left of it) beside it, as a removal of the
  // source that fails always has.
  // The mark goes on before the rename, in the same file system: an aside
  // never exists without it.
  Error removalError;
  if (errnum = setMoveAttribute(src.path(), kAsideAttribute, token); errnum != 0) {
    removalError = QSPOSIXError(kMoveItemFn, __LINE__, errnum, "setxattr of %@ failed: %s", src,
                                QSErrorText(errnum));
  } else if (renameat2(AT_FDCWD, src.fileSystemRepresentation(), AT_FDCWD, outgoing.c_str(), RENAME_NOREPLACE) !=
             0) {
    errnum = errno;
    removalError = QSPOSIXError(kMoveItemFn, __LINE__, errnum, "rename of %@ to %s failed: %s", src,
                                outgoing.c_str(), QSErrorText(errnum));
    (void)lremovexattr(src.fileSystemRepresentation(), kAsideAttribute.c_str());
  } else if (errnum = flushDirectory(srcDirectory); errnum != 0) {
    removalError = QSPOSIXError(kMoveItemFn, __LINE__, errnum, "fsync of %s failed: %s", srcDirectory.c_str(),
                                QSErrorText(errnum));
  } else if (!removeItemAtURL(URL::fileURL(outgoing, src.isDirectory()), &removalError)) {
    // removeItemAtURL wrote the record; the aside keeps its mark, the copy
    // its ticket.
  } else if (group != nullptr) {
    group->sourceDirectories_.push_back(srcDirectory);
    group->ticketedCopies_.push_back(dst.path());
    return true;
  } else {
    removeTicketAfterFlushing(srcDirectory, dst.path());
    return true;
  }
  QS_SYSLOG(kQSLogLevelError, kMoveItemFn, "Failed to remove move source after copy at %@ : %@", src.path(),
            removalError);
  return true;
}

bool QSFileManager::finishInterruptedMoveOfItemAtURL(const URL& src, const URL& dst, Error* error) const {
  const std::string incoming = hiddenSibling(dst, kQSMoveIncomingPrefix);
  const std::string outgoing = hiddenSibling(src, kQSMoveOutgoingPrefix);
  const std::string srcDirectory = src.deletingLastPathComponent().path();
  const std::string mark = outgoing.empty() ? std::string() : moveAttributeOf(outgoing, kAsideAttribute);
  if (!mark.empty()) {
    // Set aside only once its copy, with the same token, was durable at the
    // destination: while that copy is there, the source set aside is a
    // second one.
    if (!present(dst.path()) || moveAttributeOf(dst.path(), kTicketAttribute) != mark) {
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
    removeTicketAfterFlushing(srcDirectory, dst.path());
  } else if (!moveAttributeOf(dst.path(), kTicketAttribute).empty()) {
    // A move whose aside is gone, ended before its ticket came off.
    removeTicketAfterFlushing(srcDirectory, dst.path());
  }
  // An item at the aside's name without the mark is no aside: it stays.
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

bool QSFileManager::finishMoveGroup(QSMoveGroup& group, Error* error) const {
  if (group.ticketedCopies_.empty()) return true;
  const auto unique = [](std::vector<std::string> paths) {
    std::sort(paths.begin(), paths.end());
    paths.erase(std::unique(paths.begin(), paths.end()), paths.end());
    return paths;
  };
  for (const std::string& directory : unique(std::move(group.sourceDirectories_))) {
    if (int errnum = flushDirectory(directory); errnum != 0) {
      return QSFail(error, QSPOSIXError(kFinishGroupFn, __LINE__, errnum, "fsync of %s failed: %s", directory.c_str(),
                                        QSErrorText(errnum)));
    }
  }
  std::vector<std::string> copyDirectories;
  for (const std::string& copy : group.ticketedCopies_) {
    (void)lremovexattr(copy.c_str(), kTicketAttribute.c_str());
    copyDirectories.push_back(URL::fileURL(copy).deletingLastPathComponent().path());
  }
  group.sourceDirectories_.clear();
  group.ticketedCopies_.clear();
  for (const std::string& directory : unique(std::move(copyDirectories))) {
    if (int errnum = flushFileSystemOf(directory); errnum != 0) {
      return QSFail(error, QSPOSIXError(kFinishGroupFn, __LINE__, errnum, "syncfs of %s failed: %s",
                                        directory.c_str(), QSErrorText(errnum)));
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

bool QSFileManager::moveItemIfExistsAtURL(const URL& src, const URL& dst, QSMoveGroup& group, Error* error) const {
  return _moveItem(src, dst, false, &group, error);
}
