// The daily collection's own keys and records through whole runs: disk
// usage, the kernel's ECC events, network data usage, the storage
// structured log and the reporting channels.
#include <future>
#include <set>

#include "../records.h"
#include "../test_values.h"
#include "sim/default_device.h"
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
  // An event leaves the queue only once it is recorded: the eleventh, read
  // but not recorded, waits for the next run with the twelfth.
  r = Tallyrun({"-f"});
  records = EccRecords();
  ASSERT_EQ(records.size(), 12u);
  EXPECT_EQ(records[10].Get("id"), cf::Value::SInt32(11));
  EXPECT_EQ(records.back().Get("id"), cf::Value::SInt32(12));

  // An unexpected failure is logged once; an empty queue is silent.
  WritePlist("device/ecc-events.plist", cf::Array({Dict({{"errno", cf::Value::SInt32(5)}})}));
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<default>: Unexpected errno (5) reading ECC events from kernel\n"), 1u);
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "Unexpected errno"), 0u);
  EXPECT_EQ(EccRecords().size(), 12u);
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

TEST_F(CollectRun, TheDefaultDevicesSimpleFieldChannelsBecomeKeys) {
  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Scalar("com.velmora.ioreport.CPU0"), "52840") << r.err;  // named by its ID
  EXPECT_EQ(Scalar("com.velmora.ioreport.GPUEnergy"), "1200");
  EXPECT_EQ(Scalar("com.velmora.ioreport.HostReadMiB"), "30512");
  EXPECT_EQ(Scalar("com.velmora.ioreport.QueueDepth"), "(missing)");  // not the field category
  EXPECT_EQ(Scalar("com.velmora.ioreport.PerformanceStates"), "(missing)");
  EXPECT_EQ(Scalar("com.velmora.ioreport.ReadLatency"), "(missing)");

  // A hub whose buffer cannot be refreshed: the values stay as they were
  // and the rest of the collection still runs.
  WritePlist("device/ioreport.plist", Dict({{"4294970144", Dict({{"1", cf::Value::SInt64(31000)}})}}));
  cf::Array registry = sim::DefaultStorageDevice().registry.AsArray()->MutableCopy();
  for (size_t i = 0; i < registry.size(); ++i) {
    cf::Dictionary service = registry[i].AsDictionary()->MutableCopy();
    if (service.Get("class") == cf::Value("IOReportHub"))
      service.Set("properties", Dict({{"failSelectors", cf::Array({cf::Value::SInt64(3)})}}));
    registry.Set(i, service);
  }
  WritePlist("device/registry.plist", registry);
  WritePlist("device/answers.plist",
             Dict({{"DiskUsage", Dict({{"TotalDiskCapacity", cf::Value::SInt64(64000000000)}})}}));
  r = Tallyrun({"-f"});
  EXPECT_EQ(Scalar("com.velmora.ioreport.HostReadMiB"), "30512") << r.err;
  EXPECT_EQ(Scalar("com.velmora.homedeck.DiskUsageUserTotalBlocks"), "61035");
  // Working again, the day's value is replaced.
  WritePlist("device/registry.plist", sim::DefaultStorageDevice().registry);
  r = Tallyrun({"-f"});
  EXPECT_EQ(Scalar("com.velmora.ioreport.HostReadMiB"), "31000") << r.err;
  EXPECT_EQ(Scalar("com.velmora.ioreport.CPU0"), "0");  // no longer in the file
}

TEST_F(CollectRun, OnlyTheSimpleFieldChannelsOfAHubBecomeKeys) {
  auto channel = [](int64_t id, uint64_t format, uint64_t elements, const char* name) {
    return cf::Value(cf::Array({cf::Value::SInt64(id),
                                cf::Value::SInt64(static_cast<int64_t>(format | (0x0100ull << 16) | (elements << 32))),
                                cf::Value(name)}));
  };
  // Besides the two simple channels and a histogram, state channels large
  // enough that subscribing to them all would overflow the hub's buffer:
  // they must be pruned before subscribing, or no key is written at all.
  cf::Array channels({channel(1, 1, 1, "Alpha"), channel(2, 1, 1, "Beta"), channel(3, 3, 2, "Spread")});
  for (int i = 0; i < 17; ++i) channels.Append(channel(100 + i, 2, 65535, "Huge"));
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  cf::Array registry({(*device.registry.AsArray())[0]});
  registry.Append(Dict({{"class", "IOReportHub"}, {"id", cf::Value::UInt64(0x500)}, {"userClient", "hub"}}));
  registry.Append(Dict(
      {{"class", "Sensors"},
       {"name", "sensors"},
       {"id", cf::Value::UInt64(0x600)},
       {"properties",
        Dict({{"IOReportLegendPublic", cf::Value::Bool(true)},
              {"IOReportLegend",
               cf::Array({cf::Value(Dict({{"IOReportGroupName", "Sensors"},
                                          {"IOReportChannels",
                                           channels}}))})}})}}));
  WritePlist("device/registry.plist", registry);
  WritePlist("device/ioreport.plist",
             Dict({{"1536", Dict({{"1", cf::Value::SInt64(11)},
                                  {"2", cf::Value::SInt64(-22)},
                                  {"3", cf::Array({cf::Value(cf::Array({cf::Value::SInt64(4), cf::Value::SInt64(1),
                                                                        cf::Value::SInt64(9), cf::Value::SInt64(20)})),
                                                   cf::Value(cf::Array({cf::Value::SInt64(2)}))})}})}}));
  const RunResult r = Tallyrun({"-f"});
  const RunResult dump =
      RunProgram(TALLYBOOK_BIN, {"dump", "--day", std::to_string(kToday), "--prefix", "com.velmora.ioreport."}, env);
  EXPECT_EQ(dump.out, std::to_string(kToday) + " com.velmora.ioreport.Alpha 11\n" + std::to_string(kToday) +
                          " com.velmora.ioreport.Beta -22\n")
      << r.err;
}

std::string Right(size_t width, const std::string& text) {
  return std::string(width > text.size() ? width - text.size() : 0, ' ') + text;
}

TEST_F(CollectRun, DevsimShowsEveryChannelsChangeOverAnInterval) {
  // Between the two samples the first driver's counters double, so the
  // change equals what they held before.
  const cf::Value before = ReadPlist(root / "device/ioreport.plist");
  ASSERT_TRUE(before.AsDictionary());
  cf::Dictionary after = before.AsDictionary()->MutableCopy();
  cf::Dictionary pmgr_values;
  for (const auto& [id, value] : *before.AsDictionary()->Get("4294970128").AsDictionary()) {
    if (const cf::Number* n = value.AsNumber()) {
      pmgr_values.Set(id, cf::Value::SInt64(2 * n->AsSInt64()));
      continue;
    }
    cf::Array states;  // [state ID, transitions, residency]
    for (const cf::Value& state : *value.AsArray()) {
      const cf::Array& s = *state.AsArray();
      states.Append(cf::Value(cf::Array({s[0], cf::Value::SInt64(2 * s[1].AsNumber()->AsSInt64()),
                                         cf::Value::SInt64(2 * s[2].AsNumber()->AsSInt64())})));
    }
    pmgr_values.Set(id, states);
  }
  after.Set("4294970128", pmgr_values);
  auto running = std::async(std::launch::async, [&] {
    return RunProgram(DEVSIM_BIN, {"ioreport", root.path(), "--interval", "4"}, env);
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  WritePlist("device/ioreport.plist", after);
  RunResult r = running.get();
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.err, "");
  const std::string pmgr = "pmgr <id 0x100000b10> ";
  const std::string expected =
      pmgr + "CPU0 < 0x43505530 (mJ) | G/g Energy Model/(none) | cat 0x100 | format 0x01 | elts 1 >\n" + "  " +
      Right(32, "CPU0") + " = { " + Right(12, "52840") + " mJ }\n" + pmgr +
      "GPUEnergy < 0x2 (mJ) | G/g Energy Model/(none) | cat 0x100 | format 0x01 | elts 1 >\n" + "  " +
      Right(32, "GPUEnergy") + " = { " + Right(12, "1200") + " mJ }\n" + pmgr +
      "PerformanceStates < 0x3 (us) | G/g CPU States/(none) | cat 0x100 | format 0x02 | elts 3 >\n" + "  " +
      Right(20, "PerformanceStates") + "[     OFF] = { # 40       6.120e+01 s / 70.8% }\n" + "  " +
      Right(20, "PerformanceStates") + "[     LOW] = { # 310      1.800e+01 s / 20.8% }\n" + "  " +
      Right(20, "PerformanceStates") + "[    HIGH] = { # 275      7.200e+00 s /  8.3% }\n";
  EXPECT_EQ(r.out.substr(0, expected.size()), expected);
  // The second driver did not change.
  EXPECT_NE(r.out.find("  " + Right(20, "ReadLatency") + "[" + Right(12, "0") + " - " + Right(12, "100") +
                       " us] = { <no hits>; # 0 }\n"),
            std::string::npos) << r.out;
  EXPECT_NE(r.out.find("nvme-report <id 0x100000b20> QueueDepth < 0x2 ((null)) | G/g Storage/(none) | cat 0x02 |"),
            std::string::npos);

  // The field category only, as JSON.
  r = RunProgram(DEVSIM_BIN, {"ioreport", root.path(), "--interval", "0", "--category", "0x100", "--json"}, env);
  ASSERT_EQ(r.status, 0) << r.err;
  const cf::Value json = cf::ParseJSON(r.out).value;
  ASSERT_TRUE(json.AsArray()) << r.out;
  std::set<std::string> names;
  for (const cf::Value& c : *json.AsArray()) {
    names.insert(*c.AsDictionary()->Get("channel").AsString());
    if (c.AsDictionary()->Get("format") == cf::Value("simple")) {
      EXPECT_EQ(c.AsDictionary()->Get("delta"), cf::Value::SInt64(0));
    }
  }
  EXPECT_EQ(names, (std::set<std::string>{"CPU0", "GPUEnergy", "PerformanceStates", "HostReadMiB", "ReadLatency"}));

  // A hub that cannot map its buffer.
  cf::Array registry = sim::DefaultStorageDevice().registry.AsArray()->MutableCopy();
  for (size_t i = 0; i < registry.size(); ++i) {
    cf::Dictionary service = registry[i].AsDictionary()->MutableCopy();
    if (service.Get("class") == cf::Value("IOReportHub"))
      service.Set("properties", Dict({{"failMap", cf::Value::Bool(true)}}));
    registry.Set(i, service);
  }
  WritePlist("device/registry.plist", registry);
  r = RunProgram(DEVSIM_BIN, {"ioreport", root.path()}, env);
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "devsim: " + root.path() +
                       ": the reporting hub could not be subscribed to: Mach error 0xe00002bc: IOConnectMapMemory() failed\n");
}

}  // namespace
