// The helpers that normalise values read from property lists.
#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"

using platform::Array;
using platform::Dictionary;
using platform::Value;
using Type = platform::Value::Type;

namespace {

TEST(StringifyObject, AbsentStaysAbsent) { EXPECT_EQ(QSStringifyObject(Value()), std::nullopt); }

TEST(StringifyObject, StringComesBackUnchanged) {
  EXPECT_EQ(QSStringifyObject(Value("a \"quoted\" string")), std::optional<std::string>("a \"quoted\" string"));
}

TEST(StringifyObject, OtherObjectsGiveTheirDescription) {
  EXPECT_EQ(QSStringifyObject(Value(42)), std::optional<std::string>("42"));
  EXPECT_EQ(QSStringifyObject(Value(platform::URL::fileURL("/a/b", true))), std::optional<std::string>("file:///a/b/"));
  Value array(Array{Value("x"), Value(1)});
  EXPECT_EQ(QSStringifyObject(array), std::optional<std::string>(array.description()));
}

TEST(BooleanValue, NumbersGiveTheirTruth) {
  EXPECT_TRUE(QSBooleanValue(Value(2), false));
  EXPECT_FALSE(QSBooleanValue(Value(0), true));
  EXPECT_TRUE(QSBooleanValue(Value(true), false));
  EXPECT_FALSE(QSBooleanValue(Value(false), true));
  EXPECT_TRUE(QSBooleanValue(Value(0.5), false));
  EXPECT_TRUE(QSBooleanValue(Value(static_cast<unsigned long long>(UINT64_MAX)), false));
}

TEST(BooleanValue, StringsAndAbsentGiveTheDefault) {
  for (const char* text : {"YES", "true", "1", "NO", ""}) {
    EXPECT_FALSE(QSBooleanValue(Value(text), false)) << text;
    EXPECT_TRUE(QSBooleanValue(Value(text), true)) << text;
  }
  EXPECT_TRUE(QSBooleanValue(Value(), true));
  EXPECT_FALSE(QSBooleanValue(Value(), false));
  EXPECT_TRUE(QSBooleanValue(Value(Array{}), true));
}

TEST(ArrayContainsOnlyClass, EmptyOrAbsentCollectionsHoldOnlyAnything) {
  EXPECT_TRUE(QSArrayContainsOnlyClass(Value(), Type::String));
  EXPECT_TRUE(QSArrayContainsOnlyClass(Value(Array{}), Type::Dictionary));
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<std::string>{}, Type::Integer));
}

TEST(ArrayContainsOnlyClass, OneForeignElementFails) {
  EXPECT_TRUE(QSArrayContainsOnlyClass(Value(Array{Value("a"), Value("b")}), Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value(Array{Value("a"), Value(1)}), Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value(Array{Value(true)}), Type::Integer));
}

TEST(ArrayContainsOnlyClass, SignedAndUnsignedIntegersAreOneClass) {
  Value mixed(Array{Value(-1), Value(static_cast<unsigned long long>(UINT64_MAX))});
  EXPECT_TRUE(QSArrayContainsOnlyClass(mixed, Type::Integer));
  EXPECT_TRUE(QSArrayContainsOnlyClass(mixed, Type::Unsigned));
}

TEST(ArrayContainsOnlyClass, DictionaryIsWalkedByItsKeys) {
  Value dictionary(Dictionary{{"a", Value(1)}, {"b", Value(2)}});
  EXPECT_TRUE(QSArrayContainsOnlyClass(dictionary, Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(dictionary, Type::Integer));
}

TEST(ArrayContainsOnlyClass, NonCollectionIsNotAnArrayOfAnything) {
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value("text"), Type::String));
}

TEST(ArrayContainsOnlyClass, SetsOfStringsAndURLs) {
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<std::string>{"a", "b"}, Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(std::set<std::string>{"a"}, Type::URL));
  EXPECT_TRUE(QSArrayContainsOnlyClass(std::set<platform::URL>{platform::URL::fileURL("/x")}, Type::URL));
}

TEST(ArrayifyThing, AbsentGivesAbsent) { EXPECT_EQ(QSArrayifyThing(Value(), Type::String), std::nullopt); }

TEST(ArrayifyThing, ArrayOfTheClassComesBackWhole) {
  Array strings{Value("a"), Value("b")};
  EXPECT_EQ(QSArrayifyThing(Value(strings), Type::String), std::optional<Array>(strings));
}

TEST(ArrayifyThing, MixedArrayGivesAbsent) {
  EXPECT_EQ(QSArrayifyThing(Value(Array{Value("a"), Value(2)}), Type::String), std::nullopt);
}

TEST(ArrayifyThing, SingleInstanceBecomesAOneElementArray) {
  EXPECT_EQ(QSArrayifyThing(Value("only"), Type::String), std::optional<Array>(Array{Value("only")}));
  EXPECT_EQ(QSArrayifyThing(Value(7u), Type::Integer), std::optional<Array>(Array{Value(7u)}));
}

TEST(ArrayifyThing, InstanceOfAnotherClassGivesAbsent) {
  EXPECT_EQ(QSArrayifyThing(Value(3), Type::String), std::nullopt);
  EXPECT_EQ(QSArrayifyThing(Value(Dictionary{}), Type::String), std::nullopt);
}

TEST(ArrayifyThing, SetOfTheClassGivesItsMembersInSetOrder) {
  std::set<std::string> set{"zeta", "alpha"};
  EXPECT_EQ(QSArrayifyThing(set, Type::String), std::optional<Array>(Array{Value("alpha"), Value("zeta")}));
}

TEST(ArrayifyThing, SetOfAnotherClassGivesAbsent) {
  EXPECT_EQ(QSArrayifyThing(std::set<std::string>{"a", "b"}, Type::Integer), std::nullopt);
}

}  // namespace
