// devsim's triage commands on raw buffers written by the encoders.
#include <gtest/gtest.h>

#include "../temp_dir.h"
#include "parsers/parsers.h"
#include "platform/files.h"
#include "run.h"
#include "sim/statistics_buffers.h"

namespace {

class DevsimParseTest : public ::testing::Test {
 protected:
  TempDir dir;
  std::string Write(const std::string& name, const std::string& bytes) {
    EXPECT_TRUE(platform::WriteFileAtomically(dir / name, bytes));
    return dir / name;
  }
  RunResult Devsim(const std::vector<std::string>& args) { return RunProgram(DEVSIM_BIN, args, {}); }
};

TEST_F(DevsimParseTest, BuffersPrintPairsResultAndError) {
  sim::WordRecordBuffer ftl;
  ftl.Record(14, {1, 2, 3}).Record(53, {(1ull << 32) + 2}).End();
  const std::string file = Write("ftl.bin", ftl.bytes());
  RunResult r = Devsim({"parse", "ftl", file});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out,
            "hostWriteLogHisto_0 1\nhostWriteLogHisto_1 2\nhostWriteLogHisto_2 3\nexportVersion 4294967298\nresult 4\n"
            "error: VSPFTLParseBufferToCxt: hostWriteLogHisto(14): (#10) cfg elements != (3) buffer elements\n");
  r = Devsim({"parse", "stats", file});
  EXPECT_EQ(r.out, "hostWriteLogHisto0 1\nhostWriteLogHisto1 2\nhostWriteLogHisto2 3\nexportVersion 4294967298\nresult 1\n");

  sim::ByteRecordBuffer msp;
  msp.Record(8193, {4, 5}).Record(4096, {9}).End();
  r = Devsim({"parse", "msp", Write("msp.bin", msp.bytes())});
  EXPECT_EQ(r.out,
            "avg_rd_window_size0 4\navg_rd_window_size1 5\npassWithTmodeHard 9\nresult 3\n"
            "error: VSPMSPParseBufferToCxt: avg_rd_window_size(8193): cfg 5 elements; (5*4) cfg bytes != (8) buffer bytes\n");
  r = Devsim({"parse", "msp", Write("empty.bin", "")});
  EXPECT_EQ(r.out, "result 0\nerror: VSPMSPParseBufferToCxt: Passed in invalid buffer or empty buffer\n");

  r = Devsim({"parse", "ftl", dir / "missing.bin"});
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(r.err.rfind("devsim: cannot open " + (dir / "missing.bin") + ": ", 0), 0u) << r.err;
  EXPECT_EQ(Devsim({"parse", "ftl", dir.path()}).status, 2);  // a directory
  EXPECT_EQ(Devsim({"parse", "nand", file}).status, 2);
}

TEST_F(DevsimParseTest, SnapshotsInBothForms) {
  std::vector<uint32_t> words(63, 0);
  words[0] = 12;
  words[39] = 123456;
  const std::string fixed = Write("fixed.bin", sim::FixedSnapshotRecord(words));
  RunResult r = Devsim({"snapshot", fixed});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out.substr(0, std::string(kSnapshotLegend).size()), kSnapshotLegend);
  EXPECT_NE(r.out.find("T=0012 E=00 HR=   0 HW=   0 NR=   0 NW=   0 TH=     123.45 "), std::string::npos);

  sim::SnapshotBuilder b(6, 8);
  b.Legend("A - alpha").Field(0, 0, 0, "A=%u").Field(2, 4, 0, " B=%u.%02u");
  for (uint32_t i = 1; i <= 4; ++i) b.Record({i, i * 1500});
  const std::string header = Write("header.bin", b.Header());
  r = Devsim({"snapshot", Write("data.bin", b.Data()), "--header", header});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out, "- VSP Snapshot - \nA - alpha\nA=1 B=1.50\nA=2 B=3.00\nA=3 B=4.50\n");
  EXPECT_EQ(Devsim({"snapshot", fixed, "--header", dir / "nope"}).status, 2);
}

// A dump longer than devsim's 64 KiB pieces: every record is printed, the
// ones that end a piece and, in the second snapshot, records whose text
// alone is longer than a piece.
TEST_F(DevsimParseTest, SnapshotLongerThanOnePiecePrintsEveryRecord) {
  struct Case {
    const char* what;
    uint32_t triples;  // per-priority triples of each record, after its first word
    uint32_t records;  // the last of them is never printed
  };
  const Case cases[] = {
      {"8000 short records, about 118 KiB", 0, 8001},
      {"3 records of about 80 KiB each", 4000, 4},
  };
  for (const Case& k : cases) {
    sim::SnapshotBuilder b(6, 8 + 12 * k.triples);
    b.Legend("A - alpha\nB - beta").Field(0, 0, 0, "A=%u").Field(0, 4, 0, " B=%u");
    if (k.triples) b.Field(3, 8, 12 * k.triples, " %s=");
    std::string expected = "- VSP Snapshot - \nA - alpha\nB - beta\n";
    char text[64];
    for (uint32_t i = 0; i < k.records; ++i) {
      const uint32_t a = i + 1, bee = (i * 7919) % 100000;
      b.Record({a, bee});
      if (i + 1 == k.records) break;
      std::snprintf(text, sizeof text, "A=%u B=%u", a, bee);
      expected += text;
      if (k.triples) {
        const struct {
          const char* letter;
          const char* zero;
        } parts[] = {{"O", "   0"}, {"L", "      0"}, {"M", "    0"}};
        for (const auto& part : parts) {
          expected += std::string(" ") + part.letter + "=" + part.zero;
          for (uint32_t t = 1; t < k.triples; ++t) expected += std::string("/") + part.zero;
        }
      }
      expected += "\n";
    }
    ASSERT_GT(expected.size(), 65536u) << k.what;
    const RunResult r =
        Devsim({"snapshot", Write("big.bin", b.Data()), "--header", Write("big_header.bin", b.Header())});
    EXPECT_EQ(r.status, 0) << k.what;
    EXPECT_EQ(r.out.size(), expected.size()) << k.what;
    EXPECT_TRUE(r.out == expected) << k.what;  // not printed whole: it is long
    const std::string last = "A=" + std::to_string(k.records - 1) + " ";
    EXPECT_NE(r.out.rfind("\n" + last), std::string::npos) << k.what << ": the last record is missing";
  }
}

}  // namespace
