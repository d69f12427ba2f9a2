#include "Platform/Foundation/Json.h"

#include <cmath>
#include <cstdio>

#include "Platform/Foundation/Text.h"

namespace platform {

namespace {

// First code unit of the escapes that stand for bytes that are not UTF-8.
constexpr unsigned kSurrogateEscapeBase = 0xDC00;
constexpr unsigned char kDelete = 0x7F;
constexpr unsigned char kFirstPrintable = 0x20;
constexpr int kIndentWidth = 2;

void appendUnicodeEscape(std::string& out, unsigned value) {
  out += "\\u";
  appendHex(out, static_cast<uint8_t>(value >> 8));
  appendHex(out, static_cast<uint8_t>(value));
}

}  // namespace

std::string jsonQuoted(std::string_view bytes) {
  std::string out;
  out.reserve(bytes.size() + 2);
  out += '"';
  for (size_t i = 0; i < bytes.size();) {
    const auto c = static_cast<unsigned char>(bytes[i]);
    const size_t length = utf8SequenceLength(bytes, i);
    if (length == 0) {
      appendUnicodeEscape(out, kSurrogateEscapeBase + c);
      ++i;
      continue;
    }
    if (length > 1) {
      out.append(bytes.substr(i, length));
      i += length;
      continue;
    }
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      case '\b': out += "\\b"; break;
      case '\f': out += "\\f"; break;
      default:
        if (c < kFirstPrintable || c == kDelete) {
          appendUnicodeEscape(out, c);
        } else {
          out += static_cast<char>(c);
        }
    }
    ++i;
  }
  out += '"';
  return out;
}

void JsonWriter::newline() {
  if (!indented_) return;
  text_ += '\n';
  text_.append(hasMember_.size() * kIndentWidth, ' ');
}

void JsonWriter::beforeValue() {
  if (afterKey_) {
    afterKey_ = false;
    return;
  }
  if (!hasMember_.empty()) {
    if (hasMember_.back()) text_ += ',';
    hasMember_.back() = true;
    newline();
  }
}

JsonWriter& JsonWriter::beginObject() {
  beforeValue();
  text_ += '{';
  hasMember_.push_back(false);
  return *this;
}

JsonWriter& JsonWriter::endObject() {
  const bool hadMembers = hasMember_.back();
  hasMember_.pop_back();
  if (hadMembers) newline();
  text_ += '}';
  return *this;
}

JsonWriter& JsonWriter::beginArray() {
  beforeValue();
  text_ += '[';
  hasMember_.push_back(false);
  return *this;
}

JsonWriter& JsonWriter::endArray() {
  const bool hadMembers = hasMember_.back();
  hasMember_.pop_back();
  if (hadMembers) newline();
  text_ += ']';
  return *this;
}

JsonWriter& JsonWriter::key(std::string_view name) {
  beforeValue();
  text_ += jsonQuoted(name);
  text_ += indented_ ? ": " : ":";
  afterKey_ = true;
  return *this;
}

JsonWriter& JsonWriter::string(std::string_view bytes) {
  beforeValue();
  text_ += jsonQuoted(bytes);
  return *this;
}

JsonWriter& JsonWriter::boolean(bool value) {
  beforeValue();
  text_ += value ? "true" : "false";
  return *this;
}

JsonWriter& JsonWriter::null() {
  beforeValue();
  text_ += "null";
  return *this;
}

JsonWriter& JsonWriter::number(int64_t value) {
  beforeValue();
  text_ += std::to_string(value);
  return *this;
}

JsonWriter& JsonWriter::number(uint64_t value) {
  beforeValue();
  text_ += std::to_string(value);
  return *this;
}

JsonWriter& JsonWriter::real(double value, int decimals) {
  if (!std::isfinite(value)) return null();  // JSON has no infinities
  beforeValue();
  char buffer[64];
  std::snprintf(buffer, sizeof buffer, "%.*f", decimals, value);
  text_ += buffer;
  return *this;
}

JsonWriter& JsonWriter::optionalString(const std::optional<std::string>& bytes) {
  return bytes ? string(*bytes) : null();
}

}  // namespace platform
