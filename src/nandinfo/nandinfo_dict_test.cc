#include "nandinfo/nandinfo_dict.h"

#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "../../tests/temp_dir.h"
#include "platform/context.h"
#include "platform/log.h"
#include "platform/prefs.h"

namespace {

using cf::NumberType;

constexpr uint64_t k2000 = 946684800;
constexpr uint64_t kWeek = 604800;

std::string Key(std::string_view suffix) { return "com.velmora.NANDInfo." + std::string(suffix); }

class NANDInfoDictTest : public ::testing::Test {
 protected:
  TempDir root;
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, std::make_shared<platform::CaptureLog>()}};

  static VSPParseCxt With(std::vector<std::pair<const char*, uint64_t>> pairs) {
    VSPParseCxt c;
    for (const auto& [name, value] : pairs) EXPECT_EQ(AddSingleValueToGenericContext(&c, "", name, value), 1);
    return c;
  }

  // The number under the key, its exact type included; absent fails.
  static void Expect(const cf::Dictionary& d, std::string_view suffix, int64_t value, NumberType type) {
    const cf::Value* v = d.Find(Key(suffix));
    ASSERT_NE(v, nullptr) << suffix;
    ASSERT_NE(v->AsNumber(), nullptr) << suffix;
    EXPECT_EQ(v->AsNumber()->type(), type) << suffix;
    EXPECT_EQ(v->AsNumber()->AsSInt64(), value) << suffix;
  }
};

TEST_F(NANDInfoDictTest, FixedKeysValuesWidthsAndOrder) {
  VSPParseCxt c;
  c.exportVersion = 7;
  c.driverVersion = 0xFFFFFFFF;  // never set by the parser
  c.numVirtualBlocks = 0x80000000;
  c.pagesPerVirtualBlock = 2;
  c.bytesPerPage = 3;
  c.hostReads = 0xFFFFFFFFFFFFFFFF;
  c.hostWrites = 5;
  c.numFreeVirtualBlocks = 6;
  c.wearLevMoves = 0x100000000;
  c.nandReads = 8;
  c.nandWrites = 9;
  c.bandErases = 10;
  c.IND_pool_free = 11;
  c.IND_pool_count = 12;
  c.utilFormatTime = k2000 + 3 * kWeek + 5;
  c.numSleepOps = 14;
  c.maxHighEnduranceBlockErases = 15;
  c.blocksPerVirtualBlock = 16;
  c.readCountHisto[0] = 17;
  c.readCountHisto[1] = 18;
  c.readCountHisto[2] = 19;
  c.readCountHisto[3] = 20;
  c.readCountHisto[4] = 21;

  const struct {
    std::string_view suffix;
    int64_t value;
    NumberType type;
  } expected[] = {
      {"ExportVersion", 7, NumberType::kInt},
      {"DriverVersion", -1, NumberType::kInt},
      {"DemoMode", 0, NumberType::kSInt64},
      {"NumVirtualBlocks", INT32_MIN, NumberType::kInt},
      {"PagesPerVirtualBlock", 2, NumberType::kInt},
      {"BytesPerPage", 3, NumberType::kInt},
      {"NumLogicalReads", -1, NumberType::kSInt64},
      {"NumLogicalWrites", 5, NumberType::kSInt64},
      {"NumFreeVirtualBlocks", 6, NumberType::kSInt64},
      {"NumWearLevelOps", 0x100000000, NumberType::kSInt64},
      {"NumPhysicalReads", 8, NumberType::kSInt64},
      {"NumPhysicalWrites", 9, NumberType::kSInt64},
      {"NumPhysicalErases", 10, NumberType::kSInt64},
      {"NodesFree", 11, NumberType::kSInt64},
      {"NodesTotal", 12, NumberType::kSInt64},
      {"formatDaysSince2000", 3, NumberType::kSInt64},
      {"NumSleepOps", 14, NumberType::kSInt64},
      {"HighEnduranceBlockEraseCount", 15, NumberType::kSInt64},
      {"BlocksPerVirtualBlock", 16, NumberType::kInt},
      {"ReadsBeforeErasure0", 17, NumberType::kSInt64},
      {"ReadsBeforeErasure50000", 18, NumberType::kSInt64},
      {"ReadsBeforeErasure100000", 19, NumberType::kSInt64},
      {"ReadsBeforeErasure150000", 20, NumberType::kSInt64},
      {"ReadsBeforeErasure200000", 21, NumberType::kSInt64},
      {"NumMaintenanceRequests", 0, NumberType::kSInt64},
      {"MaintenanceRequestsFailedRead", 0, NumberType::kSInt64},
      {"MaintenanceRequestsFailedProg", 0, NumberType::kSInt64},
      {"MaintenanceRequestsFailedErase", 0, NumberType::kSInt64},
  };

  const cf::Dictionary full = BuildNANDInfoDictFromStatsCxt(c, false);
  ASSERT_EQ(full.size(), std::size(expected));
  for (size_t i = 0; i < std::size(expected); ++i) {
    EXPECT_EQ(full.entries()[i].first, cf::Value(Key(expected[i].suffix))) << i;
    Expect(full, expected[i].suffix, expected[i].value, expected[i].type);
  }

  // Without version keys: exactly those three are gone, the rest unchanged.
  const cf::Dictionary bare = BuildNANDInfoDictFromStatsCxt(c, true);
  ASSERT_EQ(bare.size(), std::size(expected) - 3);
  for (size_t i = 3; i < std::size(expected); ++i)
    Expect(bare, expected[i].suffix, expected[i].value, expected[i].type);
  for (std::string_view gone : {"ExportVersion", "DriverVersion", "DemoMode"}) EXPECT_FALSE(bare.Contains(Key(gone)));
}

TEST_F(NANDInfoDictTest, DemoModePreference) {
  const struct {
    const char* what;
    cf::Value value;
    int64_t expected;
  } cases[] = {
      {"absent", cf::Value(), 0},
      {"true", cf::Value::Bool(true), 1},
      {"false", cf::Value::Bool(false), 0},
      {"number 1", cf::Value::SInt32(1), 1},
      {"number 0", cf::Value::SInt32(0), 0},
      {"string", cf::Value("true"), 0},  // not a valid boolean
  };
  for (const auto& c : cases) {
    DGVPreferencesSetValue("StoreDemoMode", c.value, "com.velmora.demo-settings");
    ASSERT_TRUE(DGVPreferencesSynchronize("com.velmora.demo-settings"));
    Expect(BuildNANDInfoDictFromStatsCxt(VSPParseCxt(), false), "DemoMode", c.expected, NumberType::kSInt64);
    EXPECT_EQ(StoreDemoModeEnabled(), c.expected == 1) << c.what;
  }
  // The right key in another domain does not count.
  DGVPreferencesSetValue("StoreDemoMode", cf::Value(), "com.velmora.demo-settings");
  DGVPreferencesSetValue("StoreDemoMode", cf::Value::Bool(true), "com.velmora.other");
  EXPECT_FALSE(StoreDemoModeEnabled());
}

TEST_F(NANDInfoDictTest, WeeksSince2000) {
  const struct {
    uint64_t t;
    int64_t weeks;
  } cases[] = {
      {0, 0},
      {1, 0},
      {k2000 - 1, 0},
      {k2000, 0},
      {k2000 + 1, 0},
      {k2000 + kWeek - 1, 0},
      {k2000 + kWeek, 1},
      {k2000 + 2 * kWeek - 1, 1},
      {1795341600, 1403},                                  // a date in 2026
      {0xFFFFFFFFFFFFFFFF, (0xFFFFFFFFFFFFFFFF - k2000) / kWeek},  // unsigned all the way
  };
  for (const auto& c : cases) {
    VSPParseCxt cxt;
    cxt.utilFormatTime = c.t;
    Expect(BuildNANDInfoDictFromStatsCxt(cxt, true), "formatDaysSince2000", c.weeks, NumberType::kSInt64);
  }
}

TEST_F(NANDInfoDictTest, NamedStatisticsThroughKeyMap) {
  const VSPParseCxt c = With({
      {"maxMemChokeDuration", 123456},
      {"memChokeDuration", 123456},
      {"maxMemLowDuration", 0x50001E240},  // low 32 bits: 123456
      {"memLowDuration", 0x50001E240},
      {"bandsPerSpecialFlow4", 44},
      {"padSizes0", 1},
      {"numGrownBad", 0xFFFFFFFFFFFFFFFF},
      {"notAStatistic", 99},
      {"NumGrownBad", 98},   // names are case-sensitive
      {"numFlushes", 3},
      {"numFlushes", 4},     // a later pair wins
      {"userPartitionStartX", 5},
  });
  const cf::Dictionary d = BuildNANDInfoDictFromStatsCxt(c, true);

  Expect(d, "maxMemChokeDuration", 123000, NumberType::kSInt64);
  Expect(d, "memChokeDuration", 123456, NumberType::kSInt64);
  Expect(d, "maxMemExtremeDuration", 123000, NumberType::kSInt64);
  Expect(d, "memExtremeDuration", 0x50001E240, NumberType::kSInt64);
  Expect(d, "BandsPerInternalFlow3", 44, NumberType::kSInt64);
  Expect(d, "PadSize1", 1, NumberType::kSInt64);
  Expect(d, "numGrownBad", -1, NumberType::kSInt64);
  Expect(d, "NumFlushes", 4, NumberType::kSInt64);
  for (std::string_view absent : {"notAStatistic", "NumGrownBad", "maxMemLowDuration", "bandsPerSpecialFlow4",
                                  "BandsPerSpecialFlow4", "IntermediatePartitionSize"})
    EXPECT_FALSE(d.Contains(Key(absent))) << absent;
  // 21 fixed keys + 8 found statistics (numFlushes once) + 4 maintenance keys.
  EXPECT_EQ(d.size(), 21u + 8u + 4u);
}

TEST_F(NANDInfoDictTest, IntermediatePartitionSize) {
  const struct {
    const char* what;
    std::vector<std::pair<const char*, uint64_t>> pairs;
    bool present;
    int64_t size;
  } cases[] = {
      {"both", {{"intermediatePartitionStart", 100}, {"userPartitionStart", 4196}}, true, 4096},
      {"both, equal", {{"userPartitionStart", 7}, {"intermediatePartitionStart", 7}}, true, 0},
      {"both, user first on the device", {{"userPartitionStart", 0}, {"intermediatePartitionStart", 10}}, true, -10},
      {"no user start", {{"intermediatePartitionStart", 100}}, false, 0},
      {"no intermediate start", {{"userPartitionStart", 100}}, false, 0},
      {"user start equals the sentinel", {{"userPartitionStart", 0xFFFFFFFF}, {"intermediatePartitionStart", 1}}, false, 0},
      {"later pair wins", {{"userPartitionStart", 50}, {"intermediatePartitionStart", 10}, {"userPartitionStart", 30}}, true, 20},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    const cf::Dictionary d = BuildNANDInfoDictFromStatsCxt(With(c.pairs), true);
    EXPECT_EQ(d.Contains(Key("IntermediatePartitionSize")), c.present);
    if (c.present) Expect(d, "IntermediatePartitionSize", c.size, NumberType::kSInt64);
    // The starts themselves are not written.
    EXPECT_FALSE(d.Contains(Key("userPartitionStart")));
    EXPECT_FALSE(d.Contains(Key("intermediatePartitionStart")));
  }
}

TEST_F(NANDInfoDictTest, MaintenanceCounts) {
  const VSPParseCxt c = With({
      {"mspBootBlockReadFail0", 0xFFFFFFFFFFFFFFFF},
      {"mspBootBlockReadFail1", 0},
      {"mspBootBlockReadFail2", 1000000},
      {"mspBootBlockReadFail0", 1},  // a repeat counts again
      {"mspBootBlockReadFail3", 5},  // not one of the three
      {"mspBootBlockProgFail2", 9},
      {"mspBootBlockEraseFail1", 0},
      {"numBootBlockRefreshSuccess0", 40},
      {"numBootBlockRefreshFail0", 2},
      {"numBootBlockRefreshSuccess1", 1000},  // only index 0 counts
      {"numBootBlockRefreshFail0", 3},
  });
  const cf::Dictionary d = BuildNANDInfoDictFromStatsCxt(c, true);
  Expect(d, "MaintenanceRequestsFailedRead", 3, NumberType::kSInt64);
  Expect(d, "MaintenanceRequestsFailedProg", 1, NumberType::kSInt64);
  Expect(d, "MaintenanceRequestsFailedErase", 0, NumberType::kSInt64);
  Expect(d, "NumMaintenanceRequests", 45, NumberType::kSInt64);
  EXPECT_EQ(d.size(), 21u + 4u);
}

}  // namespace
