#include "Platform/Foundation/Text.h"

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
