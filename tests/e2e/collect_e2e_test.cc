// The daily collection's own keys and records through whole runs: disk
// usage, the kernel's ECC events, network data usage and the storage
// structured log.
#include "../records.h"
#include "../test_values.h"
#include "root_fixture.h"

namespace {

class CollectRun : public RootTest {
 protected:
  std::string Scalar(const std::string& key) {
    const RunResult dump = RunProgram(TALLYBOOK_BIN, {"dump", "--day", std::to_string(kToday), "--prefix", key}, env);
    const size_t at = dump.out.find(key + " ");
    return at == std::string::npos ? "(missing)" : dump.out.substr(at + key.size() + 1, dump.out.find('\n', at) - at - key.size() - 1);
  }
  std::vector<cf::Dictionary> EccRecords() { return Records(172); }
  std::vector<cf::Dictionary> Records(int type) {
    return StructuredRecords(root / "var/faultkeep/structured_2026-11-22.jsonl", type);
  }
  // A usage service answering one process's counters, begun today at 10:00.
  void UsageAnswer(int64_t bytes, std::initializer_list<std::pair<const char*, cf::Value>> options) {
    cf::Dictionary answer = Dict(options);
    cf::Dictionary record = Dict({{"procName", "P"}, {"sinceTime", cf::Date{1795341600}}});
    for (const char* field : {"wifiInBytes", "wifiOutBytes", "wwanInBytes", "wwanOutBytes"})
      record.Set(field, cf::Value::SInt64(bytes));
    answer.Set("records", cf::Array({record}));
    WritePlist("device/usage.plist", answer);
  }
  cf::Value Baseline() {
    const cf::Value v = ReadPlist(root / "Library/Preferences/com.velmora.diagvault.tallyrun.plist");
    return v.AsDictionary() ? v.AsDictionary()->Get("netUsageBaseline") : cf::Value();
  }
};

TEST_F(CollectRun, DiskUsageInMiB) {
  WritePlist("device/answers.plist",
             Dict({{"DiskUsage", Dict({{"TotalDiskCapacity", cf::Value::SInt64(64000000000)}})}}));
  Tallyrun({"-f"});
  EXPECT_EQ(Scalar("com.velmora.homedeck.DiskUsageUserTotalBlocks"), "61035");
  EXPECT_EQ(Scalar("com.velmora.homedeck.DiskUsageUserBlocksFree"), "-1");  // the entry is missing
  WritePlist("device/answers.plist", Dict({{"DiskUsage", cf::Value::Bool(false)}}));
  Tallyrun({"-f"});
  EXPECT_EQ(Scalar("com.velmora.homedeck.DiskUsageUserTotalBlocks"), "-1");
  // No entry at all: the root's own filesystem.
  WritePlist("device/answers.plist", cf::Dictionary());
  Tallyrun({"-f"});
  EXPECT_GT(std::stoll(Scalar("com.velmora.homedeck.DiskUsageUserTotalBlocks")), 0);
}

TEST_F(CollectRun, EccEventsTenARunEachReadOnce) {
  cf::Array queue;
  for (int i = 1; i <= 12; ++i)
    queue.Append(Dict({{"id", cf::Value::SInt32(i)},
                       {"count", cf::Value::SInt32(i == 1 ? 0 : 2)},
                       {"reg", cf::Array({cf::Value::SInt64(-i), cf::Value::SInt64(int64_t{1} << 40)})}}));
  WritePlist("device/ecc-events.plist", queue);
  RunResult r = Tallyrun({"-f"});
  auto records = EccRecords();
  ASSERT_EQ(records.size(), 10u) << r.err;
  EXPECT_EQ(cf::Value(records[0]), cf::Value(Dict({{"id", cf::Value::SInt32(1)}, {"count", cf::Value::SInt32(0)}})));
  EXPECT_EQ(cf::Value(records[1]), cf::Value(Dict({{"id", cf::Value::SInt32(2)},
                                                   {"count", cf::Value::SInt32(2)},
                                                   {"reg0", cf::Value::SInt64(-2)},
                                                   {"reg1", cf::Value::SInt64(int64_t{1} << 40)}})));
  EXPECT_EQ(Count(r.err, "Unexpected errno"), 0u);
  // The read after the tenth took the eleventh; the next run logs the twelfth.
  r = Tallyrun({"-f"});
  records = EccRecords();
  ASSERT_EQ(records.size(), 11u);
  EXPECT_EQ(records.back().Get("id"), cf::Value::SInt32(12));

  // An unexpected failure is logged once; an empty queue is silent.
  WritePlist("device/ecc-events.plist", cf::Array({Dict({{"errno", cf::Value::SInt32(5)}})}));
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<default>: Unexpected errno (5) reading ECC events from kernel\n"), 1u);
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "Unexpected errno"), 0u);
  EXPECT_EQ(EccRecords().size(), 11u);
}

TEST_F(CollectRun, TheDefaultDeviceGivesItsStorageRecordsAndAWeeklyStatusLog) {
  auto status_logs = [&] { return FilesEndingIn(root / "var/diagvault/submissions", ".165"); };
  RunResult r = Tallyrun({"-f"});
  auto logs = status_logs();
  ASSERT_EQ(logs.size(), 1u) << r.err;
  EXPECT_NE(logs[0].find(";UserWamp:2.30;"), std::string::npos) << logs[0];
  EXPECT_NE(logs[0].find(";ValidityList[2]:17,4,9;"), std::string::npos);
  EXPECT_EQ(EccRecords().size(), 3u);
  const auto storage = Records(176);
  size_t defects = 0;
  for (const cf::Dictionary& d : storage) defects += d.Find("Reason") != nullptr;
  EXPECT_EQ(defects, 2u);
  EXPECT_EQ(Count(r.err, "not supported"), 0u) << r.err;

  // The same week: the lists are fetched again, the log is not.
  r = Tallyrun({"-f"});
  EXPECT_EQ(status_logs().size(), 1u);
  EXPECT_EQ(Count(r.err, "NANDLogWriter:Last written at 2026-11-22 15:00:00 +0000 current "), 1u) << r.err;
  env["TALLYRUN_NOW"] = "2026-11-29T15:00:00Z";
  r = Tallyrun({"-f"});
  EXPECT_EQ(status_logs().size(), 2u) << r.err;
}

TEST_F(CollectRun, DataUsageOfTheDefaultRootCountsGrowthOnly) {
  for (int run = 0; run < 2; ++run) {  // the second run sees the same counters: nothing grew
    const RunResult r = Tallyrun({"-f"});
    EXPECT_EQ(Scalar("datausage.wifiInKB.com.example.maps"), "51200") << r.err;
    EXPECT_EQ(Scalar("datausage.wifiInKB.com.example.podcasts"), "716800");
    EXPECT_EQ(Scalar("datausage.olddata.com.velmora.netsyncd"), "1");
    EXPECT_EQ(Baseline().AsDictionary() ? Baseline().AsDictionary()->size() : 0u, 3u);
  }
  // No usage file: an empty answer at once, which empties the baseline.
  std::filesystem::remove(root / "device/usage.plist");
  EXPECT_EQ(Count(Tallyrun({"-f"}).err, "Vitalis timed out"), 0u);
  EXPECT_EQ(Baseline(), cf::Value(cf::Dictionary()));
}

TEST_F(CollectRun, UsageServiceWithoutAnAnswerDoesNotHoldTheRun) {
  Tallyrun({"-f"});
  const cf::Value baseline = Baseline();
  for (const bool malformed : {false, true}) {
    if (malformed) WritePlist("device/usage.plist", cf::Array({cf::Value("records")}));
    else UsageAnswer(10240, {{"neverReply", cf::Value::Bool(true)}});
    const auto start = std::chrono::steady_clock::now();
    const RunResult r = Tallyrun({"-f"});
    // Liveness, not timing: the wait is bounded, so the run ends.
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(30));
    EXPECT_EQ(Count(r.err, "<default>: Vitalis timed out, no datausage available\n"), 1u) << r.err;
    EXPECT_EQ(Count(r.err, "<error>: The usage service cannot answer: " + root / "device/usage.plist" +
                               " is an array, not a dictionary\n"),
              malformed ? 1u : 0u);
    EXPECT_EQ(Baseline(), baseline) << "no answer keeps the baseline";
  }
}

TEST_F(CollectRun, LateRepliesStillCount) {
  // Within the wait.
  UsageAnswer(10240, {{"delaySeconds", cf::Value::SInt32(3)}});
  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Scalar("datausage.wwanOutKB.com.velmora.P"), "10") << r.err;
  EXPECT_EQ(Count(r.err, "Vitalis timed out"), 0u);
  // After the wait, while the service still runs: the growth is counted.
  UsageAnswer(20480, {{"delaySeconds", cf::Value::SInt32(12)}});
  env["TALLYRUN_SERVICE_IDLE_SECONDS"] = "8";
  r = Serve({{"run-day", std::to_string(kToday - 1)}});
  EXPECT_EQ(Count(r.err, "<default>: Vitalis timed out, no datausage available\n"), 1u) << r.err;
  EXPECT_EQ(Scalar("datausage.wwanOutKB.com.velmora.P"), "20");
}

}  // namespace
