#include "Tools/appregistry/Json.h"

#include "Tools/UTF8.h"

namespace appregistry {
namespace {

constexpr char kHex[] = "0123456789abcdef";

void appendEscape(std::string& out, unsigned value) {
  out += "\\u";
  for (int shift = 12; shift >= 0; shift -= 4) out += kHex[(value >> shift) & 0xF];
}

// First code unit of the escapes that stand for bytes that are not UTF-8.
constexpr unsigned kSurrogateEscapeBase = 0xDC00;

}  // namespace

std::string jsonString(std::string_view bytes) {
  std::string out = "\"";
  for (size_t at = 0; at < bytes.size();) {
    const size_t length = tools::utf8SequenceLength(bytes, at);
    const auto byte = static_cast<unsigned char>(bytes[at]);
    if (length == 0) {
      appendEscape(out, kSurrogateEscapeBase + byte);
      ++at;
      continue;
    }
    if (length > 1) {
      out.append(bytes.substr(at, length));
      at += length;
      continue;
    }
    switch (byte) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\b':
        out += "\\b";
        break;
      case '\f':
        out += "\\f";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (byte < 0x20) {
          appendEscape(out, byte);
        } else {
          out += static_cast<char>(byte);
        }
    }
    ++at;
  }
  out += '"';
  return out;
}

void JsonWriter::beforeValue() {
  if (afterKey_) {
    afterKey_ = false;
    return;
  }
  if (!hasMember_.empty()) {
    if (hasMember_.back()) text_ += ',';
    hasMember_.back() = true;
  }
}

JsonWriter& JsonWriter::beginObject() {
  beforeValue();
  text_ += '{';
  hasMember_.push_back(false);
  return *this;
}

JsonWriter& JsonWriter::endObject() {
  text_ += '}';
  hasMember_.pop_back();
  return *this;
}

JsonWriter& JsonWriter::beginArray() {
  beforeValue();
  text_ += '[';
  hasMember_.push_back(false);
  return *this;
}

JsonWriter& JsonWriter::endArray() {
  text_ += ']';
  hasMember_.pop_back();
  return *this;
}

JsonWriter& JsonWriter::key(std::string_view name) {
  beforeValue();
  text_ += jsonString(name);
  text_ += ':';
  afterKey_ = true;
  return *this;
}

JsonWriter& JsonWriter::string(std::string_view bytes) {
  beforeValue();
  text_ += jsonString(bytes);
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

JsonWriter& JsonWriter::number(long long value) {
  beforeValue();
  text_ += std::to_string(value);
  return *this;
}

}  // namespace appregistry
