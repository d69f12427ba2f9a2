// UTF-8 checks shared by devicegen (names that cannot be property-list
// strings) and appregistry (escaping for JSON and the terminal). File-system
// names are bytes; these helpers say which of them are well-formed UTF-8.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace tools {

// The length (1-4) of the well-formed UTF-8 sequence that starts at
// bytes[at], or 0 when the bytes there are not one (a stray continuation
// byte, a truncated sequence, an overlong form, a surrogate, a value beyond
// U+10FFFF). REQUIRES: at < bytes.size().
inline size_t utf8SequenceLength(std::string_view bytes, size_t at) {
  const auto lead = static_cast<unsigned char>(bytes[at]);
  if (lead < 0x80) return 1;
  size_t extra;
  uint32_t codePoint;
  if ((lead & 0xE0) == 0xC0) {
    extra = 1;
    codePoint = lead & 0x1F;
  } else if ((lead & 0xF0) == 0xE0) {
    extra = 2;
    codePoint = lead & 0x0F;
  } else if ((lead & 0xF8) == 0xF0) {
    extra = 3;
    codePoint = lead & 0x07;
  } else {
    return 0;
  }
  if (bytes.size() - at <= extra) return 0;  // truncated
  for (size_t k = 1; k <= extra; ++k) {
    const auto next = static_cast<unsigned char>(bytes[at + k]);
    if ((next & 0xC0) != 0x80) return 0;
    codePoint = (codePoint << 6) | (next & 0x3F);
  }
  static constexpr uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000};
  if (codePoint < kSmallest[extra] || codePoint > 0x10FFFF || (codePoint >= 0xD800 && codePoint <= 0xDFFF)) return 0;
  return extra + 1;
}

inline bool isValidUTF8(std::string_view bytes) {
  for (size_t at = 0; at < bytes.size();) {
    const size_t length = utf8SequenceLength(bytes, at);
    if (length == 0) return false;
    at += length;
  }
  return true;
}

// `bytes` for a terminal or a log: well-formed UTF-8 passes unchanged except
// control characters and backslashes; every other byte becomes "\xNN".
inline std::string printable(std::string_view bytes) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(bytes.size());
  for (size_t at = 0; at < bytes.size();) {
    const size_t length = utf8SequenceLength(bytes, at);
    const auto byte = static_cast<unsigned char>(bytes[at]);
    if (length == 0 || (length == 1 && (byte < 0x20 || byte == 0x7F || byte == '\\'))) {
      if (byte == '\\') {
        out += "\\\\";
      } else {
        out += "\\x";
        out += kHex[byte >> 4];
        out += kHex[byte & 0x0F];
      }
      ++at;
      continue;
    }
    out.append(bytes.substr(at, length));
    at += length;
  }
  return out;
}

}  // namespace tools
