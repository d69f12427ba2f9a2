// Error records of the platform's file layer: the POSIX record of one failed
// call and the kFileErrorDomain records that wrap it.
//
// Records built here are never logged; they belong to the caller. Thread
// safety: pure functions (the error text comes from the re-entrant strerror_r).
#pragma once

#include <string>
#include <string_view>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"

namespace platform {

// User-information key of file records: the path the operation was about.
inline constexpr char kFilePathErrorKey[] = "FilePath";

// The error text of `errnum` ("No such file or directory").
std::string errnoText(int errnum);

// kPOSIXErrorDomain, code `errnum`, described as `<call> "<path>": <text>`.
Error POSIXCallError(int errnum, std::string_view call, std::string_view path);

// kFileErrorDomain read failure about `url`: code 260 when `underlying` is
// the POSIX record of ENOENT, 256 otherwise; described as
// `Could not read "<path>": <reason>`. `underlying` may be null.
Error FileReadError(const URL& url, std::string_view reason, const Error* underlying = nullptr);

// kFileErrorDomain 512 about `url`, described as
// `Could not write "<path>": <reason>`. `underlying` may be null.
Error FileWriteError(const URL& url, std::string_view reason, const Error* underlying = nullptr);

// Writes `record` to `out` when `out` is not null. Returns false, so that a
// failing path can end with `return failWith(error, record);`.
inline bool failWith(Error* out, Error record) {
  if (out) *out = std::move(record);
  return false;
}

}  // namespace platform
