#include "Platform/Foundation/Value.h"

#include <cmath>
#include <cstdint>
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

TEST(ValueNumbers, SignednessIsKeptApartAndAccessorsFallBack) {
  Value big(UINT64_MAX);
  EXPECT_EQ(big.type(), Value::Type::Unsigned);
  EXPECT_EQ(big.description(), "18446744073709551615");
  EXPECT_NE(big, Value(-1));
  EXPECT_EQ(Value(5), Value(5U));
  EXPECT_NE(Value(-5), Value(static_cast<uint64_t>(-5)));
  Value s("text");
  EXPECT_EQ(s.asArray(), nullptr);
  EXPECT_EQ(s.get("k"), nullptr);
  EXPECT_TRUE(s.boolValue(true));
  EXPECT_EQ(s.int64Value(-7), -7);
  EXPECT_EQ(s.uint64Value(9), 9u);
  EXPECT_EQ(s.doubleValue(2.5), 2.5);
  EXPECT_FALSE(s.isNumber());
  EXPECT_TRUE(Value(false).isNumber());
  EXPECT_FALSE(Value(3.0).isInteger());
}

TEST(ValueNumbers, ConversionsSaturateAndTruncate) {
  EXPECT_EQ(Value(true).int64Value(), 1);
  EXPECT_EQ(Value(-2.9).int64Value(), -2);
  EXPECT_EQ(Value(1e30).int64Value(), INT64_MAX);
  EXPECT_EQ(Value(-1e30).int64Value(), INT64_MIN);
  EXPECT_EQ(Value(std::nan("")).int64Value(), 0);
  EXPECT_EQ(Value(1e30).uint64Value(), UINT64_MAX);
  EXPECT_EQ(Value(0.5).uint64Value(), 0u);
  EXPECT_EQ(Value(UINT64_MAX).doubleValue(), 18446744073709551616.0);
  EXPECT_TRUE(Value(0.1).boolValue());
  EXPECT_FALSE(Value(0).boolValue(true));
}

TEST(ValueEquality, DeepAndKindSensitive) {
  EXPECT_NE(Value(1.0), Value(1));
  EXPECT_NE(Value(true), Value(1));
  EXPECT_EQ(Value(), Value(nullptr));
  EXPECT_EQ(Value(static_cast<const char*>(nullptr)), Value());
  Value a(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 2})})}});
  EXPECT_EQ(a, Value(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 2})})}}));
  EXPECT_NE(a, Value(Dictionary{{"k", Value(Array{Value(1), Value(Data{1, 3})})}}));
  EXPECT_EQ(Value(URL::fileURL("/a/")), Value(URL::fileURL("/a")));
  EXPECT_EQ(Value(Error("D", 1, {{"x", Value(1)}})), Value(Error("D", 1, {{"x", Value(1)}})));
  EXPECT_NE(Value(Error("D", 1)), Value(Error("D", 2)));
}

TEST(ValueCopy, CopiesAreIndependentAndAliasingAssignmentsKeepTheValue) {
  Value original(Dictionary{{"list", Value(Array{Value("a")})}});
  Value copy = original;
  copy.asDictionary()->at("list").asArray()->push_back(Value("b"));
  EXPECT_EQ(original.get("list")->asArray()->size(), 1u);
  EXPECT_EQ(copy.get("list")->asArray()->size(), 2u);

  Value v(Array{Value(Dictionary{{"k", Value("x")}})});
  v = (*v.asArray())[0];
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("x")}}));
  Value w(Array{Value(Dictionary{{"k", Value("y")}})});
  w = std::move((*w.asArray())[0]);
  EXPECT_EQ(w, Value(Dictionary{{"k", Value("y")}}));
  Value& alias = w;
  w = alias;
  w = std::move(alias);
  EXPECT_EQ(w, Value(Dictionary{{"k", Value("y")}}));
}

TEST(ValueDescription, IsTheTextLogLinesShow) {
  const std::pair<Value, std::string> cases[] = {
      {Value(), "(null)"},
      {Value(true), "1"},
      {Value(-42), "-42"},
      {Value(3.0), "3"},
      {Value(1.5), "1.5"},
      {Value(Date{1.5}), "1.500 seconds since 2001-01-01"},
      {Value(Data{0x01, 0xab, 0xff}), "{length = 3, bytes = 0x01abff}"},
      {Value(Data{}), "{length = 0, bytes = 0x}"},
      {Value(Data(30, 0x11)), "{length = 30, bytes = 0x1111111111111111...}"},
      {Value(Array{Value("a"), Value(2)}), "(a, 2)"},
      {Value(Array{}), "()"},
      {Value(Array{Value("two words"), Value("")}), "(\"two words\", \"\")"},
      {Value(Array{Value("say \"hi\"\n")}), "(\"say \\\"hi\\\"\\n\")"},
      {Value(Dictionary{{"k2", Value("v2")}, {"k", Value("v")}}), "{k = v; k2 = v2; }"},
      {Value(Dictionary{}), "{}"},
      {Value(Dictionary{{"a key", Value(Array{Value(1)})}}), "{\"a key\" = (1); }"},
      {Value(Array{Value(URL::fileURL("/x", true))}), "(file:///x/)"},
  };
  for (const auto& [value, text] : cases) EXPECT_EQ(value.description(), text);
  EXPECT_EQ(Value(1U).typeName(), "integer");
  EXPECT_EQ(Value(Array{}).typeName(), "array");
  EXPECT_EQ(Value(URL()).typeName(), "URL");
}

}  // namespace
