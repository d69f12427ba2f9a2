#include <openssl/evp.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <memory>

#include "Platform/ReadOnlyFile.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"
#include "Shared/Support/QSUtilities.h"

namespace {

constexpr char kReadFileFunction[] = "_ReadFile";
constexpr char kDigestFunction[] = "QSCreateSHA256Digest";
// The most of a file that is held in memory at once.
constexpr int64_t kReadChunkLimit = 65536;
constexpr char kHexDigits[] = "0123456789abcdef";
constexpr unsigned kNibbleBits = 4;
constexpr unsigned kLowNibbleMask = 0x0f;

struct FreeDeleter {
  void operator()(uint8_t* p) const { std::free(p); }
};
using HeapBuffer = std::unique_ptr<uint8_t, FreeDeleter>;

struct DigestContextDeleter {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using DigestContext = std::unique_ptr<EVP_MD_CTX, DigestContextDeleter>;

std::string hexString(const unsigned char* bytes, size_t length) {
  std::string text;
  text.reserve(length * 2);
  for (size_t i = 0; i < length; ++i) {
    text += kHexDigits[bytes[i] >> kNibbleBits];
    text += kHexDigits[bytes[i] & kLowNibbleMask];
  }
  return text;
}

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
  DigestContext context(EVP_MD_CTX_new());
  bool started = context && EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) == 1;
  bool read = started && _ReadFile(location.fileSystemRepresentation(), [&](const uint8_t* bytes, size_t length) {
                return EVP_DigestUpdate(context.get(), bytes, length) == 1;
              });
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int digestLength = 0;
  if (!read || EVP_DigestFinal_ex(context.get(), digest, &digestLength) != 1) {
    QS_SYSLOG(kQSLogLevelError, kDigestFunction, "Failed to read %@ : %s", location, QSErrorText(errno));
    return std::nullopt;
  }
  return hexString(digest, digestLength);
}

std::optional<std::string> QSCreateSHA256Digest(const std::string& path) {
  return QSCreateSHA256Digest(platform::URL::fileURL(path));
}
