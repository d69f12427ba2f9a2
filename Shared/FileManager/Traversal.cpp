// Tree walks, ownership standardisation and symbolic links.
#include <fcntl.h>
#include <fts.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/QuillsetAdditions.h"
#include "Platform/FileTree/SymlinkText.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kTraverseFn[] = "-[QSFileManager _traverseDirectory:error:withBlock:]";
constexpr char kStandardizeStepFn[] =
    "-[QSFileManager standardizeOwnershipAtURL:toUID:GID:validateSymlinks:error:]_block_invoke";
constexpr char kCreateSymlinkFn[] = "-[QSFileManager createSymbolicLinkAtURL:withDestinationURL:error:]";
constexpr char kDestinationOfSymlinkFn[] = "-[QSFileManager destinationOfSymbolicLinkAtURL:error:]";

// Links are reported as links and never followed; entries carry full paths;
// the walk stays on the root's file system.
constexpr int kWalkOptions = FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV;

constexpr mode_t kPermissionBits = 07777;

// fchmodat2, the system call that takes AT_SYMLINK_NOFOLLOW itself (Linux 6.6).
// glibc 2.36 emulates the flag through an O_PATH descriptor and /proc, four
// system calls per item; the call does it in one.
constexpr long kFchmodat2Syscall = 452;

// Changes the mode of the item at `path` itself, never of a link's target.
// Returns 0 or -1 with errno, as fchmodat does.
int changeModeNoFollow(const char* path, mode_t mode) {
  static std::atomic<bool> kernelHasFchmodat2{true};
  if (kernelHasFchmodat2.load(std::memory_order_relaxed)) {
    long rc = syscall(kFchmodat2Syscall, AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW);
    if (rc == 0 || errno != ENOSYS) return rc == 0 ? 0 : -1;
    kernelHasFchmodat2.store(false, std::memory_order_relaxed);
  }
  return fchmodat(AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW);
}
constexpr mode_t kStandardDirectoryMode = 0755;
constexpr mode_t kStandardItemMode = 0644;

// Owns an open walk. close() reports the outcome of fts_close; a walk still
// open at destruction is closed with the outcome ignored (an earlier failure
// is already being reported).
class Walk {
 public:
  explicit Walk(FTS* fts) : fts_(fts) {}
  ~Walk() {
    if (fts_) (void)fts_close(fts_);
  }
  Walk(const Walk&) = delete;
  Walk& operator=(const Walk&) = delete;

  FTS* get() const { return fts_; }
  // 0 on success, else errno.
  int close() {
    FTS* fts = fts_;
    fts_ = nullptr;
    return fts_close(fts) == 0 ? 0 : errno;
  }

 private:
  FTS* fts_;
};

QSTraversalEntry::Kind kindOf(const FTSENT& ent) {
  switch (ent.fts_info) {
    case FTS_D:
      return QSTraversalEntry::Kind::DirectoryPre;
    case FTS_DP:
    // A directory that cannot be read, or that closes a cycle, is never
    // entered and gets no post-order visit: this visit ends it.
    case FTS_DNR:
    case FTS_DC:
      return QSTraversalEntry::Kind::DirectoryPost;
    case FTS_F:
      return QSTraversalEntry::Kind::RegularFile;
    case FTS_SL:
    case FTS_SLNONE:
      return QSTraversalEntry::Kind::SymbolicLink;
    default:
      return QSTraversalEntry::Kind::Other;
  }
}

// The record a per-entry step left in its slot, if it left one.
bool stepWroteError(const Error& slot) {
  return !slot.domain().empty();
}

bool isDirectory(QSTraversalEntry::Kind kind) {
  return kind == QSTraversalEntry::Kind::DirectoryPre || kind == QSTraversalEntry::Kind::DirectoryPost;
}

}  // namespace

bool QSFileManager::_traverseDirectory(const URL& root, Error* error, const QSTraversalBlock& withBlock) const {
  const std::string& rootPath = root.path();
  char* const paths[] = {const_cast<char*>(root.fileSystemRepresentation()), nullptr};
  Walk walk(fts_open(paths, kWalkOptions, nullptr));
  if (!walk.get()) {
    int err = errno;
    return QSFail(error, QSPOSIXError(kTraverseFn, __LINE__, err, "fts_open failed for %s with error %s", rootPath,
                                      QSErrorText(err)));
  }

  std::optional<Error> failure;
  bool stopped = false;
  while (FTSENT* ent = fts_read(walk.get())) {
    QSTraversalEntry entry;
    entry.path = QuillsetAdditions::stringWithFileSystemRepresentation(ent->fts_path, ent->fts_pathlen);
    if (ent->fts_info == FTS_ERR || ent->fts_info == FTS_NS) {
      failure = QSPOSIXError(kTraverseFn, __LINE__, ent->fts_errno, "Error for path %s: %s", entry.path,
                             QSErrorText(ent->fts_errno));
      stopped = true;
      break;
    }
    entry.kind = kindOf(*ent);
    entry.errorNumber = ent->fts_errno;
    if (ent->fts_statp) entry.status = *ent->fts_statp;
    Error stepError;
    // A walk without a step only visits.
    if (withBlock && !withBlock(entry, &stepError)) {
      if (stepWroteError(stepError)) failure = std::move(stepError);
      stopped = true;
      break;
    }
  }
  // fts_read ending with an error is not told apart from the end of the walk.

  int closeErr = walk.close();
  if (closeErr != 0 && !failure) {
    failure = QSPOSIXError(kTraverseFn, __LINE__, closeErr, "fts_close failed for %s with error %s", rootPath,
                           QSErrorText(closeErr));
  }
  if (stopped || closeErr != 0) {
    if (failure && error) *error = std::move(*failure);
    return false;
  }
  return true;
}

bool QSFileManager::standardizeOwnershipAtURL(const URL& url, uint32_t toUID, uint32_t GID, bool validateSymlinks,
                                              Error* error) const {
  auto step = [&](const QSTraversalEntry& entry, Error* stepError) -> bool {
    const char* path = entry.path.c_str();
    if (entry.status.st_uid != toUID || entry.status.st_gid != GID) {
      if (lchown(path, toUID, GID) != 0) {
        QS_SYSLOG(kQSLogLevelError, kStandardizeStepFn, "Could not chown %s: %s", entry.path, QSErrorText(errno));
      }
    }
    if (validateSymlinks && entry.kind == QSTraversalEntry::Kind::SymbolicLink &&
        !realPathForURL(URL::fileURL(entry.path), url)) {
      platform::Dictionary info{{kQSLegacyErrorStringKey, platform::Value(kQSErrorCodeInvalidSymlink)}};
      return QSFail(stepError,
                    _CreateAndLogError(kStandardizeStepFn, __LINE__, QSInstallerErrorDomain, kQSErrorCodeInvalidSymlink,
                                       nullptr, &info, "invalid symlink at %s", entry.path));
    }
    // Linux keeps no mode of a symbolic link's own (every link reads 0777 and
    // fchmodat refuses AT_SYMLINK_NOFOLLOW on one with EOPNOTSUPP), so a
    // link's mode is left alone rather than reported as a failure.
    if (entry.kind == QSTraversalEntry::Kind::SymbolicLink) return true;
    const mode_t wanted = isDirectory(entry.kind) ? kStandardDirectoryMode : kStandardItemMode;
    if ((entry.status.st_mode & kPermissionBits) != wanted) {
      // Not following a link: the item may have been swapped for one since it
      // was visited.
      if (changeModeNoFollow(path, wanted) != 0) {
        QS_SYSLOG(kQSLogLevelError, kStandardizeStepFn, "Could not chmod %s: %s", entry.path, QSErrorText(errno));
      }
    }
    return true;
  };
  return _traverseDirectory(url, error, step);
}

bool QSFileManager::createSymbolicLinkAtURL(const URL& url, const URL& withDestinationURL, Error* error) const {
  if (symlink(withDestinationURL.fileSystemRepresentation(), url.fileSystemRepresentation()) != 0) {
    int err = errno;
    return QSFail(error,
                  QSPOSIXError(kCreateSymlinkFn, __LINE__, err, "Could not create symlink containing %s at %s: %s",
                               withDestinationURL.path(), url.path(), QSErrorText(err)));
  }
  return true;
}

std::optional<URL> QSFileManager::destinationOfSymbolicLinkAtURL(const URL& url, Error* error) const {
  std::string text;
  if (int err = platform::fs::readSymlinkText(url.fileSystemRepresentation(), &text); err != 0) {
    QSFail(error, QSPOSIXError(kDestinationOfSymlinkFn, __LINE__, err, "Could not readlink %s : %s", url.path(),
                               QSErrorText(err)));
    return std::nullopt;
  }
  return URL::fileURL(text);
}
