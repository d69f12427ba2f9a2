#include "Shared/Support/QSError.h"

#include <cstring>

#include "Shared/Support/QSLog.h"

const char* const QSInstallerErrorDomain = "QSInstallerErrorDomain";
const char* const QSFunctionNameErrorKey = "FunctionName";
const char* const QSSourceFileLineErrorKey = "SourceFileLine";
const char* const QSPathArgumentErrorKey = "PathArgument";

using platform::Dictionary;
using platform::Error;
using platform::Value;

Error _CreateErrorV(const char* function, int32_t sourceLine, const char* domain, long code, const char* format,
                    platform::FormatArgs args) {
  Dictionary info;
  info[platform::kLocalizedDescriptionKey] = Value(platform::FormatV(format, args));
  info[QSFunctionNameErrorKey] = Value(function ? function : "");
  info[QSSourceFileLineErrorKey] = Value(static_cast<int64_t>(sourceLine));
  return Error(domain ? domain : "", code, std::move(info));
}

Error _CreateAndLogErrorV(const char* function, int32_t sourceLine, const char* domain, long code,
                          const Error* underlying, const Dictionary* additions, const char* format,
                          platform::FormatArgs args) {
  Dictionary info = additions ? *additions : Dictionary{};
  if (format) {
    std::string message = platform::FormatV(format, args);
    info[platform::kLocalizedDescriptionKey] = Value(message);
    if (underlying) {
      QS_SYSLOG(kQSLogLevelError, function, "%d: %@ (%@)", sourceLine, message, *underlying);
    } else {
      QS_SYSLOG(kQSLogLevelError, function, "%d: %@", sourceLine, message);
    }
  }
  if (underlying) info[platform::kUnderlyingErrorKey] = Value(*underlying);
  info[QSFunctionNameErrorKey] = Value(function ? function : "");
  info[QSSourceFileLineErrorKey] = Value(static_cast<int64_t>(sourceLine));
  return Error(domain ? domain : "", code, std::move(info));
}

Error QSPOSIXUnderlyingError(int errnum) { return Error(platform::kPOSIXErrorDomain, errnum); }

const char* QSErrorText(int errnum) {
  const char* text = strerrordesc_np(errnum);
  return text ? text : "Unknown error";
}
