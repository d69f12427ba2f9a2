#include "Platform/Foundation/Value.h"

#include <cmath>

#include <gtest/gtest.h>

#include "Platform/Foundation/Error.h"

namespace {

using namespace platform;

TEST(Value, KindsAndSignednessAreKeptApartEqualityIsDeepConversionsSaturateAndTheDescriptionQuotes) {
  EXPECT_NE(Value(UINT64_MAX), Value(-1));
  EXPECT_EQ(Value(5), Value(5U));
  EXPECT_NE(Value(1.0), Value(1));
  EXPECT_NE(Value(true), Value(1));
  EXPECT_NE(Value(Array{Value(Data{1, 2})}), Value(Array{Value(Data{1, 3})}));
  EXPECT_NE(Value(Error("D", 1, {{"x", Value(1)}})), Value(Error("D", 1, {{"x", Value(2)}})));
  EXPECT_EQ(Value(-2.9).int64Value(), -2);
  EXPECT_EQ(Value(-1e30).int64Value(), INT64_MIN);
  EXPECT_EQ(Value(std::nan("")).int64Value(), 0);
  EXPECT_EQ(Value(1e30).uint64Value(), UINT64_MAX);
  EXPECT_EQ(
      Value(Dictionary{{"a b", Value(Array{Value(""), Value("say \"hi\"\n"), Value(Data(30, 0x1f))})}}).description(),
      "{\"a b\" = (\"\", \"say \\\"hi\\\"\\n\", {length = 30, bytes = 0x1f1f1f1f1f1f1f1f...}); }");
}

TEST(Value, CopiesAreIndependentAndAssigningAnElementToItsContainerKeepsTheElement) {
  Value original(Dictionary{{"list", Value(Array{Value("a")})}});
  Value copy = original;
  copy.asDictionary()->at("list").asArray()->push_back(Value("b"));
  EXPECT_EQ(original.get("list")->asArray()->size(), 1u);
  Value v(Array{Value(Dictionary{{"k", Value("x")}})});
  v = (*v.asArray())[0];
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("x")}}));
  v = Value(Array{Value(Dictionary{{"k", Value("y")}})});
  v = std::move((*v.asArray())[0]);
  EXPECT_EQ(v, Value(Dictionary{{"k", Value("y")}}));
}

}  // namespace
