// The JSON writer: escapes of every kind of byte, and the document shapes.
#include <gtest/gtest.h>

#include "Platform/Foundation/Json.h"

namespace {

TEST(Json, StringsOfAnyBytesAreEscapedAndRecoverable) {
  const std::pair<std::string, std::string> cases[] = {
      {"plain", "\"plain\""},
      {"q\"b\\s/", "\"q\\\"b\\\\s/\""},
      {"\n\r\t\b\f", "\"\\n\\r\\t\\b\\f\""},
      {std::string("\x01\x1f\x7f", 3), "\"\\u0001\\u001f\\u007f\""},
      {std::string("nul\0x", 5), "\"nul\\u0000x\""},
      {"\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80", "\"\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\""},  // kept as UTF-8
      {"\xff", "\"\\udcff\""},                                                               // not UTF-8
      {"\xc0\xaf", "\"\\udcc0\\udcaf\""},                                                    // overlong
      {"\xed\xa0\x80", "\"\\udced\\udca0\\udc80\""},                                         // a surrogate
      {"\xf4\x90\x80\x80", "\"\\udcf4\\udc90\\udc80\\udc80\""},                              // beyond U+10FFFF
      {"\xe2\x82", "\"\\udce2\\udc82\""},                                                    // cut short
  };
  for (const auto& [bytes, expected] : cases) EXPECT_EQ(platform::jsonQuoted(bytes), expected) << expected;
}

TEST(Json, DocumentsCompactAndIndented) {
  const auto build = [](platform::JsonWriter& json) {
    json.beginObject().key("a").beginArray().number(int64_t{-1}).number(uint64_t{18446744073709551615u}).endArray();
    json.key("b").optionalString(std::nullopt).key("c").real(1.5, 2).key("d").beginObject().endObject();
    json.key("e").real(1.0 / 0.0).endObject();
  };
  platform::JsonWriter compact, indented(true);
  build(compact);
  build(indented);
  EXPECT_EQ(compact.text(), "{\"a\":[-1,18446744073709551615],\"b\":null,\"c\":1.50,\"d\":{},\"e\":null}");
  EXPECT_EQ(indented.text(),
            "{\n  \"a\": [\n    -1,\n    18446744073709551615\n  ],\n  \"b\": null,\n  \"c\": 1.50,\n  \"d\": {},\n"
            "  \"e\": null\n}");
}

}  // namespace
