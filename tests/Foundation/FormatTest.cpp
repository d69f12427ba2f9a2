#include "Platform/Foundation/Format.h"

#include <functional>
#include <optional>

#include <gtest/gtest.h>

namespace {

using namespace platform;

// Each case: the call, what it should print, how many mismatches it counts
// (the test main lets only this suite raise the count).
TEST(FormatMismatch, IsCountedWhileConversionsFollowPrintfAndObjectsPrintTheirDescriptions) {
  const std::tuple<std::function<std::string()>, std::string, int> cases[] = {
      {[] { return Format("%d %ld %hhd %hd %lu %d", INT64_MAX, INT64_MAX, 300, 70000LL, -1, true); },
       "-1 9223372036854775807 44 4464 18446744073709551615 1", 0},
      {[] { return Format("%lld %#x %c %.2f%% %p", UINT64_MAX, 255U, 'k', 3.14159f, (const void*)0x10); },
       "-1 0xff k 3.14% 0x10", 0},
      {[] { return Format("[%-5d][%05d][%*d][%.2s] %s", 42, 42, 4, 7, std::string_view("abc"), (const char*)nullptr); },
       "[42   ][00042][   7][ab] (null)", 0},
      {[] { return Format("%@ %@ %@ %@ %@", nullptr, Value(), URL(), std::optional<URL>(), (const Value*)nullptr); },
       "(null) (null) (null) (null) (null)", 0},
      {[] { return Format("%@ %@ [%-4@]", URL::fileURL("/a", true), Error("D", 3), std::string("ab")); },
       "file:///a/ Error Domain=D Code=3 UserInfo={} [ab  ]", 0},
      {[] {
         return Format("%@ %@", Array{Value("a"), Value(1)}, Dictionary{{"k", Value(true)}});
       },
       "(a, 1) {k = 1; }", 0},
      {[] { return Format("%d %@ %.1f %d %s", "text", 42, 3, 2.5, 7); }, "text 42 3.0 2.5 7", 5},
      {[] { return Format("a %@ b %d", Value("x")); }, "a x b <missing>", 1},
      {[] { return Format("only %d", 1, 2); }, "only 1", 1},
      {[] { return Format("%n 50%"); }, "%n 50%", 2},
  };
  for (const auto& [format, expected, mismatches] : cases) {
    const uint64_t before = formatMismatchCount();
    EXPECT_EQ(format(), expected);
    EXPECT_EQ(formatMismatchCount() - before, static_cast<uint64_t>(mismatches)) << expected;
  }
}

}  // namespace
