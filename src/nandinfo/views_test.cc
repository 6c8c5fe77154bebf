#include "nandinfo/views.h"

#include <gtest/gtest.h>

#include <thread>

#include "../../tests/records.h"
#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "nandinfo/nandinfo.h"
#include "nandinfo/view_tables.h"
#include "parsers/context.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/default_device.h"

namespace {

class ViewsTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(20000 * 86400.0 + 3600);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  std::unique_ptr<platform::ContextScope> scope;

  void SetUp() override { Start(true); }
  void Start(bool analytics) {
    parsers::testing::ResetAPIErrorMessage();
    nandinfo::testing::ResetControllerState();
    platform::Backends backends{clock, log};
    backends.analytics_available = analytics;
    scope.reset();
    scope = std::make_unique<platform::ContextScope>(root.path(), backends);
    const sim::DefaultDevice device = sim::DefaultStorageDevice();
    Write("registry.plist", device.registry);
    Write("purgeable.plist", device.purgeable);
    WriteAt("var/eventlens/enabled-events.plist", cf::Value("*"));
  }
  void Write(const std::string& name, const cf::Value& v) { WriteAt("device/" + name, v); }
  void WriteAt(const std::string& path, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    ASSERT_TRUE(platform::WriteFileAtomically(root / path, bytes));
  }
  // A controller whose FTL statistics are `ftl` and whose MSPs are `msps`.
  void Controller(const cf::Dictionary& ftl, const cf::Array& msps = cf::Array()) {
    Write("controller.plist", Dict({{"stats", ftl}, {"msp", msps}}));
  }
  // (event, payload) of every event sent so far.
  std::vector<std::pair<std::string, cf::Dictionary>> Sent() {
    std::vector<std::pair<std::string, cf::Dictionary>> out;
    for (const cf::Dictionary& d : JSONLines(root / "var/eventlens/events.jsonl"))
      out.emplace_back(*d.Get("event").AsString(), *d.Get("payload").AsDictionary());
    return out;
  }
};

cf::Array Numbers(std::initializer_list<int64_t> values) {
  cf::Array out;
  for (int64_t v : values) out.Append(cf::Value::SInt64(v));
  return out;
}

TEST_F(ViewsTest, SourcesKeepWhitelistedFieldsAndRoundOnlyWhenAsked) {
  Controller(Dict({{"hostWrites", cf::Value::SInt64(123456789)}, {"percentUsed", cf::Value::SInt64(12345)},
                   {"validLbas", cf::Value::SInt64(1)}}),
             cf::Array({Dict({{"fw_updates", cf::Value::SInt64(1234)}, {"device_config", cf::Value::SInt64(7)}})}));
  const cf::Value exact = CopyWhitelistedNANDFTLInfo(false);
  const cf::Dictionary& e = *exact.AsDictionary();
  EXPECT_EQ(e.Get("hostWrites"), cf::Value::SInt64(123456789));
  EXPECT_EQ(e.Get("ESR_hostWrites"), cf::Value::SInt64(123456789));  // the derived figures join the view
  EXPECT_FALSE(e.Contains("validLbas"));  // a statistic no view carries
  EXPECT_EQ(e.Get("ESR_APIErrorMessage"), cf::Value("NA"));

  const cf::Value rounded = CopyWhitelistedNANDFTLInfo(true);
  EXPECT_EQ(rounded.AsDictionary()->Get("hostWrites"), cf::Value::SInt64(123456790));  // 8 digits
  EXPECT_EQ(rounded.AsDictionary()->Get("percentUsed"), cf::Value::SInt64(12300));    // 3 digits

  const cf::Value msp = CopyWhitelistedNANDMSPInfo(true);
  const cf::Dictionary* first = msp.AsDictionary()->Get("0").AsDictionary();
  ASSERT_NE(first, nullptr) << cf::Value(msp).Description();
  EXPECT_EQ(first->Get("fw_updates"), cf::Value::SInt64(1230));
  EXPECT_EQ(first->Get("ESR_hostWrites"), cf::Value::SInt64(123456789));  // added after rounding
  EXPECT_EQ(msp.AsDictionary()->size(), 2u);  // "0" and the message

  const cf::Value stats = CopyWhitelistedStorageStats(false);
  EXPECT_EQ(stats.AsDictionary()->Get("EAN_imageSize_BIC"), cf::Value::SInt32(0));  // no image driver
  EXPECT_EQ(stats.AsDictionary()->Get("ESR_hostWrites"), cf::Value::SInt64(123456789));
  EXPECT_FALSE(stats.AsDictionary()->Contains("ESR_storeDemoMode"));  // not one of the six
}

TEST_F(ViewsTest, WithoutStatisticsEachSourceSaysWhy) {
  Write("registry.plist", cf::Array());
  const cf::Value ftl = CopyWhitelistedNANDFTLInfo(false);
  EXPECT_EQ(ftl.AsDictionary()->size(), 1u);
  // The first message of the process wins: the controller's own.
  EXPECT_EQ(ftl.AsDictionary()->Get("ESR_APIErrorMessage"), cf::Value("gatherVSPFTLData: Could not get nand_exporter_t"));
  const cf::Value msp = CopyWhitelistedNANDMSPInfo(false);
  EXPECT_EQ(msp.AsDictionary()->size(), 1u);
  EXPECT_TRUE(gatherVSPOtherData().empty());
  // The MSP sender then sends nothing and returns an empty dictionary.
  const cf::Value sent = createAndLogMSPFieldsToEventLensForEvent();
  ASSERT_NE(sent.AsDictionary(), nullptr);
  EXPECT_TRUE(sent.AsDictionary()->empty());
  EXPECT_EQ(log->Count("NANDInfo: createAndLogMSPFieldsToEventLensForEvent: "
                       "com.velmora.massStorage.NANDInfo.MSPCounters_1 completed (total_nof_msps:0)"),
            1u);
}

TEST_F(ViewsTest, SendersCutEachViewToItsEvent) {
  cf::Array temperatures;
  for (int i = 0; i < 32; ++i) temperatures.Append(cf::Value::SInt64(40 + i));
  Controller(Dict({{"hostWrites", cf::Value::SInt64(5)}, {"bandsMaxTempHisto", Numbers({1, 2, 3})}}),
             cf::Array({Dict({{"fw_updates", cf::Value::SInt64(1)}, {"higher_die_temperature", temperatures}}),
                        Dict({{"fw_updates", cf::Value::SInt64(2)}})}));
  const cf::Value all = createAndLogNANDFieldsToEventLens(0);
  ASSERT_NE(all.AsDictionary(), nullptr);
  const auto sent = Sent();
  ASSERT_EQ(sent.size(), 5u);
  EXPECT_EQ(sent[0].first, nandinfo::kFTLCountersEvent);
  EXPECT_EQ(sent[0].second.Get("hostWrites"), cf::Value::SInt32(5));
  EXPECT_FALSE(sent[0].second.Contains("bandsMaxTempHisto_0"));
  EXPECT_FALSE(sent[0].second.Contains("ESR_APIErrorMessage"));
  EXPECT_EQ(sent[1].first, nandinfo::kFTLHistogramsEvent);
  EXPECT_EQ(sent[1].second.Get("bandsMaxTempHisto_2"), cf::Value::SInt32(3));
  EXPECT_FALSE(sent[1].second.Contains("hostWrites"));
  for (int i : {2, 3}) {
    EXPECT_EQ(sent[i].first, nandinfo::kMSPCountersEvent);
    EXPECT_EQ(sent[i].second.Get("msp_index"), cf::Value(std::to_string(i - 2)));
    EXPECT_EQ(sent[i].second.Get("total_nof_msps"), cf::Value::SInt32(2));
    EXPECT_EQ(sent[i].second.Get("fw_updates"), cf::Value::SInt32(i - 1));
    EXPECT_FALSE(sent[i].second.Contains("higher_die_temperature20"));  // listed, but not whitelisted
  }
  EXPECT_TRUE(sent[2].second.Contains("higher_die_temperature3"));
  EXPECT_EQ(sent[4].first, nandinfo::kStorageStatsEvent);

  // The union: both FTL payloads, the storage statistics, and the last MSP
  // payload under "msp_index".
  const cf::Dictionary& u = *all.AsDictionary();
  EXPECT_EQ(u.Get("hostWrites"), cf::Value::SInt32(5));
  EXPECT_EQ(u.Get("bandsMaxTempHisto_2"), cf::Value::SInt32(3));
  EXPECT_TRUE(u.Contains("EAN_updateCount_LowPowerEM"));
  ASSERT_NE(u.Get("msp_index").AsDictionary(), nullptr);
  EXPECT_EQ(u.Get("msp_index").AsDictionary()->Get("msp_index"), cf::Value("1"));
  EXPECT_EQ(log->Count("NANDInfo: createAndLogFTLFieldsToEventLensForEvent: "
                       "com.velmora.massStorage.NANDInfo.FTLCounters_1 enabled=1"),
            1u);
  EXPECT_EQ(log->Count("NANDInfo: createAndLogFTLFieldsToEventLensForEvent: SUCCESS in logging "
                       "massStorage_NANDInfo_FTLHistograms_1 using AnalyticsSendEventLazy"),
            1u);
  EXPECT_TRUE(createAndLogNANDFieldsToEventLens(4).IsNull());
}

TEST_F(ViewsTest, RefusedEventsAreLoggedAndTheMSPRefusalRecorded) {
  // Ten MSPs, the most there can be: fetching them records nothing.
  cf::Array msps;
  for (int i = 0; i < 10; ++i) msps.Append(Dict({{"fw_updates", cf::Value::SInt64(i)}}));
  Controller(Dict({{"hostWrites", cf::Value::SInt64(5)}}), msps);
  WriteAt("var/eventlens/enabled-events.plist", cf::Array({cf::Value(nandinfo::kFTLHistogramsEvent)}));
  const cf::Value ftl = createAndLogNANDFieldsToEventLens(1);
  ASSERT_NE(ftl.AsDictionary(), nullptr);
  EXPECT_FALSE(ftl.AsDictionary()->Contains("hostWrites"));  // only the accepted payload counts
  EXPECT_EQ(log->Count("NANDInfo: createAndLogFTLFieldsToEventLensForEvent: FAILED to log "
                       "massStorage_NANDInfo_FTLCounters_1 using AnalyticsSendEventLazy"),
            1u);
  EXPECT_EQ(log->Count("NANDInfo: createAndLogFTLFieldsToEventLensForEvent: "
                       "com.velmora.massStorage.NANDInfo.FTLCounters_1 enabled=0"),
            1u);
  const cf::Value msp = createAndLogNANDFieldsToEventLens(2);
  EXPECT_TRUE(msp.AsDictionary() && msp.AsDictionary()->empty());
  EXPECT_EQ(GetAPIErrorMessage(), "createAndLogMSPFieldsToEventLensForEvent: AnalyticsSendEventLazy failed to log to EL");
  EXPECT_EQ(Sent().size(), 1u);
}

TEST_F(ViewsTest, WithoutTheAnalyticsLibraryNothingIsSent) {
  Start(false);
  Controller(Dict({{"hostWrites", cf::Value::SInt64(5)}}));
  for (int selector : {0, 1, 2, 3}) EXPECT_TRUE(createAndLogNANDFieldsToEventLens(selector).IsNull());
  EXPECT_EQ(GetAPIErrorMessage(), "createAndLogNANDFieldsToEventLens: Unable call EL API AnalyticsSendEventLazy");
  // An analytics day (boot session 8, day 20000) sends neither views nor groups.
  Write("sysctl.plist", Dict({{"kern.bootsessionuuid", "8C0FFEE"}}));
  CopyNANDInfoWithOptions(1);
  EXPECT_FALSE(platform::FileExists(root / "var/eventlens/events.jsonl"));
}

TEST_F(ViewsTest, GroupPayloadsTakeTheStoreDictionaryAndTheThreeFigures) {
  const cf::Value map = cf::ParseJSON(nandinfo::kEventLensRefJson).value;
  ASSERT_NE(map.AsDictionary(), nullptr);
  const auto group = [&](const char* name) { return *map.AsDictionary()->Get(name).AsDictionary(); };
  const cf::Dictionary error = Dict({{"com.velmora.NANDInfo.Error", "1"},
                                     {"com.velmora.NANDInfo.ErrorMessage", "Unable to parse buffer"}});

  const cf::Dictionary main_group = BuildGroupEventPayload("com.velmora.massstorage.NANDInfo",
                                                           group("com.velmora.massstorage.NANDInfo"), error, 1, 2, 3);
  EXPECT_EQ(main_group.size(), 50u);
  for (const auto& [field, value] : main_group)
    EXPECT_EQ(value, *field.AsString() == "Error" ? cf::Value("1") : cf::Value::SInt32(0)) << *field.AsString();

  const cf::Dictionary second = BuildGroupEventPayload(
      "com.velmora.massstorage.NANDInfo_2", group("com.velmora.massstorage.NANDInfo_2"), error, 7, 65536, 1024);
  EXPECT_EQ(second.Get("ErrorMessage"), cf::Value("Unable to parse buffer"));
  EXPECT_EQ(second.Get("DiskUsageUserTotalBlocks"), cf::Value::SInt64(65536));
  EXPECT_EQ(second.Get("DiskUsageUserBlocksFree"), cf::Value::SInt64(1024));

  // A healthy day: renamed fields follow their sources, and the freezer
  // figure wins over the store's value.
  const cf::Dictionary tbkd = Dict({{"com.velmora.NANDInfo.DemoMode", cf::Value::SInt32(1)},
                                    {"com.velmora.NANDInfo.BitFlipCountParityWidget", cf::Value::SInt32(9)},
                                    {"com.velmora.NANDInfo.VMFreezer_NumPhysicalWrites", cf::Value::SInt32(5)}});
  const cf::Dictionary healthy = BuildGroupEventPayload("com.velmora.massstorage.NANDInfo",
                                                        group("com.velmora.massstorage.NANDInfo"), tbkd, 0, 0, 0);
  EXPECT_EQ(healthy.Get("DriverVersion"), cf::Value::SInt32(1));
  EXPECT_EQ(healthy.Get("BitFlipDupesParityWidget"), cf::Value::SInt32(9));
  EXPECT_EQ(healthy.Get("Error"), cf::Value("empty"));
  const cf::Dictionary sixth = BuildGroupEventPayload(
      "com.velmora.massstorage.NANDInfo_6", group("com.velmora.massstorage.NANDInfo_6"), tbkd, 4294967296, 0, 0);
  EXPECT_EQ(sixth.Get("VMFreezer_NumPhysicalWrites"), cf::Value::UInt64(4294967296));

  // Every group is sent, in order; none without a store dictionary.
  SendReferenceMapGroupEvents(cf::Value(), 0, 0, 0);
  EXPECT_TRUE(Sent().empty());
  SendReferenceMapGroupEvents(tbkd, 0, 0, 0);
  const auto sent = Sent();
  ASSERT_EQ(sent.size(), 36u);
  for (size_t i = 0; i < sent.size(); ++i) EXPECT_EQ(sent[i].first, nandinfo::EventLensEvents()[i]);
  EXPECT_EQ(sent.back().second.size(), 285u);
}

}  // namespace
