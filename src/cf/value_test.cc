#include "cf/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <unordered_set>

namespace cf {
namespace {

TEST(NumberTest, NarrowingKeepsLowBitsAndFloatsTruncateTowardZero) {
  const Number big = Number::SInt64(0x1'2345'6789LL);
  EXPECT_EQ(big.AsSInt32(), 0x23456789);
  EXPECT_EQ(Number::SInt64(0x1FF).AsSInt8(), -1);
  EXPECT_EQ(Number::SInt64(0x18000).AsSInt16(), -32768);
  EXPECT_EQ(Number::SInt32(-1).AsUInt32(), 0xFFFFFFFFu);
  EXPECT_EQ(Number::SInt32(-1).AsUInt64(), 0xFFFFFFFFFFFFFFFFull);
  // Made with a narrow type: the value is already cut to that width.
  EXPECT_EQ(Number::Make(NumberType::kSInt8, 300).AsSInt64(), 44);
  EXPECT_EQ(Number::Make(NumberType::kInt, 0x1'0000'0001LL).AsSInt64(), 1);

  EXPECT_EQ(Number::Float64(2.9).AsSInt64(), 2);
  EXPECT_EQ(Number::Float64(-2.9).AsSInt64(), -2);
  EXPECT_EQ(Number::Float64(-0.5).AsSInt32(), 0);
  EXPECT_EQ(Number::Float64(1e300).AsSInt64(), std::numeric_limits<int64_t>::max());
  EXPECT_EQ(Number::Float64(-1e300).AsSInt64(), std::numeric_limits<int64_t>::min());
  EXPECT_EQ(Number::Float64(std::nan("")).AsSInt64(), 0);
  EXPECT_EQ(Number::Float64(-1.0).AsUInt64(), 0xFFFFFFFFFFFFFFFFull);
  EXPECT_EQ(Number::MakeDouble(NumberType::kSInt32, 3.99).AsSInt64(), 3);
  EXPECT_EQ(Number::MakeDouble(NumberType::kUInt64, 1.8e19).AsUInt64(), 18000000000000000000ull);

  EXPECT_DOUBLE_EQ(Number::SInt64(-7).AsFloat64(), -7.0);
  EXPECT_DOUBLE_EQ(Number::UInt64(1ull << 63).AsFloat64(), 9223372036854775808.0);
}

TEST(NumberTest, UnsignedAboveSignedRangeSurvivesAndFloatDiffersFromDouble) {
  const uint64_t top = 0xFFFFFFFFFFFFFFFFull;
  const Number u = Number::UInt64(top);
  EXPECT_EQ(u.AsUInt64(), top);
  EXPECT_EQ(u.Description(), "18446744073709551615");
  EXPECT_FALSE(u == Number::SInt64(-1));  // same bits, different value
  EXPECT_EQ(Number::UInt64(9223372036854775808ull).Description(), "9223372036854775808");

  // 0.1 as a float is not 0.1 as a double.
  const Number f = Number::Float32(0.1f);
  EXPECT_EQ(f.type(), NumberType::kFloat32);
  EXPECT_FALSE(f == Number::Float64(0.1));
  EXPECT_TRUE(f == Number::Float64(static_cast<double>(0.1f)));
  EXPECT_EQ(f.Description(), "0.1000000014901161");
  EXPECT_EQ(Number::Float64(0.1).Description(), "0.1");
  EXPECT_EQ(Number::MakeDouble(NumberType::kFloat, 16777217.0).AsSInt64(), 16777216);
}

TEST(NumberTest, EqualityAndHashAcrossTypes) {
  EXPECT_TRUE(Number::SInt32(3) == Number::Float64(3.0));
  EXPECT_TRUE(Number::SInt8(-1) == Number::SInt64(-1));
  EXPECT_FALSE(Number::SInt32(3) == Number::Float64(3.5));
  EXPECT_EQ(Number::SInt32(3).Hash(), Number::Float64(3.0).Hash());
  EXPECT_EQ(Number::UInt64(5).Hash(), Number::SInt16(5).Hash());
  EXPECT_TRUE(Number::Float64(std::nan("")) == Number::Float64(std::nan("")));
  EXPECT_LT(Number::SInt64(-1).Compare(Number::UInt64(0)), 0);
  EXPECT_GT(Number::UInt64(1ull << 63).Compare(Number::SInt64(std::numeric_limits<int64_t>::max())), 0);
  // 2^53 + 1 is not representable as a double: comparison stays exact.
  EXPECT_FALSE(Number::SInt64((1LL << 53) + 1) == Number::Float64(9007199254740992.0));
}

TEST(ValueTest, ContainersShareAndCopy) {
  Dictionary d;
  d.Set("b", Value::SInt32(1));
  d.Set("a", Value::SInt32(2));
  d.Set("b", Value::SInt32(3));  // replacing keeps the place
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(*d.entries()[0].first.AsString(), "b");
  EXPECT_EQ(d.entries()[0].second, Value::SInt32(3));

  Value shared = d;
  d.Set("c", "x");
  EXPECT_EQ(shared.AsDictionary()->size(), 3u);  // same container

  Array inner;
  inner.Append(Value::SInt32(1));
  d.Set("list", inner);
  Value shallow = Value(d).MutableCopy();
  Value deep = Value(d).DeepCopy();
  inner.Append(Value::SInt32(2));
  d.Remove("a");
  EXPECT_EQ(shallow.AsDictionary()->size(), 4u);
  EXPECT_EQ(shallow.AsDictionary()->Get("list").AsArray()->size(), 2u);  // one level only
  EXPECT_EQ(deep.AsDictionary()->Get("list").AsArray()->size(), 1u);
  EXPECT_FALSE(d.Contains("a"));
  EXPECT_EQ(*d.entries()[0].first.AsString(), "b");
}

TEST(ValueTest, AnyValueIsAKeyAndLargeDictionariesStayOrdered) {
  Dictionary d;
  d.Set(Value::SInt32(7), "seven");
  d.Set(Value::Bool(true), "yes");
  EXPECT_EQ(d.Get(Value::Float64(7.0)), Value("seven"));  // 7 == 7.0
  EXPECT_EQ(d.Get(Value::SInt32(1)), Value());            // true is not 1
  EXPECT_EQ(d.Get(Value::Bool(true)), Value("yes"));

  Dictionary big;
  for (int i = 0; i < 3000; ++i) big.Set("k" + std::to_string(i), Value::SInt32(i));
  for (int i = 0; i < 3000; i += 2) big.Remove("k" + std::to_string(i));
  ASSERT_EQ(big.size(), 1500u);
  EXPECT_EQ(*big.entries()[0].first.AsString(), "k1");
  EXPECT_EQ(big.Get("k2999"), Value::SInt32(2999));
  EXPECT_FALSE(big.Contains("k2998"));

  // Element-wise equality, insensitive to dictionary order.
  Dictionary x, y;
  x.Set("a", Value::SInt32(1));
  x.Set("b", Value::Float64(2));
  y.Set("b", Value::SInt64(2));
  y.Set("a", Number::SInt8(1));
  EXPECT_EQ(Value(x), Value(y));
  y.Set("c", Value());
  EXPECT_NE(Value(x), Value(y));
  EXPECT_NE(Value("1"), Value::SInt32(1));
  EXPECT_EQ(Value::Bytes({1, 2}), Value::Bytes({1, 2}));
  std::unordered_set<Value, ValueHash> set{Value::SInt32(3), Value::Float64(3.0), Value("3")};
  EXPECT_EQ(set.size(), 2u);
}

TEST(ValueTest, Description) {
  EXPECT_EQ(Value("plain text").Description(), "plain text");
  EXPECT_EQ(Value::SInt64(-42).Description(), "-42");
  EXPECT_EQ(Value::Float64(1.0 / 3).Description(), "0.3333333333333333");
  EXPECT_EQ(Value::Bool(false).Description(), "false");
  EXPECT_EQ(Value().Description(), "<null>");
  EXPECT_EQ(Value::Bytes({0xde, 0xad, 0xbe, 0xef, 0x01}).Description(), "<deadbeef 01>");
  EXPECT_EQ(Value(Date{0}).Description(), "1970-01-01 00:00:00 +0000");
  Dictionary d;
  d.Set("name", "two words");
  Array a;
  a.Append(Value::SInt32(1));
  a.Append("x");
  d.Set("list", a);
  d.Set("empty", Dictionary());
  EXPECT_EQ(Value(d).Description(),
            "{\n    name = \"two words\";\n    list = (\n        1,\n        x\n    );\n    empty = {};\n}");
}

}  // namespace
}  // namespace cf
