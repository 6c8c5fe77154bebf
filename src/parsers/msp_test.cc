#include <gtest/gtest.h>

#include "parsers/parsers.h"
#include "sim/statistics_buffers.h"

namespace {

using sim::ByteRecordBuffer;

class MspTest : public ::testing::Test {
 protected:
  void SetUp() override {
    parsers::testing::ResetAPIErrorMessage();
    parsers::testing::g_adds_before_failure = -1;
  }
  void TearDown() override { parsers::testing::g_adds_before_failure = -1; }
  static uint32_t Parse(GenericParserCxt& c, const ByteRecordBuffer& b) {
    return VSPMSPParseBufferToCxt(&c, b.bytes().data(), b.size());
  }
};

TEST_F(MspTest, FillersEndMarkerAndUnknownKeys) {
  GenericParserCxt c;
  ByteRecordBuffer only_fillers;
  only_fillers.Filler().Filler().Header(0x1234, 0);
  EXPECT_EQ(Parse(c, only_fillers), 0u);
  EXPECT_EQ(GetAPIErrorMessage(), "NA");

  ByteRecordBuffer b;
  b.RecordBytes(0x2FFE, "skip me!").Record(4200, {1}).Record(8192, {1}).Record(4096, {7}).End().Record(4097, {8});
  EXPECT_EQ(Parse(c, b), 1u);
  ASSERT_EQ(c.pairs.size(), 1u);
  EXPECT_EQ(c.pairs[0].name, "passWithTmodeHard");
  EXPECT_EQ(c.pairs[0].value, 7u);

  // Odd lengths put the next header at an odd offset: it is read there.
  c = {};
  ByteRecordBuffer odd;
  odd.RecordBytes(4200, "abc").Record(4097, {9});
  EXPECT_EQ(Parse(c, odd), 1u);
  EXPECT_EQ(c.pairs[0].name, "passWithTmodeFS1_2b");
  // A truncated record and a short tail end quietly.
  c = {};
  ByteRecordBuffer truncated;
  truncated.Record(4096, {1}).Header(4097, 8).Bytes("1234").Bytes("xy");
  EXPECT_EQ(Parse(c, truncated), 1u);
  EXPECT_EQ(GetAPIErrorMessage(), "NA");

  EXPECT_EQ(VSPMSPParseBufferToCxt(&c, nullptr, 8), 0u);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPMSPParseBufferToCxt: Passed in invalid buffer or empty buffer");
  parsers::testing::ResetAPIErrorMessage();
  EXPECT_EQ(VSPMSPParseBufferToCxt(&c, "x", 0), 0u);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPMSPParseBufferToCxt: Passed in invalid buffer or empty buffer");
}

TEST_F(MspTest, LengthMismatches) {
  GenericParserCxt c;
  ByteRecordBuffer exact;
  exact.Record(8195, std::vector<uint32_t>(16, 30));
  EXPECT_EQ(Parse(c, exact), 16u);
  EXPECT_EQ(c.pairs.back().name, "lower_die_temperature15");

  c = {};
  ByteRecordBuffer shorter;
  shorter.Record(8195, std::vector<uint32_t>(10, 30)).Record(4096, {1});
  EXPECT_EQ(Parse(c, shorter), 11u);
  EXPECT_EQ(GetAPIErrorMessage(),
            "VSPMSPParseBufferToCxt: lower_die_temperature(8195): cfg 16 elements; (16*4) cfg bytes != (40) buffer bytes");

  parsers::testing::ResetAPIErrorMessage();
  c = {};
  ByteRecordBuffer longer;
  longer.Record(8195, std::vector<uint32_t>(20, 30)).Record(4096, {1});
  EXPECT_EQ(Parse(c, longer), 17u);  // sixteen, then the next record after all 80 bytes
  EXPECT_EQ(c.pairs.back().name, "passWithTmodeHard");
  EXPECT_EQ(GetAPIErrorMessage(),
            "VSPMSPParseBufferToCxt: lower_die_temperature(8195): cfg 16 elements; (16*4) cfg bytes != (80) buffer bytes");

  parsers::testing::ResetAPIErrorMessage();
  c = {};
  ByteRecordBuffer six;
  six.RecordBytes(4096, std::string("\x05\x00\x00\x00\xff\xff", 6)).RecordBytes(4097, "\x01\x02").Record(4098, {3});
  EXPECT_EQ(Parse(c, six), 2u);
  ASSERT_EQ(c.pairs.size(), 2u);
  EXPECT_EQ(c.pairs[0].value, 5u);
  EXPECT_EQ(c.pairs[1].name, "passWithTmodeFS1_4b");  // two bytes gave nothing; the walk went on
  EXPECT_EQ(GetAPIErrorMessage(),
            "VSPMSPParseBufferToCxt: passWithTmodeHard(4096): cfg 1 elements; (1*4) cfg bytes != (6) buffer bytes");

  parsers::testing::ResetAPIErrorMessage();
  c = {};
  ByteRecordBuffer window;
  window.Record(8193, {1, 2, 3, 4, 5}).Record(4096, {1});
  parsers::testing::g_adds_before_failure = 3;
  EXPECT_EQ(Parse(c, window), 0u);
  EXPECT_TRUE(c.pairs.empty());  // no partial run of the failed array
  EXPECT_EQ(GetAPIErrorMessage(), "VSPMSPParseBufferToCxt: avg_rd_window_size(8193): Error adding 5 elements to context");
  parsers::testing::ResetAPIErrorMessage();
  parsers::testing::g_adds_before_failure = 0;
  ByteRecordBuffer one;
  one.Record(4096, {1});
  EXPECT_EQ(Parse(c, one), 0u);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPMSPParseBufferToCxt: passWithTmodeHard(4096): Error adding 1 elements to context");
}

}  // namespace
