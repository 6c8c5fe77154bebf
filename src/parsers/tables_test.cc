#include <gtest/gtest.h>

#include <set>

#include "parsers/ftl_table.h"
#include "parsers/msp_table.h"

namespace parsers {
namespace {

TEST(TablesTest, FtlTableCountsAndGaps) {
  const auto rows = FtlFields();
  ASSERT_EQ(rows.size(), 569u);
  size_t scalars = 0, arrays = 0, elements = 0;
  std::set<uint32_t> keys;
  uint32_t previous = 0;
  for (const FtlField& f : rows) {
    EXPECT_GT(f.key, previous) << "rows are in key order without duplicates";
    previous = f.key;
    keys.insert(f.key);
    EXPECT_GE(f.key, 1u);
    EXPECT_LE(f.key, 666u);
    EXPECT_EQ(FindFtlField(f.key), &f);
    if (f.is_array()) {
      ++arrays;
      elements += f.count;
      EXPECT_GE(f.count, 2u) << f.name;
      EXPECT_LE(f.count, 256u) << f.name;
    } else {
      ++scalars;
    }
  }
  EXPECT_EQ(scalars, 469u);
  EXPECT_EQ(arrays, 100u);
  EXPECT_EQ(elements, 1687u);
  EXPECT_EQ(scalars + elements, 2156u);

  const std::set<uint32_t> gaps = {21,  25,  26,  29,  32,  33,  35,  40,  74,  78,  79,  108, 111, 117, 128, 150, 151,
                                   162, 166, 168, 170, 171, 173, 174, 175, 176, 177, 178, 179, 180, 181, 251, 255, 275,
                                   276, 278, 293, 294, 295, 296, 297, 339, 342, 363, 380, 413, 415, 439, 451, 455, 474,
                                   475, 478, 479, 480, 482, 508, 509, 512, 513, 514, 515, 528, 529, 536, 550, 552, 554,
                                   555, 556, 562, 571, 577, 578, 579, 580, 585, 598, 599, 600, 610, 633, 634, 650, 651,
                                   652, 653, 654, 655, 656, 658, 660, 661, 662, 663, 664, 665};
  ASSERT_EQ(gaps.size(), 97u);
  for (uint32_t k = 1; k <= 666; ++k) EXPECT_EQ(keys.count(k) == 0, gaps.count(k) == 1) << k;
  for (uint32_t k : {0u, 667u, 0xFFFFu, 0x30000001u}) EXPECT_EQ(FindFtlField(k), nullptr);

  EXPECT_STREQ(FindFtlField(1)->name, "version");
  EXPECT_STREQ(FindFtlField(14)->name, "hostWriteLogHisto");
  EXPECT_EQ(FindFtlField(14)->count, 10u);
  EXPECT_STREQ(FindFtlField(53)->name, "exportVersion");
  EXPECT_EQ(FindFtlField(90)->count, 160u);
  EXPECT_EQ(FindFtlField(265)->count, 5u);
  EXPECT_STREQ(FindFtlField(666)->name, "nofDies");
  // The fixed fields of the full statistics context are scalars.
  for (uint32_t k : {4, 7, 12, 13, 17, 18, 19, 20, 28, 45, 48, 49, 50, 51, 52, 53, 56})
    EXPECT_FALSE(FindFtlField(k)->is_array()) << k;
}

TEST(TablesTest, MspTableCounts) {
  const auto rows = MspFields();
  ASSERT_EQ(rows.size(), 95u);
  size_t single = 0, arrays = 0, elements = 0;
  for (const MspField& f : rows) {
    EXPECT_EQ(FindMspField(f.key), &f);
    EXPECT_GE(f.count, 1u);
    EXPECT_LE(f.count, 20u);
    if (f.count == 1) ++single;
    else ++arrays, elements += f.count;
  }
  EXPECT_EQ(single, 78u);
  EXPECT_EQ(arrays, 17u);
  EXPECT_EQ(elements, 176u);
  EXPECT_EQ(single + elements, 254u);
  for (uint32_t k = 4096; k <= 4168; ++k) EXPECT_NE(FindMspField(k), nullptr) << k;
  for (uint32_t k = 8193; k <= 8214; ++k) EXPECT_NE(FindMspField(k), nullptr) << k;
  for (uint32_t k : {0u, 4095u, 4169u, 4200u, 8192u, 8215u, 0x2FFEu, 0x2FFFu}) EXPECT_EQ(FindMspField(k), nullptr) << k;
  EXPECT_STREQ(FindMspField(4096)->name, "passWithTmodeHard");
  EXPECT_STREQ(FindMspField(8195)->name, "lower_die_temperature");
  EXPECT_EQ(FindMspField(8195)->count, 16u);
  EXPECT_EQ(FindMspField(4166)->count, 20u);
}

}  // namespace
}  // namespace parsers
