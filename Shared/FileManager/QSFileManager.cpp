// QSFileManager: the shared instance, the existence tests and listing.
#include "Shared/FileManager/QSFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "Platform/PosixHandles.h"
#include "Shared/FileManager/QuillsetAdditions.h"
#include "Platform/FileTree/TreeWalk.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kItemExistsFn[] = "-[QSFileManager itemExistsAtURL:]";
constexpr char kItemDoesNotExistFn[] = "-[QSFileManager itemDoesNotExistAtURL:]";
constexpr char kListDirectoryFn[] = "-[QSFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]";

void logStatusFailure(const char* function, const URL& url, int errnum) {
  QS_SYSLOG(kQSLogLevelError, function, "Failed to determine if %@ exists: %s", url, QSErrorText(errnum));
}

// Completes an entry whose type the file system left unknown. Only
// directories, links and regular files are told apart; anything else, or an
// item that cannot be examined, stays unknown.
unsigned char resolvedEntryType(const URL& directory, const dirent& entry) {
  if (entry.d_type != DT_UNKNOWN) return entry.d_type;
  URL child = directory.appending(
      QuillsetAdditions::stringWithFileSystemRepresentation(entry.d_name, std::strlen(entry.d_name)));
  struct stat status {};
  if (lstat(child.fileSystemRepresentation(), &status) != 0) return DT_UNKNOWN;
  if (S_ISDIR(status.st_mode)) return DT_DIR;
  if (S_ISLNK(status.st_mode)) return DT_LNK;
  if (S_ISREG(status.st_mode)) return DT_REG;
  return DT_UNKNOWN;
}

// Per-entry step of the listing: skips "." and "..", and links when asked.
void addListedEntry(const URL& directory, const dirent& entry, unsigned char type, bool ignoringSymlinks,
                    std::vector<URL>& list) {
  if (platform::fs::isDotOrDotDot(entry.d_name)) return;
  if (type == DT_LNK && ignoringSymlinks) {
    QS_SYSLOG(kQSLogLevelNotice, kListDirectoryFn, "Ignoring symlink at %s/%s", directory.path(), entry.d_name);
    return;
  }
  std::string name = QuillsetAdditions::stringWithFileSystemRepresentation(entry.d_name, std::strlen(entry.d_name));
  list.push_back(directory.appending(name, type == DT_DIR));
}

// Reads every entry of the directory at `directory` into `list`. Returns 0 or
// the error number that ended the iteration.
int _IterateDirectory(const URL& directory, bool ignoringSymlinks, std::vector<URL>& list) {
  platform::ScopedFD fd(open(directory.fileSystemRepresentation(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) return errno;
  platform::ScopedDIR stream(fdopendir(fd.get()));
  if (!stream.valid()) return errno;
  fd.release();  // the stream owns the descriptor now
  for (;;) {
    // readdir on a stream private to this call is re-entrant; errno tells the
    // end of the directory from a failure.
    errno = 0;
    const dirent* entry = readdir(stream.get());
    if (entry == nullptr) return errno;
    addListedEntry(directory, *entry, resolvedEntryType(directory, *entry), ignoringSymlinks, list);
  }
}

}  // namespace

QSFileManager& QSFileManager::defaultManager() {
  // Created once, even under concurrent first calls, and never destroyed.
  static QSFileManager* const instance = new QSFileManager();
  return *instance;
}

bool QSFileManager::itemExistsAtURL(const URL& url) const {
  struct stat status {};
  if (lstat(url.fileSystemRepresentation(), &status) == 0) return true;
  if (errno != ENOENT) logStatusFailure(kItemExistsFn, url, errno);
  return false;
}

bool QSFileManager::itemDoesNotExistAtURL(const URL& url) const {
  struct stat status {};
  if (lstat(url.fileSystemRepresentation(), &status) == 0) return false;
  if (errno == ENOENT) return true;
  logStatusFailure(kItemDoesNotExistFn, url, errno);
  return false;
}

std::optional<std::vector<URL>> QSFileManager::urlsForItemsInDirectoryAtURL(const URL& url, bool ignoringSymlinks,
                                                                            Error* error) const {
  std::vector<URL> list;
  int errnum = _IterateDirectory(url, ignoringSymlinks, list);
  if (errnum != 0) {
    QSFail(error, QSPOSIXError(kListDirectoryFn, __LINE__, errnum, "_IterateDirectory for %s returned %s", url.path(),
                               QSErrorText(errnum)));
    return std::nullopt;
  }
  return list;
}
