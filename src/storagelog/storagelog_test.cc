#include "storagelog/storagelog.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "../../tests/records.h"
#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "parsers/context.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "sim/default_device.h"
#include "sim/storage_lists.h"

namespace {

constexpr double kNoon = 20779 * 86400.0 + 12 * 3600;  // 2026-11-22 12:00 UTC

class StorageLogTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(kNoon);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::Backends backends{clock, log};
  std::unique_ptr<platform::ContextScope> scope = std::make_unique<platform::ContextScope>(root.path(), backends);
  cf::Dictionary controller;

  void SetUp() override {
    const char* tz = std::getenv("TZ");
    saved_tz_ = tz ? tz : "";
    had_tz_ = tz != nullptr;
    setenv("TZ", "UTC0", 1);
    tzset();
    parsers::testing::ResetAPIErrorMessage();
    nandinfo::testing::ResetControllerState();
    const sim::DefaultDevice device = sim::DefaultStorageDevice();
    controller = device.controller.AsDictionary()->MutableCopy();
    Write("registry.plist", device.registry);
    Write("answers.plist", Dict({{"SysID", "SYS-1"}, {"HardwareModel", "BX1,1"}, {"InverseDeviceID", "FK-KEY"}}));
    Write("system-version.plist", Dict({{"ProductVersion", "4.2"}, {"ProductBuildVersion", "22C41"}}));
    WriteController();
  }
  void TearDown() override {
    if (had_tz_) setenv("TZ", saved_tz_.c_str(), 1);
    else unsetenv("TZ");
    tzset();
  }
  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    std::this_thread::sleep_for(std::chrono::milliseconds(2));  // a new stamp for the profile cache
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
  void WriteController() { Write("controller.plist", controller); }
  void SetStats(std::initializer_list<std::pair<const char*, uint64_t>> fields) {
    cf::Dictionary stats = controller.Get("stats").AsDictionary()->MutableCopy();
    for (const auto& [k, v] : fields) stats.Set(k, cf::Value::UInt64(v));
    controller.Set("stats", stats);
    WriteController();
  }

  std::vector<std::string> StorageStatusLogs() { return FilesEndingIn(root / "var/diagvault/submissions", ".165"); }
  std::vector<cf::Dictionary> Records(int type) {
    return StructuredRecords(root / "var/faultkeep/structured_2026-11-22.jsonl", type);
  }

 private:
  std::string saved_tz_;
  bool had_tz_ = false;
};

std::string Bytes(const std::optional<std::string>& encoded) { return encoded.value_or(""); }
const uint8_t* Data(const std::string& s) { return reinterpret_cast<const uint8_t*>(s.data()); }

cf::Dictionary Validity(int64_t extra, std::initializer_list<std::pair<int64_t, int64_t>> entries) {
  cf::Array list;
  for (const auto& [number, value] : entries)
    list.Append(Dict({{"list", cf::Value::SInt64(number)}, {"value", cf::Value::SInt64(value)}}));
  return Dict({{"extra", cf::Value::SInt64(extra)}, {"entries", list}});
}

TEST_F(StorageLogTest, ThresholdFromThePreferenceOnlyWhenARealNumberBetweenZeroAndTen) {
  // 1536 pages of 16 KiB make 6144 units a band: 3000 erases over 10,000,000
  // host writes are 1.8432, below the default threshold of 2.
  struct Case {
    const char* what;
    uint64_t band_erases, host_writes;
    cf::Value preference;
    bool logged;
  } cases[] = {
      {"default threshold", 3000, 10000000, cf::Value(), false},
      {"1.5 as a real number applies", 3000, 10000000, cf::Value::Float64(1.5), true},
      {"an integer 3 is ignored", 4000, 10000000, cf::Value::SInt64(3), true},
      {"an integer 1 is ignored", 3000, 10000000, cf::Value::SInt64(1), false},
      {"12.5 is out of range", 4000, 10000000, cf::Value::Float64(12.5), true},
      {"0 is out of range", 3000, 10000000, cf::Value::Float64(0), false},
      {"no host writes: infinite", 1, 0, cf::Value(), true},
      {"no host writes, no erases: not a number", 0, 0, cf::Value::Float64(0.5), false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    std::filesystem::remove_all(root / "var/diagvault/submissions");
    UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), cf::Value());
    DGVPreferencesSetValue(cf::Value("userWAmp"), c.preference, "com.velmora.NANDInfo");
    SetStats({{"bandErases", c.band_erases}, {"hostWrites", c.host_writes}});
    nandinfo::testing::ResetControllerState();
    DumpStorageStructuredLog(false);
    EXPECT_EQ(StorageStatusLogs().size(), c.logged ? 1u : 0u);
  }
}

TEST_F(StorageLogTest, StorageStatusLogTextAndItsSevenDayGate) {
  storagelog::testing::SetWriteAmplification(1.5312, 0.25, true);
  const std::string list = Bytes(sim::EncodeValidityList(
      Validity(1, {{2, 17}, {0, 5}, {2, 4}, {16, 99}, {2, 9}, {15, -1}}), nullptr));
  EXPECT_TRUE(ParseValidityList(Data(list), list.size(), cf::Value(), "VelmoraVNS3NVMeController"));
  auto logs = StorageStatusLogs();
  ASSERT_EQ(logs.size(), 1u);
  const std::string& text = logs[0];
  EXPECT_EQ(text.rfind("System ID: SYS-1\nHardware Model: BX1,1\nOS Version: 4.2 (22C41)\n"
                      "Date: 2026-11-22 12:00:00 +0000\nIncident ID: ", 0), 0u) << text;
  EXPECT_NE(text.find("\nFaultkeep Key: FK-KEY\n\n2026-11-22 12:00:00 +0000 "), std::string::npos);
  EXPECT_NE(text.find("]: IntermediateWamp:0.25;UserWamp:1.53;com.velmora.NANDInfo."), std::string::npos) << text;
  EXPECT_NE(text.find(";com.velmora.NANDInfo.NumVirtualBlocks:3968;"), std::string::npos);
  EXPECT_EQ(text.find("ExportVersion"), std::string::npos);  // no version keys
  EXPECT_NE(text.find(";ValidityList[0]:5;ValidityList[2]:17,4,9;ValidityList[15]:-1\n"), std::string::npos) << text;
  EXPECT_EQ(text.find("ValidityList[16]"), std::string::npos);
  EXPECT_EQ(text.back(), '\n');

  // Within seven days (and from a date in the future) only the skip line.
  const cf::Value first = UserDefaultsGetValue(cf::Value("SSLastLoggedAt"));
  ASSERT_EQ(first, cf::Value(cf::Date{kNoon}));
  clock->Set(kNoon + 604799);
  NLW_WriteLog("165", cf::Value(Dict({{"a", cf::Value::SInt32(1)}})));
  EXPECT_EQ(log->CountContaining("NANDLogWriter:Last written at 2026-11-22 12:00:00 +0000 current "), 1u);
  UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), cf::Value(cf::Date{kNoon + 86400 * 30}));
  NLW_WriteLog("165", cf::Value(Dict({{"a", cf::Value::SInt32(1)}})));
  EXPECT_EQ(StorageStatusLogs().size(), 1u);
  EXPECT_EQ(log->CountContaining(":skipped"), 2u);

  // Seven days on, the next log goes out and the gate moves.
  UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), first);
  clock->Set(kNoon + 604800);
  NLW_WriteLog("165", cf::Value(Dict({{"f", cf::Number::Float32(2.125f)},
                                      {"n", cf::Value::SInt64(-3)},
                                      {"s", "not shown"},
                                      {"none", cf::Array({cf::Value("x")})},
                                      {"mixed", cf::Array({cf::Value("x"), cf::Value::SInt32(2)})}})));
  logs = StorageStatusLogs();
  ASSERT_EQ(logs.size(), 2u);
  bool found = false;
  for (const std::string& l : logs) found = found || l.find("]: f:2.12;n:-3;mixed:x,2\n") != std::string::npos;
  EXPECT_TRUE(found) << logs[0] << logs[1];
  EXPECT_EQ(UserDefaultsGetValue(cf::Value("SSLastLoggedAt")), cf::Value(cf::Date{kNoon + 604800}));

  // Below the threshold the list is taken and nothing is written.
  storagelog::testing::SetWriteAmplification(1.2, 0, false);
  clock->Set(kNoon + 604800 * 3);
  EXPECT_TRUE(ParseValidityList(Data(list), list.size(), cf::Value(), ""));
  EXPECT_EQ(StorageStatusLogs().size(), 2u);
}

TEST_F(StorageLogTest, ListsAreReadOnlyAsFarAsTheirBytesGo) {
  storagelog::testing::SetWriteAmplification(3, 0, true);
  const std::string validity = Bytes(sim::EncodeValidityList(Validity(2, {{1, 10}, {1, 11}}), nullptr));
  ASSERT_EQ(validity.size(), 4u * (2 + 2 * 2 + 5 * 2));
  const std::string no_entries = Bytes(sim::EncodeValidityList(Validity(0, {}), nullptr));
  struct Case {
    const char* what;
    std::string bytes;
    bool ok;
  } cases[] = {
      {"one byte short", validity.substr(0, validity.size() - 1), false},
      {"no entries", no_entries, false},
      {"shorter than its header", validity.substr(0, 7), false},
      {"empty", "", false},
      {"exactly its size", validity, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), cf::Value());
    std::filesystem::remove_all(root / "var/diagvault/submissions");
    ::testing::internal::CaptureStderr();
    EXPECT_EQ(ParseValidityList(Data(c.bytes), c.bytes.size(), cf::Value(), ""), c.ok);
    const std::string err = ::testing::internal::GetCapturedStderr();
    EXPECT_EQ(err.find("data cannot be parsed\n") != std::string::npos, !c.ok) << err;
    EXPECT_EQ(StorageStatusLogs().size(), c.ok ? 1u : 0u);
  }
}

TEST_F(StorageLogTest, DefectsWithTheirReasonAdjustedByMode) {
  auto defect = [](int64_t mode, int64_t reason) {
    return Dict({{"Bus", cf::Value::SInt64(3)}, {"CE", cf::Value::SInt64(65535)}, {"CAU", cf::Value::SInt64(2)},
                 {"Block", cf::Value::SInt64(4000000000)}, {"Cycle", cf::Value::SInt64(9)},
                 {"Reason", cf::Value::SInt64(reason)}, {"Page", cf::Value::SInt64(12)},
                 {"Temperature", cf::Value::SInt64(-40)}, {"mode", cf::Value::SInt64(mode)}});
  };
  const std::string list = Bytes(sim::EncodeDefectsList(
      Dict({{"factoryCount", cf::Value::SInt64(11)},
            {"defects", cf::Array({defect(1, 7), defect(2, 7), defect(0, 7), defect(9, 7)})}}),
      nullptr));
  const cf::Value characteristics = Dict({{"nand-device-desc", cf::Value::SInt64(0x1234)}});
  ::testing::internal::CaptureStderr();
  EXPECT_TRUE(ParseDefectsList(Data(list), list.size(), characteristics, "VelmoraVNS3NVMeController"));
  EXPECT_EQ(::testing::internal::GetCapturedStderr(), "Encountered unexpected defectMode: 0x9\n");
  // The storage kind keeps the controller's reason; a list cut inside its
  // last entry gives the complete ones.
  EXPECT_TRUE(ParseDefectsList(Data(list), list.size() - 1, cf::Value("not a dictionary"), "VSPStorage"));
  ::testing::internal::CaptureStderr();
  EXPECT_FALSE(ParseDefectsList(Data(list), 11, characteristics, ""));
  EXPECT_EQ(::testing::internal::GetCapturedStderr(), "data cannot be parsed\n");

  const auto records = Records(176);
  ASSERT_EQ(records.size(), 5u + 4u);
  EXPECT_EQ(cf::Value(records[0]), cf::Value(Dict({{"Factory Count", cf::Value::SInt32(11)},
                                                   {"com.velmora.NANDInfo.nandDesc", cf::Value::SInt32(0x1234)}})));
  EXPECT_EQ(records[1].Get("Reason"), cf::Value::SInt32(207));
  EXPECT_EQ(records[2].Get("Reason"), cf::Value::SInt32(107));
  EXPECT_EQ(records[3].Get("Reason"), cf::Value::SInt32(7));
  EXPECT_EQ(records[4].Get("Reason"), cf::Value::SInt32(7));
  EXPECT_EQ(records[1].Get("CE"), cf::Value::SInt32(65535));
  EXPECT_EQ(records[1].Get("Block"), cf::Value::SInt32(-294967296));  // the word, reinterpreted
  EXPECT_EQ(records[1].Get("Temperature"), cf::Value::SInt32(-40));
  EXPECT_EQ(cf::Value(records[5]), cf::Value(Dict({{"Factory Count", cf::Value::SInt32(11)}})));
  EXPECT_EQ(records[6].Get("Reason"), cf::Value::SInt32(7));  // mode 1, but the storage kind
  EXPECT_EQ(records.back().Get("Reason"), cf::Value::SInt32(7));
}

TEST_F(StorageLogTest, ThePassGoesOnPastAListThatFails) {
  storagelog::testing::SetWriteAmplification(0, 0, false);
  controller.Set("failCommands", cf::Array({cf::Value::SInt32(11)}));
  controller.Set("failDataCommands", cf::Array({cf::Value::SInt32(17)}));
  WriteController();
  ::testing::internal::CaptureStderr();
  EXPECT_TRUE(DumpStorageStructuredLog(false));
  std::string err = ::testing::internal::GetCapturedStderr();
  EXPECT_NE(err.find("IOConnectCallStructMethod failed with status 0xe00002bc on selector index 0\n"),
            std::string::npos) << err;
  EXPECT_NE(err.find("Could not retrieve data from driver for selector 17\n"), std::string::npos);
  EXPECT_EQ(Records(176).size(), 3u);  // the defects list still came
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);

  // Without the characteristics nothing is fetched.
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  const cf::Array& registry = *device.registry.AsArray();
  cf::Dictionary nvme = registry[1].AsDictionary()->MutableCopy();
  nvme.Set("properties", cf::Dictionary());
  Write("registry.plist", cf::Array({registry[0], cf::Value(nvme)}));
  ::testing::internal::CaptureStderr();
  EXPECT_FALSE(DumpStorageStructuredLog(false));
  err = ::testing::internal::GetCapturedStderr();
  EXPECT_NE(err.find("failed to create dictionary\n"), std::string::npos) << err;
  EXPECT_EQ(Records(176).size(), 3u);
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST_F(StorageLogTest, EncodersRefuseWhatAListCannotHold) {
  struct Case {
    cf::Dictionary fields;
    bool validity;
    const char* error;
  } cases[] = {
      {Dict({{"extra", cf::Value::Float64(1.5)}}), true, "expected a whole number of 32 bits, not 1.5"},
      {Dict({{"entries", cf::Array({Dict({{"list", cf::Value::SInt64(4294967296)}})})}}), true, "4294967296"},
      {Dict({{"entries", cf::Array({Dict({{"lsit", cf::Value::SInt64(1)}})})}}), true, "unknown key lsit"},
      {Dict({{"entries", Dict({})}}), true, "expected an array"},
      {Dict({{"extra", cf::Value::SInt64(4294967295)}}), true, "more than 67108864 bytes"},
      {Dict({{"defects", cf::Array({Dict({{"Bus", cf::Value::SInt64(65536)}})})}}), false, "16 bits"},
      {Dict({{"defects", cf::Array({cf::Value("x")})}}), false, "expected a dictionary"},
  };
  for (const Case& c : cases) {
    std::string error;
    EXPECT_FALSE(c.validity ? sim::EncodeValidityList(c.fields, &error) : sim::EncodeDefectsList(c.fields, &error));
    EXPECT_NE(error.find(c.error), std::string::npos) << error;
  }
}

}  // namespace
