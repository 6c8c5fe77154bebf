// The storage controller's figures through whole daily runs: on a day that
// writes the store's NAND keys, and on a device without a controller.
#include <set>

#include "../records.h"
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
  std::map<std::string, std::string> Keys(const std::string& day = "20778", const std::string& prefix = "com.velmora.NANDInfo.") {
    std::map<std::string, std::string> out;
    const RunResult dump = RunProgram(TALLYBOOK_BIN, {"dump", "--day", day, "--prefix", prefix}, env);
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
  // The analytics events sent, in order, other than the app installs.
  std::vector<cf::Dictionary> Events() {
    std::vector<cf::Dictionary> out;
    for (const cf::Dictionary& e : JSONLines(root / "var/eventlens/events.jsonl"))
      if (e.Get("event") != cf::Value("com.velmora.homedeck.appInstalls")) out.push_back(e);
    return out;
  }
};

TEST_F(NANDInfoRun, AnAnalyticsDaySendsEveryViewAndStoresTheNumbers) {
  // 2026-11-22 is day 20779, odd like the boot session's first digit.
  env["TALLYRUN_NOW"] = "2026-11-22T15:00:00Z";
  const RunResult r = Tallyrun({"-f"});
  std::map<std::string, std::vector<cf::Dictionary>> sent;
  for (const cf::Dictionary& e : Events()) sent[*e.Get("event").AsString()].push_back(*e.Get("payload").AsDictionary());
  EXPECT_EQ(sent.size(), 4u + 36u) << r.err;
  for (const auto& [event, payloads] : sent)
    EXPECT_EQ(payloads.size(), event == "com.velmora.massStorage.NANDInfo.MSPCounters_1" ? 2u : 1u) << event;

  const auto& counters = sent["com.velmora.massStorage.NANDInfo.FTLCounters_1"];
  ASSERT_EQ(counters.size(), 1u);
  EXPECT_TRUE(counters[0].Get("hostWrites").AsNumber());
  EXPECT_FALSE(counters[0].Contains("ESR_APIErrorMessage"));
  ASSERT_EQ(sent["com.velmora.massStorage.NANDInfo.FTLHistograms_1"].size(), 1u);
  EXPECT_TRUE(sent["com.velmora.massStorage.NANDInfo.FTLHistograms_1"][0].Get("bandsMaxTempHisto_21").AsNumber());
  std::set<std::string> indexes;
  for (const cf::Dictionary& msp : sent["com.velmora.massStorage.NANDInfo.MSPCounters_1"]) {
    indexes.insert(*msp.Get("msp_index").AsString());
    EXPECT_EQ(msp.Get("total_nof_msps"), cf::Value::SInt32(2));
    EXPECT_FALSE(msp.Contains("higher_die_temperature20"));
  }
  EXPECT_EQ(indexes, (std::set<std::string>{"0", "1"}));
  ASSERT_EQ(sent["com.velmora.massStorage.NANDInfo.StorageStats_1"].size(), 1u);
  EXPECT_NE(sent["com.velmora.massStorage.NANDInfo.StorageStats_1"][0].Get("EAN_imageSize_BIC"), cf::Value::SInt32(0));

  // The group events: the main group's renamed fields carry their sources'
  // values, and the last group is all zeros.
  const auto& main_group = sent["com.velmora.massstorage.NANDInfo"];
  ASSERT_EQ(main_group.size(), 1u);
  EXPECT_EQ(main_group[0].size(), 50u);
  EXPECT_EQ(main_group[0].Get("DriverVersion"), main_group[0].Get("DemoMode"));
  EXPECT_EQ(main_group[0].Get("BitFlipDupesParityWidget"), main_group[0].Get("BitFlipCountParityWidget"));
  EXPECT_EQ(main_group[0].Get("Error"), cf::Value("empty"));
  const auto& last_group = sent["com.velmora.massstorage.VSPMSPInfo_1"];
  ASSERT_EQ(last_group.size(), 1u);
  EXPECT_EQ(last_group[0].size(), 285u);
  for (const auto& [field, value] : last_group[0]) EXPECT_EQ(value, cf::Value::SInt32(0)) << field.Description();
  const auto& second_group = sent["com.velmora.massstorage.NANDInfo_2"];
  ASSERT_EQ(second_group.size(), 1u);
  EXPECT_GT(second_group[0].Get("DiskUsageUserTotalBlocks").AsNumber()->AsSInt64(), 0);

  // The analytics dictionary's numbers are today's scalars; its messages are not.
  const auto keys = Keys("20779", "");
  EXPECT_TRUE(keys.count("hostWrites")) << r.err;
  EXPECT_TRUE(keys.count("EAN_updateCount_FW"));
  EXPECT_FALSE(keys.count("ESR_APIErrorMessage"));
  EXPECT_FALSE(keys.count("com.velmora.NANDInfo.ErrorMessage"));
  EXPECT_FALSE(keys.count("com.velmora.NANDInfo.NumLogicalWrites"));  // no store dictionary that day
}

TEST_F(NANDInfoRun, AnEventNotInUseIsRefusedAndSaidSo) {
  cf::Array enabled;
  enabled.Append(cf::Value("com.velmora.massStorage.NANDInfo.StorageStats_1"));
  WritePlist("var/eventlens/enabled-events.plist", enabled);
  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "NANDInfo: createAndLogMSPFieldsToEventLensForEvent: FAILED to log "
                         "massStorage_NANDInfo_MSPCounters_1 using AnalyticsSendEventLazy\n"),
            2u)  // two MSPs, each once: the mirrored log does not repeat the progress line
      << r.err;
  EXPECT_EQ(Count(r.err, "NANDInfo: createAndLogStorageStatsToEventLensForEvent: SUCCESS in logging "
                         "massStorage_NANDInfo_StorageStats_1 using AnalyticsSendEventLazy\n"),
            1u);
  ASSERT_EQ(Events().size(), 1u);
  EXPECT_EQ(Events()[0].Get("event"), cf::Value("com.velmora.massStorage.NANDInfo.StorageStats_1"));
}

TEST_F(NANDInfoRun, AStoreDayWritesTheControllersKeys) {
  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "NANDInfo: CopyNANDInfoWithOptions: obtaining FTL data for TBKD"), 1u);  // once, mirrored
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

  // Such a day sends only the MSP and storage-statistics views.
  std::map<std::string, int> sent;
  for (const cf::Dictionary& e : Events()) ++sent[*e.Get("event").AsString()];
  EXPECT_EQ(sent, (std::map<std::string, int>{{"com.velmora.massStorage.NANDInfo.MSPCounters_1", 2},
                                              {"com.velmora.massStorage.NANDInfo.StorageStats_1", 1}}));
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

  // Every view, as JSON on standard output even though the service prints
  // progress lines; rounding only on request.
  for (const bool round : {false, true}) {
    std::vector<std::string> args = {"views", root.path()};
    if (round) args.push_back("--round");
    const RunResult views = RunProgram(DEVSIM_BIN, args, env);
    ASSERT_EQ(views.status, 0) << views.err;
    const cf::Value v = cf::ParseJSON(views.out).value;
    ASSERT_NE(v.AsDictionary(), nullptr) << views.out;
    const cf::Dictionary& d = *v.AsDictionary();
    EXPECT_EQ(d.Get("FTL").AsDictionary()->Get("hostWrites").AsNumber()->AsSInt64(), round ? 1843261400 : 1843261440);
    EXPECT_TRUE(d.Get("MSP").AsDictionary()->Get("1").AsDictionary());
    EXPECT_EQ(d.Get("StorageStats").AsDictionary()->Get("EAN_updateCount_dConfig").AsNumber()->AsSInt64(), 27);
    EXPECT_EQ(d.Get("InternalLab").AsDictionary()->Get("com.velmora.NANDInfo.Health.IsNANDRetirable"),
              cf::Value::SInt32(1));
    EXPECT_FALSE(d.Get("OTA").AsDictionary()->Contains("ESR_APIErrorMessage"));
    EXPECT_EQ(d.Get("ContentDeletion"), cf::Value::Bool(false));  // not the controller kind that answers it
  }

  WritePlist("device/registry.plist", cf::Array());
  const RunResult none = RunProgram(DEVSIM_BIN, {"controller", root.path()}, env);
  EXPECT_EQ(none.status, 1);
  EXPECT_NE(none.err.find("devsim: the controller of " + root.path() + " could not be read"), std::string::npos)
      << none.err;
}

}  // namespace
