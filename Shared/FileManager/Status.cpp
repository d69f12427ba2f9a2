// Status of a single item, for callers that must tell a symbolic link from
// what it points at without opening anything.
#include <sys/stat.h>

#include <cerrno>

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"

namespace {
constexpr char kIsSymbolicLinkFunction[] = "-[QSFileManager isSymbolicLinkAtURL:isLink:error:]";
}  // namespace

bool QSFileManager::isSymbolicLinkAtURL(const platform::URL& url, bool* isLink, platform::Error* error) const {
  struct stat status {};
  if (lstat(url.fileSystemRepresentation(), &status) != 0) {
    const int errnum = errno;
    return QSFail(error, QSPOSIXError(kIsSymbolicLinkFunction, __LINE__, errnum, "lstat of %s failed: %s", url.path(),
                                      QSErrorText(errnum)));
  }
  if (isLink) *isLink = S_ISLNK(status.st_mode);
  return true;
}
