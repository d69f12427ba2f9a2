// A small JSON writer for appregistry's --json output.
//
// Strings are file-system bytes, not necessarily UTF-8: well-formed UTF-8 is
// written as is (with the escapes JSON requires), and each byte that is not
// part of well-formed UTF-8 is written as the escape "\udcXX" (XX the byte),
// the lone low surrogate that Python's "surrogateescape" also uses, so that
// the original bytes can be recovered and the output stays valid ASCII-safe
// JSON text.
//
// Thread safety: a JsonWriter belongs to one thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace appregistry {

std::string jsonString(std::string_view bytes);

class JsonWriter {
 public:
  JsonWriter& beginObject();
  JsonWriter& endObject();
  JsonWriter& beginArray();
  JsonWriter& endArray();
  // A member name; the next value belongs to it. REQUIRES: inside an object.
  JsonWriter& key(std::string_view name);
  JsonWriter& string(std::string_view bytes);
  JsonWriter& boolean(bool value);
  JsonWriter& null();
  JsonWriter& number(long long value);

  const std::string& text() const { return text_; }

 private:
  void beforeValue();

  std::string text_;
  // One entry per open object or array: whether it has a member yet.
  std::vector<bool> hasMember_;
  bool afterKey_ = false;
};

}  // namespace appregistry
