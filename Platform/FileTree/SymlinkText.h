// Reading the text of a symbolic link, shared by the link operations and the
// containment check.
#pragma once

#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <string>

namespace platform::fs {

// The longest link text read; a longer text comes back cut to this length.
inline constexpr size_t kMaxSymlinkTextLength = 1024;

// Reads the text of the link at `path` into *text. Returns 0, or readlink's
// error number (EINVAL when the item is no link), leaving *text untouched.
// Thread-safe: the buffer belongs to the call.
[[nodiscard]] inline int readSymlinkText(const char* path, std::string* text) {
  char buffer[kMaxSymlinkTextLength + 1] = {};
  ssize_t length = readlink(path, buffer, kMaxSymlinkTextLength);
  if (length < 0) return errno;
  *text = std::string(buffer, static_cast<size_t>(length));  // the raw bytes, whatever they are
  return 0;
}

}  // namespace platform::fs
