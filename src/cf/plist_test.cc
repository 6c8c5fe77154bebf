#include "cf/plist.h"

#include <gtest/gtest.h>

#include <cmath>

namespace cf {
namespace {

Value Sample() {
  Dictionary d;
  d.Set("int", Value::SInt64(-9223372036854775807LL - 1));
  d.Set("uint", Value::UInt64(18446744073709551615ull));
  d.Set("real", Value::Float64(0.1));
  d.Set("whole real", Value::Float64(3.0));
  d.Set("true", Value::Bool(true));
  d.Set("false", Value::Bool(false));
  d.Set("text", "a<b & c>d é");
  d.Set("data", Value::Bytes({0, 1, 2, 253, 254, 255, 7}));
  d.Set("date", Date{1700000000});
  Array a;
  a.Append(Value::SInt32(1));
  a.Append(Array());
  a.Append(Dictionary());
  d.Set("array", a);
  return d;
}

TEST(PlistTest, XmlWriteIsExactAndRoundTripsThroughBothReaders) {
  std::string xml, error;
  Dictionary d;
  d.Set("TBCrashLogVersion", Value::SInt32(1));
  d.Set("x", Value::Float64(2.5));
  d.Set("empty", Array());
  ASSERT_TRUE(WriteXMLPropertyList(d, xml, &error)) << error;
  EXPECT_EQ(xml,
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
            "<plist version=\"1.0\">\n<dict>\n\t<key>TBCrashLogVersion</key>\n\t<integer>1</integer>\n"
            "\t<key>x</key>\n\t<real>2.5</real>\n\t<key>empty</key>\n\t<array/>\n</dict>\n</plist>\n");

  const Value sample = Sample();
  ASSERT_TRUE(WriteXMLPropertyList(sample, xml, &error)) << error;
  ParseResult back = ParsePropertyList(xml);
  ASSERT_TRUE(back.ok()) << back.error;
  EXPECT_EQ(back.value, sample);
  const Value uint_value = back.value.AsDictionary()->Get("uint");
  const Number* u = uint_value.AsNumber();
  ASSERT_NE(u, nullptr);
  EXPECT_TRUE(u->IsUnsigned());
  EXPECT_EQ(back.value.AsDictionary()->Get("int").AsNumber()->AsSInt64(), INT64_MIN);
  EXPECT_TRUE(back.value.AsDictionary()->Get("whole real").AsNumber()->IsFloat());
  // Key order is kept.
  EXPECT_EQ(*back.value.AsDictionary()->entries()[0].first.AsString(), "int");

  std::string bin;
  Dictionary no_uint = sample.AsDictionary()->MutableCopy();
  no_uint.Remove("uint");  // binary keeps 64-bit signed integers
  ASSERT_TRUE(WriteBinaryPropertyList(no_uint, bin, &error)) << error;
  EXPECT_EQ(bin.substr(0, 8), "bplist00");
  back = ParsePropertyList(bin);
  ASSERT_TRUE(back.ok()) << back.error;
  EXPECT_EQ(back.value, Value(no_uint));
}

TEST(PlistTest, UnwritableValuesFailWithAReason) {
  std::string out, error;
  Dictionary d;
  d.Set(Value::SInt32(1), "numeric key");
  EXPECT_FALSE(WriteXMLPropertyList(d, out, &error));
  EXPECT_EQ(error, "dictionary key of type number cannot be written to a property list");
  Array a;
  a.Append(Value());
  EXPECT_FALSE(WriteXMLPropertyList(a, out, &error));
  EXPECT_EQ(error, "null cannot be written to a property list");
  EXPECT_FALSE(WriteXMLPropertyList(Value("bell\x07"), out, &error));
  EXPECT_FALSE(WriteBinaryPropertyList(a, out, &error));
  Value nested = Array();
  for (int i = 0; i < kMaxNesting + 5; ++i) {
    Array outer;
    outer.Append(nested);
    nested = outer;
  }
  EXPECT_FALSE(WriteXMLPropertyList(nested, out, &error));
  EXPECT_EQ(error, "value nested too deeply");
  EXPECT_TRUE(WriteXMLPropertyList(Value::Float64(INFINITY), out, &error));
  EXPECT_NE(out.find("<real>+infinity</real>"), std::string::npos);
}

TEST(PlistTest, MalformedInputGivesAnErrorNotACrash) {
  const char* cases[] = {
      "",
      "not a plist",
      "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>a</key>",
      "<plist version=\"1.0\"><dict><key>a</key><integer>1</integer></plist>",
      "bplist00",
      "bplist00\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff"
      "\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff",
  };
  for (const char* c : cases) {
    const ParseResult r = ParsePropertyList(c);
    EXPECT_FALSE(r.ok()) << c;
    EXPECT_TRUE(r.value.IsNull());
  }
  // Text with a NUL inside (which aborted inside the reader once) ends at the NUL.
  const char with_nul[] = "<plist version=\"1.0\"><dict><key>k</key><string>x\0y</string></dict></plist>";
  const ParseResult nul = ParsePropertyList(std::string_view(with_nul, sizeof with_nul - 1));
  ASSERT_TRUE(nul.ok()) << nul.error;
  EXPECT_EQ(nul.value.AsDictionary()->Get("k"), Value("x"));

  std::string deep = "<plist version=\"1.0\">";
  for (int i = 0; i < 5000; ++i) deep += "<array>";
  for (int i = 0; i < 5000; ++i) deep += "</array>";
  deep += "</plist>";
  const ParseResult r = ParsePropertyList(deep);
  EXPECT_EQ(r.error, "property list nested too deeply");
}

TEST(JsonTest, ReadWriteAndMalformed) {
  ParseResult r = ParseJSON(R"({"b":1,"a":[true,null,2.5,"x"],"big":18446744073709551615,"neg":-3})");
  ASSERT_TRUE(r.ok()) << r.error;
  const Dictionary& d = *r.value.AsDictionary();
  EXPECT_EQ(*d.entries()[0].first.AsString(), "b");  // order kept
  EXPECT_TRUE(d.Get("big").AsNumber()->IsUnsigned());
  EXPECT_EQ(d.Get("neg"), Value::SInt64(-3));
  EXPECT_TRUE(d.Get("a").AsArray()->at(1).IsNull());

  std::string out, error;
  ASSERT_TRUE(WriteJSON(r.value, out, &error));
  EXPECT_EQ(out, R"({"b":1,"a":[true,null,2.5,"x"],"big":18446744073709551615,"neg":-3})");
  Dictionary odd;
  odd.Set("data", Value::Bytes({'h', 'i'}));
  odd.Set("when", Date{0});
  ASSERT_TRUE(WriteJSON(odd, out, &error));
  EXPECT_EQ(out, R"({"data":"aGk=","when":"1970-01-01T00:00:00Z"})");

  for (const char* bad : {"", "{", "[1,]", "{\"a\" 1}", "nul", "\"\\u12\""}) {
    r = ParseJSON(bad);
    EXPECT_FALSE(r.ok()) << bad;
    EXPECT_EQ(r.error.rfind("malformed JSON", 0), 0u) << r.error;
  }
  EXPECT_FALSE(ParseJSON(std::string(100000, '[')).ok());
}

}  // namespace
}  // namespace cf
