#include "cf/value.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <limits>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

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

// Texts across the inline limit (15) and beyond a name's 98 characters,
// with a NUL and bytes above 0x7f inside.
std::vector<std::string> TextsOfEveryLength() {
  std::vector<std::string> texts;
  for (size_t n : {0, 1, 7, 8, 9, 15, 16, 17, 31, 32, 33, 98, 300}) {
    std::string t;
    for (size_t i = 0; i < n; ++i) t += static_cast<char>("ab\0\xe9z"[i % 5]);
    texts.push_back(t);
  }
  return texts;
}

// Strings made as a dictionary built at once makes its keys: the long ones
// share one block. The texts must differ.
std::vector<String> MadeTogether(const std::vector<std::string>& texts) {
  std::vector<NamedUnsigned> pairs;
  for (const std::string& t : texts) pairs.push_back({t, 0});
  std::vector<String> made;
  for (const auto& [k, v] : Dictionary::OfUnsigned(pairs.data(), pairs.size())) made.push_back(*k.AsString());
  return made;
}

TEST(StringTest, MadeAloneOrInABlockTheTextsAreTheSame) {
  const std::vector<std::string> texts = TextsOfEveryLength();
  const std::vector<String> made_together = MadeTogether(texts);
  ASSERT_EQ(made_together.size(), texts.size());
  for (size_t i = 0; i < texts.size(); ++i) {
    const std::string& t = texts[i];
    SCOPED_TRACE(t.size());
    const String alone(t), made = made_together[i];
    for (const String* s : {&alone, &made}) {
      EXPECT_EQ(s->view(), std::string_view(t));
      EXPECT_EQ(s->size(), t.size());
      EXPECT_EQ(s->c_str()[t.size()], '\0');
      EXPECT_EQ(s->hash(), String::HashOf(t));
      EXPECT_EQ(static_cast<std::string>(*s), t);
    }
    EXPECT_EQ(alone, made);
    // Only long texts are shared; short ones are held inline.
    EXPECT_EQ(made.SharesBytesWith(String(made)), t.size() > 15);
    EXPECT_FALSE(made.SharesBytesWith(alone));
    const Value a(alone), b(made), c(t);
    EXPECT_EQ(a, b);
    EXPECT_EQ(b, c);
    EXPECT_EQ(a.Hash(), b.Hash());
    EXPECT_EQ(b.Hash(), c.Hash());
    EXPECT_EQ(b.StringView(), std::string_view(t));
    Dictionary d;
    d.Set(b, Value::SInt32(1));
    d.Set(a, Value::SInt32(2));  // the same key
    ASSERT_EQ(d.size(), 1u);
    EXPECT_EQ(d.Get(c), Value::SInt32(2));
  }
  EXPECT_EQ(Value::SInt32(1).AsString(), nullptr);
  EXPECT_TRUE(Value::SInt32(1).StringView().empty());
  EXPECT_EQ(String().c_str(), std::string(""));
}

TEST(StringTest, EveryCharacterCountsInTheHashAndEquality) {
  for (size_t n = 1; n <= 40; ++n) {
    const std::string base(n, 'q');
    const String s(base);
    for (size_t i = 0; i < n; ++i) {
      std::string other = base;
      other[i] = 'r';
      SCOPED_TRACE(std::to_string(n) + " at " + std::to_string(i));
      EXPECT_NE(String(other).hash(), s.hash());
      EXPECT_NE(String(other), s);
      EXPECT_NE(Value(other), Value(base));
    }
  }
  // Same bytes, different lengths.
  EXPECT_NE(String(std::string(16, '\0')), String(std::string(17, '\0')));
  EXPECT_NE(String(std::string(16, '\0')).hash(), String(std::string(17, '\0')).hash());
}

TEST(StringTest, SharedBytesLiveAsLongAsAnyStringMadeInThem) {
  const std::string long1(40, 'x'), long2(60, 'y');
  // The dictionary that made them is gone when they come back.
  std::vector<String> kept = MadeTogether({long1, long2});
  String copy = kept[0];
  EXPECT_TRUE(copy.SharesBytesWith(kept[0]));
  // Assigning to a copy leaves the shared bytes alone.
  copy = String(std::string(50, 'z'));
  EXPECT_EQ(kept[0], long1);
  String moved = std::move(kept[1]);
  EXPECT_EQ(moved, long2);
  EXPECT_TRUE(kept[1].empty());
  kept.clear();
  EXPECT_EQ(moved, long2);

  // Dropping copies on several threads at once.
  const String shared = MadeTogether({long1})[0];
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&shared] {
      for (int i = 0; i < 20000; ++i) {
        String c = shared;
        Value v(c);
        if (v.StringView().size() != 40) std::abort();
      }
    });
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(shared, long1);
}

TEST(StringTest, DictionariesOfSharedKeysGiveBackEveryReference) {
  // Keys from two blocks, interleaved with inline and ordinary ones; some
  // are kept past the dictionary, one dictionary is copied first.
  const auto name = [](char c, int i) { return std::string(30, c) + std::to_string(i); };
  std::vector<std::string> names_a, names_b;
  for (int i = 0; i < 20; ++i) {
    names_a.push_back(name('a', i));
    names_b.push_back(name('b', i));
  }
  const std::vector<String> a = MadeTogether(names_a), b = MadeTogether(names_b);
  Value kept_a, kept_b;
  Dictionary copy;
  {
    Dictionary d;
    for (int i = 0; i < 20; ++i) {
      d.Set(a[static_cast<size_t>(i)], Value::SInt32(i));
      d.Set(b[static_cast<size_t>(i)], Value::SInt32(100 + i));
      d.Set(Value("short" + std::to_string(i)), Value::SInt32(200 + i));
      d.Set(Value(name('c', i)), Value::SInt32(300 + i));
    }
    d.Set(Value(name('a', 3)), Value::SInt32(-3));  // replaces, keeps the place
    ASSERT_EQ(d.size(), 80u);
    EXPECT_EQ(d.entries()[12].first, Value(name('a', 3)));
    EXPECT_EQ(d.entries()[12].second, Value::SInt32(-3));
    kept_a = d.entries()[0].first;
    kept_b = d.entries()[1].first;
    copy = d.MutableCopy();
    copy.Set(Value(name('b', 0)), Value::SInt32(7));
    EXPECT_EQ(d.Get(Value(name('b', 0))), Value::SInt32(100));
  }
  EXPECT_EQ(kept_a, Value(name('a', 0)));
  EXPECT_EQ(kept_b, Value(name('b', 0)));
  EXPECT_EQ(copy.Get(kept_b), Value::SInt32(7));
  EXPECT_EQ(copy.Get(Value(name('a', 19))), Value::SInt32(19));
  copy.Clear();
  EXPECT_EQ(kept_a.StringView(), name('a', 0));
}

// A dictionary built at once is the one Set makes pair by pair: the same
// entries in the same order, a repeated name replacing the value in the
// first one's place, every key found, and keys that outlive it.
TEST(DictionaryTest, BuiltAtOnceIsWhatSetMakes) {
  for (size_t count : {0, 1, 11, 12, 13, 5000}) {
    SCOPED_TRACE(count);
    std::vector<std::string> names;
    std::vector<NamedUnsigned> pairs;
    for (size_t i = 0; i < count; ++i) {
      // Short, just inline, just shared and very long names (more
      // characters than the first text block is sized for), and every
      // seventh name a repeat of an earlier one.
      if (i % 7 == 6) {
        names.push_back(names[i / 2]);
        continue;
      }
      const size_t length = std::vector<size_t>{3, 15, 16, 17, 40, 300}[i % 6];
      std::string name = std::to_string(i) + "_";
      name.resize(std::max(length, name.size()), static_cast<char>('a' + i % 26));
      names.push_back(name);
    }
    for (size_t i = 0; i < count; ++i) pairs.push_back({names[i], i * 1000 + 1});
    Dictionary expected;
    for (const NamedUnsigned& p : pairs) expected.Set(Value(p.name), Value::UInt64(p.value));
    Value kept;
    {
      const Dictionary built = Dictionary::OfUnsigned(pairs.data(), pairs.size());
      ASSERT_EQ(built.size(), expected.size());
      for (size_t i = 0; i < built.size(); ++i) {
        EXPECT_EQ(built.entries()[i].first, expected.entries()[i].first) << i;
        ASSERT_NE(built.entries()[i].second.AsNumber(), nullptr);
        EXPECT_EQ(built.entries()[i].second.AsNumber()->type(), NumberType::kUInt64);
        EXPECT_EQ(built.entries()[i].second, expected.entries()[i].second) << i;
        const String& key = *built.entries()[i].first.AsString();
        EXPECT_EQ(key.c_str()[key.size()], '\0');
      }
      for (const std::string& name : names) EXPECT_EQ(built.Get(Value(name)), expected.Get(Value(name))) << name;
      EXPECT_FALSE(built.Contains(Value("absent")));
      if (count > 0) kept = built.entries().back().first;
      // Growing it afterwards works as for any dictionary.
      Dictionary grown = built;
      grown.Set(Value("added"), Value::SInt32(1));
      EXPECT_EQ(grown.Get(Value("added")), Value::SInt32(1));
      if (count > 0) {
        EXPECT_EQ(grown.Get(Value(names[0])), Value::UInt64(1));
      }
    }
    if (count > 0) {
      EXPECT_EQ(kept, expected.entries().back().first);
    }
  }
}

// A value changes kind by assignment, copy or move, and gives back what it
// held each time (the sanitizer build counts every reference).
TEST(ValueTest, EveryKindAssignsOverEveryKind) {
  Dictionary d;
  d.Set("k", Value::SInt32(1));
  Array a;
  a.Append(Value("element"));
  const std::vector<Value> kinds = {Value(),
                                    Value::Bool(true),
                                    Value::UInt64(18446744073709551615ull),
                                    Value("short"),
                                    Value(std::string(40, 'l')),
                                    Value::Bytes({1, 2, 3}),
                                    Value(Date{86400}),
                                    Value(a),
                                    Value(d)};
  for (const Value& from : kinds) {
    for (const Value& to : kinds) {
      Value copy = from;
      copy = to;
      EXPECT_EQ(copy, to);
      EXPECT_EQ(copy.type(), to.type());
      Value moved = from;
      Value source = to;
      moved = std::move(source);
      EXPECT_EQ(moved, to);
      Value constructed(std::move(moved));
      EXPECT_EQ(constructed, to);
      constructed = constructed;  // assigning a value to itself keeps it
      EXPECT_EQ(constructed, to);
    }
  }
  EXPECT_EQ(kinds[7].AsArray()->at(0), Value("element"));
  EXPECT_EQ(kinds[8].AsDictionary()->Get("k"), Value::SInt32(1));
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
