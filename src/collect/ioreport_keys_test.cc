#include "collect/ioreport_keys.h"

#include <gtest/gtest.h>

#include <map>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "ioreport/ioreport.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/history.h"
#include "platform/iokit.h"
#include "platform/log.h"
#include "platform/store.h"
#include "ioreport/test_legend.h"

namespace {

class ReportingKeysTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::FixedClock> clock = std::make_shared<platform::FixedClock>(20000 * 86400.0 + 43200);
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{clock, log}};

  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
  std::map<std::string, int64_t> Keys() {
    std::map<std::string, int64_t> keys;
    auto history = platform::TBHistory::initWithDefaultPath();
    if (!history) return keys;
    const int32_t today = TBDaysSince1970();
    history->scalarsForKeyPrefix("com.velmora.ioreport.", today - 1, today,
                                 [&](const std::string& k, int32_t, int64_t v, bool*) { keys[k] = v; });
    return keys;
  }
};

TEST_F(ReportingKeysTest, SimpleFieldChannelsBecomeKeys) {
  const cf::Value pub = cf::Value::Bool(true);
  cf::Array power({Dict({{"IOReportChannels",
                          cf::Array({Legend(1, Type(1, 0x0100, 1), "Total"), Legend(0x4142, Type(1, 0x0101, 1)),
                                     Legend(3, Type(2, 0x0100, 2), "Mode"), Legend(4, Type(3, 0x0100, 2), "Latency"),
                                     Legend(5, Type(4, 0x0100, 1), "Lanes"), Legend(6, Type(1, 0x0002, 1), "Other"),
                                     Legend(7, Type(1, 0x0100, 2), "Doubled")})}})});
  // A second driver's channel of the same name: the one visited last wins.
  cf::Array disk({Dict({{"IOReportChannels", cf::Array({Legend(9, Type(1, 0x0100, 1), "Total")})}})});
  Write("registry.plist",
        cf::Array({Dict({{"class", "IOReportHub"}, {"id", cf::Value::UInt64(1)}, {"userClient", "hub"}}),
                   Dict({{"class", "Power"}, {"id", cf::Value::UInt64(0x20)},
                         {"properties", Dict({{"IOReportLegendPublic", pub}, {"IOReportLegend", power}})}}),
                   Dict({{"class", "Disk"}, {"id", cf::Value::UInt64(0x30)},
                         {"properties", Dict({{"IOReportLegendPublic", pub}, {"IOReportLegend", disk}})}})}));
  Write("ioreport.plist", Dict({{"32", Dict({{"1", cf::Value::SInt64(11)},
                                             {"16706", cf::Value::SInt64(-3)},
                                             {"3", cf::Value::SInt64(5)},
                                             {"6", cf::Value::SInt64(8)}})},
                                {"48", Dict({{"9", cf::Value::SInt64(12)}})}}));
  CollectReportingChannels();
  EXPECT_EQ(Keys(), (std::map<std::string, int64_t>{{"com.velmora.ioreport.AB", -3},
                                                    {"com.velmora.ioreport.Doubled", INT64_MIN},  // two elements: no value
                                                    {"com.velmora.ioreport.Total", 12}}));
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);

  // No hub: nothing is written and nothing is left open.
  Write("ioreport.plist", Dict({{"48", Dict({{"9", cf::Value::SInt64(99)}})}}));
  Write("registry.plist", cf::Array({Dict({{"class", "Power"}, {"id", cf::Value::UInt64(0x21)},
                                           {"properties", Dict({{"IOReportLegendPublic", pub},
                                                                {"IOReportLegend", power}})}})}));
  CollectReportingChannels();
  EXPECT_EQ(Keys().at("com.velmora.ioreport.Total"), 12);
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST_F(ReportingKeysTest, OnlySimpleChannelsAreKeptAndWritten) {
  for (const auto& [legend, code] : {std::pair<cf::Value, int>{Legend(1, Type(1, 0x100, 1)), 0},
                                     {Legend(1, Type(2, 0x100, 1)), 16},
                                     {Legend(1, Type(3, 0x100, 1)), 16},
                                     {Legend(1, Type(4, 0x100, 1)), 16},
                                     {Legend(1, Type(0, 0x100, 1)), 16},
                                     {cf::Array({cf::Value::SInt64(1)}), 16}}) {
    cf::Dictionary channel;
    channel.Set("LegendChannel", legend);
    EXPECT_EQ(KeepSimpleChannels(channel), code) << legend.Description();
    EXPECT_EQ(WriteSimpleChannelKey(channel), 0);
  }
  // Only the simple one wrote, without a sample value and without a name.
  EXPECT_EQ(Keys(), (std::map<std::string, int64_t>{{"com.velmora.ioreport.<unknown>", INT64_MIN}}));
}

}  // namespace
