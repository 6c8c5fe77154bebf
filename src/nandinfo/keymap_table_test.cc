#include "nandinfo/keymap_table.h"

#include <gtest/gtest.h>

#include <cctype>
#include <set>
#include <string>

namespace {

constexpr std::string_view kPrefix = "com.velmora.NANDInfo.";

TEST(KeyMapTest, KindsNamesAndKeys) {
  size_t same = 0, capitalised = 0, own = 0;
  std::set<std::string_view> names, keys;
  for (const KeyMapRecord& r : keyMap) {
    ASSERT_TRUE(r.key.starts_with(kPrefix)) << r.name;
    const std::string_view suffix = r.key.substr(kPrefix.size());
    std::string upper(r.name);
    upper[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(upper[0])));
    if (suffix == r.name)
      ++same;
    else if (suffix == upper)
      ++capitalised;
    else
      ++own;
    EXPECT_TRUE(names.insert(r.name).second) << "name twice: " << r.name;
    EXPECT_TRUE(keys.insert(r.key).second) << "key twice: " << r.key;
  }
  EXPECT_EQ(std::size(keyMap), 709u);
  EXPECT_EQ(same, 475u);
  EXPECT_EQ(capitalised, 152u);
  EXPECT_EQ(own, 82u);
}

TEST(KeyMapTest, NamedRowsAndRangeEnds) {
  const struct {
    std::string_view name;
    std::string_view suffix;
  } rows[] = {
      {"maxMemLowDuration", "maxMemExtremeDuration"},
      {"memLowDuration", "memExtremeDuration"},
      {"padSizes0", "PadSize1"},
      {"padSizes3", "PadSize4"},
      {"bandsPerSpecialFlow2", "BandsPerInternalFlow2"},
      {"bandsPerSpecialFlow4", "BandsPerInternalFlow3"},
      {"lhotSkipPrecent", "lhotSkipPercent"},
      {"coldestCycle1", "IntermediateColdestCycle"},
      {"raidReconstructSuccessPartition0", "raidReconstructSuccessPartition"},
      {"raidReconstructSuccessPartition1", "raidReconstructSuccessPartition1"},
      {"E2EDPErrorCounters11", "E2E_F2H_SL_UECC"},
      {"wcacheDS_Reads", "wcacheDSReads"},
      {"numFactoryBad", "numFactoryBadBlocks"},
      {"CacheDepthVsThroughput0", "CacheDepthVsThroughput0"},
      {"CacheDepthVsThroughput255", "CacheDepthVsThroughput255"},
      {"balanceProportionBucketsHistogram10", "balanceProportionBucketsHistogram10"},
      {"wcacheDirtyAtFlush15", "wcacheDirtyAtFlush15"},
      {"raidFailedReadQParityInternal", "raidFailedReadQParityInternal"},
      {"intermediateBandErases", "IntermediateBandErases"},
      {"bandsCrossTempHisto44", "BandsCrossTempHisto44"},
      {"numOfAvoidedGCDueToTemp", "NumOfAvoidedGCDueToTemp"},
  };
  for (const auto& row : rows) {
    const KeyMapRecord* r = FindKeyMapRecord(row.name);
    ASSERT_NE(r, nullptr) << row.name;
    EXPECT_EQ(r->name, row.name);
    EXPECT_EQ(r->key, std::string(kPrefix) + std::string(row.suffix)) << row.name;
  }
}

TEST(KeyMapTest, LookupFindsEveryRowAndNothingElse) {
  for (const KeyMapRecord& r : keyMap) EXPECT_EQ(FindKeyMapRecord(r.name), &r) << r.name;

  for (std::string_view absent : {
           "", "numMemChok", "numMemChokeX", "NumMemChoke", "numMemChoke ",  // near a name
           "bandsPerSpecialFlow3",                                            // the gap before Flow4
           "padSizes4", "CacheDepthVsThroughput256", "bandsCrossTempHisto45", "wcacheDirtyAtFlush16",
           "bandsMaxTempHisto22", "E2EDPErrorCounters12", "maxMemExtremeDuration",  // a suffix, not a name
           "userPartitionStart", "mspBootBlockReadFail0",                         // handled by the builder
           "AAAA", "zzzz",                                                        // before and after all names
       })
    EXPECT_EQ(FindKeyMapRecord(absent), nullptr) << absent;
  EXPECT_EQ(FindKeyMapRecord(std::string(98, 'n')), nullptr);
}

}  // namespace
