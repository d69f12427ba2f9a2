#include "Platform/Foundation/Format.h"

#include <cstdint>
#include <functional>
#include <limits>
#include <optional>
#include <string>

#include <gtest/gtest.h>

using platform::Array;
using platform::Dictionary;
using platform::Error;
using platform::Format;
using platform::URL;
using platform::Value;

namespace {

struct Described {
  std::string description() const { return "<described>"; }
};

// Each case: what Format produced, what it should have produced.
using Cases = std::vector<std::pair<std::string, std::string>>;

TEST(FormatConversions, FollowPrintfWithTheWidthOfTheLengthModifier) {
  uint64_t before = platform::formatMismatchCount();
  const Cases cases = {
      {Format("%d", -42), "-42"},
      {Format("%lld", std::numeric_limits<long long>::min()), "-9223372036854775808"},
      {Format("%zd", static_cast<long>(-3)), "-3"},
      {Format("%d", true), "1"},
      {Format("%d", 'A'), "65"},
      {Format("%d", std::numeric_limits<int64_t>::max()), "-1"},
      {Format("%ld", std::numeric_limits<int64_t>::max()), "9223372036854775807"},
      {Format("%hhd", 300), "44"},
      {Format("%hd", 70000), "4464"},
      {Format("%u", -1), "4294967295"},
      {Format("%lu", -1), "18446744073709551615"},
      {Format("%lld", std::numeric_limits<uint64_t>::max()), "-1"},
      {Format("%zu", sizeof(int)), "4"},
      {Format("%#x %X %o", 255, 255U, 8), "0xff FF 10"},
      {Format("%llx", std::numeric_limits<uint64_t>::max()), "ffffffffffffffff"},
      {Format("[%5d][%-5d][%05d][%+d][% d]", 42, 42, 42, 42, 42), "[   42][42   ][00042][+42][ 42]"},
      {Format("[%08x][%*d][%.3d]", 0xbeef, 4, 7, 7), "[0000beef][   7][007]"},
      {Format("%s %s %s", "text", std::string("std"), std::string_view("view")), "text std view"},
      {Format("%s", static_cast<const char*>(nullptr)), "(null)"},
      {Format("[%6s][%-6s][%.2s]", "ab", "ab", "abcdef"), "[    ab][ab    ][ab]"},
      {Format("%c%c[%3c]", 'o', 'k', 'x'), "ok[  x]"},
      {Format("%f %.2f %8.3f", 1.5, 3.14159, -2.0), "1.500000 3.14   -2.000"},
      {Format("%g %e %f", 0.0001, 1500.0, 2.5f), "0.0001 1.500000e+03 2.500000"},
      {Format("100%% %d%%", 5), "100% 5%"},
      {Format(nullptr), ""},
  };
  for (const auto& [produced, expected] : cases) EXPECT_EQ(produced, expected);
  int x = 0;
  std::string text = Format("%p", static_cast<const void*>(&x));
  EXPECT_EQ(text.rfind("0x", 0), 0u) << text;
  EXPECT_EQ(std::stoull(text, nullptr, 16), reinterpret_cast<uintptr_t>(&x));
  EXPECT_EQ(platform::formatMismatchCount(), before);
}

TEST(FormatObjects, PrintTheirDescriptionsOrNull) {
  uint64_t before = platform::formatMismatchCount();
  Value pointed("pointed");
  const Cases cases = {
      {Format("%@ %@ %@", nullptr, Value(), URL()), "(null) (null) (null)"},
      {Format("%@ %@", static_cast<const Value*>(nullptr), std::optional<URL>()), "(null) (null)"},
      {Format("%s", Value()), "(null)"},
      {Format("%@ %@", URL::fileURL("/a/b", true), std::optional<URL>(URL::fileURL("/o"))), "file:///a/b/ file:///o"},
      {Format("%@", Error("D", 3)), "Error Domain=D Code=3 UserInfo={}"},
      {Format("%@ %@ %@", Value("v"), std::string("s"), "c"), "v s c"},
      {Format("%@ %@ %@", Value(7), Array{Value("a"), Value(1)}, Dictionary{{"k", Value(true)}}), "7 (a, 1) {k = 1; }"},
      {Format("%@ %@", Described{}, &pointed), "<described> pointed"},
      {Format("[%8@][%-8@]", Value("ab"), Value("ab")), "[      ab][ab      ]"},
      {Format("QSAppMigrator: Failed to read %@ : %@", URL::fileURL("/m.plist"), Error("D", 1)),
       "QSAppMigrator: Failed to read file:///m.plist : Error Domain=D Code=1 UserInfo={}"},
  };
  for (const auto& [produced, expected] : cases) EXPECT_EQ(produced, expected);
  EXPECT_EQ(platform::formatMismatchCount(), before);
}

// Mismatches are counted; the test main lets only this suite raise the count.
TEST(FormatMismatch, IsCountedAndTheArgumentStillShown) {
  const struct {
    std::function<std::string()> format;
    std::string expected;
  } cases[] = {
      {[] { return Format("%d", "text"); }, "text"},
      {[] { return Format("%@", 42); }, "42"},
      {[] { return Format("%s", URL::fileURL("/a")); }, "file:///a"},
      {[] { return Format("%.1f", 3); }, "3.0"},
      {[] { return Format("%d", 2.5); }, "2.5"},
      {[] { return Format("a %@ b %d", Value("x")); }, "a x b <missing>"},
      {[] { return Format("only %d", 1, 2); }, "only 1"},
      {[] { return Format("50%"); }, "50%"},
  };
  for (const auto& c : cases) {
    uint64_t before = platform::formatMismatchCount();
    EXPECT_EQ(c.format(), c.expected);
    EXPECT_EQ(platform::formatMismatchCount() - before, 1u) << c.expected;
  }
  uint64_t before = platform::formatMismatchCount();
  EXPECT_EQ(Format("%n %k", 1), "%n %k");
  EXPECT_GE(platform::formatMismatchCount() - before, 2u);
}

}  // namespace
