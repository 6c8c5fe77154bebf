#include "ioreport/ioreport.h"

#include <gtest/gtest.h>

#include <thread>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "ioreport/internal.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "ioreport/test_legend.h"

namespace {

cf::Dictionary Channel(std::initializer_list<std::pair<const char*, cf::Value>> entries) { return Dict(entries); }

const cf::Dictionary* Level(const cf::Value& v, std::initializer_list<const char*> path) {
  const cf::Dictionary* d = v.AsDictionary();
  for (const char* key : path) {
    if (!d) return nullptr;
    d = d->Get(key).AsDictionary();
  }
  return d;
}

std::vector<std::string> Names(const cf::Value& aggregate) {
  std::vector<std::string> names;
  IOReportIterate(aggregate, [&](const cf::Dictionary& c) {
    names.push_back(IOReportChannelGetChannelName(c));
    return 0;
  });
  return names;
}

TEST(IOReportChannelTest, NamesComeFromTheLegendTheIDOrNothing) {
  struct Case {
    cf::Value legend;
    std::string name;
  } cases[] = {
      {Legend(1, 0, "Total"), "Total"},
      {Legend(0x0000000041424344, 0), "ABCD"},
      {Legend(0x4100004200000043, 0), "ABC"},  // zero bytes are skipped wherever they are
      {Legend(0x4142, 0), "AB"},
      {Legend(0x4107, 0), "<unknown>"},  // one unprintable byte spoils the whole ID
      {Legend(0x41420000000000FF, 0), "<unknown>"},
      {Legend(0x7E20, 0), "~ "},
      {Legend(0x7F, 0), "<unknown>"},
      {Legend(0, 0), "<unknown>"},
      {Legend(INT64_MIN, 0), "<unknown>"},
      {cf::Array({cf::Value::SInt64(0x4142), cf::Value::SInt64(0), cf::Value::SInt64(7)}), "AB"},  // name not a string
      {cf::Array({cf::Value("AB")}), "<unknown>"},
      {cf::Value("not a legend"), "<unknown>"},
  };
  for (const Case& c : cases) {
    cf::Dictionary channel = Channel({{"LegendChannel", c.legend}});
    EXPECT_EQ(IOReportChannelGetChannelName(channel), c.name) << c.legend.Description();
    EXPECT_EQ(channel.Get("ChannelName"), cf::Value(c.name));
  }
  // The cache wins over the legend once written.
  cf::Dictionary cached = Channel({{"LegendChannel", Legend(1, 0, "Total")}, {"ChannelName", "Before"}});
  EXPECT_EQ(IOReportChannelGetChannelName(cached), "Before");
}

TEST(IOReportChannelTest, UnitLabels) {
  struct Case {
    uint64_t unit;
    const char* label;
  } cases[] = {
      {0x0100000000000000, "s"},          {0x0900820000000000, "B"},      {0x09008c0000000000, "KiB"},
      {0x0900000000000000, "b"},          {0x0900008200000000, "k"},      {0x0100007c00000000, "ms"},
      {0x0100007300000000, "ps"},         {0x0200008200000000, "kW"},
      {0x0800008800000000, "GHz"},        {0x0000a70000000000, "Ti"},     {0x09008c0000000008, "8KiB"},
      {0x0900aa0000000000, "TiB"},        {0x6400000000000000, "events"}, {0x6500000000000000, "packets"},
      {0x0B00000000000000, "??"},         {0x0A00000000000001, "C"},      {0x0000000000000000, ""},
      {0x0000007600000001, "1Gticks"},    {0x0500007600000001, "1Gticks"}, {0x0100007980000018, "24Mticks"},
      {0x0201000000000000, "hwticks?"},   {0x0002000000000000, "hwpage?"}, {0x0100007c00000001, "s"},
  };
  for (const Case& c : cases) {
    cf::Dictionary channel = Channel({{"IOReportChannelInfo", IOReportCreateUnitInfo(c.unit)}});
    EXPECT_EQ(IOReportChannelGetUnit(channel), static_cast<int64_t>(c.unit));
    EXPECT_EQ(IOReportChannelGetUnitLabel(channel), cf::Value(c.label)) << std::hex << c.unit;
    EXPECT_EQ(channel.Get("UnitLabel"), cf::Value(c.label));
  }
  // No unit: no label, and nothing cached.
  for (const cf::Value& info : {cf::Value(), cf::Value(Dict({{"IOReportChannelUnit", "s"}})), cf::Value("x")}) {
    cf::Dictionary channel = Channel({{"IOReportChannelInfo", info}});
    EXPECT_EQ(IOReportChannelGetUnit(channel), kIOReportInvalidValue);
    EXPECT_TRUE(IOReportChannelGetUnitLabel(channel).IsNull());
    EXPECT_FALSE(channel.Contains("UnitLabel"));
  }
}

TEST(IOReportChannelTest, TypeFieldsAndUnreadableChannels) {
  cf::Dictionary good = Channel({{"DriverID", cf::Value::SInt64(0x10)},
                                 {"DriverName", "PMGR <id 0x10>"},
                                 {"LegendChannel", Legend(0x4142, Type(3, 0x0102, 9) | (int64_t{-1} << 48), "Hist")},
                                 {"IOReportGroupName", "Energy"},
                                 {"IOReportSubGroupName", cf::Value::SInt64(3)}});
  EXPECT_EQ(IOReportChannelGetFormat(good), 3);
  EXPECT_EQ(IOReportChannelGetCategories(good), 0x0102);
  EXPECT_EQ(IOReportChannelGetChannelID(good), 0x4142);
  EXPECT_EQ(IOReportChannelGetDriverID(good), 0x10);
  EXPECT_EQ(IOReportChannelGetDriverName(good), cf::Value("PMGR <id 0x10>"));
  EXPECT_EQ(IOReportChannelGetGroup(good), cf::Value("Energy"));
  EXPECT_TRUE(IOReportChannelGetSubGroup(good).IsNull());  // not a string

  for (const cf::Value& legend :
       {cf::Value(), cf::Value(cf::Array()), cf::Value(cf::Array({cf::Value::SInt64(1)})),
        cf::Value(cf::Array({cf::Value::SInt64(1), cf::Value("simple")})), cf::Value(Dict({}))}) {
    cf::Dictionary bad = Channel({{"LegendChannel", legend}, {"DriverID", "x"}, {"DriverName", cf::Value::SInt64(1)}});
    EXPECT_EQ(IOReportChannelGetFormat(bad), 0);
    EXPECT_EQ(IOReportChannelGetCategories(bad), 0xFFFF);
    EXPECT_EQ(IOReportChannelGetDriverID(bad), kIOReportInvalidValue);
    EXPECT_TRUE(IOReportChannelGetDriverName(bad).IsNull());
    EXPECT_TRUE(IOReportChannelCopyDescription(bad, {}, "").IsNull());
  }
  EXPECT_EQ(IOReportChannelGetChannelID(Channel({{"LegendChannel", cf::Array({cf::Value::SInt64(7)})}})), 7);
  EXPECT_EQ(IOReportChannelGetChannelID(Channel({{"LegendChannel", cf::Array({cf::Value("7")})}})),
            kIOReportInvalidValue);
}

TEST(IOReportChannelTest, Descriptions) {
  cf::Dictionary channel = Channel({{"DriverName", "PMGR <id 0x10>"},
                                    {"LegendChannel", Legend(0x41424344, Type(1, 0x0100, 1))},
                                    {"IOReportGroupName", "Energy"},
                                    {"IOReportChannelInfo", IOReportCreateUnitInfo(0x0100007c00000000)}});
  EXPECT_EQ(IOReportChannelCopyDescription(channel, {}, "  "),
            cf::Value("  PMGR <id 0x10> ABCD < 0x41424344 (ms) | G/g Energy/(none) | cat 0x100 | format 0x01 | elts 1 >\n"));
  cf::Dictionary bare = Channel({{"LegendChannel", Legend(0, Type(0, 0, 0))}});
  EXPECT_EQ(IOReportChannelCopyDescription(bare, {}, nullptr),
            cf::Value("(null) <unknown> < 0 ((null)) | G/g (none)/(none) | cat 0000 | format 0000 | elts 0 >\n"));
}

TEST(IOReportAggregateTest, ChannelsAreFiledByDriverAndGroup) {
  struct Case {
    uint32_t options;
    std::vector<const char*> path;
  } cases[] = {
      {0, {}},
      {kIOReportByDriver, {"IOReportDrivers", "D"}},
      {kIOReportByGroup, {"IOReportChannelGroups", "G", "IOReportChannelGroups", "g"}},
      {kIOReportByDriver | kIOReportByGroup,
       {"IOReportDrivers", "D", "IOReportChannelGroups", "G", "IOReportChannelGroups", "g"}},
  };
  for (const Case& c : cases) {
    cf::Value aggregate = IOReportCreateAggregate(c.options);
    EXPECT_EQ(aggregate.AsDictionary()->Get("QueryOpts"),
              cf::Value(cf::Number::Make(cf::NumberType::kInt, static_cast<int32_t>(c.options))));
    std::optional<IOReportError> error;
    ASSERT_EQ(IOReportAddChannelDescription(aggregate, 7, "D", 1, Type(1, 0, 1), "one", "G", "g", {}, &error), 0);
    // A channel without a group sits at the driver level even when filing by group.
    ASSERT_EQ(IOReportAddChannelDescription(aggregate, 7, "D", 2, Type(1, 0, 1), "two", {}, {}, {}, &error), 0);
    EXPECT_FALSE(error);
    const cf::Dictionary* level = aggregate.AsDictionary();
    for (const char* key : c.path) level = level ? level->Get(key).AsDictionary() : nullptr;
    ASSERT_NE(level, nullptr) << c.options;
    const cf::Array* channels = level->Get("IOReportChannels").AsArray();
    ASSERT_NE(channels, nullptr);
    EXPECT_EQ(IOReportChannelGetChannelName(*channels->at(0).AsDictionary()), "one");
    EXPECT_EQ(IOReportGetChannelCount(aggregate), 2);
    EXPECT_EQ(Names(aggregate), (std::vector<std::string>{c.options & kIOReportByGroup ? "two" : "one",
                                                          c.options & kIOReportByGroup ? "one" : "two"}));
  }

  // Filing by driver needs a driver name; a wrong type on the path fails
  // and leaves the aggregate as it was.
  cf::Value by_driver = IOReportCreateAggregate(kIOReportByDriver);
  std::optional<IOReportError> error;
  EXPECT_EQ(IOReportAddChannelDescription(by_driver, 7, {}, 1, 0, {}, {}, {}, {}, &error), kIOReturnError);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->failure_reason, "_addChannel() failed");
  EXPECT_EQ(error->domain, "Mach");
  cf::Value grouped = IOReportCreateAggregate(kIOReportByDriver | kIOReportByGroup);
  cf::Dictionary(*grouped.AsDictionary()).Set("IOReportDrivers", Dict({{"D", Dict({{"IOReportChannelGroups", "x"}})}}));
  const std::string before = grouped.Description();
  error.reset();
  EXPECT_EQ(IOReportAddChannelDescription(grouped, 7, "D", 1, 0, {}, "G", {}, {}, &error), kIOReturnError);
  EXPECT_EQ(error->code, kIOReturnError);
  EXPECT_EQ(grouped.Description(), before);
  error.reset();
  EXPECT_EQ(IOReportAddChannelDescription(cf::Value("x"), 7, "D", 1, 0, {}, {}, {}, {}, &error), kIOReturnBadArgument);
  EXPECT_EQ(error->Description(), "Mach error 0xe00002c2: _addChannel() failed");
}

cf::Value ThreeDrivers() {
  cf::Value aggregate = IOReportCreateAggregate(kIOReportByDriver | kIOReportByGroup);
  IOReportAddChannelDescription(aggregate, 1, "A", 1, Type(1, 0x100, 1), "a1", {}, {}, {}, nullptr);
  IOReportAddChannelDescription(aggregate, 1, "A", 2, Type(2, 0x100, 3), "a2", "G", {}, {}, nullptr);
  IOReportAddChannelDescription(aggregate, 2, "B", 3, Type(2, 0x001, 3), "b1", "G", "g", {}, nullptr);
  IOReportAddChannelDescription(aggregate, 3, "C", 4, Type(1, 0x100, 1), "c1", {}, {}, {}, nullptr);
  return aggregate;
}

TEST(IOReportAggregateTest, PruningRemovesEmptiedLevels) {
  cf::Value aggregate = ThreeDrivers();
  // Keep only simple channels: B's only channel and A's group go, with their levels.
  EXPECT_EQ(IOReportPrune(aggregate, [](const cf::Dictionary& c) { return IOReportChannelGetFormat(c) == 1 ? 0 : 16; }),
            16);
  EXPECT_EQ(Names(aggregate), (std::vector<std::string>{"a1", "c1"}));
  EXPECT_EQ(Level(aggregate, {"IOReportDrivers", "B"}), nullptr);
  ASSERT_NE(Level(aggregate, {"IOReportDrivers", "A"}), nullptr);
  EXPECT_FALSE(Level(aggregate, {"IOReportDrivers", "A"})->Contains("IOReportChannelGroups"));
  // Nothing removed: 0.
  EXPECT_EQ(IOReportPrune(aggregate, [](const cf::Dictionary&) { return 0; }), 0);
  // Everything removed: only the options remain.
  EXPECT_EQ(IOReportPrune(aggregate, [](const cf::Dictionary&) { return 16; }), 16);
  EXPECT_EQ(aggregate.AsDictionary()->size(), 1u);
  EXPECT_TRUE(aggregate.AsDictionary()->Contains("QueryOpts"));
  EXPECT_EQ(IOReportGetChannelCount(aggregate), 0);

  // A failing callback stops the walk at once and its code comes back.
  cf::Value again = ThreeDrivers();
  int seen = 0;
  EXPECT_EQ(IOReportIterate(again, [&](const cf::Dictionary&) { return ++seen == 2 ? 5 : 0; }), 5);
  EXPECT_EQ(seen, 2);
  EXPECT_EQ(IOReportPrune(again, [&](const cf::Dictionary& c) { return IOReportChannelGetChannelID(c) == 3 ? 1 : 16; }),
            1);
  EXPECT_EQ(Names(again), (std::vector<std::string>{"b1", "c1"}));  // A was pruned before the failure
  // Codes other than skip and failure are ORed into the result; only a
  // plain skip removes a channel.
  EXPECT_EQ(IOReportIterate(again, [](const cf::Dictionary&) { return 2; }), 2);
  EXPECT_EQ(IOReportPrune(again, [](const cf::Dictionary&) { return 0x30; }), 0x30);
  EXPECT_EQ(Names(again), (std::vector<std::string>{"b1", "c1"}));
}

TEST(IOReportAggregateTest, MalformedAggregates) {
  const auto count = [](const cf::Value& v) { return IOReportGetChannelCount(v); };
  EXPECT_EQ(count(cf::Value()), -1);
  EXPECT_EQ(count(cf::Value("aggregate")), -1);
  EXPECT_EQ(count(Dict({})), 0);  // a level without channels counts none
  EXPECT_EQ(count(Dict({{"IOReportChannels", "x"}})), -1);
  EXPECT_EQ(count(Dict({{"IOReportChannels", cf::Array({Dict({}), cf::Value::SInt64(1)})}})), -1);
  EXPECT_EQ(count(Dict({{"IOReportDrivers", cf::Array()}})), -1);
  EXPECT_EQ(IOReportIterate(Dict({{"IOReportChannels", "x"}}), [](const cf::Dictionary&) { return 0; }), 273);
  // Entries that are not named levels are passed over.
  EXPECT_EQ(count(Dict({{"IOReportChannelGroups",
                         Dict({{"x", cf::Value::SInt64(1)},
                               {"G", Dict({{"IOReportChannels", cf::Array({Dict({})})}})}})}})),
            1);
  // A nesting no aggregate has.
  cf::Dictionary deep;
  cf::Dictionary top = deep;
  for (int i = 0; i < 40; ++i) {
    cf::Dictionary next;
    deep.Set("IOReportDrivers", Dict({{"D", next}}));
    deep = next;
  }
  EXPECT_EQ(count(top), -1);
}

TEST(IOReportAggregateTest, MergingSharesChannelsUnderTheDestinationsOptions) {
  cf::Value source = ThreeDrivers();
  cf::Value destination = IOReportCreateAggregate(0);
  std::optional<IOReportError> error;
  EXPECT_EQ(IOReportMergeChannels(destination, source, &error), 0);
  EXPECT_FALSE(error);
  EXPECT_EQ(Names(destination), (std::vector<std::string>{"a1", "a2", "b1", "c1"}));
  EXPECT_FALSE(destination.AsDictionary()->Contains("IOReportDrivers"));
  // The same channel objects: a cache written through one is seen in the other.
  cf::Dictionary first = *destination.AsDictionary()->Get("IOReportChannels").AsArray()->at(0).AsDictionary();
  first.Set("UnitLabel", "x");
  EXPECT_EQ(Level(source, {"IOReportDrivers", "A"})->Get("IOReportChannels").AsArray()->at(0).AsDictionary()->Get(
                "UnitLabel"),
            cf::Value("x"));

  for (const auto& [to, from] : {std::pair<cf::Value, cf::Value>{source, source}, {cf::Value(), source},
                                 {destination, cf::Value()}}) {
    error.reset();
    EXPECT_EQ(IOReportMergeChannels(to, from, &error), 273);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, kIOReturnBadArgument);
    EXPECT_EQ(error->failure_reason, "bad argument");
  }
  // A channel the destination cannot file stops the merge.
  cf::Value nameless = IOReportCreateAggregate(0);
  IOReportAddChannelDescription(nameless, 1, {}, 1, 0, {}, {}, {}, {}, nullptr);
  error.reset();
  EXPECT_EQ(IOReportMergeChannels(IOReportCreateAggregate(kIOReportByDriver), nameless, &error), 1);
  EXPECT_EQ(error->failure_reason, "_addChannel() failed");
  EXPECT_EQ(error->Description(), "Mach error 0xe00002bc: _addChannel() failed");
}

// Drivers in a device registry.
class IOReportRegistryTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};

  void WriteRegistry(const cf::Array& services) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(services, bytes, nullptr));
    ASSERT_TRUE(platform::WriteFileAtomically(root / "device/registry.plist", bytes));
  }
  static cf::Dictionary Driver(const char* name, uint64_t id, cf::Dictionary properties) {
    return Dict({{"class", "Driver"}, {"name", name}, {"id", cf::Value::UInt64(id)}, {"properties", properties}});
  }
  void SetUp() override {
    const cf::Value pub = cf::Value::Bool(true);
    cf::Array pmgr({
        Dict({{"IOReportGroupName", "Energy"},
              {"IOReportChannelInfo", IOReportCreateUnitInfo(0x0300007c00000000)},
              {"IOReportChannels", cf::Array({Legend(0x41424344, Type(1, 0x0100, 1)),
                                              Legend(2, Type(2, 0x0100, 3), "Power"), cf::Value("stop"),
                                              Legend(3, Type(1, 0x0100, 1), "Unreached")})}}),
        Dict({{"IOReportGroupName", cf::Value::SInt64(1)},  // not a string: no group
              {"IOReportSubGroupName", cf::Value::SInt64(2)},
              {"IOReportChannelInfo", "not a dictionary"},
              {"IOReportChannels", cf::Array({Legend(4, Type(3, 0x0001, 4), "Latency")})}}),
        Dict({{"IOReportGroupName", "Energy"},
              {"IOReportSubGroupName", "CPU"},
              {"IOReportChannels", cf::Array({Legend(5, Type(1, 0x0101, 1), "Total")})}}),
        Dict({{"IOReportSubGroupName", "Orphan"}, {"IOReportChannels", cf::Array({Legend(6, Type(1, 0x100, 1))})}}),
        Dict({{"IOReportChannels", cf::Array({Legend(7, Type(1, 0x100, 1), "AfterOrphan")})}}),
    });
    WriteRegistry(cf::Array({
        Driver("PMGR", 0x10, Dict({{"IOReportLegendPublic", pub}, {"IOReportLegend", pmgr}})),
        Driver("Quiet", 0x20, Dict({{"IOReportLegend", pmgr}})),  // not public
        Driver("NoLegend", 0x30, Dict({{"IOReportLegendPublic", pub}})),
        Driver("Odd", 0x40,
               Dict({{"IOReportLegendPublic", pub}, {"IOReportLegend", Dict({})}})),
        Driver("Disk", 0x50,
               Dict({{"IOReportLegendPublic", pub},
                     {"IOReportLegend", cf::Array({Dict({{"IOReportChannels",
                                                          cf::Array({Legend(0x4142, Type(1, 0x0100, 1))})}}),
                                                   cf::Value::SInt64(9)})}})),
    }));
  }
  io_service_t Find(const char* name) {
    cf::Dictionary matching;
    matching.Set("IONameMatch", name);
    return IOServiceGetMatchingService(kIOMainPortDefault, matching);
  }
};

TEST_F(IOReportRegistryTest, ReadingOneDriver) {
  const io_service_t pmgr = Find("PMGR");
  EXPECT_EQ(IOReportCopyDriverName(pmgr), cf::Value("PMGR <id 0x10>"));
  std::optional<IOReportError> error;
  const cf::Value channels = IOReportCopyChannelsForDriver(pmgr, 0, &error);
  EXPECT_FALSE(error);
  // The first entry's non-array channel ends that entry; the orphan subgroup
  // ends the legend.
  EXPECT_EQ(Names(channels), (std::vector<std::string>{"ABCD", "Power", "Latency", "Total"}));
  const cf::Array& list = *channels.AsDictionary()->Get("IOReportChannels").AsArray();
  const cf::Dictionary& first = *list[0].AsDictionary();
  EXPECT_EQ(first.Get("DriverID"), cf::Value::SInt64(0x10));
  EXPECT_EQ(first.Get("DriverName"), cf::Value("PMGR <id 0x10>"));
  EXPECT_EQ(IOReportChannelGetGroup(first), cf::Value("Energy"));
  EXPECT_EQ(IOReportChannelGetUnitLabel(first), cf::Value("mJ"));
  const cf::Dictionary& latency = *list[2].AsDictionary();
  EXPECT_FALSE(latency.Contains("IOReportGroupName"));
  EXPECT_FALSE(latency.Contains("IOReportSubGroupName"));
  EXPECT_FALSE(latency.Contains("IOReportChannelInfo"));
  EXPECT_EQ(IOReportChannelGetSubGroup(*list[3].AsDictionary()), cf::Value("CPU"));

  // Not public: an empty aggregate, and no error.
  const io_service_t quiet = Find("Quiet");
  const cf::Value none = IOReportCopyChannelsForDriver(quiet, kIOReportByDriver, &error);
  ASSERT_TRUE(none.AsDictionary());
  EXPECT_EQ(IOReportGetChannelCount(none), 0);
  EXPECT_FALSE(error);

  struct Failure {
    io_service_t driver;
    IOReturn code;
    const char* reason;
  } failures[] = {
      {Find("NoLegend"), kIOReturnNotFound, "no legend"},
      {Find("Odd"), kIOReturnBadLegend, "bad legend"},
      {0, kIOReturnBadArgument, "invalid driver"},
      {999, kIOReturnBadArgument, "invalid driver"},
  };
  for (const Failure& f : failures) {
    error.reset();
    EXPECT_TRUE(IOReportCopyChannelsForDriver(f.driver, 0, &error).IsNull());
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, f.code);
    EXPECT_EQ(error->failure_reason, f.reason);
    EXPECT_TRUE(IOReportCopyChannelsForDriver(f.driver, 0, nullptr).IsNull());
  }
  for (io_service_t s : {pmgr, quiet, failures[0].driver, failures[1].driver}) IOObjectRelease(s);
}

TEST_F(IOReportRegistryTest, ListingSkipsDriversThatCannotBeRead) {
  std::optional<IOReportError> error;
  testing::internal::CaptureStderr();
  const cf::Value quiet = IOReportCopyAllChannels(kIOReportByDriver, &error);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  EXPECT_FALSE(error);
  EXPECT_EQ(Names(quiet), (std::vector<std::string>{"ABCD", "Power", "Latency", "Total", "AB"}));
  ASSERT_NE(Level(quiet, {"IOReportDrivers", "PMGR <id 0x10>"}), nullptr);
  ASSERT_NE(Level(quiet, {"IOReportDrivers", "Disk <id 0x50>"}), nullptr);
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);

  testing::internal::CaptureStderr();
  IOReportCopyAllChannels(kIOReportPrintFailedDrivers, nullptr);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "NoLegend <id 0x30>: no legend\nOdd <id 0x40>: bad legend\n");

  // All drivers that match must be readable.
  cf::Dictionary disk;
  disk.Set("IONameMatch", "Disk");
  const cf::Value one = IOReportCopyChannelsForDrivers(disk, kIOReportByDriver, &error);
  EXPECT_EQ(Names(one), (std::vector<std::string>{"AB"}));
  EXPECT_NE(Level(one, {"IOReportDrivers", "Disk <id 0x50>"}), nullptr);
  EXPECT_TRUE(IOReportCopyChannelsForDrivers(IOServiceMatching("Driver"), 0, &error).IsNull());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, kIOReturnError);
  error.reset();
  EXPECT_TRUE(IOReportCopyChannelsForDrivers(cf::Value(), 0, &error).IsNull());
  EXPECT_EQ(error->failure_reason, "no matching dict");
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST_F(IOReportRegistryTest, Selections) {
  std::optional<IOReportError> error;
  EXPECT_EQ(Names(IOReportCopyChannelsInCategories(kIOReportCategoryField, 0, &error)),
            (std::vector<std::string>{"ABCD", "Power", "Total", "AB"}));
  EXPECT_EQ(Names(IOReportCopyChannelsInCategories(0x0001, 0, &error)),
            (std::vector<std::string>{"Latency", "Total"}));
  EXPECT_EQ(Names(IOReportCopyChannelsOfFormat(kIOReportFormatSimple, 0, &error)),
            (std::vector<std::string>{"ABCD", "Total", "AB"}));
  EXPECT_EQ(Names(IOReportCopyChannelsOfFormat(kIOReportFormatHistogram, kIOReportByDriver, &error)),
            (std::vector<std::string>{"Latency"}));
  EXPECT_EQ(Names(IOReportCopyChannelsWithUnit(0x0300007c00000000, 0, &error)),
            (std::vector<std::string>{"ABCD", "Power"}));
  EXPECT_EQ(Names(IOReportCopyChannelsInGroup("Energy", {}, 0, &error)),
            (std::vector<std::string>{"ABCD", "Power", "Total"}));
  EXPECT_EQ(Names(IOReportCopyChannelsInGroup({}, "CPU", 0, &error)), (std::vector<std::string>{"Total"}));
  EXPECT_EQ(Names(IOReportCopyChannelsInGroup("Energy", "CPU", kIOReportByGroup, &error)),
            (std::vector<std::string>{"Total"}));
  EXPECT_EQ(IOReportGetChannelCount(IOReportCopyChannelsInGroup("Other", "CPU", 0, &error)), 0);
  EXPECT_FALSE(error);
  EXPECT_TRUE(IOReportCopyChannelsInGroup({}, {}, 0, &error).IsNull());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, kIOReturnBadArgument);
  EXPECT_EQ(error->failure_reason, "no group or subgroup!");
  error.reset();
  EXPECT_EQ(IOReportSelectChannelsInGroup(Dict({{"IOReportChannels", "x"}}), "G", {}, &error), 273);
  EXPECT_EQ(error->failure_reason, "channel pruning failed");

  // One channel of unknown type per matching driver.
  const cf::Value by_id = IOReportCopyChannelsWithID(IOServiceMatching("Driver"), 0x4142, &error);
  ASSERT_EQ(IOReportGetChannelCount(by_id), 5);
  const cf::Dictionary& last = *by_id.AsDictionary()->Get("IOReportChannels").AsArray()->at(4).AsDictionary();
  EXPECT_EQ(last.Get("LegendChannel"), cf::Value(cf::Array({cf::Value::SInt64(0x4142), cf::Value::SInt64(0)})));
  EXPECT_EQ(IOReportChannelGetDriverID(last), 0x50);
  EXPECT_EQ(IOReportChannelGetChannelName(last), "AB");
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST_F(IOReportRegistryTest, DriverWalksStopAtAFailureOrARegistryChange) {
  const cf::Value all = IOServiceMatching("Driver");
  std::vector<uint64_t> seen;
  const auto visit = [&](io_service_t driver) {
    uint64_t id = 0;
    IORegistryEntryGetRegistryEntryID(driver, &id);
    seen.push_back(id);
    return kIOReturnSuccess;
  };
  EXPECT_EQ(ioreport_internal::walkDrivers(all, visit), kIOReturnSuccess);
  EXPECT_EQ(seen, (std::vector<uint64_t>{0x10, 0x20, 0x30, 0x40, 0x50}));
  seen.clear();
  EXPECT_EQ(ioreport_internal::walkDrivers(all, [&](io_service_t driver) {
              visit(driver);
              return seen.size() == 2 ? kIOReturnNotFound : kIOReturnSuccess;
            }),
            kIOReturnNotFound);
  EXPECT_EQ(seen.size(), 2u);
  // The registry changes after the first driver: the walk ends there and is not restarted.
  seen.clear();
  EXPECT_EQ(ioreport_internal::walkDrivers(all, [&](io_service_t driver) {
              visit(driver);
              std::this_thread::sleep_for(std::chrono::milliseconds(2));
              WriteRegistry(cf::Array({Driver("Late", 0x60, Dict({}))}));
              return kIOReturnSuccess;
            }),
            kIOReturnRegistryChanged);
  EXPECT_EQ(seen, (std::vector<uint64_t>{0x10}));
  EXPECT_EQ(platform::OpenIOObjectCount(), 0u);
}

TEST(IOReportLegendTest, LegendsThatAreNotArrays) {
  cf::Value aggregate = IOReportCreateAggregate(0);
  std::optional<IOReportError> error;
  EXPECT_EQ(addLegendChannels(aggregate, Dict({}), 1, "D", &error), kIOReturnBadLegend);
  EXPECT_EQ(error->Description(), "Mach error 0xe00002c9: bad legend");
  // Entries are read up to the first that is not a dictionary.
  EXPECT_EQ(addLegendChannels(aggregate,
                              cf::Array({Dict({{"IOReportChannels", cf::Array({Legend(1, 1, "x")})}}), "stop",
                                         Dict({{"IOReportChannels", cf::Array({Legend(2, 1, "y")})}})}),
                              1, "D", nullptr),
            kIOReturnSuccess);
  EXPECT_EQ(Names(aggregate), (std::vector<std::string>{"x"}));
  // An entry without channels ends the legend too.
  EXPECT_EQ(addLegendChannels(aggregate,
                              cf::Array({Dict({{"IOReportChannels", "x"}}),
                                         Dict({{"IOReportChannels", cf::Array({Legend(2, 1, "y")})}})}),
                              1, "D", nullptr),
            kIOReturnSuccess);
  EXPECT_EQ(IOReportGetChannelCount(aggregate), 1);
  // A channel without a numeric ID and type fails the whole legend.
  for (const cf::Value& bad : {cf::Value(cf::Array({cf::Value::SInt64(1)})),
                               cf::Value(cf::Array({cf::Value("x"), cf::Value::SInt64(1)})),
                               cf::Value(cf::Array({cf::Value::SInt64(1), cf::Value("simple")}))}) {
    error.reset();
    EXPECT_EQ(addLegendChannels(aggregate, cf::Array({Dict({{"IOReportChannels", cf::Array({bad})}})}), 1, "D",
                                &error),
              kIOReturnError);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->Description(), "Mach error 0xe00002bc: couldn't create channel");
  }
}

}  // namespace
