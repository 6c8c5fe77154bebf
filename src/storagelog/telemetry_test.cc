#include "storagelog/telemetry.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>
#include <span>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/default_device.h"
#include "sim/storage_lists.h"
#include "storagelog/telemetry_layouts.h"

namespace {

using storagelog::kTelemetryBusBytes;

constexpr const char* kBounds = "ERROR: Attempting to parse beyond the bounds of the buffer\n";

// Raw word index -> value, for one bus.
using RawWords = std::map<int, int64_t>;

cf::Value Bus(const RawWords& raw, std::initializer_list<std::pair<const char*, cf::Value>> summary = {}) {
  cf::Dictionary words;
  for (const auto& [index, value] : raw) words.Set(std::to_string(index), cf::Value::SInt64(value));
  cf::Dictionary bus = Dict(summary);
  bus.Set("words", words);
  return bus;
}

std::string List(std::vector<cf::Value> buses) {
  std::string error;
  const std::optional<std::string> bytes = sim::EncodeTelemetryList(Dict({{"buses", cf::Array(std::move(buses))}}), &error);
  EXPECT_TRUE(bytes) << error;
  return bytes.value_or("");
}

cf::Value Characteristics(const char* chip, const char* manufacturer, int32_t num_bus) {
  return Dict({{"chip-id", chip}, {"manufacturer-id", manufacturer}, {"num-bus", cf::Value::SInt32(num_bus)}});
}

size_t CountPrefix(const cf::Dictionary& record, const std::string& prefix) {
  size_t n = 0;
  for (const auto& [key, value] : record)
    if (key.AsString() && key.AsString()->rfind(prefix, 0) == 0) ++n;
  return n;
}

class TelemetryTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(20000 * 86400.0 + 3600);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{clock, log}};

  struct Outcome {
    bool ok = false;
    std::string errors;                 // what went to standard error
    std::vector<cf::Dictionary> records;  // the structured-data records, in order
  };

  // Runs the handler and collects (and clears) what it logged.
  Outcome Run(const std::string& bytes, const cf::Value& characteristics) {
    Outcome out;
    testing::internal::CaptureStderr();
    out.ok = ParseTelemetryList(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), characteristics,
                                "VelmoraVNS3NVMeController");
    out.errors = testing::internal::GetCapturedStderr();
    const std::string dir = root / "var/faultkeep";
    if (!std::filesystem::exists(dir)) return out;
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
      const std::string text = *platform::ReadFile(entry.path().string());
      size_t at = 0;
      for (size_t end; (end = text.find('\n', at)) != std::string::npos; at = end + 1) {
        const cf::Value line = cf::ParseJSON(text.substr(at, end - at)).value;
        if (!line.AsDictionary() || !line.AsDictionary()->Get("record").AsDictionary()) {
          ADD_FAILURE() << "not a record: " << text.substr(at, end - at);
          continue;
        }
        EXPECT_EQ(line.AsDictionary()->Get("type"), cf::Value::SInt32(176));
        out.records.push_back(*line.AsDictionary()->Get("record").AsDictionary());
      }
      std::filesystem::remove(entry.path());
    }
    EXPECT_EQ(log->lines().size(), 0u);
    return out;
  }
};

TEST_F(TelemetryTest, EachBusLogsTheNamesOfItsChipKind) {
  struct Row {
    const char* chip;
    const char* manufacturer;
    size_t read_stage, initial, life, dsp, algo, retention;
  };
  const Row rows[] = {
      {"K3R", "45822603A5710", 23, 23, 8, 12, 8, 0},
      {"K4R", "45822603A5710", 33, 23, 8, 38, 0, 12},
      {"K3", "4582603A5700", 23, 23, 8, 12, 0, 0},  // the first maker's 1x layout
      {"", "ECD7", 23, 23, 8, 12, 0, 0},            // the 1y layout
  };
  const std::string list = List({Bus({}), Bus({})});
  for (const Row& row : rows) {
    SCOPED_TRACE(row.chip);
    const Outcome out = Run(list, Characteristics(row.chip, row.manufacturer, 2));
    ASSERT_TRUE(out.ok);
    EXPECT_EQ(out.errors, "");
    ASSERT_EQ(out.records.size(), 2u);
    for (const cf::Dictionary& r : out.records) {
      // The summary first, in its order; then the groups in theirs.
      const char* first[] = {"RD", "PE", "Max_PE_rate", "t0", "Ret", "block_type", "num_pages", "readStage[0]"};
      for (size_t i = 0; i < std::size(first); ++i) EXPECT_EQ(r.entries()[i].first, cf::Value(first[i]));
      EXPECT_EQ(CountPrefix(r, "readStage["), row.read_stage);
      EXPECT_EQ(CountPrefix(r, "initialReadStage["), row.initial);
      EXPECT_EQ(CountPrefix(r, "nandStageOfLife["), row.life);
      EXPECT_EQ(CountPrefix(r, "dspExceptionParameter["), row.dsp);
      for (const char* bin : {"readStage18NumOfErrorsBin[", "readStage19NumOfErrorsBin["}) EXPECT_EQ(CountPrefix(r, bin), 12u);
      for (const char* bin : {"readStage9NumOfErrorsBin[", "readStage10NumOfErrorsBin[", "readStage17NumOfErrorsBin["})
        EXPECT_EQ(CountPrefix(r, bin), 10u);
      EXPECT_EQ(CountPrefix(r, "algoNANDAccessesBin["), row.algo);
      EXPECT_EQ(CountPrefix(r, "retentionIndication["), row.retention);
      EXPECT_EQ(r.size(), 7 + row.read_stage + row.initial + row.life + row.dsp + 54 + row.algo + row.retention);
      EXPECT_TRUE(r.Contains(cf::Value(std::string("readStage[") + std::to_string(row.read_stage - 1) + "]")));
      EXPECT_TRUE(r.Contains(cf::Value(std::string("dspExceptionParameter[") + std::to_string(row.dsp - 1) + "]")));
    }
  }
}

TEST_F(TelemetryTest, TheLayoutFollowsTheChipAndTheNandPart) {
  // Each raw word gets its own value on the second bus; the named word must
  // carry it there (and the first bus, left empty, must not), or with no
  // name, no logged word may carry it.
  struct Row {
    const char* chip;
    const char* manufacturer;
    std::vector<std::pair<int, const char*>> words;
  };
  const Row rows[] = {
      {"K3R", "AD8252232100",
       {{0, "readStage[0]"}, {18, "readStage[18]"}, {37, "readStage[19]"}, {91, "readStage[22]"},
        {19, "initialReadStage[8]"}, {104, "dspExceptionParameter[0]"}, {115, "dspExceptionParameter[11]"},
        {45, "readStage18NumOfErrorsBin[0]"}, {64, "readStage9NumOfErrorsBin[7]"},
        {103, "readStage19NumOfErrorsBin[11]"}, {113, "algoNANDAccessesBin[7]"}, {36, nullptr}, {65, nullptr}}},
      {"K4R", "4582603A5700",
       {{8, "readStage[29]"}, {110, "readStage[32]"}, {122, "initialReadStage[13]"}, {25, "nandStageOfLife[6]"},
        {26, "dspExceptionParameter[37]"}, {45, "dspExceptionParameter[33]"}, {75, "retentionIndication[2]"},
        {76, "retentionIndication[3]"}, {74, "readStage17NumOfErrorsBin[9]"}, {106, "readStage[21]"},
        {49, nullptr}, {119, nullptr}}},
      // The first maker's 1x parts, whatever the last byte of the device code.
      {"K3R ", "4582603A57FF",
       {{256, "readStage[0]"}, {261, "readStage[5]"}, {301, "readStage[19]"}, {16, "dspExceptionParameter[0]"},
        {10, "dspExceptionParameter[9]"}, {288, "initialReadStage[9]"}, {262, nullptr}, {274, nullptr}}},
      {"other", "458260DE5701", {{256, "readStage[0]"}, {262, nullptr}}},
      // The second maker's.
      {"other", "AD8252232101",
       {{259, "readStage[3]"}, {263, "readStage[8]"}, {297, "readStage[19]"}, {286, "nandStageOfLife[0]"},
        {260, nullptr}}},
      // Anything else: 1y, to the last raw word any layout reads.
      {"other", "4582603A56FF",
       {{262, "readStage[6]"}, {372, "readStage[22]"}, {21, "dspExceptionParameter[0]"},
        {531, "dspExceptionParameter[10]"}, {532, "dspExceptionParameter[11]"},
        {384, "readStage19NumOfErrorsBin[11]"}, {533, nullptr}, {1023, nullptr}}},
      {"other", "", {{256, "readStage[0]"}}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(row.chip) + " " + row.manufacturer);
    RawWords raw;
    for (size_t i = 0; i < row.words.size(); ++i) raw[row.words[i].first] = 0x5000 + static_cast<int64_t>(i);
    const Outcome out = Run(List({Bus({}), Bus(raw)}), Characteristics(row.chip, row.manufacturer, 2));
    ASSERT_EQ(out.records.size(), 2u);
    for (size_t i = 0; i < row.words.size(); ++i) {
      const cf::Value marker = cf::Value::SInt32(0x5000 + static_cast<int32_t>(i));
      SCOPED_TRACE(row.words[i].first);
      if (row.words[i].second) {
        EXPECT_EQ(out.records[1].Get(cf::Value(row.words[i].second)), marker);
        EXPECT_EQ(out.records[0].Get(cf::Value(row.words[i].second)), cf::Value::SInt32(0));
      } else {
        for (const auto& [key, value] : out.records[1]) EXPECT_NE(value, marker) << key.Description();
      }
    }
  }
}

TEST_F(TelemetryTest, SummariesAndWordsAreLoggedAsSigned32BitNumbers) {
  const std::string list =
      List({Bus({{0, 0xFFFFFFFF}, {1, 0x80000000}, {2, 0x7FFFFFFF}},
                {{"RD", cf::Value::SInt64(-1)}, {"num_pages", cf::Value::SInt64(1536)}}),
            Bus({}, {{"RD", cf::Value::SInt64(7)}, {"PE", cf::Value::UInt64(0xFFFFFFFE)}, {"Ret", cf::Value::SInt64(3)}})});
  const Outcome out = Run(list, Characteristics("K3R", "", 2));
  ASSERT_EQ(out.records.size(), 2u);
  EXPECT_EQ(out.records[0].Get("readStage[0]"), cf::Value::SInt32(-1));
  EXPECT_EQ(out.records[0].Get("readStage[1]"), cf::Value::SInt32(INT32_MIN));
  EXPECT_EQ(out.records[0].Get("readStage[2]"), cf::Value::SInt32(INT32_MAX));
  const int32_t summaries[2][7] = {{-1, 0, 0, 0, 0, 0, 1536}, {7, -2, 0, 0, 3, 0, 0}};
  for (size_t b = 0; b < 2; ++b)
    for (size_t i = 0; i < 7; ++i)
      EXPECT_EQ(out.records[b].Get(storagelog::kBusSummaryKeys[i]), cf::Value::SInt32(summaries[b][i])) << b << i;
}

TEST_F(TelemetryTest, TheBufferMustHoldEveryBlockAndSummary) {
  const std::string two =
      List({Bus({{0, 1}}, {{"RD", cf::Value::SInt32(21)}}), Bus({{0, 2}}, {{"RD", cf::Value::SInt32(22)}})});
  ASSERT_EQ(two.size(), 2 * kTelemetryBusBytes);
  struct Row {
    std::string bytes;
    cf::Value num_bus;
    size_t records;
    int32_t rd = 21;  // of the first record
  };
  const Row rows[] = {
      {two, cf::Value::SInt32(2), 2},
      {two + "trailing", cf::Value::SInt32(2), 2},
      // Fewer buses than the list holds: the summaries are taken from right
      // after the blocks read, here the second block's first word.
      {two, cf::Value::SInt32(1), 1, 2},
      {two.substr(0, two.size() - 1), cf::Value::SInt32(2), 0},
      {two, cf::Value::SInt32(3), 0},
      {two, cf::Value::SInt32(-1), 0},
      {two, cf::Value::SInt32(INT32_MIN), 0},
      {two, cf::Value::SInt32(INT32_MAX), 0},
      {two, cf::Value::UInt64(0xFFFFFFFF), 0},  // read as 32 bits: -1
      {"", cf::Value::SInt32(0), 0},
      {"", cf::Value::SInt32(1), 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.bytes.size());
    SCOPED_TRACE(row.num_bus.Description());
    const Outcome out =
        Run(row.bytes, Dict({{"chip-id", "K3R"}, {"manufacturer-id", "AD82"}, {"num-bus", row.num_bus}}));
    const bool refused = row.records == 0 && row.num_bus != cf::Value::SInt32(0);
    EXPECT_EQ(out.ok, !refused);
    EXPECT_EQ(out.errors, refused ? kBounds : "");
    ASSERT_EQ(out.records.size(), row.records);
    if (!row.records) continue;
    EXPECT_EQ(out.records[0].Get("readStage[0]"), cf::Value::SInt32(1));
    EXPECT_EQ(out.records[0].Get("RD"), cf::Value::SInt32(row.rd));
    if (row.records == 2) {
      EXPECT_EQ(out.records[1].Get("RD"), cf::Value::SInt32(22));
    }
  }
  // An empty list at no address at all.
  testing::internal::CaptureStderr();
  EXPECT_TRUE(ParseTelemetryList(nullptr, 0, Characteristics("K3R", "", 0), ""));
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

TEST_F(TelemetryTest, BadCharacteristicsAreRefusedBeforeAnythingIsLogged) {
  const std::string list = List({Bus({{0, 1}})});
  const cf::Value ok = Characteristics("K3R", "4582", 1);
  auto with = [&](const char* key, cf::Value v) {
    cf::Dictionary d = ok.AsDictionary()->MutableCopy();
    if (v.IsNull()) {
      d.Remove(key);
    } else {
      d.Set(key, v);
    }
    return cf::Value(d);
  };
  struct Row {
    cf::Value characteristics;
    const char* error;  // empty: accepted
  };
  const Row rows[] = {
      {cf::Value(), "ERROR: Could not parse the Device Characteristics dictionary\n"},
      {cf::Value(cf::Array()), "ERROR: Could not parse the Device Characteristics dictionary\n"},
      {with("chip-id", nullptr), "ERROR: Could not determine the chip-id\n"},
      {with("chip-id", cf::Value::SInt32(3)), "ERROR: chip-id is not stored as a CFStringTypeID\n"},
      {with("chip-id", std::string(64, 'K')),
       "ERROR: Unable to obtain chip-id as conversion from the UniChar contents of CFString failed, or the buffer of "
       "64 bytes is too small\n"},
      {with("chip-id", std::string(63, 'K')), ""},
      {with("manufacturer-id", nullptr), "ERROR: Could not determine the manufacturer-id\n"},
      {with("manufacturer-id", cf::Value::Bytes({0x45})), "ERROR: manufacturer-id is not stored as a CFStringTypeID\n"},
      {with("manufacturer-id", std::string("45\0" "82", 5)), "ERROR: manufacturer-id is NULL\n"},
      {with("num-bus", nullptr), "ERROR: could not determine the number of channels\n"},
      {with("num-bus", "1"), "ERROR: could not determine the number of channels\n"},
      {with("num-bus", cf::Value::Bool(true)), "ERROR: could not determine the number of channels\n"},
      // The chip's name is checked first.
      {Dict({{"num-bus", "x"}}), "ERROR: Could not determine the chip-id\n"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.characteristics.Description());
    const Outcome out = Run(list, row.characteristics);
    EXPECT_EQ(out.ok, *row.error == '\0');
    EXPECT_EQ(out.errors, row.error);
    EXPECT_EQ(out.records.size(), *row.error ? 0u : 1u);
  }
}

TEST(TelemetryLayouts, RunsReadKnownWordsAndWriteLoggedWordsOnce) {
  struct Layout {
    std::span<const storagelog::WordRun> runs;
    storagelog::ChipKind chip;
  };
  const Layout layouts[] = {{storagelog::kLayout1y, storagelog::ChipKind::kOther},
                            {storagelog::kLayout1xSandisk, storagelog::ChipKind::kOther},
                            {storagelog::kLayout1xHynix, storagelog::ChipKind::kOther},
                            {storagelog::kLayoutAlgoGeneric, storagelog::ChipKind::kK3R},
                            {storagelog::kLayoutAlgoGenericK4, storagelog::ChipKind::kK4R}};
  size_t last_read = 0;
  for (const Layout& layout : layouts) {
    std::set<size_t> logged;
    for (const storagelog::CounterNames& n : storagelog::kCounterNames)
      for (size_t i = 0; i < n.count[static_cast<size_t>(layout.chip)]; ++i) logged.insert(n.first + i);
    std::set<size_t> written;
    for (const storagelog::WordRun& r : layout.runs) {
      for (size_t i = 0; i < r.count; ++i) {
        EXPECT_LE(r.src + i, storagelog::kLastRawWordRead);
        EXPECT_LT(r.dest + i, storagelog::kVendorCounterWords);
        EXPECT_TRUE(written.insert(r.dest + i).second) << "word " << r.dest + i << " written twice";
        EXPECT_TRUE(logged.count(r.dest + i)) << "word " << r.dest + i << " is never logged";
        last_read = std::max<size_t>(last_read, r.src + i);
      }
    }
  }
  EXPECT_EQ(last_read, storagelog::kLastRawWordRead);
}

TEST(TelemetryListEncoder, WritesBlocksThenSummariesAndRefusesBadFields) {
  std::string error;
  auto encode = [&](const cf::Dictionary& fields) { return sim::EncodeTelemetryList(fields, &error); };
  const std::optional<std::string> one =
      encode(Dict({{"buses", cf::Array({Bus({{0, 0x01020304}, {1023, -1}}, {{"RD", cf::Value::SInt64(5)},
                                                                              {"num_pages", cf::Value::UInt64(0xFFFFFFFF)}})})}}));
  ASSERT_TRUE(one) << error;
  std::string expected(kTelemetryBusBytes, '\0');
  expected.replace(0, 4, "\x04\x03\x02\x01");
  expected.replace(4092, 4, "\xff\xff\xff\xff");
  expected[4096] = 5;
  expected.replace(4096 + 24, 4, "\xff\xff\xff\xff");
  EXPECT_EQ(*one, expected);
  EXPECT_EQ(encode(Dict({})), std::string());
  EXPECT_EQ(encode(Dict({{"buses", cf::Array()}})), std::string());

  struct Row {
    cf::Value bus;  // inside "buses"; a dictionary of its own when the top level is tested
    const char* error;
  };
  const Row rows[] = {
      {cf::Value("x"), "bus 0: expected a dictionary, not a string"},
      {Dict({{"rd", cf::Value::SInt32(1)}}), "bus 0: unknown key \"rd\""},
      {Dict({{"words", cf::Array()}}), "bus 0 \"words\": expected a dictionary, not an array"},
      {Bus({{1024, 1}}), "bus 0 \"words\": \"1024\" is not a word index from 0 to 1023"},
      {Bus({{-1, 1}}), "bus 0 \"words\": \"-1\" is not a word index from 0 to 1023"},
      {Dict({{"words", Dict({{"07", cf::Value::SInt32(1)}})}}),
       "bus 0 \"words\": \"07\" is not a word index from 0 to 1023"},
      {Dict({{"words", Dict({{"", cf::Value::SInt32(1)}})}}), "bus 0 \"words\": \"\" is not a word index from 0 to 1023"},
      {Bus({{3, 0x100000000}}), "bus 0 word 3: values must be integers from -2147483648 to 4294967295"},
      {Bus({{3, -2147483649}}), "bus 0 word 3: values must be integers from -2147483648 to 4294967295"},
      {Dict({{"PE", cf::Value::Float64(1)}}), "bus 0 \"PE\": values must be integers from -2147483648 to 4294967295"},
      {Dict({{"PE", cf::Value::UInt64(UINT64_MAX)}}),
       "bus 0 \"PE\": values must be integers from -2147483648 to 4294967295"},
      {Dict({{"Ret", "1"}}), "bus 0 \"Ret\": values must be integers from -2147483648 to 4294967295"},
  };
  for (const Row& row : rows) {
    error.clear();
    EXPECT_FALSE(encode(Dict({{"buses", cf::Array({row.bus})}})));
    EXPECT_EQ(error, row.error);
  }
  EXPECT_FALSE(encode(Dict({{"buses", cf::Array({Bus({}), Bus({{0, 1}}, {{"x", cf::Value::SInt32(1)}})})}})));
  EXPECT_EQ(error, "bus 1: unknown key \"x\"");
  EXPECT_FALSE(encode(Dict({{"buses", cf::Array()}, {"bus", cf::Array()}})));
  EXPECT_EQ(error, "unknown telemetry key \"bus\"");
  EXPECT_FALSE(encode(Dict({{"buses", Dict({})}})));
  EXPECT_EQ(error, "\"buses\": expected an array, not a dictionary");
}

TEST_F(TelemetryTest, TheDefaultControllerAnswersEveryModeForItsBuses) {
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  const cf::Value characteristics = (*device.registry.AsArray())[1]
                                        .AsDictionary()
                                        ->Get("properties")
                                        .AsDictionary()
                                        ->Get("Controller Characteristics");
  const cf::Dictionary* modes = device.controller.AsDictionary()->Get("telemetry").AsDictionary();
  ASSERT_NE(modes, nullptr);
  for (const char* mode : {"0", "1", "2"}) {
    SCOPED_TRACE(mode);
    std::string error;
    const std::optional<std::string> list = sim::EncodeTelemetryList(*modes->Get(mode).AsDictionary(), &error);
    ASSERT_TRUE(list) << error;
    const Outcome out = Run(*list, characteristics);
    EXPECT_TRUE(out.ok);
    ASSERT_EQ(out.records.size(), 2u);
    for (const cf::Dictionary& r : out.records)
      for (const char* key : {"readStage[0]", "initialReadStage[0]", "algoNANDAccessesBin[0]", "num_pages"})
        EXPECT_GT(r.Get(key).AsNumber()->AsSInt64(), 0) << key;
  }
  // devsim init writes the lists as they are: as a property list.
  std::string xml;
  EXPECT_TRUE(cf::WriteXMLPropertyList(device.controller, xml, nullptr));
}

}  // namespace
