// The compiled field tables against golden lists kept as text beside the
// tests. The lists were written once by hand from the controller's field
// lists, independently of the tables, so a wrong name, count or key in a
// table fails here even though buffers built from the table still parse.
#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <sstream>
#include <string>

#include "parsers/ftl_table.h"
#include "parsers/msp_table.h"

namespace parsers {
namespace {

struct GoldenRow {
  std::string name;
  uint32_t count;
};

// "key name count" per line; '#' starts a comment line.
std::map<uint32_t, GoldenRow> ReadGolden(const std::string& file) {
  std::ifstream in(std::string(PARSERS_TESTDATA) + "/" + file);
  EXPECT_TRUE(in) << "cannot open " << file;
  std::map<uint32_t, GoldenRow> rows;
  std::string line;
  while (std::getline(in, line)) {
    if (line.empty() || line[0] == '#') continue;
    std::istringstream fields(line);
    uint32_t key = 0;
    GoldenRow row;
    std::string rest;
    EXPECT_TRUE(fields >> key >> row.name >> row.count) << line;
    EXPECT_FALSE(fields >> rest) << line;
    EXPECT_TRUE(rows.emplace(key, row).second) << "duplicate key " << key;
  }
  return rows;
}

// Every row of the table equals its golden row, in key order, and a lookup
// finds exactly the golden keys across the whole key range and beyond it.
template <typename Field>
void ExpectTableIsGolden(std::span<const Field> table, const Field* (*find)(uint32_t),
                         const std::map<uint32_t, GoldenRow>& golden, uint32_t last_key_checked) {
  ASSERT_EQ(table.size(), golden.size());
  auto g = golden.begin();
  for (const Field& f : table) {
    EXPECT_EQ(f.key, g->first);
    EXPECT_STREQ(f.name, g->second.name.c_str()) << f.key;
    EXPECT_EQ(f.count, g->second.count) << f.key << " " << f.name;
    ++g;
  }
  for (uint32_t key = 0; key <= last_key_checked; ++key) {
    const Field* f = find(key);
    const auto it = golden.find(key);
    ASSERT_EQ(f != nullptr, it != golden.end()) << key;
    if (f) {
      EXPECT_STREQ(f->name, it->second.name.c_str()) << key;
    }
  }
  for (uint32_t key : {0xFFFFu, 0x2FFEu, 0x2FFFu, 0x30000001u, 0xFFFFFFFFu}) EXPECT_EQ(find(key), nullptr) << key;
}

TEST(TablesTest, FtlTableMatchesGoldenList) {
  const auto golden = ReadGolden("ftl_fields.txt");
  // The list itself: 569 rows, 469 scalars and 100 arrays of 1,687 elements
  // (2,156 values), keys 1 to 666, arrays of 2 to 256 elements.
  size_t scalars = 0, arrays = 0, elements = 0;
  for (const auto& [key, row] : golden) {
    EXPECT_GE(key, 1u);
    EXPECT_LE(key, 666u);
    EXPECT_TRUE(row.count == 0 || (row.count >= 2 && row.count <= 256)) << key;
    if (row.count == 0) ++scalars;
    else ++arrays, elements += row.count;
  }
  EXPECT_EQ(golden.size(), 569u);
  EXPECT_EQ(scalars, 469u);
  EXPECT_EQ(arrays, 100u);
  EXPECT_EQ(elements, 1687u);
  ExpectTableIsGolden<FtlField>(FtlFields(), &FindFtlField, golden, 9000);
}

TEST(TablesTest, MspTableMatchesGoldenList) {
  const auto golden = ReadGolden("msp_fields.txt");
  // 95 rows: keys 4096 to 4168 and 8193 to 8214, every one used; 78 single
  // values and 17 arrays of 176 elements (254 values).
  size_t single = 0, arrays = 0, elements = 0;
  for (const auto& [key, row] : golden) {
    EXPECT_TRUE((key >= 4096 && key <= 4168) || (key >= 8193 && key <= 8214)) << key;
    EXPECT_TRUE(row.count >= 1 && row.count <= 20) << key;
    if (row.count == 1) ++single;
    else ++arrays, elements += row.count;
  }
  EXPECT_EQ(golden.size(), 95u);
  EXPECT_EQ(single, 78u);
  EXPECT_EQ(arrays, 17u);
  EXPECT_EQ(elements, 176u);
  ExpectTableIsGolden<MspField>(MspFields(), &FindMspField, golden, 70000);
}

}  // namespace
}  // namespace parsers
