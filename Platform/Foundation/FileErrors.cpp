#include "Platform/Foundation/FileErrors.h"

#include <cerrno>
#include <cstring>

namespace platform {

namespace {

Error fileError(int64_t code, const URL& url, std::string message, const Error* underlying) {
  Dictionary info{{kLocalizedDescriptionKey, Value(std::move(message))}, {kFilePathErrorKey, Value(url.path())}};
  if (underlying) info.emplace(kUnderlyingErrorKey, Value(*underlying));
  return Error(kFileErrorDomain, code, std::move(info));
}

}  // namespace

std::string errnoText(int errnum) {
  char buffer[256];
  // The GNU strerror_r returns the text, which need not be in `buffer`.
  return strerror_r(errnum, buffer, sizeof buffer);
}

Error POSIXCallError(int errnum, std::string_view call, std::string_view path) {
  std::string message = std::string(call) + " \"" + std::string(path) + "\": " + errnoText(errnum);
  return Error(kPOSIXErrorDomain, errnum, Dictionary{{kLocalizedDescriptionKey, Value(std::move(message))}});
}

Error FileReadError(const URL& url, std::string_view reason, const Error* underlying) {
  const bool missing = underlying && underlying->isPOSIX(ENOENT);
  return fileError(missing ? kFileReadNoSuchFileError : kFileReadUnknownError, url,
                   "Could not read \"" + url.path() + "\": " + std::string(reason), underlying);
}

Error FileWriteError(const URL& url, std::string_view reason, const Error* underlying) {
  return fileError(kFileWriteUnknownError, url, "Could not write \"" + url.path() + "\": " + std::string(reason),
                   underlying);
}

}  // namespace platform
