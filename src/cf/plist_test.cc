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
  // Dates from outside may be absurd: their text stays within years 1 to 9999.
  EXPECT_TRUE(WriteXMLPropertyList(Value(Date{1e300}), out, &error));
  EXPECT_NE(out.find("<date>9999-12-31T23:59:59Z</date>"), std::string::npos);
  EXPECT_EQ(Value(Date{-1e300}).Description(), "0001-01-01 00:00:00 +0000");
  EXPECT_TRUE(WriteBinaryPropertyList(Value(Date{NAN}), out, &error));
  EXPECT_TRUE(WriteXMLPropertyList(Value::Float64(INFINITY), out, &error));
  EXPECT_NE(out.find("<real>+infinity</real>"), std::string::npos);
}

TEST(PlistTest, OnlyTextAPropertyListCanCarryIsWritten) {
  struct Case {
    std::string text;
    const char* why;  // nullptr: carried
  };
  const Case cases[] = {
      {"", nullptr},
      {"tab\tnewline\ncr\r", nullptr},
      {"del \x7f, C1 \xc2\x80, \xc2\x9f", nullptr},            // XML 1.0 allows them
      {"\xef\xbf\xbd \xef\xbf\xbc \xee\x80\x80", nullptr},  // U+FFFD, U+FFFC, U+E000
      {"\xf0\x9f\x98\x80 \xf4\x8f\xbf\xbf \xed\x9f\xbf", nullptr},  // U+1F600, U+10FFFF, U+D7FF
      {std::string("a\0b", 3), "control character U+0000 at byte 1"},
      {"com.x.bad\x01key", "control character U+0001 at byte 9"},
      {"\x08", "control character U+0008 at byte 0"},
      {"\x0b", "control character U+000B at byte 0"},
      {"\x0c", "control character U+000C at byte 0"},
      {"ok\x0e", "control character U+000E at byte 2"},
      {"\x1f", "control character U+001F at byte 0"},
      {"\xef\xbf\xbe", "noncharacter U+FFFE at byte 0"},
      {"x\xef\xbf\xbf", "noncharacter U+FFFF at byte 1"},
      {"\xff", "invalid UTF-8 at byte 0"},
      {"ab\x80", "invalid UTF-8 at byte 2"},            // a lone continuation byte
      {"\xc0\x80", "invalid UTF-8 at byte 0"},          // overlong NUL
      {"\xc1\xbf", "invalid UTF-8 at byte 0"},          // overlong
      {"\xe0\x9f\xbf", "invalid UTF-8 at byte 0"},      // overlong three bytes
      {"\xf0\x8f\xbf\xbf", "invalid UTF-8 at byte 0"},  // overlong four bytes
      {"\xed\xa0\x80", "invalid UTF-8 at byte 0"},      // a surrogate
      {"\xf4\x90\x80\x80", "invalid UTF-8 at byte 0"},  // past U+10FFFF
      {"\xf5\x80\x80\x80", "invalid UTF-8 at byte 0"},
      {"\xe2\x82", "invalid UTF-8 at byte 0"},          // cut short at the end
      {"\xe2\x82x", "invalid UTF-8 at byte 0"},
  };
  for (const Case& c : cases) {
    const bool carried = c.why == nullptr;
    std::string why = "untouched";
    EXPECT_EQ(IsPropertyListString(c.text, &why), carried) << c.text;
    EXPECT_EQ(why, carried ? "untouched" : c.why) << c.text;

    // The writer refuses the same text as a key and as a value, and what it
    // does write reads back unchanged.
    std::string key_out, value_out, key_error, value_error;
    Dictionary as_key;
    as_key.Set(c.text, "v");
    Array as_value;
    as_value.Append(c.text);
    EXPECT_EQ(WriteXMLPropertyList(as_key, key_out, &key_error), carried) << c.text;
    EXPECT_EQ(WriteXMLPropertyList(as_value, value_out, &value_error), carried) << c.text;
    if (!carried) {
      EXPECT_EQ(key_error, std::string("key cannot be written to a property list: ") + c.why);
      EXPECT_EQ(value_error, std::string("string cannot be written to a property list: ") + c.why);
      EXPECT_EQ(value_out, "") << "nothing is emitted";
      continue;
    }
    const ParseResult back = ParsePropertyList(value_out);
    ASSERT_TRUE(back.ok()) << back.error << " for " << c.text;
    EXPECT_EQ(back.value.AsArray()->at(0), Value(c.text));
    EXPECT_TRUE(ParsePropertyList(key_out).value.AsDictionary()->Contains(c.text));
  }
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
  // XML cannot hold a NUL (libplist's reader once aborted the process on one).
  const char with_nul[] = "<plist version=\"1.0\"><dict><key>k</key><string>x\0y</string></dict></plist>";
  EXPECT_EQ(ParsePropertyList(std::string_view(with_nul, sizeof with_nul - 1)).error,
            "malformed XML property list (NUL byte)");

  std::string deep = "<plist version=\"1.0\">";
  for (int i = 0; i < 5000; ++i) deep += "<array>";
  for (int i = 0; i < 5000; ++i) deep += "</array>";
  deep += "</plist>";
  const ParseResult r = ParsePropertyList(deep);
  EXPECT_EQ(r.error, "property list nested too deeply");
}

// A binary list by hand: objects, offset table, trailer.
std::string Binary(const std::vector<std::string>& objects, uint64_t top, uint8_t ref_size = 1) {
  std::string out = "bplist00";
  std::vector<uint64_t> offsets;
  for (const std::string& o : objects) {
    offsets.push_back(out.size());
    out += o;
  }
  const uint64_t table = out.size();
  int offset_size = 1;
  while (offset_size < 8 && offsets.back() >> (8 * offset_size)) ++offset_size;
  for (uint64_t off : offsets)
    for (int i = offset_size - 1; i >= 0; --i) out += static_cast<char>(off >> (8 * i));
  std::string trailer(6, '\0');
  trailer += static_cast<char>(offset_size);
  trailer += static_cast<char>(ref_size);
  auto be = [&](uint64_t v) {
    for (int i = 7; i >= 0; --i) trailer += static_cast<char>(v >> (8 * i));
  };
  be(objects.size());
  be(top);
  be(table);
  return out + trailer;
}

TEST(PlistTest, BinaryReaderOnHandMadeAndHostileLists) {
  // {"b\0": "x", "n": -1 (16-byte integer), "big": 2^64-1 (16-byte), "u": UTF-16 "é😀"}
  const std::string dict = std::string("\xD4\x01\x03\x05\x07\x02\x04\x06\x08", 9);
  const ParseResult r = ParsePropertyList(Binary(
      {dict, std::string("\x52" "b\0", 3), "\x51x", "\x51n",
       std::string("\x14\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff\xff", 17), "\x53" "big",
       std::string("\x14\0\0\0\0\0\0\0\0\xff\xff\xff\xff\xff\xff\xff\xff", 17), "\x51u",
       std::string("\x63\x00\xe9\xd8\x3d\xde\x00", 7)},
      0));
  ASSERT_TRUE(r.ok()) << r.error;
  const Dictionary& d = *r.value.AsDictionary();
  EXPECT_EQ(d.Get(std::string("b\0", 2)), Value("x"));  // a NUL inside a key is kept
  EXPECT_EQ(d.Get("n"), Value::SInt64(-1));
  EXPECT_EQ(d.Get("big"), Value::UInt64(UINT64_MAX));
  EXPECT_EQ(d.Get("u"), Value("\xc3\xa9\xf0\x9f\x98\x80"));

  // An array that contains itself, and a small file describing a huge tree.
  // (Unreferenced data pads the list so that its size allows the depth.)
  EXPECT_EQ(ParsePropertyList(Binary({std::string("\xA1\x00", 2), "\x4F\x11\x01\x2C" + std::string(300, 'p')}, 0))
                .error,
            "property list nested too deeply");
  std::vector<std::string> chain;
  for (int i = 0; i < 40; ++i) chain.push_back(std::string("\xA2", 1) + static_cast<char>(i + 1) + static_cast<char>(i + 1));
  chain.push_back("\x09");
  EXPECT_EQ(ParsePropertyList(Binary(chain, 0)).error, "binary property list too large when decoded");
  // Broken trailers and references.
  const std::string ok = Binary({"\x09"}, 0);
  EXPECT_TRUE(ParsePropertyList(ok).ok());
  EXPECT_FALSE(ParsePropertyList(ok.substr(0, ok.size() - 1)).ok());
  EXPECT_FALSE(ParsePropertyList(Binary({"\x09"}, 1)).ok());           // top object out of range
  EXPECT_FALSE(ParsePropertyList(Binary({"\xA1\x07"}, 0)).ok());        // reference out of range
  EXPECT_FALSE(ParsePropertyList(Binary({"\x5F\x10\xff"}, 0)).ok());   // length past the end
  EXPECT_FALSE(ParsePropertyList(Binary({"\x14\x01"}, 0)).ok());        // short integer
  EXPECT_FALSE(ParsePropertyList(Binary({"\x0F"}, 0)).ok());             // fill byte
  EXPECT_FALSE(ParsePropertyList(Binary({"\x09"}, 0, 9)).ok());          // reference size 9
}

// An array of refs references to object 1: a string (marker 0x5F) or data
// (0x4F) of length bytes, or UTF-16 text (0x6F) of length units.
std::string SharedLeaf(char marker, uint64_t length, uint32_t refs) {
  auto count = [](uint64_t v) {
    std::string c = "\x13";
    for (int i = 7; i >= 0; --i) c += static_cast<char>(v >> (8 * i));
    return c;
  };
  std::string array = "\xAF" + count(refs);
  for (uint32_t i = 0; i < refs; ++i) array += std::string("\0\0\0\x01", 4);
  const uint64_t payload = marker == '\x6F' ? 2 * length : length;
  return Binary({array, marker + count(length) + std::string(payload, 'a')}, 0, 4);
}

TEST(PlistTest, BinaryReaderBoundsTheDecodedSizeInBytes) {
  // One 512 KiB string in every slot of a 131,000-slot array: a frame under
  // 1 MiB that would decode to 64 GiB.
  const std::string hostile = SharedLeaf('\x5F', 512 << 10, 131'000);
  EXPECT_LT(hostile.size(), size_t{1} << 20);
  const ParseResult r = ParsePropertyList(hostile);
  EXPECT_EQ(r.error, "binary property list too large when decoded");
  EXPECT_TRUE(r.value.IsNull());

  struct Case {
    char marker;
    uint64_t length;
    uint32_t refs;
    bool ok;
  };
  const Case cases[] = {
      {'\x5F', 512 << 10, 31, true},    // 15.5 MiB decoded from 512 KiB: within 32 times
      {'\x5F', 512 << 10, 33, false},   // 16.5 MiB: over 32 times the input
      {'\x4F', 512 << 10, 33, false},   // data counts as strings do
      {'\x6F', 256 << 10, 33, false},   // and UTF-16 text as its UTF-8 may be
      {'\x4F', 3 << 20, 21, true},      // 63 MiB from 3 MiB
      {'\x4F', 3 << 20, 22, false},     // 66 MiB: within 32 times the input, over 64 MiB
  };
  for (const Case& c : cases) {
    const ParseResult p = ParsePropertyList(SharedLeaf(c.marker, c.length, c.refs));
    EXPECT_EQ(p.ok(), c.ok) << c.marker << " " << c.length << " x" << c.refs << ": " << p.error;
    if (c.ok) {
      ASSERT_EQ(p.value.AsArray()->size(), c.refs);
      const Value& last = p.value.AsArray()->at(c.refs - 1);
      EXPECT_EQ(last.AsString() ? last.AsString()->size() : last.AsData()->size(), c.length);
    }
  }
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
