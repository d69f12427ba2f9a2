#include "Platform/Foundation/Format.h"

#include <cstdint>
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

TEST(FormatConversions, SignedIntegers) {
  EXPECT_EQ(Format("%d", -42), "-42");
  EXPECT_EQ(Format("%i", 7), "7");
  EXPECT_EQ(Format("%ld", -5L), "-5");
  EXPECT_EQ(Format("%lld", std::numeric_limits<long long>::min()), "-9223372036854775808");
  EXPECT_EQ(Format("%zd", static_cast<long>(-3)), "-3");
  EXPECT_EQ(Format("%d", true), "1");
  EXPECT_EQ(Format("%d", 'A'), "65");
}

TEST(FormatConversions, IntegersTakeTheWidthOfTheLengthModifier) {
  EXPECT_EQ(Format("%d", std::numeric_limits<int64_t>::max()), "-1");
  EXPECT_EQ(Format("%ld", std::numeric_limits<int64_t>::max()), "9223372036854775807");
  EXPECT_EQ(Format("%hhd", 300), "44");
  EXPECT_EQ(Format("%hd", 70000), "4464");
  EXPECT_EQ(Format("%u", -1), "4294967295");
  EXPECT_EQ(Format("%lu", -1), "18446744073709551615");
  EXPECT_EQ(Format("%lld", std::numeric_limits<uint64_t>::max()), "-1");
}

TEST(FormatConversions, UnsignedAndHexadecimal) {
  EXPECT_EQ(Format("%u", 42U), "42");
  EXPECT_EQ(Format("%lu", std::numeric_limits<unsigned long>::max()), "18446744073709551615");
  EXPECT_EQ(Format("%llu", 1ULL), "1");
  EXPECT_EQ(Format("%zu", sizeof(int)), "4");
  EXPECT_EQ(Format("%x", 255), "ff");
  EXPECT_EQ(Format("%X", 255U), "FF");
  EXPECT_EQ(Format("%#x", 255), "0xff");
  EXPECT_EQ(Format("%lx", 0xdeadbeefcafeULL), "deadbeefcafe");
  EXPECT_EQ(Format("%llx", std::numeric_limits<uint64_t>::max()), "ffffffffffffffff");
  EXPECT_EQ(Format("%o", 8), "10");
}

TEST(FormatConversions, WidthsAndFlags) {
  EXPECT_EQ(Format("[%5d]", 42), "[   42]");
  EXPECT_EQ(Format("[%-5d]", 42), "[42   ]");
  EXPECT_EQ(Format("[%05d]", 42), "[00042]");
  EXPECT_EQ(Format("[%+d]", 42), "[+42]");
  EXPECT_EQ(Format("[% d]", 42), "[ 42]");
  EXPECT_EQ(Format("[%08x]", 0xbeef), "[0000beef]");
  EXPECT_EQ(Format("[%*d]", 4, 7), "[   7]");
  EXPECT_EQ(Format("[%.3d]", 7), "[007]");
}

TEST(FormatConversions, StringsAndCharacters) {
  EXPECT_EQ(Format("%s", "text"), "text");
  EXPECT_EQ(Format("%s", std::string("std")), "std");
  EXPECT_EQ(Format("%s", std::string_view("view")), "view");
  EXPECT_EQ(Format("%s", static_cast<const char*>(nullptr)), "(null)");
  EXPECT_EQ(Format("[%6s]", "ab"), "[    ab]");
  EXPECT_EQ(Format("[%-6s]", "ab"), "[ab    ]");
  EXPECT_EQ(Format("[%.2s]", "abcdef"), "[ab]");
  EXPECT_EQ(Format("%c%c", 'o', 'k'), "ok");
  EXPECT_EQ(Format("[%3c]", 'x'), "[  x]");
}

TEST(FormatConversions, Reals) {
  EXPECT_EQ(Format("%f", 1.5), "1.500000");
  EXPECT_EQ(Format("%.2f", 3.14159), "3.14");
  EXPECT_EQ(Format("%8.3f", -2.0), "  -2.000");
  EXPECT_EQ(Format("%g", 0.0001), "0.0001");
  EXPECT_EQ(Format("%e", 1500.0), "1.500000e+03");
  EXPECT_EQ(Format("%f", 2.5f), "2.500000");
}

TEST(FormatConversions, PercentAndPlainText) {
  EXPECT_EQ(Format("100%%"), "100%");
  EXPECT_EQ(Format("no conversions"), "no conversions");
  EXPECT_EQ(Format(nullptr), "");
  EXPECT_EQ(Format("%d%%", 5), "5%");
}

TEST(FormatConversions, Pointer) {
  int x = 0;
  std::string text = Format("%p", static_cast<const void*>(&x));
  EXPECT_EQ(text.rfind("0x", 0), 0u) << text;
  EXPECT_EQ(std::stoull(text, nullptr, 16), reinterpret_cast<uintptr_t>(&x));
}

TEST(FormatObjects, NullObjectsPrintNull) {
  EXPECT_EQ(Format("%@", nullptr), "(null)");
  EXPECT_EQ(Format("%@", Value()), "(null)");
  EXPECT_EQ(Format("%@", URL()), "(null)");
  EXPECT_EQ(Format("%@", static_cast<const Value*>(nullptr)), "(null)");
  EXPECT_EQ(Format("%@", std::optional<URL>()), "(null)");
  EXPECT_EQ(Format("%@", static_cast<const char*>(nullptr)), "(null)");
  EXPECT_EQ(Format("%s", Value()), "(null)");
}

TEST(FormatObjects, ObjectsPrintTheirDescriptions) {
  EXPECT_EQ(Format("%@", URL::fileURL("/a/b")), "file:///a/b");
  EXPECT_EQ(Format("%@", URL::fileURL("/a/b", true)), "file:///a/b/");
  EXPECT_EQ(Format("%@", std::optional<URL>(URL::fileURL("/o"))), "file:///o");
  EXPECT_EQ(Format("%@", Error("D", 3)), "Error Domain=D Code=3 UserInfo={}");
  EXPECT_EQ(Format("%@", Value("string prints as itself")), "string prints as itself");
  EXPECT_EQ(Format("%@", std::string("std string")), "std string");
  EXPECT_EQ(Format("%@", "c string"), "c string");
  EXPECT_EQ(Format("%@", Value(7)), "7");
  EXPECT_EQ(Format("%@", Array{Value("a"), Value(1)}), "(a, 1)");
  EXPECT_EQ(Format("%@", Dictionary{{"k", Value(true)}}), "{k = 1; }");
  EXPECT_EQ(Format("%@", Described{}), "<described>");
  Value v("pointed");
  EXPECT_EQ(Format("%@", &v), "pointed");
  EXPECT_EQ(Format("[%8@]", Value("ab")), "[      ab]");
  EXPECT_EQ(Format("[%-8@]", Value("ab")), "[ab      ]");
}

TEST(FormatObjects, MixedArgumentsInOrder) {
  EXPECT_EQ(Format("QSAppMigrator: Failed to read %@ : %@", URL::fileURL("/m.plist"), Error("D", 1)),
            "QSAppMigrator: Failed to read file:///m.plist : Error Domain=D Code=1 UserInfo={}");
  EXPECT_EQ(Format("%d: %@ (%s)", 12, Value("x"), "y"), "12: x (y)");
}

TEST(FormatObjects, CorrectUseCountsNoMismatch) {
  uint64_t before = platform::formatMismatchCount();
  (void)Format("%d %u %s %@ %f %x %zu %%", -1, 1U, "s", Value(1), 1.0, 255, sizeof(int));
  EXPECT_EQ(platform::formatMismatchCount(), before);
}

// Mismatches are counted; the test main lets only this suite raise the count.
class FormatMismatch : public testing::Test {
 protected:
  void SetUp() override { before_ = platform::formatMismatchCount(); }
  uint64_t added() const { return platform::formatMismatchCount() - before_; }
  uint64_t before_ = 0;
};

TEST_F(FormatMismatch, IntegerConversionGivenAString) {
  EXPECT_EQ(Format("%d", "text"), "text");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, ObjectConversionGivenAnInteger) {
  EXPECT_EQ(Format("%@", 42), "42");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, StringConversionGivenAnObject) {
  EXPECT_EQ(Format("%s", URL::fileURL("/a")), "file:///a");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, RealConversionGivenAnInteger) {
  EXPECT_EQ(Format("%.1f", 3), "3.0");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, IntegerConversionGivenAReal) {
  EXPECT_EQ(Format("%d", 2.5), "2.5");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, MissingArgument) {
  EXPECT_EQ(Format("a %@ b %d", Value("x")), "a x b <missing>");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, ExtraArgument) {
  EXPECT_EQ(Format("only %d", 1, 2), "only 1");
  EXPECT_EQ(added(), 1u);
}

TEST_F(FormatMismatch, UnknownConversionIsCopied) {
  EXPECT_EQ(Format("%n %k", 1), "%n %k");
  EXPECT_GE(added(), 2u);
}

TEST_F(FormatMismatch, LonePercentAtTheEnd) {
  EXPECT_EQ(Format("50%"), "50%");
  EXPECT_EQ(added(), 1u);
}

}  // namespace
