// The daily job as a process: modes, gate, report, OS changes and the
// service's messages, in a fresh device root made by devsim.
#include <sqlite3.h>

#include <set>
#include <thread>

#include "../store_pages.h"
#include "root_fixture.h"

namespace {

namespace fs = std::filesystem;
using TallyrunTest = RootTest;

TEST_F(TallyrunTest, GatedRunHappensOncePerDay) {
  RunResult r = Tallyrun({"-d"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(Count(r.err, "<default>: tallyrun started\n"), 1u);
  EXPECT_EQ(Count(r.err, "<default>: daily tasks for day 20778\n"), 1u);
  EXPECT_EQ(Count(r.err, "<info>: writing aggregated log. yesterday=20778\n"), 1u);
  EXPECT_EQ(Count(r.err, "<default>: tallyrun ended\n"), 1u);
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));
  ASSERT_EQ(Logs().size(), 1u);
  EXPECT_EQ(fs::path(Logs()[0]).filename(), "log-aggregated_2026-11-22-150000.193");

  const cf::Dictionary log = LastLog();
  EXPECT_EQ(log.Get("TBCrashLogVersion"), cf::Value::SInt64(1));
  EXPECT_EQ(log.Get("TBStartDate"), cf::Value(cf::Date{86400.0 * (kToday - 1)}));
  EXPECT_EQ(log.Get("TBLogCreationDate"), cf::Value(cf::Date{86400.0 * kToday + 15 * 3600}));
  const cf::Dictionary& scalars = *log.Get("TBScalars").AsDictionary();
  EXPECT_TRUE(scalars.Contains("com.velmora.homedeck.Unlocks"));
  EXPECT_TRUE(scalars.Contains("com.velmora.wifi.Roams"));               // by prefix
  EXPECT_FALSE(scalars.Contains("com.velmora.camera.PhotosTaken"));      // not listed
  EXPECT_FALSE(scalars.Contains("com.velmora.debug.Asserts"));           // internal only
  EXPECT_EQ(scalars.Get("com.velmora.power.ChargeCycles"), cf::Value::SInt64(412));
  EXPECT_EQ(scalars.Get("com.velmora.homedeck.AppLaunches").AsNumber()->AsSInt64() % 10, 0);
  EXPECT_EQ(log.Get("TBDistributions").AsDictionary()->Get("com.velmora.power.BatteryTemperatureC").AsArray()->at(4),
            cf::Value::SInt64(288));
  EXPECT_TRUE(log.Get("TBDistributionsHistogram").AsDictionary()->Contains("com.velmora.net.DNSLatencyMs"));
  EXPECT_FALSE(log.Get("TBDistributionsHistogram").AsDictionary()->Contains("com.velmora.net.ThroughputKbps"));
  EXPECT_EQ(log.Get("TBTasking"), cf::Value(cf::Array()));
  EXPECT_EQ(log.Get("TBTaskID"), cf::Value("(no tasking id)"));
  EXPECT_EQ(log.Get("TBTaskDigest"), cf::Value("(no tasking digest)"));
  EXPECT_EQ(log.Get("TBWhitelistDigest").AsString()->size(), 32u);
  EXPECT_FALSE(log.Contains("TBActivatedAppInfo"));
  std::set<std::string> keys;
  for (const auto& [k, v] : log) keys.insert(*k.AsString());
  EXPECT_EQ(keys, (std::set<std::string>{"TBCrashLogVersion", "TBStartDate", "TBLogCreationDate", "TBMetadata",
                                         "TBScalars", "TBDistributions", "TBDistributionsHistogram", "TBTasking",
                                         "TBTaskID", "TBTaskDigest", "TBWhitelistDigest"}));

  r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "<default>: Day unchanged since last run\n"), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  EXPECT_EQ(Logs().size(), 1u);
  // The gate record lost (a run stopped before writing it): the folder
  // says the day went out, so the day's other work runs and nothing more is
  // submitted. A forced run's log does not count.
  const cf::Value description = cf::ParseJSON(*platform::ReadFile(Logs()[0] + ".json")).value;
  EXPECT_EQ(description.AsDictionary()->Get("day"), cf::Value::SInt32(kToday - 1));
  EXPECT_EQ(description.AsDictionary()->Get("gated"), cf::Value::Bool(true));
  const std::string gated_log = fs::path(Logs()[0]).filename();
  Tallyrun({"-f"});
  ASSERT_EQ(Logs().size(), 2u);
  fs::remove(root / ("Library/Preferences/" + kDomain + ".plist"));
  r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "<default>: The aggregated log for day 20778 went out already (" + gated_log +
                             "); it is not submitted twice\n"),
            1u)
      << r.err;
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_EQ(Logs().size(), 2u);
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));

  // A gate record ahead of the clock (the clock was set back) counts as unchanged.
  env["TALLYRUN_NOW"] = "2026-11-20T15:00:00Z";
  EXPECT_EQ(Count(Tallyrun({"-d"}).err, "Day unchanged since last run"), 1u);
  // The next day runs again.
  env["TALLYRUN_NOW"] = "2026-11-23T09:00:00Z";
  EXPECT_EQ(Count(Tallyrun({"-d"}).err, "daily tasks for day 20779"), 1u);
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday));
}

TEST_F(TallyrunTest, OneInstanceAtATime) {
  // Three gated runs at once: the first does the day, the others wait for it
  // and then find the day recorded.
  std::vector<std::thread> runs;
  std::vector<RunResult> results(3);
  for (size_t i = 0; i < results.size(); ++i) runs.emplace_back([&, i] { results[i] = Tallyrun({"-d"}); });
  for (auto& t : runs) t.join();
  EXPECT_EQ(Logs().size(), 1u);
  size_t unchanged = 0;
  for (const RunResult& r : results) unchanged += Count(r.err, "Day unchanged since last run");
  EXPECT_EQ(unchanged, 2u);

  // A service finds another one serving: it leaves, and the first keeps its socket.
  const std::string socket = root / "var/run/com.velmora.tallybookd.tallyrun.sock";
  env["TALLYRUN_SERVICE_IDLE_SECONDS"] = "3";
  std::thread first([&] { results[0] = Tallyrun({}); });
  for (int i = 0; i < 500 && !platform::FileExists(socket); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  ASSERT_TRUE(platform::FileExists(socket));
  const RunResult second = Tallyrun({});
  EXPECT_EQ(Count(second.err, "<default>: Another tallyrun is running; leaving the work to it\n"), 1u);
  EXPECT_TRUE(platform::FileExists(socket));
  EXPECT_EQ(Tallyctl({"logging-status"}).status, 0);  // the first still answers
  first.join();
  EXPECT_FALSE(platform::FileExists(socket));
}

TEST_F(TallyrunTest, ALogHoldsItsOwnDayOnly) {
  // Day 20779 (today at init) has two listed keys on the day before only.
  auto at = [&](const char* now) {
    auto e = env;
    e["TALLYRUN_NOW"] = now;
    return e;
  };
  ASSERT_EQ(RunProgram(TALLYBOOK_BIN, {"set", "com.velmora.wifi.OnlyTheDayBefore", "5"}, at("2026-11-21T12:00:00Z")).status, 0);
  ASSERT_EQ(RunProgram(TALLYBOOK_BIN, {"push", "com.velmora.net.OnlyTheDayBefore", "1.5"}, at("2026-11-21T12:00:00Z")).status, 0);
  env["TALLYRUN_NOW"] = "2026-11-23T09:00:00Z";
  ASSERT_EQ(Count(Tallyrun({"-f"}).err, "writing aggregated log. yesterday=20779"), 1u);
  ASSERT_EQ(Logs().size(), 1u);
  const cf::Dictionary log = LastLog();
  EXPECT_EQ(log.Get("TBStartDate"), cf::Value(cf::Date{86400.0 * kToday}));
  EXPECT_TRUE(log.Get("TBScalars").AsDictionary()->Contains("com.velmora.homedeck.Unlocks"));
  EXPECT_FALSE(log.Get("TBScalars").AsDictionary()->Contains("com.velmora.wifi.OnlyTheDayBefore"));
  EXPECT_FALSE(log.Get("TBDistributions").AsDictionary()->Contains("com.velmora.net.OnlyTheDayBefore"));

  // Day 20780 has no rows of its own: no log at all, not a copy of the day before.
  env["TALLYRUN_NOW"] = "2026-11-24T09:00:00Z";
  ASSERT_EQ(Count(Tallyrun({"-f"}).err, "writing aggregated log. yesterday=20780"), 1u);
  EXPECT_EQ(Logs().size(), 1u);

  // The tool's day still means that day.
  const RunResult dump = RunProgram(TALLYBOOK_BIN, {"dump", "--day", "20778", "--prefix", "com.velmora.wifi.Only"}, env);
  EXPECT_EQ(dump.out, "20778 com.velmora.wifi.OnlyTheDayBefore 5\n");
}

TEST_F(TallyrunTest, ForceTodayAndArguments) {
  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_TRUE(Pref(kGate).IsNull());  // -f neither reads nor writes the gate
  EXPECT_EQ(Logs().size(), 1u);

  r = Tallyrun({"-t"});
  EXPECT_EQ(Count(r.err, "daily tasks for day 20779"), 1u);
  EXPECT_EQ(LastLog().Get("TBStartDate"), cf::Value(cf::Date{86400.0 * kToday}));
  EXPECT_EQ(Logs().size(), 2u);

  r = Tallyrun({"-x", "-d"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(Count(r.err, "<default>: Unknown arg: -x\n"), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  EXPECT_EQ(Logs().size(), 2u);

  r = Tallyrun({"-d", "-f"});  // only the first argument counts
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));
  EXPECT_EQ(Count(Tallyrun({"-d"}).err, "Day unchanged since last run"), 1u);
  EXPECT_EQ(Tallyrun({""}).status, 0);
}

TEST_F(TallyrunTest, DebugLinesOnlyWhenAskedFor) {
  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<debug>"), 0u);
  env["TALLYRUN_LOG_DEBUG"] = "1";
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<debug>: prefix match com.velmora.wifi. for com.velmora.wifi.JoinFailures\n"), 1u);
  EXPECT_EQ(Count(r.err, "<debug>: Treating key com.velmora.net.DNSLatencyMs as a histogram\n"), 1u);
  // Syslog only: on stderr just the storage service's own progress lines,
  // which it always writes there too.
  env.erase("TALLYRUN_LOG_STDERR");
  const std::string err = Tallyrun({"-f"}).err;
  EXPECT_EQ(Count(err, "\n"), Count(err, "NANDInfo: ")) << err;
  EXPECT_EQ(Count(err, "<"), 0u) << err;
}

TEST_F(TallyrunTest, NoLogWithoutSubmissionOrWhitelistedData) {
  cf::Dictionary answers;
  answers.Set("DiagnosticLogSubmissionEnabled", cf::Value::Bool(false));
  WritePlist("device/answers.plist", answers);
  RunResult r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_EQ(Count(r.err, "writing aggregated log"), 0u);
  EXPECT_TRUE(Logs().empty());
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));  // advanced all the same

  fs::remove(root / "device/answers.plist");
  env["TALLYRUN_NOW"] = "2027-01-01T12:00:00Z";  // a day the store has no rows for
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "writing aggregated log"), 1u);
  EXPECT_TRUE(Logs().empty());

  env["TALLYRUN_NOW"] = "2026-11-22T15:00:00Z";
  fs::remove(root / "Library/Application Support/Tallybook/Whitelist_boxOS.plist");
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<error>: Couldn't load whitelist\n"), 1u);
  EXPECT_TRUE(Logs().empty());
  EXPECT_TRUE(Pref("LastOSVersion").IsNull());  // nothing serialized, nothing recorded
}

TEST_F(TallyrunTest, OSChangeIsReportedOnce) {
  auto options_of_last = [&] {
    const auto json = platform::ReadFile(Logs().back() + ".json");
    return cf::ParseJSON(json.value_or("")).value.AsDictionary()->Get("options");
  };
  Tallyrun({"-f"});
  cf::Dictionary first;
  first.Set("previous_os_version", "<unknown>");
  EXPECT_EQ(options_of_last(), cf::Value(first));
  EXPECT_EQ(Pref("LastOSVersion"), cf::Value("4.2 (22C41)"));
  Tallyrun({"-f"});
  EXPECT_EQ(options_of_last(), cf::Value(cf::Dictionary()));

  cf::Dictionary version;
  version.Set("ProductVersion", "4.3");
  version.Set("ProductBuildVersion", "22D10");
  WritePlist("device/system-version.plist", version);
  Tallyrun({"-f"});
  cf::Dictionary changed;
  changed.Set("previous_os_version", "4.2 (22C41)");
  EXPECT_EQ(options_of_last(), cf::Value(changed));
  Tallyrun({"-f"});
  EXPECT_EQ(options_of_last(), cf::Value(cf::Dictionary()));
  EXPECT_EQ(Logs().size(), 4u);
}

TEST_F(TallyrunTest, ServiceRunsTheGateWithRequestedAppInfo) {
  const std::string apps = root / "apps.json";
  ASSERT_TRUE(platform::WriteFileAtomically(apps, R"([
    {"bundle_id": "com.example.notes", "version": "3.1", "adam_id": 123456789, "arch": 16777228,
     "uuid": "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"},
    {"bundle_id": "com.example.maps", "version": "1.0", "adam_id": -1, "arch": 0,
     "uuid": "FFFFFFFF-0000-0000-0000-000000000000"}])"));
  const RunResult r = Serve({{"logging-status"}, {"app-data", apps}});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(Count(r.err, "notified of logging status, waiting for activate app info"), 1u);
  EXPECT_EQ(Count(r.err, "tallyrun got requestedAAI:\n("), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_EQ(Count(r.err, "never received requested AAI"), 0u);
  EXPECT_EQ(Count(*platform::ReadFile(root / "var/run/notifications.log"),
                  "2026-11-22T15:00:00Z com.velmora.tallybookd.tallyrun.logging\n"),
            1u);
  const cf::Value info = LastLog().Get("TBActivatedAppInfo");
  ASSERT_NE(info.AsArray(), nullptr);
  ASSERT_EQ(info.AsArray()->size(), 2u);
  cf::Dictionary first;
  first.Set("bundle", "com.example.notes");
  first.Set("version", "3.1");
  first.Set("adamID", cf::Value::SInt64(123456789));
  first.Set("arch", cf::Value::SInt64(16777228));
  first.Set("uuid", "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");
  EXPECT_EQ(info.AsArray()->at(0), cf::Value(first));
  EXPECT_EQ(info.AsArray()->at(1).AsDictionary()->Get("adamID"), cf::Value::SInt64(-1));
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));
}

TEST_F(TallyrunTest, ServiceSingleTurnAndUnsolicitedAppInfo) {
  const std::string empty = root / "empty.json";
  ASSERT_TRUE(platform::WriteFileAtomically(empty, "[]"));
  // Unsolicited app information only logs.
  RunResult r = Serve({{"app-data", empty}});
  EXPECT_EQ(Count(r.err, "tallyrun got (unsolicited -- so ignoring) AAI:\n()"), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  EXPECT_TRUE(Logs().empty());
  EXPECT_FALSE(fs::exists(root / "var/tallyrun/last-run.plist")) << "a turn without the day's work records no run";

  // Operation 1 runs that day, ungated; a later operation 0 is ignored.
  r = Serve({{"run-day", "20000"}, {"logging-status"}, {"app-data", empty}});
  EXPECT_EQ(Count(r.err, "daily tasks for day 20000"), 1u);
  EXPECT_EQ(Count(r.err, "notified of logging status"), 0u);
  EXPECT_EQ(Count(r.err, "(unsolicited -- so ignoring) "), 1u);
  EXPECT_TRUE(Pref(kGate).IsNull());
  EXPECT_FALSE(platform::FileExists(root / "var/run/notifications.log"));
  const cf::Value record = ReadPlist(root / "var/tallyrun/last-run.plist");
  ASSERT_TRUE(record.AsDictionary());
  EXPECT_EQ(record.AsDictionary()->Get("mode"), cf::Value("service"));
  EXPECT_EQ(record.AsDictionary()->Get("day"), cf::Value::SInt32(20000));

  // An unknown operation (sent on purpose) uses up the turn too.
  r = Serve({{"send", "5", "--raw"}, {"logging-status"}});
  EXPECT_EQ(Count(r.err, "notified of logging status"), 0u);
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  // The low 32 bits decide: 2^32 + 1 is operation 1.
  r = Serve({{"send", "4294967297", "--value", "20001", "--raw"}});
  EXPECT_EQ(Count(r.err, "daily tasks for day 20001"), 1u);
}

TEST_F(TallyrunTest, ServiceRunsWithoutAppInfoWhenItNeverComes) {
  const RunResult r = Serve({{"logging-status"}});
  EXPECT_EQ(Count(r.err, "<default>: never received requested AAI, so moving along without it\n"), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks for day 20778"), 1u);
  EXPECT_EQ(Logs().size(), 1u);
  EXPECT_FALSE(LastLog().Contains("TBActivatedAppInfo"));
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));
}

TEST_F(TallyrunTest, IdleServiceEndsAfterTenQuietSeconds) {
  env.erase("TALLYRUN_SERVICE_IDLE_SECONDS");
  const auto start = std::chrono::steady_clock::now();
  const RunResult r = Serve({});
  const auto took = std::chrono::steady_clock::now() - start;
  EXPECT_GE(took, std::chrono::seconds(10));
  EXPECT_LT(took, std::chrono::seconds(20));
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(Count(r.err, "\n"), 2u);  // the start and end lines only
  EXPECT_EQ(Count(r.err, "tallyrun started"), 1u);
  EXPECT_EQ(Count(r.err, "tallyrun ended"), 1u);
}

// Runs SQL on the root's store as another writer of it would.
void StoreSQL(const std::string& root, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open((root + "/var/mobile/Library/Tallybook/TBDataStore.sqlitedb").c_str(), &db), SQLITE_OK);
  char* message = nullptr;
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &message), SQLITE_OK) << (message ? message : "");
  sqlite3_free(message);
  sqlite3_close(db);
}

TEST_F(TallyrunTest, OneBadValueNeverCostsTheDay) {
  // A listed key the log cannot carry, left in the store by an older writer.
  StoreSQL(root.path(), "INSERT INTO scalars VALUES(20778, 'com.velmora.wifi.Bad' || char(1), 5);"
                        "INSERT INTO series(day, key) VALUES(20778, 'com.velmora.net.Bad' || char(65535));"
                        "INSERT INTO samples SELECT id, 1, 2.5, 0 FROM series WHERE key LIKE 'com.velmora.net.Bad%';"
  // Values of a type their column cannot mean, as another program could
  // leave them: each row is skipped with one error line, and shown by the
  // tools with a warning, never as 0 or the largest integer.
                        "INSERT INTO scalars VALUES(20778, 'com.velmora.bad.Blob', x'0102');"
                        "INSERT INTO scalars VALUES(20778, 'com.velmora.bad.Huge', 1.5e300);"
                        "INSERT INTO scalars VALUES(20778, 'com.velmora.bad.Text', 'abc');"
                        "INSERT INTO series(day, key) VALUES(20778, 'com.velmora.bad.Samples');"
                        "INSERT INTO samples SELECT id, 1, 'x', 0 FROM series WHERE key = 'com.velmora.bad.Samples';"
                        "INSERT INTO samples SELECT id, 2, 1.5, 5e9 FROM series WHERE key = 'com.velmora.bad.Samples';"
                        "INSERT INTO samples SELECT id, 3, 2.5, 7 FROM series WHERE key = 'com.velmora.bad.Samples';");
  const std::vector<std::string> bad_rows = {
      "The store's scalar com.velmora.bad.Blob of day 20778 holds a blob of 2 bytes, not a 64-bit integer; it is skipped\n",
      "The store's scalar com.velmora.bad.Huge of day 20778 holds the real 1.5e+300, not a 64-bit integer; it is "
      "skipped\n",
      "The store's scalar com.velmora.bad.Text of day 20778 holds the text \"abc\", not a 64-bit integer; it is "
      "skipped\n",
      "The store's sample of com.velmora.bad.Samples on day 20778 holds the text \"x\", not a number; it is skipped\n",
      "The store's sample of com.velmora.bad.Samples on day 20778 holds 5000000000 as its offset, not a "
      "32-bit second of the day; it is skipped\n"};
  const RunResult dump =
      RunProgram(TALLYBOOK_BIN, {"dump", "--day", "20778", "--prefix", "com.velmora.bad."}, env);
  EXPECT_EQ(dump.status, 0);
  EXPECT_EQ(dump.out, "20778 com.velmora.bad.Samples 1 2.5 2.5 2.5\n");
  std::string warned;
  for (const std::string& line : bad_rows) warned += "tallybook: warning: " + line;
  EXPECT_EQ(dump.err, warned);
  RunResult r = Tallyrun({"-f"});
  ASSERT_EQ(Logs().size(), 1u) << r.err;
  // (The report reads the samples of listed keys only.)
  for (size_t i = 0; i < 3; ++i) EXPECT_EQ(Count(r.err, "<error>: " + bad_rows[i]), 1u) << bad_rows[i];
  EXPECT_EQ(Count(r.err, "<error>: Skipping a store key that a property list cannot carry: control character U+0001 "
                         "at byte 20\n"),
            1u);
  EXPECT_EQ(Count(r.err, "<error>: Skipping a store key that a property list cannot carry: noncharacter U+FFFF at "
                         "byte 19\n"),
            1u);
  cf::Dictionary log = LastLog();
  EXPECT_EQ(log.Get("TBScalars").AsDictionary()->Get("com.velmora.power.ChargeCycles"), cf::Value::SInt64(412));
  EXPECT_TRUE(log.Get("TBDistributions").AsDictionary()->Contains("com.velmora.net.DNSLatencyMs"));

  // A language and region from the environment that the log cannot carry.
  env["LANG"] = "de_D\x01E.UTF-8";
  r = Tallyrun({"-f"});
  ASSERT_EQ(Logs().size(), 2u) << r.err;
  log = LastLog();
  EXPECT_EQ(log.Get("TBMetadata").AsDictionary()->Get("TBPreferredUserInterfaceLanguage"), cf::Value("<unknown>"));
  EXPECT_FALSE(log.Get("TBMetadata").AsDictionary()->Contains("TBUserSetRegionFormat"));
  env.erase("LANG");

  // An app record from the service whose text the log cannot carry is
  // skipped; the others are kept.
  const std::string apps = root / "apps.json";
  ASSERT_TRUE(platform::WriteFileAtomically(apps, R"([
    {"bundle_id": "com.example.\u0001bad", "version": "1", "adam_id": 1, "arch": 1,
     "uuid": "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"},
    {"bundle_id": "com.example.notes", "version": "3.\u0008", "adam_id": 2, "arch": 1,
     "uuid": "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"},
    {"bundle_id": "com.example.maps", "version": "1.0", "adam_id": 3, "arch": 1,
     "uuid": "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"}])"));
  r = Serve({{"logging-status"}, {"app-data", apps}});
  ASSERT_EQ(Logs().size(), 3u) << r.err;
  EXPECT_EQ(Count(r.err, "<error>: Skipping an app record whose bundle_id a property list cannot carry (control "
                         "character U+0001 at byte 12)\n"),
            1u);
  EXPECT_EQ(Count(r.err, "<error>: Skipping an app record whose version a property list cannot carry (control "
                         "character U+0008 at byte 2)\n"),
            1u);
  const cf::Value info = LastLog().Get("TBActivatedAppInfo");
  ASSERT_NE(info.AsArray(), nullptr);
  ASSERT_EQ(info.AsArray()->size(), 1u);
  EXPECT_EQ(info.AsArray()->at(0).AsDictionary()->Get("bundle"), cf::Value("com.example.maps"));
}

TEST_F(TallyrunTest, ACorruptStoreWithholdsTheLogAndIsCounted) {
  // A busy day: enough listed keys for the scalars to span many pages.
  std::string sql = "BEGIN;";
  for (int i = 0; i < 2000; ++i)
    sql += "INSERT INTO scalars VALUES(20778, 'com.velmora.wifi.Filler" + std::to_string(10000 + i) + "', " +
           std::to_string(i) + ");";
  StoreSQL(root.path(), sql + "COMMIT;");
  const std::string store = root / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb";
  int64_t page_size = 0;
  const std::vector<int64_t> leaves = LeafPages(store, "scalars", &page_size);
  ASSERT_GT(leaves.size(), 10u);
  // Yesterday's rows come first in key order and fill nearly every leaf.
  ASSERT_TRUE(OverwritePage(store, leaves[leaves.size() / 2], page_size));

  RunResult r = Tallyrun({"-d"});
  EXPECT_TRUE(Logs().empty());
  EXPECT_EQ(Count(r.err, "<error>: Tallybook history read failed: database disk image is malformed\n"), 1u) << r.err;
  EXPECT_EQ(Count(r.err, "<error>: Not writing the aggregated log for day 20778: the store could not be read "
                         "completely\n"),
            1u);
  const cf::Value counter = ReadPlist(root / "Library/Preferences/com.velmora.tallybookd.plist");
  ASSERT_NE(counter.AsDictionary(), nullptr);
  EXPECT_EQ(counter.AsDictionary()->Get("DatabaseCorruptionCount"), cf::Value::SInt64(1));
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));  // the day counts as handled

  // The next day's log, read from pages the damage did not reach, reports it.
  env["TALLYRUN_NOW"] = "2026-11-23T15:00:00Z";
  r = Tallyrun({"-d"});
  ASSERT_EQ(Logs().size(), 1u) << r.err;
  EXPECT_EQ(LastLog().Get("TBScalars").AsDictionary()->Get("com.velmora.diagvault.tbkd.database.corruptions"),
            cf::Value::SInt64(1));
}

TEST_F(TallyrunTest, ToolsRefuseBadInput) {
  RunResult r = Tallyctl({"logging-status"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.err.find("tallyctl: no service listening at " + (root / "var/run/com.velmora.tallybookd.tallyrun.sock")),
            std::string::npos) << r.err;
  ASSERT_TRUE(platform::WriteFileAtomically(root / "bad.json", R"([{"bundle_id": "x", "version": "1", "adam_id": 1, "arch": 1, "uuid": "nope"}])"));
  r = Tallyctl({"app-data", root / "bad.json"});
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(r.err, "tallyctl: " + (root / "bad.json") + ": app 0: \"uuid\" must be 36-character UUID text\n");
  EXPECT_EQ(Tallyctl({"app-data", root / "missing.json"}).status, 2);
  EXPECT_EQ(Tallyctl({"run-day", "soon"}).status, 2);

  r = RunProgram(DEVSIM_BIN, {"init", root.path()}, env);
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(r.err, "devsim: " + root.path() + " is not empty (use --force to replace the device root in it)\n");
}

}  // namespace
