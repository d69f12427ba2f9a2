// Printable forms of names and the columns they take on a terminal: what the
// progress bar and the tools' tables cut and align by.
#include <gtest/gtest.h>

#include "Platform/Foundation/Text.h"

namespace {

TEST(Text, PrintableEscapesControlsBackslashesAndBytesThatAreNotUTF8) {
  const std::pair<std::string, std::string> cases[] = {
      {"com.example.app", "com.example.app"},
      {"caf\xc3\xa9 \xe6\x97\xa5", "caf\xc3\xa9 \xe6\x97\xa5"},
      {"a\\b", "a\\\\b"},
      {"\x1b[2J\t\x7f", "\\x1b[2J\\x09\\x7f"},
      {"\xff\xc3", "\\xff\\xc3"},           // a stray byte, a truncated sequence
      {"\xed\xa0\x80", "\\xed\\xa0\\x80"},  // a surrogate
  };
  for (const auto& [bytes, shown] : cases) EXPECT_EQ(platform::printable(bytes), shown) << shown;
}

TEST(Text, ColumnsCountWideCharactersTwiceAndCutsFallBetweenCodePoints) {
  struct Case {
    std::string text;
    size_t columns;       // of the whole text
    size_t limit;         // cut to this many columns...
    std::string leading;  // ...leaves this
  };
  const Case cases[] = {
      {"abcdef", 6, 4, "abcd"},
      {"caf\xc3\xa9s", 5, 4, "caf\xc3\xa9"},
      {"\xe6\x97\xa5\xe6\x9c\xac", 4, 3, "\xe6\x97\xa5"},  // two CJK ideographs: the second does not fit
      {"a\xf0\x9f\x98\x80z", 4, 2, "a"},                   // an emoji is two columns
      {"x\xffy", 3, 2, "x\xff"},                           // a stray byte counts as one
      {"abc", 3, 0, ""},
      {"", 0, 5, ""},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(platform::displayColumns(c.text), c.columns) << platform::printable(c.text);
    EXPECT_EQ(platform::leadingColumns(c.text, c.limit), c.leading) << platform::printable(c.text);
  }
}

}  // namespace
