// Error-record constructors and the exported error domain and keys.
//
// Every error record of the system is built here. Records carry the raising
// function's name ("FunctionName") and source line ("SourceFileLine").
// Nothing here fails or throws; the constructors are re-entrant.
#pragma once

#include <cstdint>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/Format.h"

// The system's own error domain and user-information keys.
extern const char* const QSInstallerErrorDomain;      // "QSInstallerErrorDomain"
extern const char* const QSFunctionNameErrorKey;      // "FunctionName"
extern const char* const QSSourceFileLineErrorKey;    // "SourceFileLine"
extern const char* const QSPathArgumentErrorKey;      // "PathArgument"
inline constexpr char kQSLegacyErrorStringKey[] = "LegacyErrorString";

// Codes of QSInstallerErrorDomain used by the file layer.
inline constexpr long kQSErrorCodeFileOperationFailed = 4;
inline constexpr long kQSErrorCodeStoreDataCaptureFailed = 24;
inline constexpr long kQSErrorCodeInvalidSymlink = 70;

// A record of exactly {description, FunctionName, SourceFileLine}; no line is
// logged. `format` is required.
platform::Error _CreateErrorV(const char* function, int32_t sourceLine, const char* domain, long code,
                              const char* format, platform::FormatArgs args);

template <class... Args>
platform::Error _CreateError(const char* function, int32_t sourceLine, const char* domain, long code,
                             const char* format, const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    return _CreateErrorV(function, sourceLine, domain, code, format, {});
  } else {
    const platform::FormatArg captured[] = {platform::FormatArg(args)...};
    return _CreateErrorV(function, sourceLine, domain, code, format, captured);
  }
}

// A record whose user information is `additions` (may be null) plus, when a
// format is given, the description; plus the underlying error (may be null);
// plus FunctionName and SourceFileLine, which override the additions. With a
// format, one level-3 line "%d: %@" (or "%d: %@ (%@)" with an underlying
// error) is written through SystemLogWrite under `function`, subject to the
// level test. `format` may be null: then no description and no line.
platform::Error _CreateAndLogErrorV(const char* function, int32_t sourceLine, const char* domain, long code,
                                    const platform::Error* underlying, const platform::Dictionary* additions,
                                    const char* format, platform::FormatArgs args);

template <class... Args>
platform::Error _CreateAndLogError(const char* function, int32_t sourceLine, const char* domain, long code,
                                   const platform::Error* underlying, const platform::Dictionary* additions,
                                   const char* format, const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    return _CreateAndLogErrorV(function, sourceLine, domain, code, underlying, additions, format, {});
  } else {
    const platform::FormatArg captured[] = {platform::FormatArg(args)...};
    return _CreateAndLogErrorV(function, sourceLine, domain, code, underlying, additions, format, captured);
  }
}

// The one place where an errno becomes an error record: POSIX domain, code
// `errnum`, the formatted message (which names the call, the path and the
// error text), the function name and the source line. Not logged.
template <class... Args>
platform::Error QSPOSIXError(const char* function, int32_t sourceLine, int errnum, const char* format,
                             const Args&... args) {
  return _CreateError(function, sourceLine, platform::kPOSIXErrorDomain, errnum, format, args...);
}

// The bare POSIX record used as an underlying error: code only, no user
// information.
platform::Error QSPOSIXUnderlyingError(int errnum);

// strerror for messages, thread-safe.
const char* QSErrorText(int errnum);

// Writes `record` to `out` when `out` is not null; returns false, so that a
// failing path can end with `return QSFail(error, record);`.
inline bool QSFail(platform::Error* out, platform::Error record) {
  if (out) *out = std::move(record);
  return false;
}
