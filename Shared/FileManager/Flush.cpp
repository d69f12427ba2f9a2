// Flushing a directory's entries, so that the items just moved into or out of
// it stay where they are after a power cut.
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "Platform/PosixHandles.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"

using platform::Error;
using platform::URL;

namespace {
constexpr char kSynchronizeFn[] = "-[QSFileManager synchronizeDirectoryAtURL:error:]";
}  // namespace

bool QSFileManager::synchronizeDirectoryAtURL(const URL& url, Error* error) const {
  platform::ScopedFD fd(open(url.fileSystemRepresentation(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (fd.get() < 0) {
    const int err = errno;
    return QSFail(error, QSPOSIXError(kSynchronizeFn, __LINE__, err, "Failed to open %s : %s", url.path(),
                                      QSErrorText(err)));
  }
  // A file system that cannot flush directories (EINVAL) has nothing to flush.
  if (fsync(fd.get()) != 0 && errno != EINVAL) {
    const int err = errno;
    return QSFail(error, QSPOSIXError(kSynchronizeFn, __LINE__, err, "Failed to fsync %s : %s", url.path(),
                                      QSErrorText(err)));
  }
  return true;
}
