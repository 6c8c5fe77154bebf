#include "nandinfo/helpers.h"

#include <gtest/gtest.h>

#include "parsers/parsers.h"

namespace {

TEST(HelpersTest, LastErrorMessage) {
  parsers::testing::ResetAPIErrorMessage();
  EXPECT_EQ(GetAPIErrorMessage(), "NA");
  SetAPIErrorMessage("a %d", 1);
  SetAPIErrorMessage("b");
  EXPECT_EQ(GetAPIErrorMessage(), "a 1");
  parsers::testing::ResetAPIErrorMessage();
  SetAPIErrorMessage("%s", std::string(2000, 'x'));
  EXPECT_EQ(GetAPIErrorMessage().size(), 1023u);
  parsers::testing::ResetAPIErrorMessage();
}

TEST(HelpersTest, RoundSigAndHex) {
  EXPECT_EQ(roundSig(123456, 3), 123000u);
  EXPECT_EQ(roundSig(123500, 3), 124000u);  // halves go up
  EXPECT_EQ(roundSig(123499, 3), 123000u);
  EXPECT_EQ(roundSig(999, 2), 1000u);
  EXPECT_EQ(roundSig(123, 3), 123u);
  EXPECT_EQ(roundSig(7, 3), 7u);
  EXPECT_EQ(roundSig(0, 5), 0u);
  EXPECT_EQ(roundSig(15, 1), 20u);
  EXPECT_EQ(roundSig(18446744073709551615ull, 1), 0u);  // 20 digits: e = 19 > 18
  EXPECT_EQ(roundSig(18446744073709551615ull, 2), 18000000000000000000ull);  // e = 18, the last power
  EXPECT_EQ(roundSig(1000000000000000000ull, 0), 0u);   // 19 digits, e = 19

  testing::internal::CaptureStdout();
  EXPECT_EQ(hexStringToByte("g1", 2), 1);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "unrecognized hex character: g");
  EXPECT_EQ(hexStringToByte("A", 1), 10);
  EXPECT_EQ(hexStringToByte("ff", 2), 255);
  EXPECT_EQ(hexStringToByte("fff", 3), 255);  // at most two characters
  EXPECT_EQ(hexStringToByte("", 0), 0);
  EXPECT_EQ(hexStringToInt32("12345678", 8), 0x12345678u);
  EXPECT_EQ(hexStringToInt32("123456789A", 10), 0x12345678u);  // at most eight
  EXPECT_EQ(hexStringToInt32("123", 3), 0x1203u);
  EXPECT_EQ(hexStringToInt32("abcde", 5), 0xabcd0eu);
  EXPECT_EQ(hexStringToInt32("", 0), 0u);
  EXPECT_EQ(hexStringToInt32("F", 1), 0xFu);

  EXPECT_EQ(GetUserCapacityInGB(1376256), 1536);
  EXPECT_EQ(GetUserCapacityInGB(1770495), 1536);
  EXPECT_EQ(GetUserCapacityInGB(1770496), 2048);
  EXPECT_EQ(GetUserCapacityInGB(1376255), 2048);
  EXPECT_EQ(GetUserCapacityInGB(0), 0);
  EXPECT_EQ(GetUserCapacityInGB(121856), 128);
  EXPECT_EQ(GetUserCapacityInGB(131072), 256);
  EXPECT_EQ(GetUserCapacityInGB(0xFFFFFFFF), 0);
  EXPECT_EQ(GetUserCapacityInGB(1), 0);  // 2 MiB is 0 GB
}

TEST(HelpersTest, Dictionaries) {
  GenericParserCxt c;
  EXPECT_TRUE(CreateDictFromCxt(c).empty());
  AddSingleValueToGenericContext(&c, "", "a", 1);
  AddSingleValueToGenericContext(&c, "", "b", 2);
  AddSingleValueToGenericContext(&c, "", "a", 3);  // the later pair wins
  cf::Dictionary d = CreateDictFromCxt(c);
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(d.Get("a"), cf::Value::UInt64(3));
  EXPECT_TRUE(d.Get("a").AsNumber()->IsUnsigned());
  d = CreateDictFromCxt(c, cf::Array({cf::Value("b"), cf::Value("zz")}));
  ASSERT_EQ(d.size(), 1u);
  EXPECT_EQ(d.Get("b"), cf::Value::UInt64(2));

  // Long names, repeated: the first place, the last value, and keys that
  // outlive the context they were read from.
  const std::string long_a(60, 'a'), long_b(98, 'b');
  ReleaseGenericParserCxt(&c);
  AddSingleValueToGenericContext(&c, "prefix_", long_a.c_str(), 1);
  AddSingleValueToGenericContext(&c, "", long_b.c_str(), 2);
  AddSingleValueToGenericContext(&c, "", "s", 3);
  AddSingleValueToGenericContext(&c, "prefix_", long_a.c_str(), 4);
  AddSingleValueToGenericContext(&c, "", long_b.c_str(), 5);
  d = CreateDictFromCxt(c);
  const cf::Dictionary filtered =
      CreateDictFromCxt(c, cf::Array({cf::Value(long_b), cf::Value("s"), cf::Value("prefix_")}));
  ReleaseGenericParserCxt(&c);
  ASSERT_EQ(d.size(), 3u);
  EXPECT_EQ(d.entries()[0].first, cf::Value("prefix_" + long_a));
  EXPECT_EQ(d.entries()[0].second, cf::Value::UInt64(4));
  EXPECT_EQ(d.entries()[1].first, cf::Value(long_b));
  EXPECT_EQ(d.entries()[1].second, cf::Value::UInt64(5));
  EXPECT_EQ(d.entries()[2].first, cf::Value("s"));
  EXPECT_EQ(d.Get(cf::Value("prefix_" + long_a)), cf::Value::UInt64(4));
  ASSERT_EQ(filtered.size(), 2u);
  EXPECT_EQ(filtered.entries()[0].first, cf::Value(long_b));
  EXPECT_EQ(filtered.entries()[0].second, cf::Value::UInt64(5));
  EXPECT_EQ(filtered.Get(cf::Value("s")), cf::Value::UInt64(3));

  cf::Dictionary source;
  source.Set("x", cf::Value::SInt64(123456));
  source.Set("y", "text");
  source.Set("z", cf::Value::SInt64(5));
  const cf::Value same = CreateFilteredDict(source, cf::Value());
  EXPECT_TRUE(same.AsDictionary()->SameAs(source));
  EXPECT_EQ(CreateFilteredDict(source, cf::Array({cf::Value("x")})).AsDictionary()->size(), 1u);
  EXPECT_TRUE(CreateFilteredDict(cf::Value(), cf::Array({cf::Value("x")})).AsDictionary()->empty());

  cf::Dictionary digits;
  digits.Set("x", cf::Value::SInt32(2));
  digits.Set("y", cf::Value::SInt32(2));
  const cf::Value rounded = CreateFilteredDict_SigDig(source, digits, true);
  EXPECT_EQ(rounded.AsDictionary()->Get("x"), cf::Value::UInt64(120000));
  EXPECT_EQ(rounded.AsDictionary()->Get("y"), cf::Value("text"));  // text stays
  EXPECT_FALSE(rounded.AsDictionary()->Contains("z"));             // not in digits: dropped
  EXPECT_EQ(CreateFilteredDict_SigDig(source, digits, false).AsDictionary()->Get("x"), cf::Value::SInt64(123456));
  EXPECT_TRUE(CreateFilteredDict_SigDig(source, cf::Value(), true).AsDictionary()->SameAs(source));

  EXPECT_EQ(GetNumberFromDictionarySafe(source, "missing"), cf::Value::SInt32(0));
  EXPECT_EQ(GetNumberFromDictionarySafe(source, "y"), cf::Value("text"));  // the stored object as it is
  EXPECT_EQ(GetStringFromDictionarySafe(source, "missing"), cf::Value("empty"));
  EXPECT_EQ(GetStringFromDictionarySafe(cf::Value(), "x"), cf::Value("empty"));

  cf::Dictionary typed;
  const int8_t small = -2;
  const int64_t big = -5;
  const int32_t mid = 70000;
  setNumberValueForType(typed, "s", &small, 1);
  setNumberValueForType(typed, "b", &big, 4);
  setNumberValueForType(typed, "m", &mid, 9);
  setNumberValueForType(typed, "bad", &mid, 7);
  EXPECT_EQ(typed.Get("s").AsNumber()->type(), cf::NumberType::kSInt8);
  EXPECT_EQ(typed.Get("s"), cf::Value::SInt32(-2));
  EXPECT_EQ(typed.Get("b"), cf::Value::SInt64(-5));
  EXPECT_EQ(typed.Get("m").AsNumber()->type(), cf::NumberType::kInt);
  EXPECT_FALSE(typed.Contains("bad"));
  cf::Array list;
  appendNumberValueForType(list, &mid, 3);
  appendNumberValueForType(list, nullptr, 3);
  EXPECT_EQ(list.size(), 1u);
  cf::Dictionary target;
  CopyDictionary("k", cf::Value::SInt32(1), target);
  EXPECT_EQ(target.Get("k"), cf::Value::SInt32(1));
}

}  // namespace
