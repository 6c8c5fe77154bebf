#include "ioreport/samples.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cmath>
#include <cstring>
#include <map>
#include <thread>
#include <tuple>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace {

uint64_t Type(uint8_t format, uint16_t categories, uint16_t elements) {
  return static_cast<uint64_t>(IOReportChannelType(format, categories, elements));
}

// One 64-byte element as the hub writes it.
std::string Element(uint64_t driver, uint64_t id, uint64_t type, uint64_t time, std::initializer_list<int64_t> values) {
  std::string e(64, '\0');
  std::memcpy(e.data(), &driver, 8);
  std::memcpy(e.data() + 8, &id, 8);
  std::memcpy(e.data() + 16, &type, 8);
  std::memcpy(e.data() + 24, &time, 8);
  size_t i = 0;
  for (int64_t v : values) std::memcpy(e.data() + 32 + 8 * i++, &v, 8);
  return e;
}

cf::Value Aggregate(std::initializer_list<std::tuple<int64_t, uint64_t, const char*>> channels,
                    const cf::Value& info = {}) {
  cf::Value aggregate = IOReportCreateAggregate(kIOReportByDriver);
  for (const auto& [id, type, name] : channels)
    IOReportAddChannelDescription(aggregate, 0x10, "PMGR <id 0x10>", id, static_cast<int64_t>(type),
                                  name ? cf::Value(name) : cf::Value(), {}, {}, info, nullptr);
  return aggregate;
}

std::map<std::string, cf::Dictionary> ByName(const cf::Value& samples) {
  std::map<std::string, cf::Dictionary> out;
  IOReportIterate(samples, [&](const cf::Dictionary& c) {
    out.emplace(IOReportChannelGetChannelName(c), c);
    return 0;
  });
  return out;
}

class IOReportSamplesTest : public ::testing::Test {
 protected:
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  TempDir root;
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};
};

TEST_F(IOReportSamplesTest, RawBuffersAreCutIntoRecords) {
  const cf::Value channels = Aggregate({{1, Type(1, 0x100, 1), "Simple"},
                                        {2, Type(2, 0x100, 3), "State"},
                                        {3, Type(3, 0x100, 2), "Hist"},
                                        {4, Type(4, 0x100, 2), "Array"},
                                        {5, 0, "Learned"},
                                        {9, Type(1, 0x100, 1), "Absent"}});
  std::string raw = Element(0x10, 1, Type(1, 0x100, 1), 0, {250});
  for (int i = 0; i < 3; ++i)
    raw += Element(0x10, 2, Type(2, 0x100, 3), 10 + i, {0x4F4646 + i, i, (i == 0 ? 30 : i == 1 ? 10 : 0)});
  raw += Element(0x10, 3, Type(3, 0x100, 2), 0, {0, 0, 0, 0}) + Element(0x10, 3, Type(3, 0x100, 2), 0, {4, 5, 9, 28});
  raw += Element(0x10, 4, Type(4, 0x100, 2), 0, {1, 2, 3, 4}) + Element(0x10, 4, Type(4, 0x100, 2), 0, {5, 6, 7, 8});
  raw += Element(0x11, 5, Type(1, 0x100, 1), 0, {6});  // another driver's channel 5
  raw += Element(0x10, 5, Type(1, 0x0102, 1), 0, {7});
  raw += std::string(36, '\xff');  // short of an element: not read

  std::optional<IOReportError> error;
  const cf::Value samples = IOReportCreateSamplesRaw(channels, Raw(raw), &error);
  ASSERT_FALSE(error);
  auto by_name = ByName(samples);
  ASSERT_EQ(by_name.size(), 5u);
  EXPECT_FALSE(by_name.count("Absent"));
  EXPECT_EQ(by_name["State"].Get("RawElements").AsData()->size(), 192u);
  int64_t unit = 0;
  EXPECT_EQ(IOReportSimpleGetIntegerValue(by_name["Simple"], &unit), 250);
  EXPECT_EQ(unit, kIOReportInvalidValue);
  // A channel asked for by ID takes its type from its record, once: the
  // channel that was subscribed keeps it for every later sample.
  EXPECT_EQ(IOReportChannelGetFormat(by_name["Learned"]), 1);
  EXPECT_EQ(IOReportChannelGetCategories(by_name["Learned"]), 0x0102);
  EXPECT_EQ(IOReportSimpleGetIntegerValue(by_name["Learned"], nullptr), 7);
  IOReportIterate(channels, [](const cf::Dictionary& c) {
    if (IOReportChannelGetChannelID(c) == 5) {
      EXPECT_EQ(IOReportChannelGetFormat(c), 1);
    }
    EXPECT_FALSE(c.Contains("RawElements"));
    return 0;
  });
  // Array values run across elements, four to an element.
  const cf::Dictionary& array = by_name["Array"];
  EXPECT_EQ(IOReportArrayGetValueAtIndex(array, 0), 1);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(array, 5), 6);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(array, 7), 8);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(array, 8), kIOReportInvalidValue);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(array, -1), kIOReportInvalidValue);
  // Format checks: each accessor reads only its own format.
  EXPECT_EQ(IOReportSimpleGetIntegerValue(array, nullptr), kIOReportInvalidValue);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(by_name["Simple"], 0), kIOReportInvalidValue);
  EXPECT_EQ(IOReportStateGetResidency(by_name["Hist"], 0), kIOReportInvalidValue);
  EXPECT_EQ(IOReportHistogramGetBucketHits(by_name["State"], 0), kIOReportInvalidValue);

  // 100 bytes hold one element.
  const cf::Value one = IOReportCreateSamplesRaw(channels, Raw(raw.substr(0, 100)), nullptr);
  EXPECT_EQ(IOReportGetChannelCount(one), 1);
  // Less than one element is an error.
  EXPECT_TRUE(IOReportCreateSamplesRaw(channels, Raw(raw.substr(0, 63)), &error).IsNull());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, kIOReturnBadArgument);
  EXPECT_EQ(error->failure_reason, "couldn't create samples");
  error.reset();
  EXPECT_TRUE(IOReportCreateSamplesRaw(channels, cf::Value("bytes"), &error).IsNull());
  EXPECT_EQ(error->code, kIOReturnBadArgument);
}

TEST_F(IOReportSamplesTest, RecordsWithoutElementsOrOverrunningTheBuffer) {
  const cf::Value channels = Aggregate({{1, Type(1, 0x100, 1), "One"}, {2, Type(2, 0x100, 2), "Two"}});
  // A record claiming no elements hides every record behind it.
  std::string raw = Element(0x10, 1, Type(1, 0x100, 1), 0, {3}) + Element(0x10, 7, Type(1, 0, 0), 0, {}) +
                    Element(0x10, 2, Type(2, 0x100, 2), 0, {}) + Element(0x10, 2, Type(2, 0x100, 2), 0, {});
  std::optional<IOReportError> error;
  const cf::Value samples = IOReportCreateSamplesRaw(channels, Raw(raw), &error);
  EXPECT_FALSE(error);
  EXPECT_EQ(IOReportGetChannelCount(samples), 1);
  EXPECT_EQ(log->Count("channel has zero elements! PMGR <id 0x10> -- (null) -- (null) -- Two"), 1u);

  // The matching record runs past the end: the whole sample fails.
  raw = Element(0x10, 1, Type(1, 0x100, 1), 0, {3}) + Element(0x10, 2, Type(2, 0x100, 3), 0, {}) +
        Element(0x10, 2, Type(2, 0x100, 3), 0, {});
  EXPECT_TRUE(IOReportCreateSamplesRaw(channels, Raw(raw), &error).IsNull());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->failure_reason, "absurd element count");
  EXPECT_EQ(log->Count("absurd element count! nelems=3, PMGR <id 0x10> -- (null) -- (null) -- Two"), 1u);
  // A record of another channel that overruns is skipped past, not read.
  raw = Element(0x10, 5, Type(1, 0x100, 0xFFFF), 0, {}) + Element(0x10, 1, Type(1, 0x100, 1), 0, {3});
  EXPECT_EQ(IOReportGetChannelCount(IOReportCreateSamplesRaw(channels, Raw(raw), nullptr)), 0);
}

TEST_F(IOReportSamplesTest, LogLinesReadTheChannelBeforeItsNameIsCached) {
  // Four entries fill the channel dictionary's storage, so caching the name
  // moves its values: the log lines must not hold on to one across that.
  const cf::Value channels =
      Aggregate({{1, Type(1, 0x100, 1), "One"}, {2, Type(2, 0x100, 3), "Two"}}, IOReportCreateUnitInfo(0));
  IOReportIterate(channels, [](const cf::Dictionary& c) {
    EXPECT_EQ(c.size(), 4u);
    return 0;
  });
  std::string raw = Element(0x10, 7, Type(1, 0, 0), 0, {});
  EXPECT_EQ(IOReportGetChannelCount(IOReportCreateSamplesRaw(channels, Raw(raw), nullptr)), 0);
  EXPECT_EQ(log->Count("channel has zero elements! PMGR <id 0x10> -- (null) -- (null) -- One"), 1u);
  EXPECT_EQ(log->Count("channel has zero elements! PMGR <id 0x10> -- (null) -- (null) -- Two"), 1u);

  const cf::Value fresh =
      Aggregate({{1, Type(1, 0x100, 1), "One"}, {2, Type(2, 0x100, 3), "Two"}}, IOReportCreateUnitInfo(0));
  raw = Element(0x10, 2, Type(2, 0x100, 3), 0, {}) + Element(0x10, 2, Type(2, 0x100, 3), 0, {});
  EXPECT_TRUE(IOReportCreateSamplesRaw(fresh, Raw(raw), nullptr).IsNull());
  EXPECT_EQ(log->Count("absurd element count! nelems=3, PMGR <id 0x10> -- (null) -- (null) -- Two"), 1u);
}

TEST_F(IOReportSamplesTest, EachChannelTakesItsFirstRecordWhereverItLies) {
  // Many channels, their records in the reverse of walk order, some IDs
  // shared with another driver, and a second record for channel 7.
  cf::Value channels = IOReportCreateAggregate(0);
  for (int64_t id = 1; id <= 300; ++id)
    IOReportAddChannelDescription(channels, 0x10, "A", id, static_cast<int64_t>(Type(1, 0x100, 1)), {}, {}, {}, {},
                                  nullptr);
  std::string raw;
  for (int64_t id = 300; id >= 1; --id) {
    raw += Element(0x10, static_cast<uint64_t>(id), Type(1, 0x100, 1), 0, {id * 10});
    if (id % 3 == 0) raw += Element(0x11, static_cast<uint64_t>(id), Type(1, 0x100, 1), 0, {-id});
  }
  raw += Element(0x10, 7, Type(1, 0x100, 1), 0, {-7});
  const cf::Value samples = IOReportCreateSamplesRaw(channels, Raw(raw), nullptr);
  int seen = 0;
  IOReportIterate(samples, [&](const cf::Dictionary& s) {
    EXPECT_EQ(IOReportSimpleGetIntegerValue(s, nullptr), IOReportChannelGetChannelID(s) * 10);
    ++seen;
    return 0;
  });
  EXPECT_EQ(seen, 300);
}

cf::Dictionary StateSample(std::initializer_list<std::array<int64_t, 4>> states, uint16_t legend_count = 0) {
  const uint16_t n = legend_count ? legend_count : static_cast<uint16_t>(states.size());
  std::string raw;
  for (const auto& s : states) raw += Element(0x10, 2, Type(2, 0, n), static_cast<uint64_t>(s[3]), {s[0], s[1], s[2]});
  cf::Dictionary sample;
  sample.Set("LegendChannel", cf::Array({cf::Value::SInt64(2), cf::Value::SInt64(static_cast<int64_t>(Type(2, 0, n)))}));
  sample.Set("RawElements", Raw(raw));
  return sample;
}

TEST_F(IOReportSamplesTest, StateSamples) {
  // ID, in-transitions, residency, update time
  cf::Dictionary s = StateSample({{0x4F4646, 4, 30, 5}, {0x4F4E, 7, 10, 9}, {0x4F4E, 1, 0, 9}});
  EXPECT_EQ(IOReportStateGetCount(s), 3);
  EXPECT_DOUBLE_EQ(IOReportStateGetDutyCycle(s, 0), 0.75);
  EXPECT_DOUBLE_EQ(IOReportStateGetDutyCycle(s, 1), 0.25);
  EXPECT_DOUBLE_EQ(IOReportStateGetDutyCycle(s, 2), 0);
  EXPECT_TRUE(std::isnan(IOReportStateGetDutyCycle(s, 3)));
  EXPECT_EQ(IOReportStateGetInTransitions(s, 1), 7);
  EXPECT_EQ(IOReportStateGetResidency(s, 3), kIOReportInvalidValue);
  EXPECT_EQ(IOReportStateGetIDForIndex(s, -1), kIOReportInvalidValue);
  EXPECT_EQ(IOReportStateGetIndexForID(s, 0x4F4E), 2);  // searched from the last state down
  EXPECT_EQ(IOReportStateGetIndexForID(s, 1), -1);
  EXPECT_EQ(IOReportStateGetCurrent(s), 1);  // the first of equal latest times
  EXPECT_EQ(IOReportStateGetNameForIndex(s, 0), cf::Value("OFF"));
  EXPECT_EQ(IOReportStateGetNameForIndex(s, 2), cf::Value("ON"));
  EXPECT_TRUE(IOReportStateGetNameForIndex(s, 3).IsNull());
  EXPECT_EQ(s.Get("StateNames"), cf::Value(cf::Array({"OFF", "ON", "ON"})));

  // No residency at all, no update time, an unprintable state ID.
  cf::Dictionary idle = StateSample({{1, 0, 0, 0}, {0x4F4E, 0, 0, 0}});
  EXPECT_TRUE(std::isnan(IOReportStateGetDutyCycle(idle, 0)));
  EXPECT_EQ(IOReportStateGetCurrent(idle), -1);
  EXPECT_TRUE(IOReportStateGetNameForIndex(idle, 1).IsNull());
  EXPECT_FALSE(idle.Contains("StateNames"));

  // The legend must count the elements the sample holds.
  cf::Dictionary short_sample = StateSample({{0x41, 1, 30, 1}, {0x42, 1, 10, 2}}, 3);
  EXPECT_EQ(IOReportStateGetCount(short_sample), 3);
  EXPECT_EQ(IOReportStateGetResidency(short_sample, 0), kIOReportInvalidValue);
  EXPECT_TRUE(std::isnan(IOReportStateGetDutyCycle(short_sample, 0)));
  EXPECT_EQ(IOReportStateGetCurrent(short_sample), -1);
  EXPECT_EQ(IOReportStateGetIndexForID(short_sample, 0x41), -1);
  EXPECT_EQ(IOReportHistogramGetBucketCount(short_sample), -1);
}

cf::Value Segments(std::initializer_list<std::array<int32_t, 4>> segments) {
  std::string bytes;
  for (const auto& s : segments) bytes.append(reinterpret_cast<const char*>(s.data()), 16);
  return Raw(bytes);
}

TEST_F(IOReportSamplesTest, HistogramBucketsAndBounds) {
  std::string raw = Element(0x10, 3, Type(3, 0, 4), 0, {0, 0, 0, 0}) + Element(0x10, 3, Type(3, 0, 4), 0, {2, 11, 19, 30}) +
                    Element(0x10, 3, Type(3, 0, 4), 0, {1, 25, 25, 25}) + Element(0x10, 3, Type(3, 0, 4), 0, {0, 0, 0, 0});
  cf::Dictionary h;
  h.Set("LegendChannel", cf::Array({cf::Value::SInt64(3), cf::Value::SInt64(static_cast<int64_t>(Type(3, 0, 4)))}));
  h.Set("RawElements", Raw(raw));
  h.Set("IOReportChannelInfo", Dict({{"IOReportChannelConfig", Segments({{10, 0, 0, 4}})}}));
  EXPECT_EQ(IOReportHistogramGetBucketCount(h), 4);
  EXPECT_EQ(IOReportHistogramGetBucketHits(h, 1), 2);
  EXPECT_EQ(IOReportHistogramGetBucketSum(h, 1), 30);
  EXPECT_EQ(IOReportHistogramGetMinValue(h), 11);
  EXPECT_EQ(IOReportHistogramGetMaxValue(h), 25);
  int64_t lower = -1, upper = -1;
  EXPECT_EQ(IOReportHistogramGetBucketBounds(h, 0, &lower, &upper), kIOReturnSuccess);
  EXPECT_EQ(std::pair(lower, upper), (std::pair<int64_t, int64_t>(0, 10)));
  EXPECT_EQ(IOReportHistogramGetBucketBounds(h, 3, &lower, &upper), kIOReturnSuccess);
  EXPECT_EQ(std::pair(lower, upper), (std::pair<int64_t, int64_t>(30, 40)));
  EXPECT_EQ(IOReportHistogramGetBucketBounds(h, 4, &lower, nullptr), kIOReturnError);
  EXPECT_EQ(h.Get("ProcessedChannelConfig"), cf::Value(cf::Array({cf::Value::SInt64(10), cf::Value::SInt64(20),
                                                                   cf::Value::SInt64(30), cf::Value::SInt64(40)})));

  struct Case {
    cf::Value config;
    std::vector<int64_t> bounds;  // empty: the bounds cannot be made
  } cases[] = {
      {Segments({{2, 1, 0, 3}}), {2, 4, 8}},
      {Segments({{3, 0, 0, 2}, {7, 0, 1, 2}}), {3, 6, 7, 14}},
      {Segments({{10, 0, 0, 5}, {2, 1, 1, 3}}), {}},  // 2 is not above 50
      {Segments({{10, 0, 0, 5}}), {}},               // more bounds than elements
      {Segments({{0, 0, 0, 1}}), {}},                // the first bound must be above 0
      {Segments({{1, 1, 0, 2}}), {}},                // 1, 1 does not rise
      // Exact to the last unit, just below 2^63; one step more cannot be stored.
      {Segments({{2097151, 1, 0, 3}}), {2097151, 4398042316801, 9223358842721533951}},
      {Segments({{2097152, 1, 0, 3}}), {}},
      {Raw(std::string(15, '\0')), {}},
      {cf::Value(), {}},
  };
  for (const Case& c : cases) {
    cf::Dictionary channel = h.MutableCopy();
    channel.Remove("ProcessedChannelConfig");
    channel.Set("IOReportChannelInfo", Dict({{"IOReportChannelConfig", c.config}}));
    std::vector<int64_t> got;
    for (int i = 0; IOReportHistogramGetBucketBounds(channel, i, nullptr, &upper) == kIOReturnSuccess; ++i)
      got.push_back(upper);
    EXPECT_EQ(got, c.bounds) << c.config.Description();
    EXPECT_EQ(channel.Contains("ProcessedChannelConfig"), !c.bounds.empty());
  }
}

TEST(IOReportScaleTest, ConvertsBetweenScalesOfOneQuantity) {
  constexpr uint64_t kSeconds = 0x0100000000000000, kMilliseconds = 0x0100007c00000000, kWatts = 0x0200000000000000;
  struct Case {
    uint64_t value, from, to;
    double expected;  // NaN: no conversion
  } cases[] = {
      {1500, kMilliseconds, kSeconds, 1.5},
      {2, kSeconds, kMilliseconds, 2000},
      {1, 0x09008c0000000000, 0x0900820000000000, 1024},  // KiB to bytes
      {1, 0x0900820000000000, 0x0900000000000000, 8},     // a byte is 2^3 bits
      {24, 0x0100000080000018, kSeconds, 1},              // bit 31: one over the constant
      {5, 0x0100000000000000 | 0, 0x0100000000000000, 5},
      {UINT64_MAX, kSeconds, kSeconds, 18446744073709551615.0},  // the value is unsigned
      {1, kSeconds, kWatts, NAN},
      {1, 0x0101000000000000, kSeconds, NAN},  // special units do not convert
  };
  for (const Case& c : cases) {
    const double got = IOReportScaleValue(c.value, c.from, c.to);
    if (std::isnan(c.expected)) EXPECT_TRUE(std::isnan(got)) << std::hex << c.from;
    else EXPECT_DOUBLE_EQ(got, c.expected) << std::hex << c.from << " " << c.to;
  }
}


// Subscribing through the simulated hub.
class IOReportSubscriptionTest : public IOReportSamplesTest {
 protected:
  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    std::this_thread::sleep_for(std::chrono::milliseconds(2));  // a new stamp for the registry
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
  void WriteDevice(cf::Dictionary hub_properties) {
    cf::Array legend({Dict({{"IOReportGroupName", "Energy"},
                            {"IOReportChannels",
                             cf::Array({cf::Array({cf::Value::SInt64(1), cf::Value::SInt64(Type(1, 0x100, 1)), "Total"}),
                                        cf::Array({cf::Value::SInt64(2), cf::Value::SInt64(Type(2, 0x100, 2)), "Mode"}),
                                        cf::Array({cf::Value::SInt64(3), cf::Value::SInt64(Type(1, 0x100, 1)),
                                                   "Idle"})})}})});
    Write("registry.plist",
          cf::Array({Dict({{"class", "IOReportHub"}, {"id", cf::Value::UInt64(1)}, {"userClient", "hub"},
                           {"properties", hub_properties}}),
                     Dict({{"class", "PMGR"}, {"id", cf::Value::UInt64(0x20)},
                           {"properties", Dict({{"IOReportLegendPublic", cf::Value::Bool(true)},
                                                {"IOReportLegend", legend}})}})}));
  }
};

TEST_F(IOReportSubscriptionTest, SamplesComeFromTheHubsBuffer) {
  WriteDevice(Dict({}));
  Write("ioreport.plist",
        Dict({{"32", Dict({{"1", cf::Value::SInt64(-5)},
                           {"2", cf::Array({cf::Array({cf::Value::SInt64(0x4F4646), cf::Value::SInt64(1),
                                                       cf::Value::SInt64(30)}),
                                            Dict({{"values", cf::Array({cf::Value::SInt64(0x4F4E), cf::Value::SInt64(2),
                                                                        cf::Value::SInt64(10)})},
                                                  {"time", cf::Value::SInt64(99)}})})}})}}));
  std::optional<IOReportError> error;
  cf::Value channels = IOReportCopyAllChannels(kIOReportByDriver, &error);
  // A channel the hub does not know: no record, so no sample.
  IOReportAddChannelDescription(channels, 0x20, "PMGR <id 0x20>", 77, static_cast<int64_t>(Type(1, 0x100, 1)), "Gone",
                                {}, {}, {}, nullptr);
  ASSERT_EQ(IOReportGetChannelCount(channels), 4);
  {
    cf::Value subscribed;
    IOReportSubscriptionRef subscription = IOReportCreateSubscription(nullptr, channels, &subscribed, 0, &error);
    ASSERT_TRUE(subscription) << error->Description();
    EXPECT_EQ(IOReportGetChannelCount(subscribed), 4);
    EXPECT_FALSE(subscribed.AsDictionary()->Contains("QueryOpts"));
    const cf::Value samples = IOReportCreateSamples(subscription, subscribed, &error);
    ASSERT_FALSE(error);
    auto by_name = ByName(samples);
    ASSERT_EQ(by_name.size(), 3u);
    EXPECT_EQ(IOReportSimpleGetIntegerValue(by_name["Total"], nullptr), -5);
    EXPECT_EQ(IOReportSimpleGetIntegerValue(by_name["Idle"], nullptr), 0);  // not in the file: 0
    EXPECT_EQ(IOReportStateGetNameForIndex(by_name["Mode"], 1), cf::Value("ON"));
    EXPECT_DOUBLE_EQ(IOReportStateGetDutyCycle(by_name["Mode"], 0), 0.75);
    EXPECT_EQ(IOReportStateGetCurrent(by_name["Mode"]), 1);

    // The next sample sees the file as it is then; the first keeps its bytes.
    Write("ioreport.plist", Dict({{"32", Dict({{"1", cf::Value::SInt64(7)}})}}));
    const cf::Value later = IOReportCreateSamples(subscription, subscribed, &error);
    EXPECT_EQ(IOReportSimpleGetIntegerValue(ByName(later)["Total"], nullptr), 7);
    EXPECT_EQ(IOReportSimpleGetIntegerValue(by_name["Total"], nullptr), -5);
  }
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST_F(IOReportSubscriptionTest, EachFailingStepSaysWhichItWas) {
  struct Case {
    cf::Dictionary hub;
    bool subscribes;
    const char* reason;
  } cases[] = {
      {Dict({{"failSelectors", cf::Array({cf::Value::SInt64(0)})}}), false, "kIOReportUserClientOpen failed"},
      {Dict({{"failSelectors", cf::Array({cf::Value::SInt64(2)})}}), false,
       "kIOReportUserClientConfigureInterests failed"},
      {Dict({{"failMap", cf::Value::Bool(true)}}), false, "IOConnectMapMemory() failed"},
      {Dict({{"failSelectors", cf::Array({cf::Value::SInt64(3)})}}), true, "_updateKernelBuffer() failed"},
  };
  for (const Case& c : cases) {
    WriteDevice(c.hub);
    const cf::Value channels = IOReportCopyAllChannels(0, nullptr);
    cf::Value subscribed;
    std::optional<IOReportError> error;
    IOReportSubscriptionRef subscription = IOReportCreateSubscription(nullptr, channels, &subscribed, 0, &error);
    EXPECT_EQ(subscription != nullptr, c.subscribes);
    if (subscription) {
      EXPECT_TRUE(IOReportCreateSamples(subscription, subscribed, &error).IsNull());
    }
    ASSERT_TRUE(error);
    EXPECT_EQ(error->failure_reason, c.reason);
    EXPECT_EQ(error->code, kIOReturnError);
    subscription.reset();
    EXPECT_EQ(platform::OpenIOObjectCount(), 0u) << c.reason;
  }

  WriteDevice(Dict({}));
  cf::Value subscribed;
  std::optional<IOReportError> error;
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, IOReportCreateAggregate(0), &subscribed, 0, &error));
  EXPECT_EQ(error->failure_reason, "no channels");
  EXPECT_EQ(error->code, kIOReturnBadArgument);
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, Dict({{"IOReportChannels", "x"}}), &subscribed, 0, &error));
  EXPECT_EQ(error->failure_reason, "iteration error");
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, IOReportCopyAllChannels(0, nullptr), nullptr, 0, &error));
  EXPECT_EQ(error->failure_reason, "bad arguments");
  // A channel without a type cannot be asked for.
  cf::Value untyped = IOReportCreateAggregate(0);
  cf::Dictionary(*untyped.AsDictionary())
      .Set("IOReportChannels", cf::Array({Dict({{"DriverID", cf::Value::SInt64(0x20)},
                                                {"LegendChannel", cf::Array({cf::Value::SInt64(1)})}})}));
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, untyped, &subscribed, 0, &error));
  EXPECT_EQ(error->failure_reason, "createInterestList() failed");
  EXPECT_EQ(error->code, kIOReturnNoMemory);
  EXPECT_TRUE(IOReportCreateSamples(nullptr, subscribed, &error).IsNull());
  EXPECT_EQ(error->code, kIOReturnBadArgument);

  // A buffer the hub will not keep: 17 channels of 65535 elements.
  Write("registry.plist",
        cf::Array({Dict({{"class", "IOReportHub"}, {"id", cf::Value::UInt64(1)}, {"userClient", "hub"}}),
                   Dict({{"class", "PMGR"}, {"id", cf::Value::UInt64(0x20)},
                         {"properties",
                          Dict({{"IOReportLegend",
                                 cf::Array({Dict({{"IOReportChannels",
                                                   cf::Array({cf::Value(cf::Array(
                                                       {cf::Value::SInt64(9), cf::Value::SInt64(Type(1, 0, 0xFFFF))}))})}})})}})}})}));
  cf::Value huge = IOReportCreateAggregate(0);
  for (int i = 0; i < 17; ++i)
    IOReportAddChannelDescription(huge, 0x20, "PMGR", 9, static_cast<int64_t>(Type(1, 0, 0xFFFF)), {}, {}, {}, {},
                                  nullptr);
  error.reset();
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, huge, &subscribed, 0, &error));
  EXPECT_EQ(error->failure_reason, "kIOReportUserClientConfigureInterests failed");
  EXPECT_EQ(error->code, kIOReturnNoMemory);

  // No hub at all: not found, without a message.
  Write("registry.plist", cf::Array({Dict({{"class", "PMGR"}, {"id", cf::Value::UInt64(0x20)}})}));
  cf::Value one = IOReportCreateAggregate(0);
  IOReportAddChannelDescription(one, 0x20, "PMGR", 1, static_cast<int64_t>(Type(1, 0, 1)), {}, {}, {}, {}, nullptr);
  error.reset();
  EXPECT_FALSE(IOReportCreateSubscription(nullptr, one, &subscribed, 0, &error));
  EXPECT_EQ(error->code, kIOReturnNotFound);
  EXPECT_EQ(error->failure_reason, "");
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

cf::Dictionary Sample(int64_t id, uint64_t type, std::initializer_list<std::initializer_list<int64_t>> elements) {
  std::string raw;
  for (const auto& values : elements) raw += Element(0x10, static_cast<uint64_t>(id), type, 0, values);
  cf::Dictionary s;
  s.Set("DriverID", cf::Value::SInt64(0x10));
  s.Set("LegendChannel", cf::Array({cf::Value::SInt64(id), cf::Value::SInt64(static_cast<int64_t>(type))}));
  s.Set("RawElements", Raw(raw));
  return s;
}

int64_t Slot(const cf::Value& sample, size_t element, size_t i) {
  int64_t v;
  std::memcpy(&v, sample.AsDictionary()->Get("RawElements").AsData()->data() + 64 * element + 32 + 8 * i, 8);
  return v;
}

TEST(IOReportDeltaTest, PairsOfSamplesByFormat) {
  constexpr int64_t kNone = kIOReportInvalidValue;
  std::optional<IOReportError> error;
  const cf::Dictionary before = Sample(1, Type(1, 0, 1), {{100}});
  const cf::Dictionary after = Sample(1, Type(1, 0, 1), {{250}});
  const cf::Value simple = IOReportSampleCreateDelta(before, after, &error);
  EXPECT_EQ(IOReportSimpleGetIntegerValue(*simple.AsDictionary(), nullptr), 150);
  EXPECT_EQ(Slot(simple, 0, 1), kNone);  // slots the format does not use are marked
  EXPECT_EQ(IOReportSimpleGetIntegerValue(before, nullptr), 100);  // the inputs stay as they were
  EXPECT_TRUE(IOReportSampleCreateDelta(Sample(1, Type(1, 0, 1), {{kNone}}), after, &error).IsNull());

  const cf::Value state = IOReportSampleCreateDelta(Sample(2, Type(2, 0, 2), {{0x41, 1, 10}, {0x42, 2, 20}}),
                                                    Sample(2, Type(2, 0, 2), {{0x41, 4, 15}, {0x42, 2, 50}}), &error);
  EXPECT_EQ(IOReportStateGetInTransitions(*state.AsDictionary(), 0), 3);
  EXPECT_EQ(IOReportStateGetResidency(*state.AsDictionary(), 1), 30);
  EXPECT_EQ(IOReportStateGetIDForIndex(*state.AsDictionary(), 1), 0x42);
  EXPECT_TRUE(IOReportSampleCreateDelta(Sample(2, Type(2, 0, 1), {{0x41, 1, 10}}),
                                        Sample(2, Type(2, 0, 2), {{0x41, 4, 15}, {0x42, 2, 50}}), &error)
                  .IsNull());

  // hits, minimum, maximum, sum per bucket
  const cf::Value histogram =
      IOReportSampleCreateDelta(Sample(3, Type(3, 0, 3), {{2, 1, 9, 12}, {0, 5, 5, 77}, {1, 1, 1, 1}}),
                                Sample(3, Type(3, 0, 3), {{5, 1, 9, 40}, {3, 4, 8, 20}, {1, 1, 1, 1}}), &error);
  EXPECT_EQ(IOReportHistogramGetBucketHits(*histogram.AsDictionary(), 0), 3);
  EXPECT_EQ(IOReportHistogramGetBucketSum(*histogram.AsDictionary(), 0), 28);
  EXPECT_EQ(IOReportHistogramGetBucketSum(*histogram.AsDictionary(), 1), 20);  // the earlier sum had no hits
  EXPECT_EQ(IOReportHistogramGetBucketMinValue(*histogram.AsDictionary(), 1), 4);
  EXPECT_EQ(IOReportHistogramGetBucketHits(*histogram.AsDictionary(), 2), 0);
  EXPECT_EQ(IOReportHistogramGetBucketSum(*histogram.AsDictionary(), 2), kNone);

  const cf::Value array = IOReportSampleCreateDelta(Sample(4, Type(4, 0, 1), {{kNone, 5, 9, kNone}}),
                                                    Sample(4, Type(4, 0, 1), {{3, kNone, 10, kNone}}), &error);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(*array.AsDictionary(), 0), 3);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(*array.AsDictionary(), 1), 5);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(*array.AsDictionary(), 2), 1);
  EXPECT_EQ(IOReportArrayGetValueAtIndex(*array.AsDictionary(), 3), kNone);

  error.reset();
  EXPECT_TRUE(IOReportSampleCreateDelta(before, Sample(1, Type(4, 0, 1), {{1}}), &error).IsNull());
  EXPECT_EQ(error->failure_reason, "mismatched formats");
  EXPECT_EQ(error->code, kIOReturnBadArgument);
  EXPECT_TRUE(IOReportSampleCreateDelta(Sample(1, Type(7, 0, 1), {{1}}), Sample(1, Type(7, 0, 1), {{1}}), &error)
                  .IsNull());
  EXPECT_EQ(error->failure_reason, "unknown report format");
  EXPECT_EQ(static_cast<uint32_t>(error->code), 0xe00002e6u);
}

TEST(IOReportDeltaTest, AggregatesPairChannelsByDriverIDAndType) {
  const auto aggregate = [](std::initializer_list<cf::Dictionary> channels) {
    cf::Value a = IOReportCreateAggregate(kIOReportByDriver);
    for (const cf::Dictionary& c : channels) {
      cf::Dictionary named = c.MutableCopy();
      named.Set("DriverName", "D");
      IOReportMergeChannels(a, Dict({{"IOReportChannels", cf::Array({named})}}), nullptr);
    }
    return a;
  };
  // The earlier sample has a channel the later one lost, and lacks one.
  const cf::Value earlier = aggregate(
      {Sample(9, Type(1, 0, 1), {{0}}), Sample(1, Type(1, 0, 1), {{10}}), Sample(2, Type(1, 0, 1), {{20}})});
  const cf::Value later = aggregate({Sample(1, Type(1, 0, 1), {{11}}), Sample(2, Type(1, 0, 1), {{25}}),
                                     Sample(3, Type(1, 0, 1), {{7}})});
  std::optional<IOReportError> error;
  const cf::Value delta = IOReportCreateSamplesDelta(earlier, later, &error);
  ASSERT_FALSE(delta.IsNull());
  std::vector<int64_t> values;
  IOReportIterate(delta, [&](const cf::Dictionary& c) {
    values.push_back(IOReportSimpleGetIntegerValue(c, nullptr));
    return 0;
  });
  EXPECT_EQ(values, (std::vector<int64_t>{1, 5, 7}));

  // A driver level the earlier sample does not have.
  EXPECT_TRUE(IOReportCreateSamplesDelta(IOReportCreateAggregate(kIOReportByDriver), later, &error).IsNull());
  // A channel of the same ID with another type is no partner.
  const cf::Value retyped = aggregate({Sample(1, Type(1, 0x100, 1), {{5}})});
  const cf::Value alone = IOReportCreateSamplesDelta(retyped, aggregate({Sample(1, Type(1, 0, 1), {{11}})}), &error);
  IOReportIterate(alone, [](const cf::Dictionary& c) {
    EXPECT_EQ(IOReportSimpleGetIntegerValue(c, nullptr), 11);
    return 0;
  });
  EXPECT_EQ(IOReportGetChannelCount(alone), 1);
  // An earlier channel whose type cannot be read fails the delta when the
  // search for a partner reaches it.
  cf::Dictionary untyped = Sample(8, Type(1, 0, 1), {{1}});
  untyped.Set("LegendChannel", cf::Array({cf::Value::SInt64(8), cf::Value("simple")}));
  EXPECT_TRUE(IOReportCreateSamplesDelta(aggregate({untyped, Sample(1, Type(1, 0, 1), {{10}})}),
                                         aggregate({Sample(1, Type(1, 0, 1), {{11}})}), &error)
                  .IsNull());
}

std::string Right(size_t width, const std::string& text) {
  return std::string(width > text.size() ? width - text.size() : 0, ' ') + text;
}

TEST(IOReportDescriptionTest, OneLinePerElement) {
  const cf::Value ms = IOReportCreateUnitInfo(0x0100007c00000000);
  cf::Dictionary simple = Sample(1, Type(1, 0, 1), {{250}});
  simple.Set("IOReportChannelInfo", ms);
  simple.Set("LegendChannel", cf::Array({cf::Value::SInt64(1), cf::Value::SInt64(Type(1, 0, 1)), "Total"}));
  EXPECT_EQ(IOReportSampleCopyDescription(simple, {}, "> "),
            cf::Value("> " + Right(32, "Total") + " = { " + Right(12, "250") + " ms }\n"));

  cf::Dictionary state = Sample(0x4D6F6465, Type(2, 0, 3), {{0x4F4646, 4, 30000}, {0x4F4E, 7, 10000}, {0x5A, 0, 0}});
  state.Set("IOReportChannelInfo", ms);
  EXPECT_EQ(IOReportSampleCopyDescription(state, {}, nullptr),
            cf::Value(Right(20, "Mode") + "[     OFF] = { # 4        3.000e+01 s / 75.0% }\n" + Right(20, "Mode") +
                      "[      ON] = { # 7        1.000e+01 s / 25.0% }\n" + Right(20, "Mode") +
                      "[       Z] = { # 0        0.000e+00 s /  0.0% }\n"));
  // One state without a text form: every state goes by its ID.
  cf::Dictionary unnamed = Sample(0x4D6F6465, Type(2, 0, 2), {{7, 1, 5}, {0x4F4E, 1, 5}});
  unnamed.Set("IOReportChannelInfo", ms);
  EXPECT_EQ(IOReportSampleCopyDescription(unnamed, {}, nullptr),
            cf::Value(Right(20, "Mode") + "[     0x7] = { # 1        5.000e-03 s / 50.0% }\n" + Right(20, "Mode") +
                      "[  0x4f4e] = { # 1        5.000e-03 s / 50.0% }\n"));

  cf::Dictionary histogram = Sample(3, Type(3, 0, 2), {{2, 11, 19, 30}, {0, 0, 0, 0}});
  histogram.Set("LegendChannel", cf::Array({cf::Value::SInt64(3), cf::Value::SInt64(Type(3, 0, 2)), "Lat"}));
  histogram.Set("IOReportChannelInfo", Dict({{"IOReportChannelUnit", cf::Value::SInt64(0x0100007c00000000)},
                                             {"IOReportChannelConfig", Segments({{10, 0, 0, 2}})}}));
  EXPECT_EQ(IOReportSampleCopyDescription(histogram, {}, ""),
            cf::Value(Right(20, "Lat") + "[" + Right(12, "0") + " - " + Right(12, "10") + " ms] = { m " +
                      Right(12, "11") + "; M " + Right(12, "19") + "; s " + Right(12, "30") + "; # " + Right(12, "2") +
                      " }\n" + Right(20, "Lat") + "[" + Right(12, "10") + " - " + Right(12, "20") +
                      " ms] = { <no hits>; # 0 }\n"));

  EXPECT_EQ(IOReportSampleCopyDescription(Sample(4, Type(4, 0, 2), {{1}, {2}}), {}, ""),
            cf::Value("arrays unsupported?arrays unsupported?"));
  // A name that is not text: the first element's ID, cut to nine characters.
  cf::Dictionary odd = Sample(0x123456789A, Type(1, 0, 1), {{5}});
  odd.Set("ChannelName", "\xff\xfe");
  EXPECT_EQ(IOReportSampleCopyDescription(odd, {}, ""),
            cf::Value(Right(32, "0x1234567") + " = { " + Right(12, "5") + " (null) }\n"));
  // Lines that cannot be made: no bounds, no value, no elements, no format.
  histogram.Remove("ProcessedChannelConfig");
  histogram.Set("IOReportChannelInfo", ms);
  EXPECT_TRUE(IOReportSampleCopyDescription(histogram, {}, "").IsNull());
  EXPECT_TRUE(IOReportSampleCopyDescription(Sample(1, Type(1, 0, 1), {{kIOReportInvalidValue}}), {}, "").IsNull());
  simple.Remove("RawElements");
  EXPECT_TRUE(IOReportSampleCopyDescription(simple, {}, "").IsNull());
  EXPECT_TRUE(IOReportSampleCopyDescription(Sample(1, Type(0, 0, 1), {{1}}), {}, "").IsNull());
  EXPECT_TRUE(IOReportSampleCopyDescription(Sample(1, Type(5, 0, 1), {{1}}), {}, "").IsNull());
}

TEST(IOReportDescriptionTest, WritingText) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  EXPECT_EQ(IOReportWriteStringUTF8(fds[1], cf::Value("caf\xc3\xa9\n")), kIOReturnSuccess);
  char buffer[16] = {};
  EXPECT_EQ(read(fds[0], buffer, sizeof buffer), 6);
  EXPECT_STREQ(buffer, "caf\xc3\xa9\n");
  EXPECT_EQ(IOReportWriteStringUTF8(fds[1], cf::Value()), kIOReturnBadArgument);
  for (const char* bad : {"\xff", "a\xc3", "\xc0\x80", "\xed\xa0\x80", "\xf4\x90\x80\x80", "\xe2\x82"})
    EXPECT_EQ(IOReportWriteStringUTF8(fds[1], cf::Value(bad)), kIOReturnNoMemory) << bad;
  EXPECT_EQ(IOReportWriteStringUTF8(fds[1], cf::Value("\xf0\x9f\x98\x80\xe2\x82\xac")), kIOReturnSuccess);
  EXPECT_EQ(read(fds[0], buffer, sizeof buffer), 7);
  // A pipe that takes only part of the text.
  ASSERT_EQ(fcntl(fds[1], F_SETFL, O_NONBLOCK), 0);
  EXPECT_EQ(static_cast<uint32_t>(IOReportWriteStringUTF8(fds[1], cf::Value(std::string(1 << 20, 'x')))),
            0xe00002e7u);
  close(fds[0]);
  close(fds[1]);
  EXPECT_EQ(static_cast<uint32_t>(IOReportWriteStringUTF8(fds[1], cf::Value("x"))), 0xe00002cau);
}

}  // namespace
