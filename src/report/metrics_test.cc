#include <gtest/gtest.h>

#include <limits>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/faultkeep.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/store.h"
#include "platform/system.h"
#include "report/report.h"

namespace {

constexpr int64_t kMax = std::numeric_limits<int64_t>::max();

class MetricsTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(1795341600);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{clock, log}};

  void Write(const std::string& rel, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    ASSERT_TRUE(platform::WriteFileAtomically(root / rel, bytes));
  }
  // A whitelist listing exactly these scalar keys.
  void List(std::initializer_list<const char*> keys) {
    cf::Dictionary scalars;
    for (const char* k : keys) scalars.Set(k, cf::Dictionary());
    cf::Dictionary group;
    group.Set("ScalarKeys", scalars);
    cf::Dictionary whitelist;
    whitelist.Set("Metrics", group);
    Write("Library/Application Support/Tallybook/Whitelist_boxOS.plist", whitelist);
  }
  void Kernel(std::initializer_list<std::pair<const char*, uint64_t>> values) {
    cf::Dictionary d;
    for (const auto& [k, v] : values) d.Set(k, cf::Value::UInt64(v));
    Write("device/sysctl.plist", d);
  }
  void InstallSupportLibrary() {
    const auto bytes = platform::ReadFile(FAULTKEEP_SUPPORT_LIBRARY);
    ASSERT_TRUE(bytes.has_value());
    ASSERT_TRUE(platform::WriteFileAtomically(root / std::string(kFaultkeepSupportPath).substr(1), *bytes, nullptr, 0755));
  }
  static cf::Value Get(const TBReport& r, const char* key) { return r.scalarsOutput().Get(key); }
};

TEST_F(MetricsTest, FreezerRowsGatesSentinelsAndRatios) {
  List({"com.velmora.kernel.memorystatus_freeze_count", "com.velmora.kernel.memorystatus_freeze_pageouts",
        "com.velmora.memorystatus_freezer_thaws_per_gb", "com.velmora.kernel.memorystatus_thaw_count",
        "com.velmora.kernel.memorystatus_freeze_budget_pages_remaining",
        "com.velmora.memorystatus_freezer_error_no_compressor_space_count",
        "com.velmora.memorystatus_freezer_error_other_count",
        "com.velmora.memorystatus_freezer_process_considered_count",
        "com.velmora.memorystatus_freezer_skipped_full_count", "com.velmora.memorystatus_freezer_refreeze_average",
        "com.velmora.memorystatus_freezer_thaw_percentage"});
  Kernel({{"kern.memorystatus_freeze_count", 0x1'0000'0000ull},  // does not fit: the 32-bit read fails
          {"kern.memorystatus_freeze_pageouts", 0},
          {"kern.memorystatus_freezer_process_considered_count", 0},
          {"kern.memorystatus_freezer_error_no_compressor_space_count", 3},
          {"kern.memorystatus_freezer_error_other_count", 0},
          {"kern.memorystatus_freezer_refreeze_count", 9},
          {"kern.memorystatus_freezer_bytes_refrozen", 900}});
  TBReport r;
  r.reportVMStats();
  EXPECT_EQ(Get(r, "com.velmora.kernel.memorystatus_freeze_count"), cf::Value::SInt64(4294967295));
  EXPECT_EQ(Get(r, "com.velmora.kernel.memorystatus_thaw_count"), cf::Value::SInt64(4294967295));  // missing
  EXPECT_EQ(Get(r, "com.velmora.kernel.memorystatus_freeze_pageouts"), cf::Value::SInt64(0));
  EXPECT_TRUE(Get(r, "com.velmora.memorystatus_freezer_thaws_per_gb").IsNull());  // under 1 GiB frozen
  EXPECT_EQ(Get(r, "com.velmora.kernel.memorystatus_freeze_budget_pages_remaining"), cf::Value::SInt64(-1));
  // C = 0: 3/0 saturates, 0/0 is 0.
  EXPECT_EQ(Get(r, "com.velmora.memorystatus_freezer_error_no_compressor_space_count"), cf::Value::SInt64(kMax));
  EXPECT_EQ(Get(r, "com.velmora.memorystatus_freezer_error_other_count"), cf::Value::SInt64(0));
  EXPECT_EQ(Get(r, "com.velmora.memorystatus_freezer_process_considered_count"), cf::Value::SInt64(0));
  EXPECT_TRUE(Get(r, "com.velmora.memorystatus_freezer_skipped_full_count").IsNull());  // gate T failed
  EXPECT_TRUE(Get(r, "com.velmora.memorystatus_freezer_refreeze_average").IsNull());    // 9 refreezes
  EXPECT_EQ(Get(r, "com.velmora.memorystatus_freezer_thaw_percentage"), cf::Value::SInt64(-1));

  const uint64_t one_gib_of_pages = 1073741824 / platform::PageSize();
  Kernel({{"kern.memorystatus_freeze_pageouts", one_gib_of_pages * 2},
          {"kern.memorystatus_thaw_count_since_boot", 7},
          {"kern.memorystatus_freezer_process_considered_count", 400},
          {"kern.memorystatus_freezer_error_no_compressor_space_count", 3},  // 0.75 %: truncated to 0
          {"kern.memorystatus_freezer_below_threshold_count", 8},
          {"kern.memorystatus_freezer_skipped_full_count", 1},
          {"kern.memorystatus_freezer_refreeze_count", 10},
          {"kern.memorystatus_freezer_thaw_percentage", 23}});
  TBReport second;
  second.reportVMStats();
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_thaws_per_gb"), cf::Value::SInt64(3));  // 7 / 2 GiB
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_error_no_compressor_space_count"), cf::Value::SInt64(0));
  // A failed numerator is 2^64 before the division: 2^64 / 400 * 100 = 2^62.
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_error_other_count"), cf::Value::SInt64(4611686018427387904));
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_skipped_full_count"), cf::Value::SInt64(12));  // 12.5
  // Ten refreezes with the byte count missing: all-ones / 10, unsigned.
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_refreeze_average"),
            cf::Value::SInt64(static_cast<int64_t>(18446744073709551615ull / 10)));
  EXPECT_EQ(Get(second, "com.velmora.memorystatus_freezer_thaw_percentage"), cf::Value::SInt64(23));
}

TEST_F(MetricsTest, AMeasurementRunsOnlyForAListedKey) {
  List({"com.velmora.listed"});
  TBReport r;
  int runs = 0;
  r.addScalarForKey("com.velmora.unlisted", [&] { return int64_t{++runs}; });
  EXPECT_EQ(runs, 0);
  r.addScalarForKey("com.velmora.listed", [&] { return int64_t{++runs} + 6; });
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(Get(r, "com.velmora.listed"), cf::Value::SInt64(7));

  // The corruption counter is read and reset only when its key is listed:
  // unlisted, the count stays for the day it is.
  InstallSupportLibrary();
  DGVPreferencesSetValue("DatabaseCorruptionCount", cf::Value::SInt64(4), "com.velmora.tallybookd");
  ASSERT_TRUE(DGVPreferencesSynchronize("com.velmora.tallybookd"));
  r.reportVMStats();
  r.reportCPUUptime();
  r.reportDatabaseSize();
  r.addInstalledAppInfo();
  EXPECT_EQ(r.scalarsOutput().size(), 1u);
  // Listed now: the count is still there to be read.
  List({"com.velmora.diagvault.tbkd.database.corruptions"});
  TBReport listed;
  listed.reportDatabaseSize();
  EXPECT_EQ(Get(listed, "com.velmora.diagvault.tbkd.database.corruptions"), cf::Value::SInt64(4));
}

TEST_F(MetricsTest, DatabaseSizeAndCorruptionCounter) {
  List({"com.velmora.diagvault.tbkd.database.size", "com.velmora.diagvault.tbkd.database.corruptions"});
  TBReport missing;
  missing.reportDatabaseSize();
  EXPECT_EQ(Get(missing, "com.velmora.diagvault.tbkd.database.size"), cf::Value::SInt64(-1));
  // Without the support library: 0, no reset, and the three messages.
  EXPECT_EQ(Get(missing, "com.velmora.diagvault.tbkd.database.corruptions"), cf::Value::SInt64(0));
  EXPECT_EQ(log->Count("Failed to dynamically load the FaultkeepSupport framework"), 1u);
  EXPECT_EQ(log->Count("Failed to dyanmically link DGVPreferencesGetIntegerValue"), 1u);
  EXPECT_EQ(log->Count("Failed to dynamically link DGVPreferencesSetValue"), 1u);

  const std::string store = root / "var/mobile/Library/Tallybook/TBDataStore.sqlitedb";
  ASSERT_TRUE(platform::WriteFileAtomically(store, std::string(1048575, 'x')));
  InstallSupportLibrary();
  DGVPreferencesSetValue("DatabaseCorruptionCount", cf::Value::SInt64(4), "com.velmora.tallybookd");
  ASSERT_TRUE(DGVPreferencesSynchronize("com.velmora.tallybookd"));
  TBReport r;
  r.reportDatabaseSize();
  EXPECT_EQ(Get(r, "com.velmora.diagvault.tbkd.database.size"), cf::Value::SInt64(0));  // 1048575 bytes
  EXPECT_EQ(Get(r, "com.velmora.diagvault.tbkd.database.corruptions"), cf::Value::SInt64(4));
  // The library reset the counter in its own process state; it reaches the
  // disk at exit. Through the library it already reads 0.
  TBReport again;
  ASSERT_TRUE(platform::WriteFileAtomically(store, std::string(1048576, 'x')));
  again.reportDatabaseSize();
  EXPECT_EQ(Get(again, "com.velmora.diagvault.tbkd.database.size"), cf::Value::SInt64(1));
  EXPECT_EQ(Get(again, "com.velmora.diagvault.tbkd.database.corruptions"), cf::Value::SInt64(0));
  EXPECT_EQ(log->Count("Failed to dynamically load the FaultkeepSupport framework"), 1u);

  // Listed size only: the counter is neither read nor reset.
  List({"com.velmora.diagvault.tbkd.database.size"});
  DGVPreferencesSetValue("DatabaseCorruptionCount", cf::Value::SInt64(9), "com.velmora.tallybookd");
  TBReport size_only;
  size_only.reportDatabaseSize();
  EXPECT_FALSE(size_only.scalarsOutput().Contains("com.velmora.diagvault.tbkd.database.corruptions"));
  EXPECT_EQ(DGVPreferencesGetIntegerValue("DatabaseCorruptionCount", "com.velmora.tallybookd"), 9);
}

TEST_F(MetricsTest, UptimeAppsAndMetadata) {
  List({"com.velmora.usage.cur_boot_session_cpu_uptime", "com.velmora.homedeck.numThirdPartyApps"});
  clock->AdvanceMonotonic(299'000'000'000ull);  // 300 s since boot in all
  cf::Dictionary user, system;
  user.Set("bundleIdentifier", "com.example.a");
  user.Set("bundleType", "User");
  system.Set("bundleIdentifier", "com.velmora.b");
  system.Set("bundleType", "System");
  Write("device/apps.plist", cf::Array({user, system, system}));
  TBReport r;
  r.reportCPUUptime();
  r.addInstalledAppInfo();
  EXPECT_EQ(Get(r, "com.velmora.usage.cur_boot_session_cpu_uptime"), cf::Value::SInt64(5));
  EXPECT_EQ(Get(r, "com.velmora.homedeck.numThirdPartyApps"), cf::Value::SInt64(1));
  EXPECT_FALSE(r.scalarsOutput().Contains("com.velmora.homedeck.numAllInstalledApps"));
  EXPECT_FALSE(platform::FileExists(root / "var/eventlens/events.jsonl"));  // event not used

  clock->SetTimebase(1, 0);
  TBReport broken;
  broken.reportCPUUptime();
  EXPECT_EQ(Get(broken, "com.velmora.usage.cur_boot_session_cpu_uptime"), cf::Value::SInt64(-1));
  EXPECT_EQ(log->Count("Couldn't retrieve mach_timebase_info"), 1u);

  // Only the event is used: the apps are counted and offered, no scalar added.
  List({"com.velmora.other"});
  Write("var/eventlens/enabled-events.plist", cf::Array({cf::Value("com.velmora.homedeck.appInstalls")}));
  TBReport event_only;
  event_only.addInstalledAppInfo();
  EXPECT_TRUE(event_only.scalarsOutput().empty());
  EXPECT_EQ(*platform::ReadFile(root / "var/eventlens/events.jsonl"),
            "{\"time\":\"2026-11-22T10:00:00Z\",\"event\":\"com.velmora.homedeck.appInstalls\","
            "\"payload\":{\"numThirdPartyApps\":1,\"numAllApps\":3}}\n");

  setenv("LANG", "fr_CA.UTF-8", 1);
  unsetenv("LANGUAGE");
  cf::Dictionary answers;
  answers.Set("SystemLanguages", cf::Array({cf::Value("en"), cf::Value("fr")}));
  Write("device/answers.plist", answers);
  TBReport meta;
  meta.addMetadataKeys();
  EXPECT_EQ(meta.metadataOutput().Get("TBUserInterfaceLanguage"), cf::Value("fr"));
  EXPECT_EQ(meta.metadataOutput().Get("TBPreferredUserInterfaceLanguage"), cf::Value("fr-CA"));
  EXPECT_EQ(meta.metadataOutput().Get("TBUserSetRegionFormat"), cf::Value("CA"));
  setenv("LANG", "C", 1);
  TBReport plain;
  plain.addMetadataKeys();
  EXPECT_EQ(plain.metadataOutput().Get("TBUserInterfaceLanguage"), cf::Value("<unknown>"));
  EXPECT_EQ(plain.metadataOutput().Get("TBPreferredUserInterfaceLanguage"), cf::Value("<unknown>"));
  EXPECT_FALSE(plain.metadataOutput().Contains("TBUserSetRegionFormat"));
  unsetenv("LANG");
}

}  // namespace
