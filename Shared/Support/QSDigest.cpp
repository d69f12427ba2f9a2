#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <memory>

#include "Platform/Digest.h"
#include "Platform/Foundation/Text.h"
#include "Platform/ReadOnlyFile.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"
#include "Shared/Support/QSUtilities.h"

namespace {

constexpr char kReadFileFunction[] = "_ReadFile";
constexpr char kDigestFunction[] = "QSCreateSHA256Digest";
// The most of a file that is held in memory at once.
constexpr int64_t kReadChunkLimit = 65536;

struct FreeDeleter {
  void operator()(uint8_t* p) const { std::free(p); }
};
using HeapBuffer = std::unique_ptr<uint8_t, FreeDeleter>;

// Writes a failure line of the reader without disturbing errno, which the
// digest's own line reports after the reader has returned.
template <class... Args>
void logReadFailure(const char* format, const Args&... args) {
  const int saved = errno;
  QS_SYSLOG(kQSLogLevelError, kReadFileFunction, format, args...);
  errno = saved;
}

}  // namespace

bool _ReadFile(const char* path, const QSReadFileConsumer& consumer) {
  platform::ReadOnlyFile file(path);
  if (!file.isOpen()) {
    logReadFailure("failed to open %s : %s", path, QSErrorText(errno));
    return false;
  }
  int64_t fileSize = 0;
  if (!file.size(&fileSize)) {
    logReadFailure("failed to stat %s : %s", path, QSErrorText(errno));
    return false;
  }
  const long bufferSize = static_cast<long>(std::min(fileSize, kReadChunkLimit));
  HeapBuffer buffer(static_cast<uint8_t*>(std::malloc(static_cast<size_t>(bufferSize))));
  if (!buffer && bufferSize > 0) {
    logReadFailure("malloc failed for %ld bytes: %s", bufferSize, QSErrorText(errno));
    return false;
  }
  for (int64_t offset = 0; offset < fileSize;) {
    const size_t want = static_cast<size_t>(std::min<int64_t>(bufferSize, fileSize - offset));
    const int64_t got = file.read(buffer.get(), want);
    if (got == -1) {
      logReadFailure("read failed for %s : %s", path, QSErrorText(errno));
      return false;
    }
    if (got < 1) {
      logReadFailure("read failed for %s, got %lld bytes", path, static_cast<long long>(got));
      return false;
    }
    if (!consumer(buffer.get(), static_cast<size_t>(got))) return false;
    offset += got;
  }
  return true;
}

std::optional<std::string> QSCreateSHA256Digest(const platform::URL& location) {
  platform::SHA256 hasher;
  if (!_ReadFile(location.fileSystemRepresentation(), [&](const uint8_t* bytes, size_t length) {
        hasher.update(bytes, length);
        return true;
      })) {
    QS_SYSLOG(kQSLogLevelError, kDigestFunction, "Failed to read %@ : %s", location, QSErrorText(errno));
    return std::nullopt;
  }
  const platform::SHA256Digest digest = hasher.finish();
  return platform::hexString(digest.data(), digest.size());
}

std::optional<std::string> QSCreateSHA256Digest(const std::string& path) {
  return QSCreateSHA256Digest(platform::URL::fileURL(path));
}
