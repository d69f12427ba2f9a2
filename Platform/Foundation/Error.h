// Error: an error record, as every fallible operation of the system reports
// failure: a domain, a signed code and a user-information dictionary.
//
// Out-parameter contract used throughout the system: an operation that takes
// `Error* error` writes *error if and only if it fails, and only when `error`
// is not null. Operations never throw.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Platform/Foundation/Value.h"

namespace platform {

// The platform's POSIX error domain: codes are errno values.
inline constexpr char kPOSIXErrorDomain[] = "POSIXErrorDomain";
// The platform's file-read domain; code 260 means the file does not exist.
inline constexpr char kFileErrorDomain[] = "FileErrorDomain";
inline constexpr int64_t kFileReadNoSuchFileError = 260;
inline constexpr int64_t kFileReadUnknownError = 256;
inline constexpr int64_t kFileWriteUnknownError = 512;

// User-information keys the platform itself defines.
inline constexpr char kLocalizedDescriptionKey[] = "LocalizedDescription";
inline constexpr char kUnderlyingErrorKey[] = "UnderlyingError";

class Error {
 public:
  Error() = default;  // an empty record: domain "", code 0
  Error(std::string domain, int64_t code, Dictionary userInfo = {});

  const std::string& domain() const { return domain_; }
  int64_t code() const { return code_; }
  const Dictionary& userInfo() const { return userInfo_; }

  // The message under kLocalizedDescriptionKey, or "" when there is none.
  std::string localizedDescription() const;
  // The record under kUnderlyingErrorKey, or null.
  const Error* underlyingError() const;

  bool is(std::string_view domain, int64_t code) const { return domain_ == domain && code_ == code; }
  bool isPOSIX(int errnum) const { return is(kPOSIXErrorDomain, errnum); }

  // Error Domain=D Code=C "message" UserInfo={...}
  std::string description() const;

 private:
  std::string domain_;
  int64_t code_ = 0;
  Dictionary userInfo_;
};

}  // namespace platform
