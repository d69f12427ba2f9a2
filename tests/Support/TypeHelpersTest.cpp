// The helpers that normalise values read from property lists.
#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"

using platform::Array;
using platform::Dictionary;
using platform::Value;
using Type = platform::Value::Type;

namespace {

TEST(TypeHelpers, OnlyNumbersAreBooleansIntegerKindsAreOneClassAndNothingElseIsArrayified) {
  EXPECT_EQ(QSStringifyObject(Value()), std::nullopt);
  EXPECT_EQ(QSStringifyObject(Value("a \"q\"")), std::optional<std::string>("a \"q\""));
  EXPECT_EQ(QSStringifyObject(Value(Array{Value("x"), Value(1)})), std::optional<std::string>("(x, 1)"));
  EXPECT_TRUE(QSBooleanValue(Value(0.5), false));
  EXPECT_FALSE(QSBooleanValue(Value(0), true));
  EXPECT_TRUE(QSBooleanValue(Value("NO"), true));
  EXPECT_FALSE(QSBooleanValue(Value("YES"), false));
  const Value integers(Array{Value(-1), Value(UINT64_MAX)});
  EXPECT_TRUE(QSArrayContainsOnlyClass(integers, Type::Integer) && QSArrayContainsOnlyClass(integers, Type::Unsigned));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value(Array{Value(true)}), Type::Integer));
  EXPECT_TRUE(QSArrayContainsOnlyClass(Value(Dictionary{{"a", Value(1)}}), Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value("text"), Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(std::set<std::string>{"a"}, Type::URL));
  EXPECT_EQ(QSArrayifyThing(Value("only"), Type::String), Array{Value("only")});
  EXPECT_EQ(QSArrayifyThing(Value(Array{Value("a"), Value(2)}), Type::String), std::nullopt);
  EXPECT_EQ(QSArrayifyThing(Value(3), Type::String), std::nullopt);
  EXPECT_EQ(QSArrayifyThing(std::set<std::string>{"zeta", "alpha"}, Type::String),
            (Array{Value("alpha"), Value("zeta")}));
}

}  // namespace
