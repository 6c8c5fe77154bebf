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

}  // namespace
