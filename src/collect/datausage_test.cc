#include "collect/datausage.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cmath>
#include <map>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/store.h"

namespace {

using Keys = std::map<std::string, int64_t>;

class DataUsageTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{std::make_shared<platform::FixedClock>(1795446000), log}};
  const int32_t today = TBDaysSince1970();

  cf::Value At(int32_t day) { return cf::Date{platform::StartOfDay(day) + 600}; }
  Keys UsageKeys() {
    Keys out;
    sqlite3_stmt* st = nullptr;
    sqlite3_prepare_v2(scope.context().store()->handle(), "SELECT key, value FROM scalars WHERE key LIKE 'datausage.%'",
                       -1, &st, nullptr);
    while (sqlite3_step(st) == SQLITE_ROW)
      out[reinterpret_cast<const char*>(sqlite3_column_text(st, 0))] = sqlite3_column_int64(st, 1);
    sqlite3_finalize(st);
    return out;
  }
  // The baseline as the preference file holds it.
  cf::Value StoredBaseline() {
    const auto bytes = platform::ReadFile(root / "Library/Preferences/com.velmora.diagvault.tallyrun.plist");
    const cf::Value v = bytes ? cf::ParsePropertyList(*bytes).value : cf::Value();
    return v.AsDictionary() ? v.AsDictionary()->Get("netUsageBaseline") : cf::Value();
  }
  void Reply(const cf::Array& records) {
    std::counting_semaphore<> done(0);
    ProcessDataUsageReply(records, done);
    EXPECT_TRUE(done.try_acquire()) << "the handler signals when it is done";
  }
};

cf::Value Record(const char* proc, cf::Value since, int64_t wifi_in, int64_t wifi_out = 0, int64_t wwan_in = 0,
                 int64_t wwan_out = 0) {
  return Dict({{"procName", proc}, {"sinceTime", since}, {"wifiInBytes", cf::Value::SInt64(wifi_in)},
               {"wifiOutBytes", cf::Value::SInt64(wifi_out)}, {"wwanInBytes", cf::Value::SInt64(wwan_in)},
               {"wwanOutBytes", cf::Value::SInt64(wwan_out)}});
}
cf::Value Entry(cf::Value since, int64_t a, int64_t b = 0, int64_t c = 0, int64_t d = 0) {
  return cf::Array({since, cf::Value::SInt64(a), cf::Value::SInt64(b), cf::Value::SInt64(c), cf::Value::SInt64(d)});
}

TEST_F(DataUsageTest, DeltasAgainstTheBaseline) {
  const cf::Value t = At(today), y = At(today - 1), old = At(today - 3);
  cf::Dictionary bundled = *Record("Maps", t, 4096).AsDictionary();
  bundled.Set("bundleName", "com.example.maps");
  const struct {
    const char* what;
    cf::Value before;  // the stored baseline; null: none
    std::vector<cf::Value> records;
    Keys keys;
    cf::Value after;
  } cases[] = {
      {"first run", {}, {{Record("P", t, 10240, 1, 2, 3)}}, {{"datausage.wifiInKB.com.velmora.P", 10}},
       Dict({{"P", Entry(t, 10240, 1, 2, 3)}})},
      {"sub-KB growth is lost", Dict({{"P", Entry(t, 10240)}}), {{Record("P", t, 11000)}}, {},
       Dict({{"P", Entry(t, 11000)}})},
      {"a counter went down", Dict({{"P", Entry(t, 10240, 0, 7, 9)}}), {{Record("P", t, 5000, 1500, 6, 9)}},
       {{"datausage.baddata.com.velmora.P", 2}, {"datausage.wifiOutKB.com.velmora.P", 1}},
       Dict({{"P", Entry(t, 5000, 1500, 6, 9)}})},
      {"old counters", {}, {{Record("P", old, 1 << 20)}}, {{"datausage.olddata.com.velmora.P", 1}},
       Dict({{"P", Entry(old, 1 << 20)}})},
      {"yesterday's counters whole, in KB toward zero", {}, {{Record("P", y, 2047, 1023, -1023, -2048)}},
       {{"datausage.wifiInKB.com.velmora.P", 1}, {"datausage.wwanOutKB.com.velmora.P", -2}},
       Dict({{"P", Entry(y, 2047, 1023, -1023, -2048)}})},
      {"a new start date", Dict({{"P", Entry(y, 1 << 20)}}), {{Record("P", t, 3072)}},
       {{"datausage.wifiInKB.com.velmora.P", 3}}, Dict({{"P", Entry(t, 3072)}})},
      {"bundle name, no prefix", {}, {{bundled}}, {{"datausage.wifiInKB.com.example.maps", 4}},
       Dict({{"com.example.maps", Entry(t, 4096)}})},
      {"empty reply", Dict({{"P", Entry(t, 10240)}}), {}, {}, cf::Dictionary()},
      {"unreadable baseline", "junk", {{Record("P", t, 1024)}}, {{"datausage.wifiInKB.com.velmora.P", 1}},
       Dict({{"P", Entry(t, 1024)}})},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    sqlite3_exec(scope.context().store()->handle(), "DELETE FROM scalars", nullptr, nullptr, nullptr);
    DGVPreferencesSetValue("netUsageBaseline", c.before, "com.velmora.diagvault.tallyrun");
    Reply(cf::Array(c.records));
    EXPECT_EQ(UsageKeys(), c.keys);
    EXPECT_EQ(StoredBaseline(), c.after);
  }
}

TEST_F(DataUsageTest, UnusableRecordsAreSkippedWithoutHarmToTheRest) {
  const cf::Value t = At(today);
  cf::Dictionary numeric_bundle = *Record("Q", t, 2048).AsDictionary();
  numeric_bundle.Set("bundleName", cf::Value::SInt32(7));  // not a name: the process name counts
  cf::Dictionary no_counter = *Record("P", t, 1024).AsDictionary();
  no_counter.Remove("wwanOutBytes");
  Reply(cf::Array({cf::Value("not a record"), Dict({{"procName", cf::Value::SInt32(5)}}), Record("P", "today", 1024),
          Dict({{"procName", "P"}, {"sinceTime", t}, {"wifiInBytes", "10"}}), no_counter, Record("", t, 1024),
          Record("bad\xff", t, 1024), Record("P", cf::Date{std::nan("")}, 1024), numeric_bundle,
          Record("R", t, 1024)}));
  EXPECT_EQ(UsageKeys(), (Keys{{"datausage.wifiInKB.com.velmora.Q", 2}, {"datausage.wifiInKB.com.velmora.R", 1}}));
  EXPECT_EQ(StoredBaseline(), cf::Value(Dict({{"Q", Entry(t, 2048)}, {"R", Entry(t, 1024)}})));
  EXPECT_EQ(log->Count("Skipped 8 data usage records without a usable name, start date or counter"), 1u);
  AddDataUsageKB("wifiInPackets", "", "R", 4096);  // no "Bytes": no key
  EXPECT_EQ(UsageKeys().size(), 2u);
}

}  // namespace
