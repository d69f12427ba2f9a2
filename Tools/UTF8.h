// UTF-8 checks shared by devicegen (names that cannot be property-list
// strings) and appregistry (escaping for JSON and the terminal). File-system
// names are bytes; these helpers say which of them are well-formed UTF-8 and
// show the others.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "Platform/Foundation/Text.h"

namespace tools {

// The validators are the platform's.
using platform::isValidUTF8;
using platform::utf8SequenceLength;

// `bytes` for a terminal or a log: well-formed UTF-8 passes unchanged except
// control characters and backslashes; every other byte becomes "\xNN".
inline std::string printable(std::string_view bytes) {
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
        platform::appendHex(out, byte);
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
