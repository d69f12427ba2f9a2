// The helpers that normalise values read from property lists.
#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"

using platform::Array;
using platform::Dictionary;
using platform::Value;
using Type = platform::Value::Type;

namespace {

TEST(StringifyObject, StringsStayAndOtherObjectsGiveTheirDescription) {
  EXPECT_EQ(QSStringifyObject(Value()), std::nullopt);
  EXPECT_EQ(QSStringifyObject(Value("a \"quoted\" string")), std::optional<std::string>("a \"quoted\" string"));
  EXPECT_EQ(QSStringifyObject(Value(platform::URL::fileURL("/a/b", true))), std::optional<std::string>("file:///a/b/"));
  Value array(Array{Value("x"), Value(1)});
  EXPECT_EQ(QSStringifyObject(array), std::optional<std::string>(array.description()));
}

TEST(BooleanValue, NumbersGiveTheirTruthAndAnythingElseTheDefault) {
  for (Value number : {Value(2), Value(true), Value(0.5), Value(UINT64_MAX)}) EXPECT_TRUE(QSBooleanValue(number, false));
  for (Value number : {Value(0), Value(false)}) EXPECT_FALSE(QSBooleanValue(number, true));
  for (Value other : {Value("YES"), Value("true"), Value("1"), Value("NO"), Value(""), Value(), Value(Array{})}) {
    EXPECT_FALSE(QSBooleanValue(other, false)) << other.description();
    EXPECT_TRUE(QSBooleanValue(other, true)) << other.description();
  }
}

TEST(ArrayContainsOnlyClass, WalksArraysDictionaryKeysAndSets) {
  const Value mixedIntegers(Array{Value(-1), Value(UINT64_MAX)});
  const Value dictionary(Dictionary{{"a", Value(1)}, {"b", Value(2)}});
  const std::tuple<Value, Type, bool> cases[] = {
      {Value(), Type::String, true},
      {Value(Array{}), Type::Dictionary, true},
      {Value(Array{Value("a"), Value("b")}), Type::String, true},
      {Value(Array{Value("a"), Value(1)}), Type::String, false},
      {Value(Array{Value(true)}), Type::Integer, false},
      {mixedIntegers, Type::Integer, true},
      {mixedIntegers, Type::Unsigned, true},
      {dictionary, Type::String, true},
      {dictionary, Type::Integer, false},
      {Value("text"), Type::String, false},
  };
  for (const auto& [value, type, expected] : cases) {
    EXPECT_EQ(QSArrayContainsOnlyClass(value, type), expected) << value.description();
  }
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<std::string>{}, Type::Integer));
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<std::string>{"a", "b"}, Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(std::set<std::string>{"a"}, Type::URL));
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<platform::URL>{platform::URL::fileURL("/x")}, Type::URL));
}

TEST(ArrayifyThing, GivesTheArrayAOneElementArrayOrNothing) {
  const Array strings{Value("a"), Value("b")};
  const std::tuple<Value, Type, std::optional<Array>> cases[] = {
      {Value(), Type::String, std::nullopt},
      {Value(strings), Type::String, strings},
      {Value(Array{Value("a"), Value(2)}), Type::String, std::nullopt},
      {Value("only"), Type::String, Array{Value("only")}},
      {Value(7u), Type::Integer, Array{Value(7u)}},
      {Value(3), Type::String, std::nullopt},
      {Value(Dictionary{}), Type::String, std::nullopt},
  };
  for (const auto& [value, type, expected] : cases) EXPECT_EQ(QSArrayifyThing(value, type), expected);
  std::set<std::string> set{"zeta", "alpha"};
  EXPECT_EQ(QSArrayifyThing(set, Type::String), std::optional<Array>(Array{Value("alpha"), Value("zeta")}));
  EXPECT_EQ(QSArrayifyThing(set, Type::Integer), std::nullopt);
}

}  // namespace
