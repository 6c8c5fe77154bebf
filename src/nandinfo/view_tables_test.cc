#include "nandinfo/view_tables.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <vector>

namespace nandinfo {
namespace {

constexpr std::string_view kKeyPrefix = "com.velmora.NANDInfo.";

std::set<std::string_view> Names(std::span<const SigDigits> rows) {
  std::set<std::string_view> names;
  for (const SigDigits& r : rows) names.insert(r.name);
  return names;
}

bool Has(std::span<const std::string_view> fields, std::string_view name) {
  return std::ranges::find(fields, name) != fields.end();
}

// -1: not whitelisted.
int DigitsOf(std::span<const SigDigits> rows, std::string_view name) {
  for (const SigDigits& r : rows) {
    if (r.name == name) return r.digits;
  }
  return -1;
}

TEST(ViewTables, CountsAndUniqueNames) {
  const struct {
    const char* what;
    std::span<const SigDigits> rows;
    size_t size;
  } whitelists[] = {
      {"FTL", WhitelistedRawNANDFTLCounters(), 931},
      {"MSP", WhitelistedRawNANDMSPCounters(), 261},
      {"storage", WhitelistedStorageStats(), 16},
  };
  for (const auto& w : whitelists) {
    EXPECT_EQ(w.rows.size(), w.size) << w.what;
    EXPECT_EQ(Names(w.rows).size(), w.rows.size()) << w.what << ": a name twice";
    EXPECT_TRUE(std::ranges::is_sorted(w.rows, {}, &SigDigits::name)) << w.what;
  }

  const struct {
    std::string_view event;
    size_t size;
  } events[] = {
      {kFTLCountersEvent, 364},
      {kFTLHistogramsEvent, 570},
      {kMSPCountersEvent, 295},
      {kStorageStatsEvent, 17},
  };
  const std::span<const EventFields> details = EventLensConfigDetails();
  ASSERT_EQ(details.size(), std::size(events));
  for (size_t i = 0; i < details.size(); ++i) {
    EXPECT_EQ(details[i].event, events[i].event);
    EXPECT_EQ(details[i].fields.size(), events[i].size) << events[i].event;
    const std::set<std::string_view> unique(details[i].fields.begin(), details[i].fields.end());
    EXPECT_EQ(unique.size(), details[i].fields.size()) << events[i].event << ": a field twice";
    const std::span<const std::string_view> looked_up = EventLensFields(events[i].event);
    EXPECT_EQ(looked_up.data(), details[i].fields.data());
    EXPECT_EQ(looked_up.size(), details[i].fields.size());
  }
  // Only the exact names are events.
  for (std::string_view other : {"", "com.velmora.massstorage.NANDInfo.FTLCounters_1",
                                 "com.velmora.massStorage.NANDInfo.FTLCounters_1 ",
                                 "massStorage_NANDInfo_MSPCounters_1", "com.velmora.massstorage.NANDInfo"}) {
    EXPECT_TRUE(EventLensFields(other).empty()) << "'" << other << "'";
  }
}

TEST(ViewTables, WhitelistDigits) {
  const auto ftl = WhitelistedRawNANDFTLCounters();
  const auto msp = WhitelistedRawNANDMSPCounters();
  const struct {
    std::span<const SigDigits> rows;
    std::string_view name;
    int digits;
  } rows[] = {
      {ftl, "k3rFwVer", 2},
      {ftl, "ESR_APIErrorMessage", 0},
      {ftl, "ESR_storeDemoMode", 1},
      {ftl, "numBootChainUpdates", 3},
      {ftl, "nofDies", 4},
      {ftl, "ESR_APIErrorCode", 4},
      {ftl, "clogFailReason_12", 5},
      {ftl, "ungracefulBootTimeLogMs_7", 5},
      {ftl, "averageSLCPECycles", 6},
      {ftl, "ESR_averageSLCPECycles", 6},
      {ftl, "hostWrites", 8},
      {ftl, "ESR_hostWrites", 8},
      {ftl, "CacheDepthVsThroughput_255", 8},
      {ftl, "lhotSkipPrecent", 8},
      {ftl, "Count", -1},
      {ftl, "lhotSkipPercent", -1},
      {ftl, "CacheDepthVsThroughput_256", -1},
      {ftl, "msp_index", -1},
      {msp, "fw_updates", 3},
      {msp, "ESR_hostWrites", 8},
      {msp, "ESR_APIErrorMessage", 0},
      {msp, "boot_block_refresh", 4},
      {msp, "device_config", 5},
      {msp, "ESR_averageSLCPECycles", 6},
      {msp, "readFail", 2},
      {msp, "higher_die_temperature15", 2},
      {msp, "lower_die_temperature15", 2},
      {msp, "higher_die_temperature16", -1},
      {msp, "higher_die_temperature20", -1},
      {msp, "lower_die_temperature31", -1},
      {msp, "msp_index", -1},
      {msp, "total_nof_msps", -1},
      {msp, "Count", -1},
  };
  for (const auto& r : rows) EXPECT_EQ(DigitsOf(r.rows, r.name), r.digits) << r.name;

  // The non-default digits, counted over each whole whitelist.
  const struct {
    std::span<const SigDigits> rows;
    std::map<int, size_t> by_digits;
  } spreads[] = {
      {ftl, {{0, 1}, {1, 1}, {2, 7}, {3, 5}, {4, 11}, {5, 87}, {6, 5}, {8, 814}}},
      {msp, {{0, 1}, {2, 247}, {3, 5}, {4, 2}, {5, 4}, {6, 1}, {8, 1}}},
  };
  for (const auto& s : spreads) {
    std::map<int, size_t> by_digits;
    for (const SigDigits& r : s.rows) ++by_digits[r.digits];
    EXPECT_EQ(by_digits, s.by_digits);
  }

  const std::vector<std::pair<std::string_view, int>> storage = {
      {"EAN_imageSize_BIC", 5},       {"EAN_imageSize_LTH", 5},
      {"EAN_updateCount_BIC", 4},     {"EAN_updateCount_FW", 4},
      {"EAN_updateCount_LTH", 4},     {"EAN_updateCount_LowPowerEM", 4},
      {"EAN_updateCount_NonEssentialFW", 4},
      {"EAN_updateCount_dConfig", 4}, {"EAN_updateCount_fConfig", 4},
      {"ESR_APIErrorCode", 4},        {"ESR_DV_Capacity_GB", 5},
      {"ESR_DV_Diskfullness_BP", 2},  {"ESR_averageSLCPECycles", 6},
      {"ESR_averageTLCPECycles", 5},  {"ESR_formatWeeksSince2000", 5},
      {"ESR_hostWrites", 8},
  };
  std::vector<std::pair<std::string_view, int>> got;
  for (const SigDigits& r : WhitelistedStorageStats()) got.emplace_back(r.name, r.digits);
  EXPECT_EQ(got, storage);
}

TEST(ViewTables, EventFieldLists) {
  const struct {
    std::string_view event;
    std::string_view first, last;
    bool has_count;
  } ends[] = {
      {kFTLCountersEvent, "k3rFwVer", "Count", true},
      // The histogram list is the one without "Count".
      {kFTLHistogramsEvent, "gracefulBootTimeLogMs_0", "ESR_formatWeeksSince2000", false},
      {kMSPCountersEvent, "msp_index", "Count", true},
      {kStorageStatsEvent, "EAN_updateCount_FW", "Count", true},
  };
  for (const auto& e : ends) {
    const auto fields = EventLensFields(e.event);
    ASSERT_FALSE(fields.empty()) << e.event;
    EXPECT_EQ(fields.front(), e.first) << e.event;
    EXPECT_EQ(fields.back(), e.last) << e.event;
    EXPECT_EQ(Has(fields, "Count"), e.has_count) << e.event;
  }

  // Rows in stored order, ranges expanded, odd spellings kept.
  const struct {
    std::string_view event;
    size_t index;
    std::string_view name;
  } rows[] = {
      {kFTLCountersEvent, 33, "numBandsRefreshedForAgePerTier_0"},
      {kFTLCountersEvent, 35, "numBandsRefreshedForAgePerTier_2"},
      {kFTLCountersEvent, 45, "bandsPerSpecialFlow_2"},
      {kFTLCountersEvent, 46, "bandsPerSpecialFlow_4"},
      {kFTLHistogramsEvent, 191, "CacheDepthVsThroughput_0"},
      {kFTLHistogramsEvent, 446, "CacheDepthVsThroughput_255"},
      {kFTLHistogramsEvent, 484, "bandsLifeTimeTempHisto_22"},
      {kMSPCountersEvent, 1, "active_time_hist0"},
      {kMSPCountersEvent, 167, "higher_die_temperature29"},
      {kMSPCountersEvent, 168, "higher_die_temperature27"},
      {kStorageStatsEvent, 15, "ESR_DV_Diskfullness_BP"},
  };
  for (const auto& r : rows) {
    const auto fields = EventLensFields(r.event);
    ASSERT_LT(r.index, fields.size());
    EXPECT_EQ(fields[r.index], r.name) << r.event << " [" << r.index << "]";
  }
  EXPECT_TRUE(Has(EventLensFields(kFTLCountersEvent), "lhotSkipPrecent"));
  EXPECT_FALSE(Has(EventLensFields(kFTLCountersEvent), "bandsPerSpecialFlow_3"));
  for (std::string_view name : {"higher_die_temperature16", "higher_die_temperature20",
                                "higher_die_temperature31", "lower_die_temperature31"}) {
    EXPECT_TRUE(Has(EventLensFields(kMSPCountersEvent), name)) << name;
  }
}

// Each whitelist is its events' fields, less the names it leaves out, plus
// the error message.
TEST(ViewTables, WhitelistsFollowTheEvents) {
  std::set<std::string_view> msp_dropped = {"Count", "msp_index", "total_nof_msps"};
  std::vector<std::string> temperatures;
  for (int i = 16; i < 32; ++i) {
    temperatures.push_back("higher_die_temperature" + std::to_string(i));
    temperatures.push_back("lower_die_temperature" + std::to_string(i));
  }
  for (const std::string& t : temperatures) msp_dropped.insert(t);
  ASSERT_EQ(msp_dropped.size(), 35u);

  const struct {
    const char* what;
    std::span<const SigDigits> rows;
    std::vector<std::string_view> events;
    std::set<std::string_view> dropped;
    std::set<std::string_view> added;
  } cases[] = {
      {"FTL", WhitelistedRawNANDFTLCounters(), {kFTLCountersEvent, kFTLHistogramsEvent},
       {"Count"}, {"ESR_APIErrorMessage"}},
      {"MSP", WhitelistedRawNANDMSPCounters(), {kMSPCountersEvent}, msp_dropped,
       {"ESR_APIErrorMessage"}},
      {"storage", WhitelistedStorageStats(), {kStorageStatsEvent}, {"Count"}, {}},
  };
  for (const auto& c : cases) {
    std::set<std::string_view> want = c.added;
    for (std::string_view event : c.events) {
      for (std::string_view f : EventLensFields(event)) {
        if (!c.dropped.contains(f)) want.insert(f);
      }
    }
    for (std::string_view d : c.dropped) {
      bool listed = false;
      for (std::string_view event : c.events) listed |= Has(EventLensFields(event), d);
      EXPECT_TRUE(listed) << c.what << ": drops " << d << ", which no event lists";
    }
    EXPECT_EQ(Names(c.rows), want) << c.what;
  }
}

TEST(ViewTables, ReferenceMap) {
  // Exact text layout: 4-space indent, "field" : "value".
  EXPECT_EQ(kEventLensRefJson.size(), 75799u);
  EXPECT_TRUE(kEventLensRefJson.starts_with(
      "{\n    \"com.velmora.massstorage.NANDInfo\" : {\n"
      "        \"2E_H2F_VL_Corr\" : \"com.velmora.NANDInfo.E2E_H2F_VL_Corr\",\n"));
  EXPECT_TRUE(kEventLensRefJson.ends_with(
      "        \"readStage5_NumOfErrorsBin_1_19\" : \"log.only.to.EL\"\n    }\n}"));

  const auto ordered = nlohmann::ordered_json::parse(kEventLensRefJson);
  ASSERT_TRUE(ordered.is_object());
  const std::span<const std::string_view> events = EventLensEvents();
  ASSERT_EQ(events.size(), 36u);
  ASSERT_EQ(ordered.size(), 36u);
  size_t i = 0;
  for (const auto& [name, group] : ordered.items()) {
    EXPECT_EQ(name, events[i]) << "member " << i << " out of send order";
    ++i;
  }

  const nlohmann::json map = nlohmann::json::parse(kEventLensRefJson);
  const std::set<std::string> event_set(events.begin(), events.end());
  std::set<std::string> member_set;
  size_t entries = 0, keys = 0, same_name = 0, placeholders = 0, log_only = 0;
  std::vector<std::pair<std::string, std::string>> placeholder_fields;
  for (const auto& [name, group] : map.items()) {
    member_set.insert(name);
    ASSERT_TRUE(group.is_object()) << name;
    for (const auto& [field, value] : group.items()) {
      ASSERT_TRUE(value.is_string()) << name << " " << field;
      const std::string v = value.get<std::string>();
      ++entries;
      if (v.starts_with(kKeyPrefix)) {
        ++keys;
        same_name += v.substr(kKeyPrefix.size()) == field;
      } else if (v == kNANDInfoTbkdPlaceholder) {
        ++placeholders;
        placeholder_fields.emplace_back(name, field);
      } else if (v == kNANDInfoLogELOnly) {
        ++log_only;
        EXPECT_EQ(name, events.back()) << field;
      } else {
        ADD_FAILURE() << name << " " << field << " -> " << v;
      }
    }
  }
  EXPECT_EQ(member_set, event_set);
  EXPECT_EQ(entries, 1043u);
  EXPECT_EQ(keys, 755u);
  EXPECT_EQ(same_name, 480u);  // the other 275 are renames and the field<N> groups
  EXPECT_EQ(placeholders, 3u);
  EXPECT_EQ(log_only, 285u);
  EXPECT_EQ(placeholder_fields, (std::vector<std::pair<std::string, std::string>>{
                                    {"com.velmora.massstorage.NANDInfo_2", "DiskUsageUserBlocksFree"},
                                    {"com.velmora.massstorage.NANDInfo_2", "DiskUsageUserTotalBlocks"},
                                    {"com.velmora.massstorage.NANDInfo_6", "VMFreezer_NumPhysicalWrites"},
                                }));

  const struct {
    size_t group;  // 1-based, in send order
    size_t entries;
  } sizes[] = {{1, 50}, {2, 50}, {3, 50}, {4, 33}, {20, 45}, {25, 4}, {28, 64}, {31, 64},
               {32, 4}, {33, 13}, {34, 20}, {35, 37}, {36, 285}};
  for (const auto& s : sizes) {
    EXPECT_EQ(map.at(std::string(events[s.group - 1])).size(), s.entries) << "group " << s.group;
  }

  const struct {
    size_t group;
    const char* field;
    const char* value;  // nullptr: the group has no such field
  } rows[] = {
      {1, "2E_H2F_VL_Corr", "com.velmora.NANDInfo.E2E_H2F_VL_Corr"},
      {1, "E2E_H2F_VL_Corr", nullptr},
      {1, "eadsBeforeErasure50000", "com.velmora.NANDInfo.ReadsBeforeErasure50000"},
      {1, "DriverVersion", "com.velmora.NANDInfo.DemoMode"},
      {1, "DemoMode", "com.velmora.NANDInfo.DemoMode"},
      {1, "BitFlipDupesParityWidget", "com.velmora.NANDInfo.BitFlipCountParityWidget"},
      {1, "BitFlipDupesECCWidget", "com.velmora.NANDInfo.BitFlipDupesECCWidget"},
      {1, "Error", "com.velmora.NANDInfo.Error"},
      {2, "lhotSkipPrecent", "com.velmora.NANDInfo.lhotSkipPercent"},
      {2, "maxMemLowDuration", "com.velmora.NANDInfo.maxMemExtremeDuration"},
      {2, "metaMismatchReread", "com.velmora.NANDInfo.MetaMismatchReread"},
      {2, "ErrorMessage", nullptr},
      {3, "numMemLow", "com.velmora.NANDInfo.numMemExtreme"},
      {3, "ReadsBeforeErasure200000", "com.velmora.NANDInfo.ReadsBeforeErasure200000"},
      {4, "TotalPurgeableBytes", "com.velmora.NANDInfo.Purgewell.TotalPurgeableBytes"},
      {4, "wcacheDS_Reads", "com.velmora.NANDInfo.wcacheDSReads"},
      {4, "powerBudgetSelect3", "com.velmora.NANDInfo.powerBudgetSelect3"},
      {25, "PadSize1", "com.velmora.NANDInfo.PadSize1"},
      {25, "PadSize0", nullptr},
      {28, "field0", "com.velmora.NANDInfo.CacheDepthVsThroughput0"},
      {28, "field5", "com.velmora.NANDInfo.CacheDepthVsThroughput5"},
      {28, "field64", nullptr},
      {29, "field64", "com.velmora.NANDInfo.CacheDepthVsThroughput64"},
      {31, "field255", "com.velmora.NANDInfo.CacheDepthVsThroughput255"},
      {32, "field2", "com.velmora.NANDInfo.clogPagesFillingPercentage2"},
      {32, "field4", nullptr},
      {36, "avg_rd_window_size_0", "log.only.to.EL"},
      {36, "nandStageOfLife_3", nullptr},
      {36, "readStage1_2_4_5_NumOfBitFlipsBin_10", "log.only.to.EL"},
  };
  for (const auto& r : rows) {
    const nlohmann::json& group = map.at(std::string(events[r.group - 1]));
    if (r.value == nullptr) {
      EXPECT_FALSE(group.contains(r.field)) << "group " << r.group << " " << r.field;
    } else {
      EXPECT_EQ(group.value(r.field, ""), r.value) << "group " << r.group << " " << r.field;
    }
  }
}

}  // namespace
}  // namespace nandinfo
