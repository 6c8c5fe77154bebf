#include <gtest/gtest.h>

#include <limits>
#include <thread>

#include "../../tests/stream_capture.h"
#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "nandinfo/views.h"
#include "parsers/context.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/default_device.h"

namespace {

constexpr uint32_t kDBIC = 0x64424943;
constexpr uint32_t kIFW1 = 0x69667731;
constexpr uint32_t kLPEM = 0x4C50454D;

cf::Value S32(int32_t v) { return cf::Value::SInt32(v); }
cf::Value U64(uint64_t v) { return cf::Value::UInt64(v); }

class ViewsHealthTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};

  void SetUp() override { Fresh(); }
  void TearDown() override { EXPECT_EQ(platform::OpenIOObjectCount(), 0u) << "every handle is given back"; }

  // As a new process would start: no cached FTL figures, no error recorded.
  void Fresh() {
    parsers::testing::ResetAPIErrorMessage();
    nandinfo::testing::ResetControllerState();
    log->Clear();
  }
  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    WriteRaw(name, bytes);
  }
  void WriteRaw(const std::string& name, const std::string& bytes) {
    std::this_thread::sleep_for(std::chrono::milliseconds(2));  // a new stamp for every version
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
  void Registry(const char* cls, const char* kind, cf::Dictionary extra = {}) {
    cf::Dictionary service = Dict({{"class", cls}, {"id", U64(0x100)}, {"userClient", kind}});
    for (const auto& [k, v] : extra) service.Set(k, v);
    Write("registry.plist", cf::Array({cf::Value(service)}));
  }
};

TEST_F(ViewsHealthTest, ImageQueriesAnswerFromTheDriverAndSayWhyNot) {
  // No driver: both queries answer 0 and say so, on the system log and on
  // standard error alike, with the key as a number and as its characters.
  {
    StreamCapture err(stderr);
    EXPECT_EQ(GetEANImageSize(kDBIC), 0u);
    EXPECT_EQ(GetEANUpdateCount(kDBIC), 0u);
    EXPECT_EQ(err.Text(),
              "getEANConnection: Couldn't find VelmoraNVMeEAN object\n"
              "GetEANImageSize: Unable to get EAN Io service connection for key (1682065731): dBIC\n"
              "getEANConnection: Couldn't find VelmoraNVMeEAN object\n"
              "GetEANUpdateCount: Unable to get EAN Io service connection for key (1682065731): dBIC\n");
    EXPECT_EQ(log->Count("getEANConnection: Couldn't find VelmoraNVMeEAN object"), 2u);
    EXPECT_EQ(log->Count("GetEANUpdateCount: Unable to get EAN Io service connection for key (1682065731): dBIC"), 1u);
  }

  // A driver that cannot be opened: the service found is given back.
  Registry("VelmoraNVMeEAN", "ean", Dict({{"openable", cf::Value::Bool(false)}}));
  log->Clear();
  EXPECT_EQ(GetEANImageSize(kDBIC), 0u);
  EXPECT_TRUE(log->Contains("getEANConnection: IOServiceOpen on VelmoraNVMeEAN failed kernResult:e00002c1"));
  EXPECT_TRUE(log->Contains("GetEANImageSize: Unable to get EAN Io service connection for key (1682065731): dBIC"));

  Registry("VelmoraNVMeEAN", "ean");
  const uint64_t kMax = std::numeric_limits<uint64_t>::max();
  Write("ean.plist",
        Dict({{"dBIC", Dict({{"size", U64(262144)}, {"updates", S32(3)}})}, {"LPEM", Dict({{"updates", U64(kMax)}})}}));
  log->Clear();
  EXPECT_EQ(GetEANImageSize(kDBIC), 262144u);
  EXPECT_EQ(GetEANUpdateCount(kDBIC), 3u);
  EXPECT_EQ(GetEANUpdateCount(kLPEM), kMax);
  // No size for LPEM: the driver succeeds without touching the output.
  EXPECT_EQ(GetEANImageSize(kLPEM), 0u);
  EXPECT_TRUE(log->lines().empty());

  // An image the driver does not know.
  EXPECT_EQ(GetEANImageSize(kIFW1), 0u);
  EXPECT_EQ(GetEANUpdateCount(kIFW1), 0u);
  EXPECT_EQ(log->Count("GetImageSize: IOConnectCallMethod failed (key (1768322865): ifw1) kernResult:e00002f0"), 1u);
  EXPECT_EQ(log->Count("GetUpdateCount: IOConnectCallMethod failed (key (1768322865): ifw1) kernResult:e00002f0"), 1u);
}

TEST_F(ViewsHealthTest, TheDefaultDeviceAnswersTheImageFiguresTheStorageViewReports) {
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  Write("registry.plist", device.registry);
  Write("ean.plist", device.ean);
  for (const uint32_t key : {kDBIC, 0x644C5448u}) EXPECT_GT(GetEANImageSize(key), 0u) << std::hex << key;
  for (const uint32_t key : {kDBIC, 0x644C5448u, kIFW1, 0x64436667u, 0x66436667u, 0x6E656677u, kLPEM})
    EXPECT_GT(GetEANUpdateCount(key), 0u) << std::hex << key;
  EXPECT_TRUE(log->lines().empty());
}

TEST_F(ViewsHealthTest, AMalformedImageFileFailsOnlyTheQueryItSpoils) {
  Registry("VelmoraNVMeEAN", "ean");
  const struct {
    cf::Value file;
    uint64_t size, updates;  // 0 where the query fails
    size_t failing;          // queries that fail, each with one complaint
    const char* complaint;
  } cases[] = {
      {cf::Array({cf::Value("dBIC")}), 0, 0, 2, "device: ean.plist: expected a dictionary of images, not an array"},
      {Dict({{"dBIC", "big"}}), 0, 0, 2, "device: ean.plist \"dBIC\": expected a dictionary, not a string"},
      {Dict({{"dBIC", Dict({{"size", "12"}, {"updates", S32(5)}})}}), 0, 5, 1,
       "device: ean.plist \"dBIC\" \"size\": expected a whole number from 0 to 2^64 - 1, not a string"},
      {Dict({{"dBIC", Dict({{"size", S32(7)}, {"updates", S32(-1)}})}}), 7, 0, 1,
       "device: ean.plist \"dBIC\" \"updates\": expected a whole number from 0 to 2^64 - 1, not a negative number"},
      // No update count: that query succeeds with 0.
      {Dict({{"dBIC", Dict({{"size", cf::Value::Float64(1.5)}})}}), 0, 0, 1,
       "device: ean.plist \"dBIC\" \"size\": expected a whole number from 0 to 2^64 - 1, not a real number"},
  };
  for (const auto& c : cases) {
    Write("ean.plist", c.file);
    log->Clear();
    EXPECT_EQ(GetEANImageSize(kDBIC), c.size) << c.complaint;
    EXPECT_EQ(GetEANUpdateCount(kDBIC), c.updates) << c.complaint;
    EXPECT_EQ(log->CountContaining("device: "), c.failing) << c.complaint;
    EXPECT_EQ(log->Count(c.complaint), c.failing) << c.complaint;
    EXPECT_EQ(log->CountContaining("IOConnectCallMethod failed (key (1682065731): dBIC) kernResult:e00002bc"),
              c.failing)
        << c.complaint;
  }
  // Not a property list at all: every image is unknown, and the file is
  // named once however often it is asked.
  WriteRaw("ean.plist", "<plist><dict><key>dBIC");
  log->Clear();
  EXPECT_EQ(GetEANImageSize(kDBIC), 0u);
  EXPECT_EQ(GetEANUpdateCount(kDBIC), 0u);
  EXPECT_EQ(log->CountContaining("ean.plist is not a property list"), 1u);
  EXPECT_EQ(log->CountContaining("kernResult:e00002f0"), 2u);

  // The driver's own checks of what it is asked.
  Write("ean.plist", Dict({{"dBIC", Dict({{"size", S32(9)}})}}));
  const io_service_t service = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("VelmoraNVMeEAN"));
  io_connect_t connection = 0;
  ASSERT_EQ(IOServiceOpen(service, mach_task_self(), 0, &connection), kIOReturnSuccess);
  const uint64_t keys[2] = {kDBIC, kDBIC};
  uint8_t bytes[4] = {};
  const struct {
    uint32_t selector, inputs, outputs;
    const void* struct_in;
    kern_return_t expected;
    uint64_t out;
  } calls[] = {
      {3, 1, 1, nullptr, kIOReturnSuccess, 9},     {3, 0, 1, nullptr, kIOReturnBadArgument, 0},
      {3, 2, 1, nullptr, kIOReturnBadArgument, 0}, {3, 1, 0, nullptr, kIOReturnBadArgument, 0},
      {3, 1, 2, nullptr, kIOReturnBadArgument, 0}, {3, 1, 1, bytes, kIOReturnBadArgument, 0},
      {4, 1, 1, nullptr, kIOReturnUnsupported, 0},
  };
  for (const auto& c : calls) {
    uint64_t out[2] = {0, 0};
    uint32_t count = c.outputs;
    EXPECT_EQ(IOConnectCallMethod(connection, c.selector, keys, c.inputs, c.struct_in, c.struct_in ? 4 : 0, out, &count,
                                  nullptr, nullptr),
              c.expected)
        << c.selector << " " << c.inputs << " " << c.outputs;
    EXPECT_EQ(out[0], c.out);
  }
  // A key wider than four characters names no image.
  const uint64_t wide = (uint64_t{1} << 32) | kDBIC;
  uint64_t out = 0;
  uint32_t count = 1;
  EXPECT_EQ(IOConnectCallScalarMethod(connection, 3, &wide, 1, &out, &count), kIOReturnNotFound);
  EXPECT_EQ(IOServiceClose(connection), kIOReturnSuccess);
  EXPECT_EQ(IOObjectRelease(service), kIOReturnSuccess);
}

TEST_F(ViewsHealthTest, HealthFiguresAndTheThreeViews) {
  const std::string kPct = "com.velmora.NANDInfo.Health.MaxPercentageNANDUsed";
  const std::string kE2E = "com.velmora.NANDInfo.Health.MaxE2EErrors";
  const std::string kHost = "com.velmora.NANDInfo.Health.HostReadErrors";
  const std::string kGrown = "com.velmora.NANDInfo.Health.NumGrownBadBlocks";
  const std::string kSpare = "com.velmora.NANDInfo.Health.SpareAvailablePercent";
  const std::string kRefurb = "com.velmora.NANDInfo.Health.IsNANDRefurbishable";
  const std::string kRetire = "com.velmora.NANDInfo.Health.IsNANDRetirable";
  Registry("VelmoraVNS3NVMeController", "nvme");

  cf::Array e2e;
  for (int i = 0; i < 12; ++i) e2e.Append(U64(i == 3 ? 0x80000000u : i == 11 ? 5 : 1));
  const struct {
    const char* what;
    cf::Dictionary ftl;
    int32_t pct, e2e, host;
    std::optional<uint64_t> grown, spare;
    int32_t retirable;
  } cases[] = {
      {"the largest use", Dict({{"percentUsed", U64(12)}, {"slcPercentUsed", U64(40)}}), 40, 0, 0, {}, {}, 0},
      // Read as signed 32-bit: 0xFFFFFFFF and 0x80000000 are negative and
      // left out, 0x100000003 is 3.
      {"negatives ignored",
       Dict({{"fwUpdatesPercentUsed", U64(0xFFFFFFFFu)},
             {"percentUsed", U64(7)},
             {"E2EDPErrorCounters", e2e},
             {"ueccReads", U64(2)},
             {"raidSmartErrors", U64(0x100000003)},
             {"numGrownBad", U64(6)},
             {"spareAvailablePercent", U64(3)}}),
       7, 5, 3, 6, 3, 0},
      {"spare at the bound", Dict({{"spareAvailablePercent", U64(4)}}), 0, 0, 0, {}, 4, 1},
  };
  for (const auto& c : cases) {
    Fresh();
    Write("controller.plist", Dict({{"stats", c.ftl}}));
    cf::Dictionary ota = Dict({{kPct.c_str(), S32(c.pct)}, {kHost.c_str(), S32(c.host)}, {kE2E.c_str(), S32(c.e2e)}});
    if (c.grown) ota.Set(kGrown, U64(*c.grown));
    cf::Dictionary halvern = ota.MutableCopy();
    halvern.Set(kRefurb, S32(1));
    halvern.Set("ESR_APIErrorMessage", "NA");
    cf::Dictionary lab = ota.MutableCopy();
    if (c.spare) lab.Set(kSpare, U64(*c.spare));
    lab.Set(kRetire, S32(c.retirable));
    lab.Set("ESR_APIErrorMessage", "NA");
    EXPECT_EQ(CopyOTANANDInfo(), cf::Value(ota)) << c.what;
    EXPECT_EQ(CopyHalvernNANDInfo(), cf::Value(halvern)) << c.what;
    EXPECT_EQ(CopyInternalLabNANDInfo(), cf::Value(lab)) << c.what;
  }

  // No FTL figures: an empty health dictionary, so the views carry only
  // their extras, and the first failure of the run is the one they show.
  Fresh();
  Write("registry.plist", cf::Array());
  EXPECT_TRUE(gatherNANDHealthInfo().empty());
  EXPECT_EQ(CopyOTANANDInfo(), cf::Value(cf::Dictionary()));
  EXPECT_EQ(CopyHalvernNANDInfo(),
            cf::Value(Dict({{kRefurb.c_str(), S32(1)},
                            {"ESR_APIErrorMessage", "gatherVSPFTLData: Could not get nand_exporter_t"}})));
  EXPECT_EQ(CopyInternalLabNANDInfo(),
            cf::Value(Dict({{kRetire.c_str(), S32(0)},
                            {"ESR_APIErrorMessage", "gatherVSPFTLData: Could not get nand_exporter_t"}})));
}

TEST_F(ViewsHealthTest, OnlyTheThirdKindCanRecommendDeletingContent) {
  const auto four = [](uint8_t b0, uint8_t b3) { return cf::Value::Bytes(cf::Data({b0, 0, 0, b3})); };
  const struct {
    const char* cls;  // null: no controller
    cf::Value answer;
    cf::Dictionary extra;
    bool expected;
    const char* err;
  } cases[] = {
      {"VSPStorage", S32(1), {}, true, ""},
      {"VSPStorage", four(0, 1), {}, true, ""},
      {"VSPStorage", four(0, 0), {}, false, ""},
      {"VSPStorage", cf::Value::Bytes(cf::Data({1, 0})), {}, false, ""},  // too short
      {"VSPStorage", cf::Value(), {}, false, ""},                         // the call fails
      {"VSPStorage", S32(1), Dict({{"closeFails", cf::Value::Bool(true)}}), true,
       "Could not close connection to service\n"},
      {"VSPStorage", S32(1), Dict({{"openable", cf::Value::Bool(false)}}), false,
       "Could not get connection to service\n"},
      {"VelmoraVNS3NVMeController", S32(1), {}, false, ""},
      {"VelmoraEmbeddedNVMeController", S32(1), {}, false, ""},
      {nullptr, S32(1), {}, false, "_load_nand_infoCould not get matching IOKit service for exporting classes\n"},
  };
  for (const auto& c : cases) {
    const std::string what = std::string(c.cls ? c.cls : "none") + " " + c.answer.Description();
    if (c.cls)
      Registry(c.cls, "nvme", c.extra);
    else
      Write("registry.plist", cf::Array());
    cf::Dictionary controller;
    if (!c.answer.IsNull()) controller.Set("contentDeletion", c.answer);
    Write("controller.plist", controller);
    StreamCapture err(stderr);
    EXPECT_EQ(NandRecommendsContentDeletion(), cf::Value::Bool(c.expected)) << what;
    EXPECT_EQ(err.Text(), c.err) << what;
  }
}

}  // namespace
