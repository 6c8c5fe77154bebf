// The storage controller's figures through whole daily runs: on a day that
// writes the store's NAND keys, and on a device without a controller.
#include "root_fixture.h"

namespace {

class NANDInfoRun : public RootTest {
 protected:
  // 2026-11-21 is day 20778 in UTC, even: with the default device's boot
  // session (first digit 7, odd) it is a day that writes the NAND keys.
  void SetUp() override {
    env["TALLYRUN_NOW"] = "2026-11-21T15:00:00Z";
    RootTest::SetUp();
  }
  std::map<std::string, std::string> Keys() {
    std::map<std::string, std::string> out;
    const RunResult dump = RunProgram(TALLYBOOK_BIN, {"dump", "--day", "20778", "--prefix", "com.velmora.NANDInfo."}, env);
    size_t start = 0;
    while (start < dump.out.size()) {
      const size_t end = dump.out.find('\n', start);
      const std::string line = dump.out.substr(start, end - start);
      start = end == std::string::npos ? dump.out.size() : end + 1;
      const size_t a = line.find(' '), b = line.rfind(' ');
      if (a != std::string::npos && b > a) out[line.substr(a + 1, b - a - 1)] = line.substr(b + 1);
    }
    return out;
  }
};

TEST_F(NANDInfoRun, AStoreDayWritesTheControllersKeys) {
  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "NANDInfo: CopyNANDInfoWithOptions: obtaining FTL data for TBKD"), 2u);  // log and stderr
  const auto keys = Keys();
  EXPECT_GT(keys.size(), 700u) << r.err;
  for (const auto& [key, value] : std::vector<std::pair<std::string, std::string>>{
           {"com.velmora.NANDInfo.maxMemChokeDuration", "123000"},  // three significant digits
           {"com.velmora.NANDInfo.memChokeDuration", "123456"},
           {"com.velmora.NANDInfo.NumLogicalWrites", "1843261440"},
           {"com.velmora.NANDInfo.DriverVersion", "-1"},             // never set by the parser
           {"com.velmora.NANDInfo.IntermediatePartitionSize", "32768"},
           {"com.velmora.NANDInfo.formatDaysSince2000", "1304"},     // weeks, despite the name
           {"com.velmora.NANDInfo.MaintenanceRequestsFailedRead", "1"},
           {"com.velmora.NANDInfo.MaintenanceRequestsFailedProg", "0"},
           {"com.velmora.NANDInfo.MaintenanceRequestsFailedErase", "0"},
           {"com.velmora.NANDInfo.VMFreezer.NumPhysicalWrites", "2147483648"},
           {"com.velmora.NANDInfo.Purgewell.TotalPurgeableBytes", "6442450944"}}) {
    EXPECT_EQ(keys.count(key) ? keys.at(key) : "(missing)", value) << key;
  }
  EXPECT_TRUE(keys.count("com.velmora.NANDInfo.BandsPerInternalFlow3"));  // from bandsPerSpecialFlow4
  EXPECT_TRUE(keys.count("com.velmora.NANDInfo.NumMaintenanceRequests"));
  EXPECT_FALSE(keys.count("com.velmora.NANDInfo.ErrorMessage"));
}

TEST_F(NANDInfoRun, WithoutAControllerNothingIsWritten) {
  WritePlist("device/registry.plist", cf::Array());
  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<default>: error reading nand info, error 1 with message Unable to parse buffer\n"), 1u)
      << r.err;
  // The write amplification, the structured log and the NAND info each look.
  EXPECT_EQ(Count(r.err, "Could not get matching IOKit service for exporting classes\n"), 3u);
  EXPECT_TRUE(Keys().empty());
}

}  // namespace

namespace {

TEST_F(NANDInfoRun, DevsimShowsTheControllerOfARoot) {
  const RunResult shown = RunProgram(DEVSIM_BIN, {"controller", root.path()}, env);
  ASSERT_EQ(shown.status, 0) << shown.err;
  const cf::Value json = cf::ParseJSON(shown.out).value;
  ASSERT_NE(json.AsDictionary(), nullptr) << shown.out;
  EXPECT_EQ(json.AsDictionary()->Get("com.velmora.NANDInfo.NumLogicalWrites").AsNumber()->AsSInt64(), 1843261440);
  EXPECT_EQ(json.AsDictionary()->Get("com.velmora.NANDInfo.VMFreezer.NumPhysicalWrites").AsNumber()->AsSInt64(),
            2147483648);

  WritePlist("device/registry.plist", cf::Array());
  const RunResult none = RunProgram(DEVSIM_BIN, {"controller", root.path()}, env);
  EXPECT_EQ(none.status, 1);
  EXPECT_NE(none.err.find("devsim: the controller of " + root.path() + " could not be read"), std::string::npos)
      << none.err;
}

}  // namespace
