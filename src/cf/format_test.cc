#include "cf/format.h"

#include <gtest/gtest.h>

namespace cf {
namespace {

TEST(FormatTest, PrintfConversionsFollowTheirLengthModifiers) {
  EXPECT_EQ(Format("%d|%u|%llu|%lld|%lu|%zd", -5, 4294967295u, 18446744073709551615ull, -9LL, 7ul, size_t{3}),
            "-5|4294967295|18446744073709551615|-9|7|3");
  // %d reads 32 bits: a 64-bit argument is cut to its low bits, as on the device.
  EXPECT_EQ(Format("%d", int64_t{0x1'0000'0002}), "2");
  EXPECT_EQ(Format("%u", -1), "4294967295");
  EXPECT_EQ(Format("%x %#x %#llx %02x %X", 255, 255, 0xabcdef0123ull, 5, 0xbeef), "ff 0xff 0xabcdef0123 05 BEEF");
  EXPECT_EQ(Format("%s/%c/%.2f/%.2lf/%0.16g", "txt", 'A', 2.005, 1.0 / 3, 0.1), "txt/A/2.00/0.33/0.1");
  EXPECT_EQ(Format("[%4u][%-8llu][%9.3e][%4.1f%%]", 7u, 12ull, 12345.678, 99.44), "[   7][12      ][1.235e+04][99.4%]");
  EXPECT_EQ(Format("%p", static_cast<const void*>(nullptr)), "(nil)");
  EXPECT_EQ(Format("%*d|%-*s|", 4, 7, 3, "a"), "   7|a  |");
  EXPECT_EQ(Format("%hhd %hu", 0x1ff, 0x12345), "-1 9029");
}

TEST(FormatTest, ValuesAndOddFormats) {
  Dictionary d;
  d.Set("k", Value::SInt32(1));
  EXPECT_EQ(Format("group %@ off", Value("net")), "group net off");
  EXPECT_EQ(Format("%{public}@=%@", Value("a"), Value::Float64(2.5)), "a=2.5");
  EXPECT_EQ(Format("%@", Value(d)), "{\n    k = 1;\n}");
  EXPECT_EQ(Format("%@", Value()), "(null)");
  EXPECT_EQ(Format("%d", Value::SInt64(-3)), "-3");
  // Missing arguments and a dangling % never read past what was passed.
  EXPECT_EQ(Format("%d and %s", 1), "1 and (null)");
  EXPECT_EQ(Format("100%"), "100%");
  EXPECT_EQ(Format("%{public"), "%{public");
  EXPECT_EQ(Format("%k"), "%k");
  EXPECT_EQ(Format("%%d"), "%d");
  EXPECT_EQ(Format("%5@|%-5@|", Value("ab"), Value("cd")), "   ab|cd   |");
  EXPECT_EQ(Format("%.3s", "abcdef"), "abc");
  EXPECT_EQ(Format("%99999d", 1).size(), 4096u);  // widths are bounded
  EXPECT_EQ(Format("%*u", 1000000000, 7u).size(), 4096u);  // also when they come from an argument
  EXPECT_EQ(Format("%*u|", INT64_MIN, 7u).size(), 4097u);
  EXPECT_EQ(Format("%.*s|", -5, "abc"), "abc|");
  EXPECT_EQ(Format(std::string_view("%\0d", 3), 5), std::string("%\0d", 3));
}

}  // namespace
}  // namespace cf
