// Tasking through whole daily runs: every transition of the stored tasking,
// the three kinds of user, and a key group switched off and on by tasking.
#include "root_fixture.h"

namespace {

using TaskingTest = RootTest;

cf::Dictionary Entry(const char* domain, const char* user, const char* key, const cf::Value& value) {
  cf::Dictionary e;
  e.Set("Domain", domain);
  e.Set("User", user);
  e.Set("Key", key);
  e.Set("Value", value);
  return e;
}

class Tasking : public TaskingTest {
 protected:
  void Schedule(const cf::Value& id, const cf::Value& payload, const cf::Value& digest = cf::Value("digest-1")) {
    cf::Dictionary tasking;
    if (!id.IsNull()) tasking.Set("TaskingID", id);
    if (!digest.IsNull()) tasking.Set("TaskingDigest", digest);
    if (!payload.IsNull()) tasking.Set("TaskingPayload", payload);
    cf::Dictionary domain;
    domain.Set("ScheduledTasking", tasking);
    WritePlist("var/diagvault/config/com.velmora.OTAFerrowin.plist", domain);
  }
  void SetBuild(const char* build) {
    cf::Dictionary version;
    version.Set("ProductVersion", "4.3");
    version.Set("ProductBuildVersion", build);
    WritePlist("device/system-version.plist", version);
  }
  cf::Value PrefIn(const std::string& rel_file, const char* key) {
    const cf::Value v = ReadPlist(root / rel_file);
    return v.AsDictionary() ? v.AsDictionary()->Get(key) : cf::Value();
  }
  size_t Notifications() {
    return Count(platform::ReadFile(root / "var/run/notifications.log").value_or(""), "com.velmora.da.tasking_changed");
  }
  cf::Array Payload() {
    return cf::Array({Entry("com.velmora.da", "mobile", "Power", cf::Value::Bool(false)),
                      Entry("com.velmora.diag", "__diagvault__", "Level", cf::Value::SInt32(3)),
                      Entry("com.velmora.audio", "guest", "Volume", cf::Value::SInt32(7))});
  }
};

TEST_F(Tasking, FirstTaskingUnchangedAndOSUpdate) {
  Schedule("T1", Payload());
  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "Tasking update"), 0u);  // nothing was stored before
  EXPECT_EQ(Count(r.err, "<default>: OS change since last run ((null) -> 22C41)\n"), 1u);
  EXPECT_EQ(Notifications(), 1u);
  EXPECT_EQ(Pref("TaskingID"), cf::Value("T1"));
  EXPECT_EQ(Pref("TaskingOS"), cf::Value("22C41"));
  EXPECT_EQ(Pref("TaskingDigest"), cf::Value("digest-1"));
  EXPECT_EQ(Pref("TaskingPayload"), cf::Value(Payload()));
  cf::Dictionary last_update;
  last_update.Set("version", "22C41");
  last_update.Set("day", cf::Value::SInt32(kToday));
  EXPECT_EQ(Pref("LastOSUpdate"), cf::Value(last_update));
  // Each kind of user lands in its own place.
  EXPECT_EQ(PrefIn("Library/Preferences/com.velmora.da.plist", "Power"), cf::Value::Bool(false));
  EXPECT_EQ(PrefIn("var/diagvault/config/com.velmora.diag.plist", "Level"), cf::Value::SInt32(3));
  EXPECT_EQ(PrefIn("var/users/guest/Library/Preferences/com.velmora.audio.plist", "Volume"), cf::Value::SInt32(7));

  // The same tasking and build the next day: nothing happens.
  env["TALLYRUN_NOW"] = "2026-11-23T15:00:00Z";
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "Tasking update"), 0u);
  EXPECT_EQ(Count(r.err, "OS change"), 0u);
  EXPECT_EQ(Notifications(), 1u);

  // An OS update re-applies the same tasking.
  SetBuild("22D10");
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<default>: OS change since last run (22C41 -> 22D10)\n"), 1u);
  EXPECT_EQ(Count(r.err, "<default>: Tasking update (T1 -> T1, 22C41 -> 22D10)\n"), 1u);
  EXPECT_EQ(Notifications(), 2u);
  EXPECT_EQ(Pref("TaskingOS"), cf::Value("22D10"));
  EXPECT_EQ(PrefIn("var/users/guest/Library/Preferences/com.velmora.audio.plist", "Volume"), cf::Value::SInt32(7));
  last_update.Set("version", "22D10");
  last_update.Set("day", cf::Value::SInt32(kToday + 1));
  EXPECT_EQ(Pref("LastOSUpdate"), cf::Value(last_update));

  // A new tasking without the entries withdraws them everywhere.
  Schedule("T2", cf::Array(), cf::Value());
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "Tasking update (T1 -> T2, 22D10 -> 22D10)"), 1u);
  EXPECT_TRUE(PrefIn("Library/Preferences/com.velmora.da.plist", "Power").IsNull());
  EXPECT_TRUE(PrefIn("var/diagvault/config/com.velmora.diag.plist", "Level").IsNull());
  EXPECT_TRUE(PrefIn("var/users/guest/Library/Preferences/com.velmora.audio.plist", "Volume").IsNull());
  EXPECT_EQ(Pref("TaskingID"), cf::Value("T2"));
  EXPECT_TRUE(Pref("TaskingDigest").IsNull());
  EXPECT_EQ(Pref("TaskingPayload"), cf::Value(cf::Array()));
  EXPECT_EQ(Notifications(), 3u);
}

TEST_F(Tasking, IdentifierWithoutPayloadPostsEveryRunAndBadEntriesAreSkipped) {
  Schedule("T9", cf::Value());
  Tallyrun({"-f"});
  Tallyrun({"-f"});
  EXPECT_EQ(Notifications(), 2u);
  EXPECT_TRUE(Pref("TaskingID").IsNull());

  // No identifier: the scheduled tasking is ignored.
  Schedule(cf::Value(), Payload());
  Tallyrun({"-f"});
  EXPECT_EQ(Notifications(), 2u);

  cf::Dictionary no_key;
  no_key.Set("Domain", "com.velmora.da");
  no_key.Set("User", "mobile");
  // A Key or Domain that is not a string is skipped too, and does not keep
  // the valid entry of the same domain from being written.
  cf::Dictionary number_key = Entry("com.velmora.da", "mobile", "", cf::Value::SInt32(1));
  number_key.Set("Key", cf::Value::SInt32(5));
  cf::Dictionary number_domain = Entry("", "mobile", "Other", cf::Value::SInt32(1));
  number_domain.Set("Domain", cf::Value::SInt32(5));
  Schedule("T10", cf::Array({no_key, number_key, number_domain,
                             Entry("com.velmora.da", "mobile", "Network", cf::Value::Bool(true))}));
  const RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<error>: Skipping a tasking entry without a string Key or Domain: {"), 3u);
  EXPECT_EQ(PrefIn("Library/Preferences/com.velmora.da.plist", "Network"), cf::Value::Bool(true));
  EXPECT_EQ(Notifications(), 3u);

  // Applied, then a tasking without payload: the old entries go, and so does
  // the stored tasking (back to none), with a notification.
  Schedule("T11", cf::Value());
  const RunResult withdraw = Tallyrun({"-f"});
  EXPECT_EQ(Count(withdraw.err, "Tasking update (T10 -> T11, 22C41 -> 22C41)"), 1u);
  EXPECT_TRUE(PrefIn("Library/Preferences/com.velmora.da.plist", "Network").IsNull());
  EXPECT_TRUE(Pref("TaskingID").IsNull());
  EXPECT_TRUE(Pref("TaskingPayload").IsNull());
  EXPECT_EQ(Pref("TaskingOS"), cf::Value("22C41"));  // left in place
  EXPECT_EQ(Notifications(), 4u);
}

TEST_F(Tasking, AValueNoPreferenceFileCanHoldPoisonsNothing) {
  // XML cannot carry the control character; the configuration arrives as a
  // binary list, which can.
  cf::Dictionary tasking;
  tasking.Set("TaskingID", "T1");
  tasking.Set("TaskingDigest", "digest-1");
  tasking.Set("TaskingPayload", cf::Array({Entry("com.velmora.da", "mobile", "Power", cf::Value("on\x01")),
                                           Entry("com.velmora.da", "mobile", "Network", cf::Value::Bool(true))}));
  cf::Dictionary domain;
  domain.Set("ScheduledTasking", tasking);
  std::string bytes;
  ASSERT_TRUE(cf::WriteBinaryPropertyList(domain, bytes, nullptr));
  ASSERT_TRUE(platform::WriteFileAtomically(root / "var/diagvault/config/com.velmora.OTAFerrowin.plist", bytes));

  RunResult r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "<error>: Skipping a tasking entry that no preference file can hold: string cannot be "
                         "written to a property list: control character U+0001 at byte 2\n"),
            1u)
      << r.err;
  EXPECT_EQ(Count(r.err, "Not setting preference"), 0u);
  EXPECT_EQ(Count(r.err, "Could not write preferences domain"), 0u);
  EXPECT_EQ(Pref(kGate), cf::Value::SInt32(kToday - 1));
  EXPECT_EQ(Pref("TaskingID"), cf::Value("T1"));
  EXPECT_EQ(Pref("TaskingDigest"), cf::Value("digest-1"));
  EXPECT_TRUE(Pref("LastOSUpdate").AsDictionary());
  EXPECT_EQ(PrefIn("Library/Preferences/com.velmora.da.plist", "Network"), cf::Value::Bool(true));
  EXPECT_TRUE(PrefIn("Library/Preferences/com.velmora.da.plist", "Power").IsNull());

  // What was applied is what is kept, so a later tasking withdraws it.
  EXPECT_EQ(Pref("TaskingPayload"),
            cf::Value(cf::Array({Entry("com.velmora.da", "mobile", "Network", cf::Value::Bool(true))})));

  r = Tallyrun({"-d"});
  EXPECT_EQ(Count(r.err, "<default>: Day unchanged since last run\n"), 1u);
  EXPECT_EQ(Count(r.err, "daily tasks"), 0u);
  EXPECT_EQ(Logs().size(), 1u);

  Schedule("T2", cf::Array());
  Tallyrun({"-f"});
  EXPECT_TRUE(PrefIn("Library/Preferences/com.velmora.da.plist", "Network").IsNull());
}

TEST_F(Tasking, AGroupSwitchedOffByTaskingLeavesTheReportAndComesBack) {
  Schedule("T1", cf::Array({Entry("com.velmora.da", "mobile", "Power", cf::Value::Bool(false))}));
  Tallyrun({"-f"});  // the report comes before the tasking: still complete
  EXPECT_TRUE(LastLog().Get("TBScalars").AsDictionary()->Contains("com.velmora.power.ChargeCycles"));

  RunResult r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "<default>: keyGroup Power is disabled by tasking\n"), 1u);
  cf::Dictionary log = LastLog();
  EXPECT_FALSE(log.Get("TBScalars").AsDictionary()->Contains("com.velmora.power.ChargeCycles"));
  EXPECT_FALSE(log.Get("TBDistributions").AsDictionary()->Contains("com.velmora.power.BatteryTemperatureC"));
  EXPECT_TRUE(log.Get("TBScalars").AsDictionary()->Contains("com.velmora.homedeck.Unlocks"));
  EXPECT_EQ(log.Get("TBTaskID"), cf::Value("T1"));
  EXPECT_EQ(log.Get("TBTaskDigest"), cf::Value("digest-1"));
  EXPECT_EQ(log.Get("TBTasking").AsArray()->size(), 1u);

  Schedule("T2", cf::Array());
  Tallyrun({"-f"});  // withdraws the switch after this report
  r = Tallyrun({"-f"});
  EXPECT_EQ(Count(r.err, "disabled by tasking"), 0u);
  EXPECT_TRUE(LastLog().Get("TBScalars").AsDictionary()->Contains("com.velmora.power.ChargeCycles"));
}

TEST_F(Tasking, ReportCarriesTheMetrics) {
  env["LANG"] = "de_DE.UTF-8";
  Tallyrun({"-f"});
  const cf::Dictionary log = LastLog();
  const cf::Dictionary& scalars = *log.Get("TBScalars").AsDictionary();
  EXPECT_EQ(scalars.Get("com.velmora.homedeck.numAllInstalledApps"), cf::Value::SInt64(7));
  EXPECT_EQ(scalars.Get("com.velmora.homedeck.numThirdPartyApps"), cf::Value::SInt64(3));
  EXPECT_EQ(scalars.Get("com.velmora.kernel.memorystatus_freeze_count"), cf::Value::SInt64(37));
  EXPECT_EQ(scalars.Get("com.velmora.memorystatus_freezer_refreeze_average"), cf::Value::SInt64(8192000));
  EXPECT_EQ(scalars.Get("com.velmora.diagvault.tbkd.database.corruptions"), cf::Value::SInt64(0));
  EXPECT_TRUE(scalars.Contains("com.velmora.usage.cur_boot_session_cpu_uptime"));
  EXPECT_EQ(log.Get("TBMetadata").AsDictionary()->Get("TBUserInterfaceLanguage"), cf::Value("de"));
  EXPECT_EQ(log.Get("TBMetadata").AsDictionary()->Get("TBUserSetRegionFormat"), cf::Value("DE"));
  EXPECT_NE(platform::ReadFile(root / "var/eventlens/events.jsonl").value_or("").find("com.velmora.homedeck.appInstalls"),
            std::string::npos);

  // The corruption counter raised by the store is reported once and reset.
  cf::Dictionary counter;
  counter.Set("DatabaseCorruptionCount", cf::Value::SInt64(2));
  WritePlist("Library/Preferences/com.velmora.tallybookd.plist", counter);
  Tallyrun({"-f"});
  EXPECT_EQ(LastLog().Get("TBScalars").AsDictionary()->Get("com.velmora.diagvault.tbkd.database.corruptions"),
            cf::Value::SInt64(2));
  Tallyrun({"-f"});
  EXPECT_EQ(LastLog().Get("TBScalars").AsDictionary()->Get("com.velmora.diagvault.tbkd.database.corruptions"),
            cf::Value::SInt64(0));
}

}  // namespace
