#include "nandinfo/controller.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <thread>

#include "../../tests/stream_capture.h"
#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/statistics_buffers.h"

namespace {

cf::Dictionary Service(const char* cls, uint64_t id, bool openable = true) {
  cf::Dictionary d;
  d.Set("class", cls);
  d.Set("id", cf::Value::UInt64(id));
  d.Set("userClient", "nvme");
  d.Set("openable", cf::Value::Bool(openable));
  return d;
}

class ControllerTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};

  void SetUp() override {
    parsers::testing::ResetAPIErrorMessage();
    nandinfo::testing::ResetControllerState();
  }
  void TearDown() override { EXPECT_EQ(platform::OpenIOObjectCount(), 0u) << "every handle is given back"; }

  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    std::this_thread::sleep_for(std::chrono::milliseconds(2));  // a new stamp for every version
    ASSERT_TRUE(platform::WriteFileAtomically(root / ("device/" + name), bytes));
  }
  void Controller(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
    cf::Dictionary c;
    for (const auto& [k, v] : entries) c.Set(k, v);
    Write("controller.plist", c);
  }
  static cf::Dictionary Fields(std::initializer_list<std::pair<const char*, uint64_t>> fields) {
    cf::Dictionary d;
    for (const auto& [k, v] : fields) d.Set(k, cf::Value::UInt64(v));
    return d;
  }
};

TEST_F(ControllerTest, DiscoveryOpensTheFirstKindThatAnswers) {
  nand_exporter_t* e = nullptr;
  EXPECT_EQ(findNandExporter(&e), 0u);
  ASSERT_NE(e, nullptr);
  EXPECT_EQ(e->className, nullptr);  // the terminating record
  EXPECT_FALSE(findNandExporterNew(&e));
  EXPECT_EQ(e->className, nullptr);

  // The first kind matches but cannot be opened: findNandExporter takes it,
  // findNandExporterNew goes on to the next kind.
  Write("registry.plist", cf::Array({Service("VelmoraVNS3NVMeController", 1, false),
                                     Service("VSPStorage", 2)}));
  const io_service_t s = findNandExporter(&e);
  EXPECT_NE(s, 0u);
  EXPECT_STREQ(e->className, "VelmoraVNS3NVMeController");
  EXPECT_EQ(log->Count("NANDInfo: findNandExporter: Controller found: VelmoraVNS3NVMeController"), 1u);
  IOObjectRelease(s);
  StreamCapture out(stdout);
  ASSERT_TRUE(findNandExporterNew(&e));
  EXPECT_EQ(out.Text(), "NANDInfo_quill: findNandExporterNew: Controller found: VSPStorage\n");
  EXPECT_STREQ(e->className, "VSPStorage");
  EXPECT_NE(e->connection, 0u);
  EXPECT_EQ(e->contentDeletionMethod, 5u);
  EXPECT_EQ(e->parseMSPBuffer, nullptr);
  ReleaseIOInterfaces(*e);

  // The exported connection calls and their messages.
  StreamCapture err(stderr);
  nand_exporter_t* found = nullptr;
  EXPECT_EQ(VNDConnect(&found), 0u);
  VSPConnection c{};
  EXPECT_FALSE(openVSPConnection(&c));
  EXPECT_EQ(c.connection, 0u);
  EXPECT_EQ(c.service, 0u);
  EXPECT_EQ(err.Text(),
            "IOServiceOpen failed for class 'VelmoraVNS3NVMeController', result 0xe00002c1\n"
            "IOServiceOpen failed for class 'VelmoraVNS3NVMeController', result 0xe00002c1\n"
            "Can't get VSP Connection!\n");
  Write("registry.plist", cf::Array());
  StreamCapture none(stderr);
  EXPECT_EQ(VNDConnect(&found), 0u);
  EXPECT_FALSE(openVSPConnection(&c));
  EXPECT_EQ(none.Text(), "No class foundCan't get VSP Connection, no matching service!\n");
}

TEST_F(ControllerTest, TunnelCommandsAndTheirFailures) {
  Write("registry.plist", cf::Array({Service("VelmoraVNS3NVMeController", 1)}));
  Controller({{"stats", Fields({{"hostWrites", 5}, {"hostReads", 6}})}, {"defects", cf::Value::Bytes({1, 2, 3, 4})},
              {"shortData", Fields({{"15", 3}})}});
  nand_exporter_t* e = nullptr;
  ASSERT_TRUE(findNandExporterNew(&e));
  tunnel_command_t command{};
  command.sizeHint = 77;  // zeroed by the call
  TunnelBuffer buffer;
  size_t size = 123;

  // A data phase that returns fewer bytes than the size phase announced:
  // the size is what came back.
  ASSERT_TRUE(executeTunnelCommand(e->connection, e, VSPGetDefectsListSelectors(), &command, &buffer, &size));
  EXPECT_EQ(size, 3u);
  EXPECT_EQ(std::string(reinterpret_cast<char*>(buffer.get()), 4), std::string("\x01\x02\x03\x00", 4));
  EXPECT_EQ(command.phase, 0u);
  EXPECT_EQ(command.command, 15u);

  // No selectors: an empty input, which this controller refuses.
  EXPECT_FALSE(executeTunnelCommand(e->connection, e, nullptr, &command, &buffer, &size));
  EXPECT_EQ(GetAPIErrorMessage(), "executeTunnelCommand: IOConnectCallStructMethod failed while retrieving data size");
  EXPECT_EQ(buffer, nullptr);
  EXPECT_EQ(size, 0u);
  ReleaseIOInterfaces(*e);

  for (const auto& [connection, exporter, message] :
       std::vector<std::tuple<io_connect_t, nand_exporter_t, std::string>>{
           {0, nand_exporters[0], "executeTunnelCommand: Invalid connection"},
           {5, nand_exporter_t{}, "executeTunnelCommand: Invalid exporter"}}) {
    parsers::testing::ResetAPIErrorMessage();
    EXPECT_FALSE(executeTunnelCommand(connection, &exporter, VSPGetStatsSelectors(), &command, &buffer, &size));
    EXPECT_EQ(GetAPIErrorMessage(), message);
  }

  // The statistics context through the table's own parser.
  VSPParseCxt stats;
  StreamCapture quiet(stderr);
  ASSERT_TRUE(gatherVSPStatsData(&e, &stats));
  EXPECT_EQ(stats.hostWrites, 5u);
  EXPECT_EQ(stats.hostReads, 6u);
  e->releaseContext(&stats);
  // A failing size phase, then a failing data phase.
  for (const char* fault : {"failCommands", "failDataCommands"}) {
    Controller({{"stats", Fields({{"hostWrites", 5}})}, {fault, cf::Array({cf::Value::SInt32(13)})}});
    EXPECT_FALSE(gatherVSPStatsData(&e, &stats)) << fault;
  }
  EXPECT_EQ(quiet.Text(), "");
}

TEST_F(ControllerTest, FtlDictionaryIsFetchedOncePerProcess) {
  Write("registry.plist", cf::Array({Service("VelmoraVNS3NVMeController", 1)}));
  Controller({{"stats", Fields({{"hostWrites", 5}})}, {"failCommands", cf::Array({cf::Value::SInt32(13)})}});
  EXPECT_TRUE(gatherVSPFTLData().IsNull());
  EXPECT_EQ(GetAPIErrorMessage(), "executeTunnelCommand: IOConnectCallStructMethod failed while retrieving data size");
  // A null answer is asked again; a real one is kept however the device changes.
  Controller({{"stats", Fields({{"hostWrites", 5}})}});
  const cf::Value first = gatherVSPFTLData();
  ASSERT_NE(first.AsDictionary(), nullptr);
  EXPECT_EQ(first.AsDictionary()->Get("hostWrites"), cf::Value::UInt64(5));
  Controller({{"stats", Fields({{"hostWrites", 9}})}});
  EXPECT_EQ(gatherVSPFTLData().AsDictionary()->Get("hostWrites"), cf::Value::UInt64(5));

  // Bytes that do not parse: null, and the parser's reason first.
  nandinfo::testing::ResetControllerState();
  parsers::testing::ResetAPIErrorMessage();
  Controller({{"stats", cf::Value::Bytes({1, 2, 3})}});
  EXPECT_TRUE(gatherVSPFTLData().IsNull());
  EXPECT_NE(GetAPIErrorMessage(), "NA");
}

TEST_F(ControllerTest, MspDictionariesPerAnsweringIndex) {
  Write("registry.plist", cf::Array({Service("VelmoraVNS3NVMeController", 1)}));
  auto msps = [&](int n) {
    cf::Array a;
    for (int i = 0; i < n; ++i) a.Append(Fields({{"passWithTmodeHard", static_cast<uint64_t>(100 + i)}}));
    return a;
  };
  for (const auto& [answering, expected] : std::vector<std::pair<int, size_t>>{{4, 4}, {10, 10}, {11, 10}}) {
    Controller({{"msp", msps(answering)}});
    const cf::Value v = gatherVSPMSPData();
    ASSERT_NE(v.AsDictionary(), nullptr);
    EXPECT_EQ(v.AsDictionary()->size(), expected) << answering;
    EXPECT_EQ(v.AsDictionary()->Get(std::to_string(expected - 1)).AsDictionary()->Get("passWithTmodeHard"),
              cf::Value::UInt64(100 + expected - 1));
  }
  // None answers: an empty dictionary, and the first failure's message (the
  // first message of a process is the one kept); a kind without MSP: null.
  parsers::testing::ResetAPIErrorMessage();
  Controller({});
  EXPECT_EQ(gatherVSPMSPData(), cf::Value(cf::Dictionary()));
  EXPECT_EQ(GetAPIErrorMessage(), "executeTunnelCommand: IOConnectCallStructMethod failed while retrieving data size");
  parsers::testing::ResetAPIErrorMessage();
  Write("registry.plist", cf::Array({Service("VelmoraEmbeddedNVMeController", 1)}));
  EXPECT_TRUE(gatherVSPMSPData().IsNull());
  EXPECT_EQ(GetAPIErrorMessage(), "gatherVSPMSPData: Controller does not support MSP data");
}

}  // namespace
