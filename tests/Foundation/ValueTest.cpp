#include "Platform/Foundation/Value.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>

#include <gtest/gtest.h>

#include "Platform/Foundation/Error.h"

using platform::Array;
using platform::Data;
using platform::Date;
using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

TEST(ValueTypes, EachConstructorMakesItsType) {
  EXPECT_EQ(Value().type(), Value::Type::Null);
  EXPECT_EQ(Value(nullptr).type(), Value::Type::Null);
  EXPECT_EQ(Value(static_cast<const char*>(nullptr)).type(), Value::Type::Null);
  EXPECT_EQ(Value(true).type(), Value::Type::Boolean);
  EXPECT_EQ(Value(1).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1L).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1LL).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1U).type(), Value::Type::Unsigned);
  EXPECT_EQ(Value(1UL).type(), Value::Type::Unsigned);
  EXPECT_EQ(Value(1ULL).type(), Value::Type::Unsigned);
  EXPECT_EQ(Value(1.0).type(), Value::Type::Real);
  EXPECT_EQ(Value("s").type(), Value::Type::String);
  EXPECT_EQ(Value(std::string("s")).type(), Value::Type::String);
  EXPECT_EQ(Value(std::string_view("s")).type(), Value::Type::String);
  EXPECT_EQ(Value(Data{1}).type(), Value::Type::Data);
  EXPECT_EQ(Value(Date{1}).type(), Value::Type::Date);
  EXPECT_EQ(Value(Array{}).type(), Value::Type::Array);
  EXPECT_EQ(Value(Dictionary{}).type(), Value::Type::Dictionary);
  EXPECT_EQ(Value(URL::fileURL("/a")).type(), Value::Type::URL);
  EXPECT_EQ(Value(Error("D", 1)).type(), Value::Type::Error);
}

TEST(ValueTypes, AccessorsOfAnotherTypeGiveNullOrFallback) {
  Value s("text");
  EXPECT_NE(s.asString(), nullptr);
  EXPECT_EQ(s.asData(), nullptr);
  EXPECT_EQ(s.asArray(), nullptr);
  EXPECT_EQ(s.asDictionary(), nullptr);
  EXPECT_EQ(s.asURL(), nullptr);
  EXPECT_EQ(s.asError(), nullptr);
  EXPECT_EQ(s.asDate(), nullptr);
  EXPECT_EQ(s.get("k"), nullptr);
  EXPECT_TRUE(s.boolValue(true));
  EXPECT_EQ(s.int64Value(-7), -7);
  EXPECT_EQ(s.uint64Value(9), 9u);
  EXPECT_EQ(s.doubleValue(2.5), 2.5);
  EXPECT_FALSE(s.isNumber());
}

TEST(ValueTypes, NumberTestCoversBooleansIntegersAndReals) {
  EXPECT_TRUE(Value(false).isNumber());
  EXPECT_TRUE(Value(-3).isNumber());
  EXPECT_TRUE(Value(3U).isNumber());
  EXPECT_TRUE(Value(0.5).isNumber());
  EXPECT_FALSE(Value().isNumber());
  EXPECT_FALSE(Value(Data{}).isNumber());
  EXPECT_TRUE(Value(3U).isInteger());
  EXPECT_FALSE(Value(3.0).isInteger());
}

TEST(ValueTypes, DictionaryLookupFindsKeys) {
  Value d(Dictionary{{"a", Value(1)}, {"b", Value("two")}});
  ASSERT_NE(d.get("b"), nullptr);
  EXPECT_EQ(*d.get("b"), Value("two"));
  EXPECT_EQ(d.get("c"), nullptr);
}

TEST(ValueNumbers, SignednessIsKeptApart) {
  Value big(std::numeric_limits<uint64_t>::max());
  Value minusOne(-1);
  EXPECT_EQ(big.type(), Value::Type::Unsigned);
  EXPECT_EQ(big.uint64Value(), UINT64_MAX);
  EXPECT_EQ(big.description(), "18446744073709551615");
  EXPECT_EQ(minusOne.description(), "-1");
  EXPECT_NE(big, minusOne);
  EXPECT_EQ(Value(5), Value(5U));
  EXPECT_NE(Value(-5), Value(static_cast<uint64_t>(-5)));
}

TEST(ValueNumbers, ConversionsBetweenKinds) {
  EXPECT_EQ(Value(true).int64Value(), 1);
  EXPECT_EQ(Value(false).uint64Value(), 0u);
  EXPECT_EQ(Value(2.9).int64Value(), 2);
  EXPECT_EQ(Value(-2.9).int64Value(), -2);
  EXPECT_EQ(Value(1e30).int64Value(), INT64_MAX);
  EXPECT_EQ(Value(-1e30).int64Value(), INT64_MIN);
  EXPECT_EQ(Value(std::nan("")).int64Value(), 0);
  EXPECT_EQ(Value(1e30).uint64Value(), UINT64_MAX);
  EXPECT_EQ(Value(0.5).uint64Value(), 0u);
  EXPECT_EQ(Value(7).doubleValue(), 7.0);
  EXPECT_EQ(Value(UINT64_MAX).doubleValue(), 18446744073709551616.0);
  EXPECT_TRUE(Value(0.1).boolValue());
  EXPECT_FALSE(Value(0).boolValue(true));
}

TEST(ValueEquality, RealNeverEqualsInteger) {
  EXPECT_NE(Value(1.0), Value(1));
  EXPECT_NE(Value(true), Value(1));
  EXPECT_EQ(Value(1.5), Value(1.5));
  EXPECT_EQ(Value(), Value(nullptr));
}

TEST(ValueEquality, DeepComparison) {
  Value a(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 2})})}});
  Value b(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 2})})}});
  Value c(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 3})})}});
  EXPECT_EQ(a, b);
  EXPECT_NE(a, c);
  EXPECT_EQ(Value(URL::fileURL("/a/")), Value(URL::fileURL("/a")));
  EXPECT_EQ(Value(Error("D", 1, {{"x", Value(1)}})), Value(Error("D", 1, {{"x", Value(1)}})));
  EXPECT_NE(Value(Error("D", 1)), Value(Error("D", 2)));
  EXPECT_EQ(Value(Date{3}), Value(Date{3}));
}

TEST(ValueCopy, CopiesAreIndependent) {
  Value original(Dictionary{{"list", Value(Array{Value("a")})}});
  Value copy = original;
  copy.asDictionary()->at("list").asArray()->push_back(Value("b"));
  EXPECT_EQ(original.get("list")->asArray()->size(), 1u);
  EXPECT_EQ(copy.get("list")->asArray()->size(), 2u);

  Value assigned;
  assigned = original;
  (*assigned.asDictionary())["new"] = Value(1);
  EXPECT_EQ(original.get("new"), nullptr);
}

TEST(ValueCopy, MoveLeavesSourceNull) {
  Value source("text");
  Value target(std::move(source));
  EXPECT_TRUE(source.isNull());  // NOLINT(bugprone-use-after-move): the moved-from state is specified
  EXPECT_EQ(target, Value("text"));
}

TEST(ValueCopy, AssigningAnElementToItsContainer) {
  Value v(Array{Value(Dictionary{{"k", Value("x")}})});
  v = (*v.asArray())[0];
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("x")}}));

  Value w(Array{Value(Dictionary{{"k", Value("y")}})});
  w = std::move((*w.asArray())[0]);
  EXPECT_EQ(w, Value(Dictionary{{"k", Value("y")}}));
}

TEST(ValueCopy, SelfAssignmentKeepsTheValue) {
  Value v(Array{Value(1)});
  Value& alias = v;
  v = alias;
  EXPECT_EQ(v, Value(Array{Value(1)}));
  v = std::move(alias);
  EXPECT_EQ(v, Value(Array{Value(1)}));
}

TEST(ValueDescription, Scalars) {
  EXPECT_EQ(Value().description(), "(null)");
  EXPECT_EQ(Value(true).description(), "1");
  EXPECT_EQ(Value(false).description(), "0");
  EXPECT_EQ(Value(-42).description(), "-42");
  EXPECT_EQ(Value(3.0).description(), "3");
  EXPECT_EQ(Value(1.5).description(), "1.5");
  EXPECT_EQ(Value("plain text").description(), "plain text");
  EXPECT_EQ(Value(Date{1.5}).description(), "1.500 seconds since 2001-01-01");
}

TEST(ValueDescription, DataShowsLengthAndBytes) {
  EXPECT_EQ(Value(Data{0x01, 0xab, 0xff}).description(), "{length = 3, bytes = 0x01abff}");
  EXPECT_EQ(Value(Data{}).description(), "{length = 0, bytes = 0x}");
  Data long_(30, 0x11);
  EXPECT_EQ(Value(long_).description(), "{length = 30, bytes = 0x1111111111111111...}");
}

TEST(ValueDescription, CollectionsQuoteStringsThatNeedIt) {
  EXPECT_EQ(Value(Array{Value("a"), Value(2)}).description(), "(a, 2)");
  EXPECT_EQ(Value(Array{}).description(), "()");
  EXPECT_EQ(Value(Array{Value("two words"), Value("")}).description(), "(\"two words\", \"\")");
  EXPECT_EQ(Value(Array{Value("say \"hi\"\n")}).description(), "(\"say \\\"hi\\\"\\n\")");
  EXPECT_EQ(Value(Dictionary{{"k", Value("v")}, {"k2", Value("v2")}}).description(), "{k = v; k2 = v2; }");
  EXPECT_EQ(Value(Dictionary{}).description(), "{}");
  EXPECT_EQ(Value(Dictionary{{"a key", Value(Array{Value(1)})}}).description(), "{\"a key\" = (1); }");
  EXPECT_EQ(Value(Array{Value(URL::fileURL("/x", true))}).description(), "(file:///x/)");
}

TEST(ValueDescription, DictionariesIterateInKeyOrder) {
  Dictionary d;
  d["b"] = Value(2);
  d["a"] = Value(1);
  d["c"] = Value(3);
  EXPECT_EQ(Value(d).description(), "{a = 1; b = 2; c = 3; }");
}

TEST(ValueDescription, TypeNames) {
  EXPECT_EQ(Value().typeName(), "null");
  EXPECT_EQ(Value(1U).typeName(), "integer");
  EXPECT_EQ(Value(-1).typeName(), "integer");
  EXPECT_EQ(Value(Dictionary{}).typeName(), "dictionary");
  EXPECT_EQ(Value(Array{}).typeName(), "array");
  EXPECT_EQ(Value(URL()).typeName(), "URL");
}

TEST(ValueHelpers, StringArray) {
  EXPECT_EQ(Value(platform::makeStringArray({"a", "b"})), Value(Array{Value("a"), Value("b")}));
}

}  // namespace
