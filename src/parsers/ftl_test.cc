#include <gtest/gtest.h>

#include <type_traits>

#include "parsers/parsers.h"
#include "sim/statistics_buffers.h"

namespace {

using sim::WordRecordBuffer;

class FtlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    parsers::testing::ResetAPIErrorMessage();
    parsers::testing::g_adds_before_failure = -1;
  }
  void TearDown() override { parsers::testing::g_adds_before_failure = -1; }
  static std::vector<std::string> Names(const GenericParserCxt& c) {
    std::vector<std::string> out;
    for (const auto& p : c.pairs) out.emplace_back(p.name);
    return out;
  }
  static uint32_t Ftl(GenericParserCxt& c, const WordRecordBuffer& b) {
    return VSPFTLParseBufferToCxt(&c, b.bytes().data(), b.size());
  }
  static uint32_t Stats(VSPParseCxt& c, const WordRecordBuffer& b) {
    return VSPParseBufferToCxt(&c, b.bytes().data(), b.size());
  }
};

// Each fixed field of the full statistics context comes from its own key.
// Keys and names are written out here rather than taken from the field
// table, and each key gets a value of its own, so two swapped fields fail.
TEST_F(FtlTest, StatsFixedFieldsByKey) {
  struct Fixed {
    uint32_t key;
    const char* name;
    uint64_t (*get)(const VSPParseCxt&);
    bool low_32_bits;
  };
#define FIXED(key, field, narrow) {key, #field, [](const VSPParseCxt& c) -> uint64_t { return c.field; }, narrow}
  const Fixed fixed[] = {
      FIXED(4, hostWrites, false),
      FIXED(7, hostReads, false),
      FIXED(12, IND_pool_free, false),
      FIXED(13, IND_pool_count, false),
      FIXED(17, wearLevMoves, false),
      FIXED(18, nandWrites, false),
      FIXED(19, nandReads, false),
      FIXED(20, bandErases, false),
      FIXED(28, numSleepOps, false),
      FIXED(45, maxHighEnduranceBlockErases, false),
      FIXED(48, numFreeVirtualBlocks, false),
      FIXED(49, bytesPerPage, true),
      FIXED(50, pagesPerVirtualBlock, true),
      FIXED(51, blocksPerVirtualBlock, true),
      FIXED(52, numVirtualBlocks, true),
      FIXED(53, exportVersion, true),
      FIXED(56, utilFormatTime, false),
  };
#undef FIXED
  ASSERT_EQ(std::size(fixed), 17u);
  // Distinct in both halves, so the 32-bit fields differ too.
  auto value = [](uint32_t key) { return (uint64_t{0xAB00 + key} << 32) | (0x5000 + key); };
  auto expected = [&](const Fixed& f) { return f.low_32_bits ? value(f.key) & 0xFFFFFFFF : value(f.key); };

  // One key at a time: its field and no other.
  for (const Fixed& f : fixed) {
    WordRecordBuffer b;
    b.Record(f.key, {value(f.key)});
    VSPParseCxt c;
    ASSERT_EQ(Stats(c, b), 1u) << f.name;
    for (const Fixed& g : fixed) EXPECT_EQ(g.get(c), &g == &f ? expected(f) : 0u) << f.name << " -> " << g.name;
    for (uint64_t h : c.readCountHisto) EXPECT_EQ(h, 0u) << f.name;
    ASSERT_EQ(c.pairs.size(), 1u);
    EXPECT_EQ(c.pairs[0].name, f.name);
    EXPECT_EQ(c.pairs[0].value, value(f.key));  // the pair keeps all 64 bits
  }

  // All together with readCountHisto (key 265, five elements; extra words
  // are not stored), a key that has no fixed field, and the FTL end marker,
  // which this parse does not know: the record after it is read.
  WordRecordBuffer all;
  for (const Fixed& f : fixed) all.Record(f.key, {value(f.key)});
  all.Record(265, {71, 72, 73, 74, 75, 76, 77}).Record(16, {99}).End().Record(2, {98});
  VSPParseCxt c;
  ASSERT_EQ(Stats(c, all), 1u);
  for (const Fixed& f : fixed) EXPECT_EQ(f.get(c), expected(f)) << f.name;
  for (size_t i = 0; i < 5; ++i) EXPECT_EQ(c.readCountHisto[i], 71 + i) << i;
  EXPECT_EQ(c.driverVersion, 0xFFFFFFFFu);
  ASSERT_EQ(c.pairs.size(), 17u + 5u + 2u);
  EXPECT_EQ(c.pairs[17].name, "readCountHisto0");
  EXPECT_EQ(c.pairs[21].name, "readCountHisto4");
  EXPECT_EQ(c.pairs[22].name, "gcWrites");
  EXPECT_EQ(c.pairs[23].name, "hostWriteXacts");

  // Release empties the pairs and zeroes every fixed field.
  VSPReleaseContext(&c);
  EXPECT_TRUE(c.pairs.empty());
  for (const Fixed& f : fixed) EXPECT_EQ(f.get(c), 0u) << f.name;
  for (uint64_t h : c.readCountHisto) EXPECT_EQ(h, 0u);
  EXPECT_EQ(c.driverVersion, 0u);
}

TEST_F(FtlTest, EndRulesAndSkipping) {
  GenericParserCxt c;
  // Zero-length record, a scalar, an unknown key, the end marker, then a
  // record that must not be read.
  WordRecordBuffer b;
  b.Header(2, 0).Record(2, {7, 99}).Record(21, {5, 5}).Record(700, {1}).Record(0xFFFF, {0}).Record(3, {8});
  EXPECT_EQ(Ftl(c, b), 1u);
  EXPECT_EQ(Names(c), (std::vector<std::string>{"hostWriteXacts"}));
  EXPECT_EQ(c.pairs[0].value, 7u);  // further payload words are ignored

  // A key above 0x30000000 ends both parses; a truncated record too.
  c = {};
  WordRecordBuffer bad;
  bad.Record(2, {1}).Record(0x30000001, {1}).Record(3, {2});
  EXPECT_EQ(Ftl(c, bad), 1u);
  VSPParseCxt s;
  s.exportVersion = 9;
  EXPECT_EQ(Stats(s, bad), 0u);
  EXPECT_EQ(s.exportVersion, 0u);
  c = {};
  WordRecordBuffer truncated;
  truncated.Record(2, {1}).Header(3, 2).Word(5);
  EXPECT_EQ(Ftl(c, truncated), 1u);
  VSPParseCxt t;
  EXPECT_EQ(Stats(t, truncated), 0u);
  EXPECT_EQ(GetAPIErrorMessage(), "NA");  // ending on a bad record is quiet

  // Fewer than 8 bytes.
  c = {};
  EXPECT_EQ(VSPFTLParseBufferToCxt(&c, "1234567", 7), 0u);
  VSPParseCxt small;
  small.exportVersion = 5;
  EXPECT_EQ(VSPParseBufferToCxt(&small, "1234567", 7), 0u);
  EXPECT_EQ(small.exportVersion, 5u);
  EXPECT_EQ(small.driverVersion, 0xFFFFFFFFu);
  EXPECT_EQ(VSPFTLParseBufferToCxt(&c, nullptr, 64), 0u);

  // Exactly filled gives 1; four stray bytes are ignored; one word short gives 0.
  WordRecordBuffer exact;
  exact.Record(4, {10}).Record(7, {20});
  VSPParseCxt e;
  EXPECT_EQ(Stats(e, exact), 1u);
  EXPECT_EQ(e.hostWrites, 10u);
  EXPECT_EQ(e.hostReads, 20u);
  WordRecordBuffer stray = exact;
  stray.Bytes("abcd");
  VSPParseCxt st;
  EXPECT_EQ(Stats(st, stray), 1u);
  WordRecordBuffer short_one;
  short_one.Record(4, {10}).Header(7, 2).Word(1);
  VSPParseCxt sh;
  EXPECT_EQ(Stats(sh, short_one), 0u);
  EXPECT_EQ(sh.hostWrites, 10u);  // what was parsed stays
}

TEST_F(FtlTest, ArraysNamesAndMismatchMessages) {
  GenericParserCxt c;
  WordRecordBuffer shorter;
  shorter.Record(14, {0, 1, 2, 3, 4, 5, 6});
  EXPECT_EQ(Ftl(c, shorter), 7u);
  EXPECT_EQ(Names(c).front(), "hostWriteLogHisto_0");
  EXPECT_EQ(Names(c).back(), "hostWriteLogHisto_6");
  EXPECT_EQ(GetAPIErrorMessage(), "VSPFTLParseBufferToCxt: hostWriteLogHisto(14): (#10) cfg elements != (7) buffer elements");

  parsers::testing::ResetAPIErrorMessage();
  c = {};
  WordRecordBuffer longer;
  longer.Record(14, {0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11}).Record(2, {42});
  EXPECT_EQ(Ftl(c, longer), 11u);  // ten elements, then the scalar after all twelve words
  EXPECT_EQ(c.pairs.back().name, "hostWriteXacts");
  EXPECT_EQ(c.pairs.back().value, 42u);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPFTLParseBufferToCxt: hostWriteLogHisto(14): (#10) cfg elements != (12) buffer elements");

  // One word: the bare name, "_" included for the FTL parse, not for stats.
  c = {};
  WordRecordBuffer single;
  single.Record(14, {5});
  EXPECT_EQ(Ftl(c, single), 1u);
  EXPECT_EQ(Names(c), (std::vector<std::string>{"hostWriteLogHisto_"}));
  VSPParseCxt s;
  EXPECT_EQ(Stats(s, single), 1u);
  EXPECT_EQ(Names(s), (std::vector<std::string>{"hostWriteLogHisto"}));

  // Stats names run on without "_"; key 265 fills readCountHisto.
  WordRecordBuffer stats;
  stats.Record(269, {1, 2}).Record(265, {10, 11, 12, 13, 14}).Record(53, {(1ull << 32) + 2});
  VSPParseCxt full;
  EXPECT_EQ(Stats(full, stats), 1u);
  EXPECT_EQ(Names(full)[0], "numBootBlockRefreshSuccess0");
  EXPECT_EQ(Names(full)[1], "numBootBlockRefreshSuccess1");
  EXPECT_EQ(Names(full)[6], "readCountHisto4");
  EXPECT_EQ(full.readCountHisto[0], 10u);
  EXPECT_EQ(full.readCountHisto[4], 14u);
  EXPECT_EQ(full.exportVersion, 2u);  // the low 32 bits
  EXPECT_EQ(full.pairs.back().name, "exportVersion");
  EXPECT_EQ(full.pairs.back().value, 4294967298u);
  EXPECT_EQ(ParserPairValueText(full.pairs.back()), "4294967298");
}

TEST_F(FtlTest, AddFailures) {
  GenericParserCxt c;
  WordRecordBuffer b;
  b.Record(1, {1}).Record(2, {2}).Record(14, {1, 2, 3}).Record(3, {3});
  parsers::testing::g_adds_before_failure = 0;
  // A failed scalar still counts and the walk goes on; a failed array stops it.
  EXPECT_EQ(Ftl(c, b), 2u);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPFTLParseBufferToCxt: version(1) cannot add 1 element to context");
  parsers::testing::ResetAPIErrorMessage();
  parsers::testing::g_adds_before_failure = 2;
  c = {};
  WordRecordBuffer arrays;
  arrays.Record(14, std::vector<uint64_t>(10, 1)).Record(2, {2});
  EXPECT_EQ(Ftl(c, arrays), 0u);
  EXPECT_TRUE(c.pairs.empty());  // no partial run of the failed array
  EXPECT_EQ(GetAPIErrorMessage(), "VSPFTLParseBufferToCxt: hostWriteLogHisto(14): Cannot add 10 elements to context");
  // The first message of the process wins.
  SetAPIErrorMessage("later %d", 1);
  EXPECT_EQ(GetAPIErrorMessage(), "VSPFTLParseBufferToCxt: hostWriteLogHisto(14): Cannot add 10 elements to context");
}

// An array add is all or nothing: a call that fails leaves the context as it
// was before the call (earlier pairs stay), and a count the 16-bit index
// cannot name is refused before anything is added.
TEST_F(FtlTest, ArrayAddsAllOrNothing) {
  std::vector<uint64_t> source(65537);
  for (size_t i = 0; i < source.size(); ++i) source[i] = i * 3;
  struct Case {
    const char* what;
    uint32_t count;
    int64_t adds_before_failure;
    int result;
    size_t added;
  };
  const Case cases[] = {
      {"the largest count", 65536, -1, 1, 65536},
      {"one past the 16-bit index", 65537, -1, 0, 0},
      {"heap exhausted mid-array", 10, 4, 0, 0},
      {"heap exhausted at the first element", 10, 0, 0, 0},
      {"heap exhausted at the last element", 10, 9, 0, 0},
      {"heap holds exactly the array", 10, 10, 1, 10},
      {"a single element without heap", 1, 0, 0, 0},
      {"a count no heap could hold", UINT32_MAX, -1, 0, 0},
  };
  for (const Case& k : cases) {
    GenericParserCxt c;
    ASSERT_EQ(AddSingleValueToGenericContext(&c, "", "before", 7), 1);
    ASSERT_EQ(AddMultipleFieldsToGenericContext(&c, "pre", source.data(), 8, 3), 1);
    parsers::testing::g_adds_before_failure = k.adds_before_failure;
    EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, "x", source.data(), 8, k.count), k.result) << k.what;
    parsers::testing::g_adds_before_failure = -1;
    EXPECT_EQ(c.pairs.size(), 4 + k.added) << k.what;
    if (c.pairs.size() != 4 + k.added) continue;
    EXPECT_EQ(c.pairs[3].name, "pre2") << k.what;
    // Every index as its decimal text, across each new digit.
    for (size_t i = 0; i < k.added; ++i) {
      ASSERT_EQ(c.pairs[4 + i].name, "x" + std::to_string(i)) << k.what;
      ASSERT_EQ(c.pairs[4 + i].value, i * 3) << k.what;
    }
    // The context goes on from where it was.
    EXPECT_EQ(AddSingleValueToGenericContext(&c, "", "after", 1), 1);
    EXPECT_EQ(c.pairs.back().name, "after");
    EXPECT_EQ(c.pairs.size(), 5 + k.added) << k.what;
  }
}

TEST_F(FtlTest, ContextOperations) {
  GenericParserCxt c;
  EXPECT_EQ(AddSingleValueToGenericContext(nullptr, "", "x", 1), 0);
  EXPECT_EQ(AddSingleValueToGenericContext(&c, "pre_", std::string(200, 'n').c_str(), 5), 1);
  EXPECT_EQ(c.pairs[0].name.size(), 98u);
  EXPECT_EQ(c.pairs[0].name.substr(0, 5), "pre_n");
  EXPECT_EQ(AddSingleValueToGenericContext(&c, "", "dup", 1), 1);
  EXPECT_EQ(AddSingleValueToGenericContext(&c, "", "dup", 2), 1);
  EXPECT_EQ(c.pairs.size(), 3u);  // duplicates are kept
  const uint32_t four[3] = {0xFFFFFFFF, 2, 3};
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, "t", four, 4, 3), 1);
  EXPECT_EQ(c.pairs[3].name, "t0");
  EXPECT_EQ(c.pairs[3].value, 0xFFFFFFFFu);  // zero-extended
  EXPECT_EQ(ParserPairValueText(c.pairs[3]), "4294967295");
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, "z", four, 4, 0), 1);
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, "z", four, 0, 3), 1);
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, "z", four, 9, 1), 0);
  EXPECT_EQ(c.pairs.size(), 6u);

  // The 98-character cut applies after the index: "n...n10" and "n...n11"
  // both become "n...n1"; one element keeps the bare name.
  const std::string n97(97, 'n');
  const uint64_t twelve[12] = {};
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, n97.c_str(), twelve, 8, 12), 1);
  EXPECT_EQ(c.pairs[6].name, n97 + "0");
  EXPECT_EQ(c.pairs[16].name, n97 + "1");
  EXPECT_EQ(c.pairs[17].name, n97 + "1");
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, std::string(120, 'm').c_str(), twelve, 8, 2), 1);
  EXPECT_EQ(c.pairs.back().name, std::string(98, 'm'));
  EXPECT_EQ(AddMultipleFieldsToGenericContext(&c, n97.c_str(), twelve, 8, 1), 1);
  EXPECT_EQ(c.pairs.back().name, n97);

  // Every name length, whole and split between prefix and name, comes out
  // exactly (cut to 98).
  for (size_t length = 0; length <= 110; ++length) {
    std::string name;
    for (size_t i = 0; i < length; ++i) name += static_cast<char>('!' + (i * 7 + length) % 90);
    const std::string want = name.substr(0, 98);
    ASSERT_EQ(AddSingleValueToGenericContext(&c, "", name.c_str(), length), 1);
    EXPECT_EQ(c.pairs.back().name, want) << length;
    const std::string head = name.substr(0, length / 3), tail = name.substr(length / 3);
    ASSERT_EQ(AddSingleValueToGenericContext(&c, head.c_str(), tail.c_str(), length), 1);
    EXPECT_EQ(c.pairs.back().name, want) << length;
    ASSERT_EQ(AddMultipleFieldsToGenericContext(&c, name.c_str(), twelve, 8, 3), 1);
    EXPECT_EQ(c.pairs.back().name, (name + "2").substr(0, 98)) << length;
  }

  ReleaseGenericParserCxt(&c);
  ReleaseGenericParserCxt(&c);
  ReleaseGenericParserCxt(nullptr);
  EXPECT_TRUE(c.pairs.empty());

  // Names stay readable as a context grows through many blocks, when it is
  // moved (a copy would share its names, so there is none), and the
  // released or moved-from context can be filled again.
  static_assert(!std::is_copy_constructible_v<GenericParserCxt> && !std::is_copy_assignable_v<GenericParserCxt>);
  static_assert(std::is_nothrow_move_constructible_v<GenericParserCxt>);
  std::vector<std::string> expected;
  for (int i = 0; i < 20000; ++i) {
    expected.push_back("f" + std::string(static_cast<size_t>(i % 90), 'x') + std::to_string(i));
    ASSERT_EQ(AddSingleValueToGenericContext(&c, "", expected.back().c_str(), static_cast<uint64_t>(i)), 1);
  }
  GenericParserCxt moved = std::move(c);
  ReleaseGenericParserCxt(&c);
  EXPECT_EQ(AddSingleValueToGenericContext(&c, "", "again", 1), 1);
  EXPECT_EQ(Names(c), (std::vector<std::string>{"again"}));
  c = std::move(moved);
  EXPECT_EQ(Names(c), expected);
  EXPECT_TRUE(moved.pairs.empty());
  EXPECT_EQ(AddSingleValueToGenericContext(&moved, "", "later", 2), 1);
  EXPECT_EQ(Names(moved), (std::vector<std::string>{"later"}));
  VSPParseCxt stats;
  EXPECT_EQ(AddSingleValueToGenericContext(&stats, "", "s", 3), 1);
  VSPParseCxt stats_moved = std::move(stats);
  VSPReleaseContext(&stats);
  EXPECT_EQ(Names(stats_moved), (std::vector<std::string>{"s"}));
}

}  // namespace
