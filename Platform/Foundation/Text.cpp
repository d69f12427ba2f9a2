#include "Platform/Foundation/Text.h"

#include <algorithm>
#include <cstdint>
#include <utility>

namespace platform {

size_t utf8SequenceLength(std::string_view bytes, size_t at) {
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

bool isValidUTF8(std::string_view bytes) {
  for (size_t at = 0; at < bytes.size();) {
    const size_t length = utf8SequenceLength(bytes, at);
    if (length == 0) return false;
    at += length;
  }
  return true;
}

std::string printable(std::string_view bytes) {
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
        appendHex(out, byte);
      }
      ++at;
      continue;
    }
    out.append(bytes.substr(at, length));
    at += length;
  }
  return out;
}

namespace {

// The code point of the well-formed sequence of `length` bytes at bytes[at].
uint32_t codePointAt(std::string_view bytes, size_t at, size_t length) {
  static constexpr uint8_t kLeadMask[] = {0, 0x7F, 0x1F, 0x0F, 0x07};
  uint32_t codePoint = static_cast<unsigned char>(bytes[at]) & kLeadMask[length];
  for (size_t k = 1; k < length; ++k) codePoint = (codePoint << 6) | (static_cast<unsigned char>(bytes[at + k]) & 0x3F);
  return codePoint;
}

// The blocks of characters a terminal shows two columns wide.
struct CodePointRange {
  uint32_t first, last;
};
constexpr CodePointRange kWideCharacters[] = {
    {0x1100, 0x115F}, {0x2E80, 0x303E},   {0x3041, 0x33FF},   {0x3400, 0x4DBF},   {0x4E00, 0x9FFF},
    {0xA000, 0xA4CF}, {0xAC00, 0xD7A3},   {0xF900, 0xFAFF},   {0xFE30, 0xFE4F},   {0xFF00, 0xFF60},
    {0xFFE0, 0xFFE6}, {0x1F300, 0x1F64F}, {0x1F900, 0x1F9FF}, {0x20000, 0x2FFFD}, {0x30000, 0x3FFFD},
};

size_t columnsOf(uint32_t codePoint) {
  for (const CodePointRange& range : kWideCharacters) {
    if (codePoint >= range.first && codePoint <= range.last) return 2;
  }
  return 1;
}

// Walks `text` code point by code point (a byte that starts no well-formed
// sequence counts as one) until the next one would pass `columns`; returns
// the bytes walked and the columns they take.
std::pair<size_t, size_t> walkColumns(std::string_view text, size_t columns) {
  size_t at = 0, used = 0;
  while (at < text.size()) {
    const size_t length = std::max<size_t>(utf8SequenceLength(text, at), 1);
    const size_t width = length == 1 ? 1 : columnsOf(codePointAt(text, at, length));
    if (used + width > columns) break;
    used += width;
    at += length;
  }
  return {at, used};
}

}  // namespace

size_t displayColumns(std::string_view text) {
  return walkColumns(text, SIZE_MAX).second;
}

std::string_view leadingColumns(std::string_view text, size_t columns) {
  return text.substr(0, walkColumns(text, columns).first);
}

void appendHex(std::string& out, uint8_t byte, HexCase letters) {
  static constexpr char kLower[] = "0123456789abcdef";
  static constexpr char kUpper[] = "0123456789ABCDEF";
  const char* digits = letters == HexCase::Lower ? kLower : kUpper;
  out += digits[byte >> 4];
  out += digits[byte & 0x0F];
}

std::string hexString(const void* bytes, size_t length) {
  std::string text;
  text.reserve(length * 2);
  for (size_t i = 0; i < length; ++i) appendHex(text, static_cast<const uint8_t*>(bytes)[i]);
  return text;
}

std::string uuidString(std::span<const uint8_t, 16> random) {
  static constexpr uint8_t kVersionMask = 0x0F, kVersion4 = 0x40, kVariantMask = 0x3F, kVariantRFC4122 = 0x80;
  std::string text;
  for (size_t i = 0; i < random.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
    uint8_t byte = random[i];
    if (i == 6) byte = static_cast<uint8_t>((byte & kVersionMask) | kVersion4);
    if (i == 8) byte = static_cast<uint8_t>((byte & kVariantMask) | kVariantRFC4122);
    appendHex(text, byte, HexCase::Upper);
  }
  return text;
}

}  // namespace platform
