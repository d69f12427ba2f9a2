// The one JSON writer of the system: the host's log lines, plan and report,
// and the tools' --json output all go through it.
//
// Strings are bytes (file-system names, log messages), not necessarily UTF-8.
// Well-formed UTF-8 is written as it is; quotes, backslashes, control
// characters and DEL (0x7F, which a terminal may act on) are escaped; and each
// byte that is not part of well-formed UTF-8 becomes the escape "\udcXX" (XX
// the byte), the lone low surrogate of Python's "surrogateescape" convention,
// so that the original bytes can be recovered.
//
// Thread safety: jsonQuoted is a pure function; a JsonWriter belongs to one
// thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

// A JSON string literal, quotes included, for any bytes.
std::string jsonQuoted(std::string_view bytes);

// Builds one JSON text. Members and elements are separated as they are
// added; optionally indented (two spaces per level) for people to read.
class JsonWriter {
 public:
  explicit JsonWriter(bool indented = false) : indented_(indented) {}

  JsonWriter& beginObject();
  JsonWriter& endObject();
  JsonWriter& beginArray();
  JsonWriter& endArray();
  // A member name; the next value belongs to it. REQUIRES: inside an object.
  JsonWriter& key(std::string_view name);
  JsonWriter& string(std::string_view bytes);
  JsonWriter& boolean(bool value);
  JsonWriter& null();
  JsonWriter& number(int64_t value);
  JsonWriter& number(uint64_t value);
  JsonWriter& number(int value) { return number(static_cast<int64_t>(value)); }
  // A real, written with `decimals` digits after the point.
  JsonWriter& real(double value, int decimals = 3);
  // The string, or null when there is none.
  JsonWriter& optionalString(const std::optional<std::string>& bytes);

  const std::string& text() const { return text_; }

 private:
  void beforeValue();
  void newline();

  const bool indented_;
  std::string text_;
  // One entry per open object or array: whether it has a member yet.
  std::vector<bool> hasMember_;
  bool afterKey_ = false;
};

}  // namespace platform
