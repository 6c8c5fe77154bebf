#include <gtest/gtest.h>

#include "parsers/parsers.h"
#include "sim/statistics_buffers.h"

namespace {

std::vector<uint32_t> Words(std::initializer_list<std::pair<int, uint32_t>> set) {
  std::vector<uint32_t> w(63, 0);
  for (const auto& [i, v] : set) w[static_cast<size_t>(i)] = v;
  return w;
}

TEST(SnapshotTest, FixedLayout) {
  std::vector<char> out(8192);
  uint32_t size = static_cast<uint32_t>(out.size());
  // Fewer than 252 bytes: the legend and one newline.
  EXPECT_EQ(VSPParseSnapshotBuffer("short", 5, out.data(), &size), 1);
  EXPECT_EQ(std::string(out.data(), size), std::string(kSnapshotLegend) + "\n");
  EXPECT_NE(std::string(kSnapshotLegend).find("(Min/Max)S   - Number of free segs\n"), std::string::npos);

  std::vector<uint32_t> w(63);
  for (uint32_t i = 0; i < 63; ++i) w[i] = i;
  w[39] = 123456;  // TH: 123.45, right-aligned in eight
  const std::string record = sim::FixedSnapshotRecord(w) + sim::FixedSnapshotRecord(Words({{39, 7}, {0, 1}}));
  size = static_cast<uint32_t>(out.size());
  ASSERT_EQ(VSPParseSnapshotBuffer(record.data(), static_cast<uint32_t>(record.size()), out.data(), &size), 1);
  const std::string text(out.data(), size);
  const std::string first =
      "T=0000 E=26 HR=  27 HW=  28 NR=  29 NW=  30 TH=     123.45 GC=  31 W=33 BI= 36 BU= 37 V=   45 BF=47/48 P= 1 "
      "H=41/40 X=50/51 L= 43/ 44 C=53/54 S=  42 U=      52 RO=  14/  17/  20/  23 RL=     15/     18/     21/     24 "
      "RM=   16/   19/   22/   25 WO=   2/   5/   8/  11 WL=      3/      6/      9/     12 WM=    4/    7/   10/   13\n";
  EXPECT_EQ(text.substr(std::string(kSnapshotLegend).size(), first.size()), first);
  EXPECT_NE(text.find("T=0001 E=00 HR=   0 HW=   0 NR=   0 NW=   0 TH=       0.00 "), std::string::npos);
  EXPECT_EQ(text.back(), '\n');
  EXPECT_EQ(text.substr(text.size() - 3), "0\n\n");
  // 123459 is cut, not rounded.
  w[39] = 123459;
  const std::string cut = sim::FixedSnapshotRecord(w);
  size = static_cast<uint32_t>(out.size());
  VSPParseSnapshotBuffer(cut.data(), 252, out.data(), &size);
  EXPECT_NE(std::string(out.data(), size).find("TH=     123.45 "), std::string::npos);

  // Too small: 0, outSize unchanged, never past the capacity.
  std::vector<char> small(100, 'x');
  small.push_back('#');
  size = 100;
  EXPECT_EQ(VSPParseSnapshotBuffer(record.data(), static_cast<uint32_t>(record.size()), small.data(), &size), 0);
  EXPECT_EQ(size, 100u);
  EXPECT_EQ(small[100], '#');
  const uint32_t legend = static_cast<uint32_t>(std::string(kSnapshotLegend).size());
  size = legend;  // exactly the legend's length: no room for its NUL
  EXPECT_EQ(VSPParseSnapshotBuffer(nullptr, 0, out.data(), &size), 0);
  size = legend + 2;
  EXPECT_EQ(VSPParseSnapshotBuffer(nullptr, 0, out.data(), &size), 1);
  EXPECT_EQ(size, legend + 1);
}

sim::SnapshotBuilder Described(uint32_t version) {
  sim::SnapshotBuilder b(version, 40);
  b.Legend("A - alpha\nB - beta");
  b.Field(0, 0, 0, "A=%u").Field(2, 4, 0, " B=%u.%02u").Field(3, 8, 24, " Q%s=").Field(9, 0, 0, "never").Field(1, 36, 0, "");
  return b;
}

TEST(SnapshotTest, DescriptorDrivenAndResumable) {
  sim::SnapshotBuilder b = Described(6);
  b.Record({1, 1234, 10, 11, 12, 20, 21, 22});
  b.Record({0, 99});  // empty interval
  b.Record({3, 7});
  b.Record({4, 8});
  b.Record({5, 9});
  b.Record({6, 9});
  b.Record({7, 9});  // the last record of the count is never printed
  const std::string header = b.Header(), data = b.Data();
  std::vector<char> out(4096);
  uint32_t size = static_cast<uint32_t>(out.size()), index = 0;
  ASSERT_EQ(VSPParseSnapshotBufferWithInplaceParser(data.data(), static_cast<uint32_t>(data.size()), out.data(), &size,
                                                    header.data(), static_cast<uint32_t>(header.size()), &index),
            1);
  const std::string preamble = "- VSP Snapshot - \nA - alpha\nB - beta\n";
  const std::string r1 = "A=1 B=1.23 QO=  10/  20 QL=     11/     21 QM=   12/   22\n";
  const std::string r3 = "A=3 B=0.00 QO=   0/   0 QL=      0/      0 QM=    0/    0\n";
  auto line = [](int a) { return "A=" + std::to_string(a) + " B=0.00 QO=   0/   0 QL=      0/      0 QM=    0/    0\n"; };
  const std::string all = preamble + r1 + r3 + line(4) + line(5) + line(6);
  EXPECT_EQ(std::string(out.data()), all);
  EXPECT_EQ(size, all.size() + 1);
  EXPECT_EQ(index, 6u);

  // Resumed across three output buffers: each holds the complete records that fit.
  std::string dump;
  index = 0;
  int calls = 0, result = 0;
  const uint32_t capacity = static_cast<uint32_t>(preamble.size() + r1.size() + 1);
  do {
    std::vector<char> piece(capacity + 1, '#');
    size = capacity;
    result = VSPParseSnapshotBufferWithInplaceParser(data.data(), static_cast<uint32_t>(data.size()), piece.data(),
                                                     &size, header.data(), static_cast<uint32_t>(header.size()), &index);
    EXPECT_EQ(piece[capacity], '#');
    EXPECT_EQ(size, std::string(piece.data()).size() + 1);
    dump += piece.data();
    ++calls;
  } while (result == 0 && calls < 10);
  EXPECT_EQ(calls, 3);
  // A record that did not fit is skipped, not retried.
  EXPECT_EQ(dump, preamble + r1 + line(4) + line(6));

  // An older header: the fixed legend as preamble.
  sim::SnapshotBuilder old = Described(5);
  old.Record({1}).Record({1});
  size = static_cast<uint32_t>(out.size());
  index = 0;
  const std::string old_header = old.Header();
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(old.Data().data(), static_cast<uint32_t>(old.Data().size()),
                                                    out.data(), &size, old_header.data(),
                                                    static_cast<uint32_t>(old_header.size()), &index),
            1);
  EXPECT_EQ(std::string(out.data()).substr(0, 5), "Key: ");
}

TEST(SnapshotTest, DescriptorDrivenEdgeCases) {
  std::vector<char> out(4096);
  uint32_t size = 4096, index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser("", 0, out.data(), &size, nullptr, 0, &index), 0);
  EXPECT_EQ(size, 4096u);

  // Only empty records: the preamble alone.
  sim::SnapshotBuilder empty = Described(6);
  empty.Record({0}).Record({0}).Record({0});
  std::string header = empty.Header();
  ASSERT_EQ(VSPParseSnapshotBufferWithInplaceParser(empty.Data().data(), static_cast<uint32_t>(empty.Data().size()),
                                                    out.data(), &size, header.data(),
                                                    static_cast<uint32_t>(header.size()), &index),
            1);
  EXPECT_EQ(std::string(out.data()), "- VSP Snapshot - \nA - alpha\nB - beta\n");

  // A single record: nothing at all, not even the preamble.
  sim::SnapshotBuilder single = Described(6);
  single.Record({1});
  header = single.Header();
  size = 4096;
  index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(single.Data().data(), 40, out.data(), &size, header.data(),
                                                    static_cast<uint32_t>(header.size()), &index),
            1);
  EXPECT_EQ(std::string(out.data()), "");
  EXPECT_EQ(size, 1u);

  // A preamble that does not fit: empty text, outSize 1, result 0.
  size = 10;
  index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(single.Data().data(), 40, out.data(), &size, header.data(),
                                                    static_cast<uint32_t>(header.size()), &index),
            0);
  EXPECT_EQ(size, 1u);

  // Hostile headers: counts and offsets far beyond the bytes given. Nothing
  // is read outside them (the sanitizers would say).
  sim::SnapshotBuilder lying = Described(6);
  lying.Record({1, 2}).Record({1, 2}).ClaimCount(0xFFFFFFFF);
  header = lying.Header();
  size = 4096;
  index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(lying.Data().data(), 80, out.data(), &size, header.data(),
                                                    static_cast<uint32_t>(header.size()), &index),
            1);
  EXPECT_EQ(index, 2u);  // stopped at the end of the data
  std::string truncated_header = header.substr(0, 40);  // legend without its NUL, no table
  size = 4096;
  index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(lying.Data().data(), 80, out.data(), &size, truncated_header.data(),
                                                    static_cast<uint32_t>(truncated_header.size()), &index),
            1);
  // Formats from the device cannot reach past their arguments.
  sim::SnapshotBuilder formats(6, 8);
  formats.Field(0, 0, 0, "%s%s%n%p%s").Field(2, 4, 0, "%99999d");
  formats.Record({5, 6}).Record({5, 6});
  header = formats.Header();
  size = 4096;
  index = 0;
  EXPECT_EQ(VSPParseSnapshotBufferWithInplaceParser(formats.Data().data(), 16, out.data(), &size, header.data(),
                                                    static_cast<uint32_t>(header.size()), &index),
            0);  // the width does not fit the buffer
  EXPECT_LT(size, 4096u);
}

}  // namespace
