// Byte-string helpers: UTF-8 well-formedness, printable forms and
// hexadecimal digits.
//
// File-system names and property-list strings are bytes; these helpers say
// which of them are well-formed UTF-8 and spell bytes in hexadecimal.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

namespace platform {

// The length (1-4) of the well-formed UTF-8 sequence that starts at
// bytes[at], or 0 when the bytes there are not one (a stray continuation
// byte, a truncated sequence, an overlong form, a surrogate, a value beyond
// U+10FFFF). REQUIRES: at < bytes.size().
size_t utf8SequenceLength(std::string_view bytes, size_t at);

bool isValidUTF8(std::string_view bytes);

// `bytes` for a terminal or a log: well-formed UTF-8 passes unchanged except
// control characters and backslashes; every other byte becomes "\xNN".
std::string printable(std::string_view bytes);

// Columns of a terminal that printable text (see printable) takes: two for
// an East Asian wide or full-width character or an emoji, one for every
// other code point (combining marks are rare in identifiers and paths; they
// only make a line look a column shorter than it is).
size_t displayColumns(std::string_view text);

// The longest start of printable `text` that takes at most `columns`
// columns, cut between code points.
std::string_view leadingColumns(std::string_view text, size_t columns);

enum class HexCase { Lower, Upper };

// Appends the two hexadecimal digits of `byte`.
void appendHex(std::string& out, uint8_t byte, HexCase letters = HexCase::Lower);

// Two lower-case hexadecimal digits per byte.
std::string hexString(const void* bytes, size_t length);

// A version-4 UUID ("0F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F0", upper case) made
// of 16 random bytes.
std::string uuidString(std::span<const uint8_t, 16> random);

}  // namespace platform
