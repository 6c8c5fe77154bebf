#include "platform/iokit.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstring>
#include <thread>

#include "../../tests/temp_dir.h"
#include "../../tests/test_values.h"
#include "cf/plist.h"
#include "parsers/parsers.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "sim/statistics_buffers.h"

namespace platform {
namespace {

cf::Dictionary Service(const char* cls, uint64_t id, std::initializer_list<std::pair<const char*, cf::Value>> more = {}) {
  cf::Dictionary d;
  d.Set("class", cls);
  d.Set("id", cf::Value::UInt64(id));
  for (const auto& [k, v] : more) d.Set(k, v);
  return d;
}

class IOKitTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<CaptureLog> log = std::make_shared<CaptureLog>();
  ContextScope scope{root.path(), Backends{nullptr, log}};

  void Write(const std::string& name, const cf::Value& v) {
    std::string bytes;
    ASSERT_TRUE(cf::WriteXMLPropertyList(v, bytes, nullptr));
    ASSERT_TRUE(WriteFileAtomically(root / ("device/" + name), bytes));
  }
  // A tunnel command: the 24-byte record, the size phase, then the data phase.
  struct Tunnel {
    kern_return_t size_rc = -1, data_rc = -1;
    uint32_t announced = 0;
    std::string bytes;
  };
  Tunnel Run(io_connect_t c, uint32_t method, uint32_t command, uint32_t index = 0, uint32_t mode = 0) {
    uint8_t record[24] = {};
    std::memcpy(record, &command, 4);
    uint32_t flags = 1 | (mode << 2);
    std::memcpy(record + 4, &flags, 4);
    std::memcpy(record + 8, &index, 4);
    Tunnel t;
    size_t size = 4;
    t.size_rc = IOConnectCallStructMethod(c, method, record, sizeof record, &t.announced, &size);
    if (t.size_rc != kIOReturnSuccess) return t;
    flags = mode << 2;
    std::memcpy(record + 4, &flags, 4);
    std::string buffer(t.announced, '\0');
    size_t got = buffer.size();
    t.data_rc = IOConnectCallStructMethod(c, method, record, sizeof record, buffer.data(), &got);
    t.bytes = buffer.substr(0, got);
    return t;
  }
};

TEST_F(IOKitTest, MatchingPropertiesAndHandles) {
  cf::Dictionary chars = Dict({{"chip-id", "K3R"}});
  Write("registry.plist",
        cf::Array({Service("Root", 1, {{"properties", Dict({{"IOReportLegend", "legend"}, {"model", "x"}})}}),
                   Service("VelmoraVNS3NVMeController", 7,
                           {{"name", "nvme0"}, {"parent", cf::Value::UInt64(1)},
                            {"properties", Dict({{"Controller Characteristics", chars}, {"model", "y"}})}}),
                   Service("VelmoraVNS3NVMeController", 8, {{"parent", cf::Value::UInt64(1)}})}));
  EXPECT_EQ(IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("Nothing")), 0u);
  const io_service_t s = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("VelmoraVNS3NVMeController"));
  ASSERT_NE(s, 0u);
  uint64_t id = 0;
  EXPECT_EQ(IORegistryEntryGetRegistryEntryID(s, &id), kIOReturnSuccess);
  EXPECT_EQ(id, 7u);  // the first in registry order
  char name[128];
  EXPECT_EQ(IORegistryEntryGetName(s, name), kIOReturnSuccess);
  EXPECT_STREQ(name, "nvme0");
  EXPECT_EQ(IORegistryEntryCreateCFProperty(s, "Controller Characteristics"), cf::Value(chars));
  EXPECT_EQ(IORegistryEntryCreateCFProperty(s, "model"), cf::Value("y"));  // its own wins over the parent's
  EXPECT_TRUE(IORegistryEntryCreateCFProperty(s, "IOReportLegend").IsNull());
  EXPECT_EQ(IORegistryEntrySearchCFProperty(s, kIOServicePlane, "IOReportLegend",
                                            kIORegistryIterateRecursively | kIORegistryIterateParents),
            cf::Value("legend"));
  EXPECT_TRUE(IORegistryEntrySearchCFProperty(s, kIOServicePlane, "IOReportLegend", kIORegistryIterateRecursively).IsNull());

  // Property matching: every listed property present and equal.
  cf::Dictionary by_property;
  by_property.Set("IOPropertyMatch", Dict({{"Controller Characteristics", chars}}));
  io_iterator_t it = 0;
  ASSERT_EQ(IOServiceGetMatchingServices(kIOMainPortDefault, by_property, &it), kIOReturnSuccess);
  const io_object_t only = IOIteratorNext(it);
  EXPECT_NE(only, 0u);
  EXPECT_EQ(IOIteratorNext(it), 0u);
  by_property.Set("IOPropertyMatch", Dict({{"Controller Characteristics", chars}, {"model", "x"}}));
  EXPECT_EQ(IOServiceGetMatchingService(kIOMainPortDefault, by_property), 0u);

  // References: a retained object needs two releases; then it is gone, and
  // a released or unknown handle fails cleanly.
  EXPECT_EQ(IOObjectRetain(s), kIOReturnSuccess);
  EXPECT_EQ(IOObjectRelease(s), kIOReturnSuccess);
  EXPECT_EQ(IOObjectRelease(s), kIOReturnSuccess);
  EXPECT_EQ(IOObjectRelease(s), kIOReturnBadArgument);
  EXPECT_EQ(IORegistryEntryGetRegistryEntryID(s, &id), kIOReturnBadArgument);
  EXPECT_EQ(IORegistryEntryGetName(12345, name), kIOReturnBadArgument);
  EXPECT_TRUE(IORegistryEntryCreateCFProperty(12345, "model").IsNull());
  io_connect_t c = 1;
  EXPECT_EQ(IOServiceOpen(s, mach_task_self(), 0, &c), kIOReturnBadArgument);
  EXPECT_EQ(c, 0u);
  EXPECT_EQ(IOObjectRelease(only), kIOReturnSuccess);
  EXPECT_EQ(IOObjectRelease(it), kIOReturnSuccess);
  EXPECT_EQ(OpenIOObjectCount(), 0u);
}

TEST_F(IOKitTest, AnIteratorEndsWhenTheRegistryChanges) {
  Write("registry.plist", cf::Array({Service("A", 1), Service("A", 2), Service("A", 3)}));
  io_iterator_t it = 0;
  ASSERT_EQ(IOServiceGetMatchingServices(kIOMainPortDefault, IOServiceMatching("A"), &it), kIOReturnSuccess);
  const io_object_t first = IOIteratorNext(it);
  EXPECT_NE(first, 0u);
  EXPECT_TRUE(IOIteratorIsValid(it));
  std::this_thread::sleep_for(std::chrono::milliseconds(5));  // a new modification time
  Write("registry.plist", cf::Array({Service("A", 1)}));
  EXPECT_FALSE(IOIteratorIsValid(it));
  EXPECT_EQ(IOIteratorNext(it), 0u);
  IOIteratorReset(it);
  EXPECT_TRUE(IOIteratorIsValid(it));
  IOObjectRelease(first);
  IOObjectRelease(it);

  // A registry a person got wrong is no registry, with the reason.
  for (const auto& [bad, why] : std::vector<std::pair<cf::Value, std::string>>{
           {cf::Value("text"), "the registry must be an array of services"},
           {cf::Array({Service("A", 1), Service("B", 1)}), "service 1: \"id\" 1 is used twice"},
           {cf::Array({Service("A", 0)}), "service 0: \"id\" must be a positive integer"},
           {cf::Array({Service("A", 1, {{"openable", "yes"}})}), "service 0: \"openable\" must be a boolean"},
           {cf::Array({cf::Value::SInt32(3)}), "service 0: not a dictionary"}}) {
    log->Clear();
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    Write("registry.plist", bad);
    EXPECT_EQ(IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("A")), 0u) << why;
    EXPECT_EQ(log->Count(root / "device/registry.plist: " + why + "; the device has no services"), 1u) << why;
  }
  EXPECT_EQ(OpenIOObjectCount(), 0u);
}

TEST_F(IOKitTest, ConnectionsAndTheControllersTunnel) {
  Write("registry.plist",
        cf::Array({Service("VelmoraVNS3NVMeController", 1, {{"userClient", "nvme"}}),
                   Service("VSPStorage", 2, {{"userClient", "nvme"}, {"closeFails", cf::Value::Bool(true)}}),
                   Service("Locked", 3, {{"userClient", "nvme"}, {"openable", cf::Value::Bool(false)}}),
                   Service("NoClient", 4)}));
  cf::Dictionary ftl;
  ftl.Set("hostWrites", cf::Value::UInt64(77));
  ftl.Set("hostWriteLogHisto", cf::Array({cf::Value::SInt32(1), cf::Value::SInt32(2)}));
  cf::Dictionary msp0;
  msp0.Set("passWithTmodeHard", cf::Value::SInt32(5));
  cf::Dictionary telemetry;
  telemetry.Set("3", Raw("mode three"));
  cf::Dictionary short_data;
  short_data.Set("15", cf::Value::SInt32(2));
  cf::Dictionary controller;
  controller.Set("stats", ftl);
  controller.Set("msp", cf::Array({msp0, Raw("raw")}));
  controller.Set("defects", Raw("defects!"));
  controller.Set("telemetry", telemetry);
  controller.Set("shortData", short_data);
  controller.Set("failCommands", cf::Array({cf::Value::SInt32(39)}));
  controller.Set("failDataCommands", cf::Array({cf::Value::SInt32(22)}));
  controller.Set("taskScheduler", Raw("x"));
  controller.Set("snapshot", Raw("y"));
  controller.Set("contentDeletion", cf::Value::SInt32(1));
  Write("controller.plist", controller);

  auto open = [](const char* cls, kern_return_t* rc) {
    const io_service_t s = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching(cls));
    io_connect_t c = 0;
    *rc = IOServiceOpen(s, mach_task_self(), 0, &c);
    IOObjectRelease(s);
    return c;
  };
  kern_return_t rc;
  EXPECT_EQ(open("Locked", &rc), 0u);
  EXPECT_EQ(rc, kIOReturnNotPrivileged);
  EXPECT_EQ(open("NoClient", &rc), 0u);
  EXPECT_EQ(rc, kIOReturnUnsupported);
  const io_connect_t c = open("VelmoraVNS3NVMeController", &rc);
  ASSERT_EQ(rc, kIOReturnSuccess);

  // Statistics described field by field come back as the parser reads them.
  const Tunnel stats = Run(c, 9, 13);
  ASSERT_EQ(stats.size_rc, kIOReturnSuccess);
  ASSERT_EQ(stats.data_rc, kIOReturnSuccess);
  EXPECT_EQ(stats.announced, stats.bytes.size());
  GenericParserCxt parsed;
  ASSERT_EQ(VSPFTLParseBufferToCxt(&parsed, stats.bytes.data(), static_cast<uint32_t>(stats.bytes.size())), 3u);
  ASSERT_EQ(parsed.pairs.size(), 3u);
  EXPECT_EQ(parsed.pairs[0].value, 77u);
  EXPECT_EQ(parsed.pairs[2].value, 2u);

  // Each family, its phases and its faults.
  EXPECT_EQ(Run(c, 8, 13).size_rc, kIOReturnUnsupported);  // not this kind's tunnel method
  EXPECT_EQ(Run(c, 9, 221, 0).bytes, sim::ByteRecordBuffer().Record(0x1000, {5}).End().bytes());
  EXPECT_EQ(Run(c, 9, 221, 1).bytes, "raw");
  EXPECT_EQ(Run(c, 9, 221, 2).size_rc, kIOReturnNotFound);  // no third MSP
  EXPECT_EQ(Run(c, 9, 17, 0, 3).bytes, "mode three");
  EXPECT_EQ(Run(c, 9, 17, 0, 4).size_rc, kIOReturnUnsupported);
  const Tunnel defects = Run(c, 9, 15);
  EXPECT_EQ(defects.announced, 8u);
  EXPECT_EQ(defects.bytes, "de");  // fewer bytes than announced
  EXPECT_EQ(Run(c, 9, 39).size_rc, kIOReturnError);
  const Tunnel snapshot = Run(c, 9, 22);
  EXPECT_EQ(snapshot.size_rc, kIOReturnSuccess);
  EXPECT_EQ(snapshot.data_rc, kIOReturnError);
  EXPECT_EQ(Run(c, 9, 11).size_rc, kIOReturnUnsupported);  // no band statistics
  EXPECT_EQ(Run(c, 9, 999).size_rc, kIOReturnUnsupported);
  uint32_t out = 0;
  size_t out_size = 4;
  EXPECT_EQ(IOConnectCallStructMethod(c, 9, nullptr, 0, &out, &out_size), kIOReturnBadArgument);  // no record
  EXPECT_EQ(IOConnectCallStructMethod(c, 5, nullptr, 0, &out, &out_size), kIOReturnUnsupported);

  // The third kind tunnels through 8 and answers content deletion on 5.
  const io_connect_t storage = open("VSPStorage", &rc);
  ASSERT_EQ(rc, kIOReturnSuccess);
  EXPECT_EQ(Run(storage, 8, 15).bytes, "de");
  out_size = 4;
  EXPECT_EQ(IOConnectCallStructMethod(storage, 5, nullptr, 0, &out, &out_size), kIOReturnSuccess);
  EXPECT_EQ(out, 1u);
  EXPECT_EQ(out_size, 4u);
  controller.Set("contentDeletion", Raw(std::string("\x01\x00", 2)));
  controller.Set("stats", Dict({{"noSuchField", cf::Value::SInt32(1)}}));
  std::this_thread::sleep_for(std::chrono::milliseconds(5));
  Write("controller.plist", controller);
  out_size = 4;
  EXPECT_EQ(IOConnectCallStructMethod(storage, 5, nullptr, 0, &out, &out_size), kIOReturnSuccess);
  EXPECT_EQ(out_size, 2u);
  EXPECT_EQ(Run(c, 9, 13).size_rc, kIOReturnError);
  EXPECT_EQ(log->Count("device: controller.plist \"stats\": unknown FTL field \"noSuchField\""), 1u);

  EXPECT_EQ(IOServiceClose(storage), kIOReturnError);  // closeFails: it says so, and is closed anyway
  EXPECT_EQ(IOServiceClose(storage), kIOReturnBadArgument);
  EXPECT_EQ(IOConnectCallStructMethod(storage, 8, nullptr, 0, &out, &out_size), kIOReturnBadArgument);
  EXPECT_EQ(IOObjectRelease(c), kIOReturnBadArgument);  // connections end with a close
  EXPECT_EQ(IOServiceClose(c), kIOReturnSuccess);
  mach_vm_address_t address;
  mach_vm_size_t size;
  EXPECT_EQ(IOConnectMapMemory64(c, 0, mach_task_self(), &address, &size, kIOMapAnywhere), kIOReturnBadArgument);
  EXPECT_EQ(OpenIOObjectCount(), 0u);
}

}  // namespace
}  // namespace platform
