// The core types: Value, URL and the error records.
#include <cmath>

#include <gtest/gtest.h>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

namespace {

using namespace platform;

// Each row: two values and whether they are equal.
TEST(ValueEquality, KindsAndSignednessAreKeptApartAndContainersCompareDeeply) {
  const std::tuple<Value, Value, bool> rows[] = {
      {Value(UINT64_MAX), Value(-1), false},
      {Value(5), Value(5U), true},
      {Value(1.0), Value(1), false},
      {Value(true), Value(1), false},
      {Value(nullptr), Value(), true},
      {Value(Array{Value(Data{1, 2})}), Value(Array{Value(Data{1, 3})}), false},
      {Value(Error("D", 1, {{"x", Value(1)}})), Value(Error("D", 1, {{"x", Value(2)}})), false},
  };
  for (const auto& [a, b, equal] : rows) EXPECT_EQ(a == b, equal) << a.description() << " == " << b.description();
}

TEST(ValueConversions, SaturateTruncateTowardZeroAndFallBackOnlyForOtherKinds) {
  EXPECT_EQ((std::vector<int64_t>{Value(-2.9).int64Value(), Value(-1e30).int64Value(), Value(NAN).int64Value(),
                                  Value(true).int64Value()}),
            (std::vector<int64_t>{-2, INT64_MIN, 0, 1}));
  EXPECT_EQ((std::vector<uint64_t>{Value(1e30).uint64Value(), Value(0.5).uint64Value(), Value(NAN).uint64Value()}),
            (std::vector<uint64_t>{UINT64_MAX, 0, 0}));
  EXPECT_EQ((std::vector<bool>{Value(0.1).boolValue(), Value(0).boolValue(true), Value("s").isNumber()}),
            (std::vector<bool>{true, false, false}));
  EXPECT_EQ(Value("s").doubleValue(2.5), 2.5);
}

TEST(ValueDescription, QuotesStringsAndAbbreviatesLongData) {
  EXPECT_EQ(Value(Dictionary{{"a b", Value(Array{Value(""), Value("say \"hi\"\n"), Value(Data(30, 0x1f)), Value(),
                                                 Value(UINT64_MAX), Value(3.0), Value(0.5), Value(Date{1.5}),
                                                 Value(URL::fileURL("/x"))})}})
                .description(),
            "{\"a b\" = (\"\", \"say \\\"hi\\\"\\n\", {length = 30, bytes = 0x1f1f1f1f1f1f1f1f...}, (null), "
            "18446744073709551615, 3, 0.5, 1.500 seconds since 2001-01-01, file:///x); }");
}

TEST(Value, AssigningAnElementToItsContainerKeepsTheElement) {
  Value v(Array{Value(Dictionary{{"k", Value("x")}})});
  v = (*v.asArray())[0];
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("x")}}));
  v = Value(Array{Value(Dictionary{{"k", Value("y")}})});
  v = std::move((*v.asArray())[0]);
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("y")}}));
}

// Paths are normalised; a component appended with a leading separator stays under its base.
TEST(URLPaths, AreNormalisedComposedAndSplitAtTheEdges) {
  const URL base = URL::fileURL("/private/var", true);
  EXPECT_EQ(URL::fileURL("/a//b///c/").path() + URL::fileURL("//").path(), "/a/b/c/");
  EXPECT_EQ(base.appending("/leading").path() + base.appending("trailing/").path(),
            "/private/var/leading/private/var/trailing");
  EXPECT_EQ(URL::fileURL("/").appending("a").path() + URL::fileURL("/").deletingLastPathComponent().path(), "/a/");
  EXPECT_EQ(URL::fileURL("/a/archive.tar.gz").pathExtension() + URL::fileURL("/a/.profile").pathExtension() +
                URL::fileURL("/a/name.").pathExtension() + URL::fileURL("/a.d/name").pathExtension(),
            "gz");
  EXPECT_EQ(path::components("/a//b/"), (std::vector<std::string>{"/", "a", "b", "/"}));
}

// Which POSIX errors make a read error "no such file" is checked with the read failures of property lists.
TEST(ErrorRecord, DescriptionIsTheLoggedTextAndOnlyARecordIsAnUnderlyingError) {
  Error missing = POSIXCallError(ENOENT, "open", "/x");
  Error outer("QSInstallerErrorDomain", 4,
              {{kLocalizedDescriptionKey, Value("failed")}, {kUnderlyingErrorKey, Value(missing)}});
  EXPECT_EQ(outer.description(),
            "Error Domain=QSInstallerErrorDomain Code=4 \"failed\" UserInfo={LocalizedDescription = "
            "failed; UnderlyingError = " +
                missing.description() + "; }");
  EXPECT_EQ(missing.localizedDescription(), "open \"/x\": No such file or directory");
  EXPECT_EQ(Error("D", 1, {{kUnderlyingErrorKey, Value("text")}}).underlyingError(), nullptr);
  EXPECT_FALSE(Error(kFileErrorDomain, EPERM).isPOSIX(EPERM));
}

}  // namespace
