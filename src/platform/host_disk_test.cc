#include "platform/host_disk.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <cstring>
#include <limits>

#include "../../tests/temp_dir.h"
#include "cf/plist.h"
#include "parsers/parsers.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/iokit.h"
#include "platform/log.h"

namespace platform {
namespace {

constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();

// A health page built byte by byte as the controller lays it out.
struct Page {
  std::string bytes = std::string(kNvmeHealthPageBytes, '\0');
  Page& Byte(size_t at, uint8_t v) {
    bytes[at] = static_cast<char>(v);
    return *this;
  }
  Page& Counter(size_t at, uint64_t low, uint64_t high = 0) {
    for (int i = 0; i < 8; ++i) {
      bytes[at + i] = static_cast<char>(low >> (8 * i));
      bytes[at + 8 + i] = static_cast<char>(high >> (8 * i));
    }
    return *this;
  }
};

TEST(HostDiskPagesTest, HealthPageFieldsOffsetsAndSaturation) {
  Page page;
  page.Byte(0, 0x04).Byte(1, 0x2C).Byte(2, 0x01).Byte(3, 97).Byte(4, 10).Byte(5, 3);
  page.Counter(32, 1000).Counter(48, 2000).Counter(64, 30).Counter(80, 40).Counter(96, 555);
  page.Counter(112, 7).Counter(128, 8760).Counter(144, 12).Counter(160, 2).Counter(176, 99);
  const auto h = DecodeNvmeHealthPage(page.bytes);
  ASSERT_TRUE(h);
  EXPECT_EQ(h->critical_warning, 0x04);
  EXPECT_EQ(h->temperature_kelvin, 300);  // 0x012C, little-endian
  EXPECT_EQ(h->available_spare, 97);
  EXPECT_EQ(h->percent_used, 3);  // byte 5; byte 4 is the spare threshold
  EXPECT_EQ(h->data_units_read, 1000u);
  EXPECT_EQ(h->data_units_written, 2000u);
  EXPECT_EQ(h->host_read_commands, 30u);
  EXPECT_EQ(h->host_write_commands, 40u);
  EXPECT_EQ(h->power_cycles, 7u);  // not the busy time before it
  EXPECT_EQ(h->power_on_hours, 8760u);
  EXPECT_EQ(h->unsafe_shutdowns, 12u);
  EXPECT_EQ(h->media_errors, 2u);  // not the error log entries after it

  struct Case {
    uint64_t low, high, want;
  };
  for (const Case& c : {Case{kMax, 0, kMax}, Case{0, 1, kMax}, Case{5, 1ull << 63, kMax}, Case{0x0102030405060708, 0,
                                                                                                0x0102030405060708}}) {
    Page p;
    p.Counter(48, c.low, c.high);
    EXPECT_EQ(DecodeNvmeHealthPage(p.bytes)->data_units_written, c.want) << c.low << " " << c.high;
  }

  EXPECT_FALSE(DecodeNvmeHealthPage(page.bytes.substr(0, 511)));
  EXPECT_FALSE(DecodeNvmeHealthPage(""));
  EXPECT_TRUE(DecodeNvmeHealthPage(page.bytes + "extra"));
}

TEST(HostDiskPagesTest, IdentifyControllerText) {
  std::string data(kNvmeIdentifyBytes, '\0');
  std::memcpy(&data[4], "  S4EWNX0R123456     ", 20);
  const std::string model = "Disk Model 970\x01 PLUS";
  std::memcpy(&data[24], (model + std::string(40 - model.size(), ' ')).data(), 40);
  std::memcpy(&data[64], "2B2QEXM7", 8);
  data[280 + 4] = 0x74;  // 0x74_0000_0000 bytes
  auto id = DecodeNvmeIdentifyController(data);
  ASSERT_TRUE(id);
  EXPECT_EQ(id->serial, "S4EWNX0R123456");
  EXPECT_EQ(id->model, "Disk Model 970? PLUS");
  EXPECT_EQ(id->firmware, "2B2QEXM7");
  EXPECT_EQ(id->capacity_bytes, std::optional<uint64_t>(0x7400000000ull));
  data[280 + 8] = 1;  // over 64 bits
  EXPECT_FALSE(DecodeNvmeIdentifyController(data)->capacity_bytes);
  EXPECT_FALSE(DecodeNvmeIdentifyController(data.substr(0, 4095)));
}

TEST(HostDiskPagesTest, BlockStatLines) {
  struct Case {
    const char* text;
    bool ok;
    uint64_t reads, sectors_read, writes, sectors_written;
    std::optional<uint64_t> discards, sectors_discarded, flushes;
  };
  const Case cases[] = {
      {"  503119    19226 14209554   282923  1402809    93775 212010024   708508        0   341220  1218110   417972  "
       "     43 170862800   126164   323660   100514\n",
       true, 503119, 14209554, 1402809, 212010024, 417972, 170862800, 323660},
      {"1 2 3 4 5 6 7 8 9 10 11", true, 1, 3, 5, 7, std::nullopt, std::nullopt, std::nullopt},
      {"1 2 3 4 5 6 7 8 9 10 11 12 13 14 15\n", true, 1, 3, 5, 7, 12, 14, std::nullopt},
      {"1\t2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 19", true, 1, 3, 5, 7, 12, 14, 16},
      {"0 0 18446744073709551615 0 0 0 0 0 0 0 0", true, 0, kMax, 0, 0, std::nullopt, std::nullopt, std::nullopt},
      {"0 0 18446744073709551616 0 0 0 0 0 0 0 0", false, 0, 0, 0, 0, {}, {}, {}},  // one past 64 bits
      {"1 2 3 4 5 6 7 8 9 10", false, 0, 0, 0, 0, {}, {}, {}},
      {"1 2 3 4 5 6 7 8 9 10 x", false, 0, 0, 0, 0, {}, {}, {}},
      {"1 2 3 4 5 6 -7 8 9 10 11", false, 0, 0, 0, 0, {}, {}, {}},
      {"1 2 3 4 5 6 7 8 9 10 11 0x1", false, 0, 0, 0, 0, {}, {}, {}},
      {"", false, 0, 0, 0, 0, {}, {}, {}},
      {"\n", false, 0, 0, 0, 0, {}, {}, {}},
  };
  for (const Case& c : cases) {
    const auto s = ParseBlockStat(c.text);
    ASSERT_EQ(s.has_value(), c.ok) << c.text;
    if (!s) continue;
    EXPECT_EQ(s->reads, c.reads) << c.text;
    EXPECT_EQ(s->sectors_read, c.sectors_read) << c.text;
    EXPECT_EQ(s->writes, c.writes) << c.text;
    EXPECT_EQ(s->sectors_written, c.sectors_written) << c.text;
    EXPECT_EQ(s->discards, c.discards) << c.text;
    EXPECT_EQ(s->sectors_discarded, c.sectors_discarded) << c.text;
    EXPECT_EQ(s->flushes, c.flushes) << c.text;
  }

  BlockStat a = *ParseBlockStat("1 0 15 0 2 0 16 0 0 0 0 0 0 8 0 0 3 0");
  AddBlockStat(a, *ParseBlockStat("1 0 18446744073709551615 0 2 0 16 0 0 0 0"));
  EXPECT_EQ(a.sectors_read, kMax);  // saturates
  EXPECT_EQ(a.sectors_written, 32u);
  EXPECT_FALSE(a.discards);  // one namespace without them: unknown
  EXPECT_FALSE(a.flushes);
}

std::map<std::string, uint64_t> Fields(const cf::Dictionary& d) {
  std::map<std::string, uint64_t> out;
  for (const auto& [k, v] : d) out[*k.AsString()] = v.AsNumber()->AsUInt64();
  return out;
}

TEST(HostDiskPagesTest, FtlFieldsAndTheirUnits) {
  // 512-byte sectors become 4 KiB ones, rounding down.
  const BlockStat stat = *ParseBlockStat("10 0 15 0 20 0 16 0 0 0 0 3 0 17 0 4 0");
  EXPECT_EQ(Fields(HostDiskFtlFields(stat, nullptr)),
            (std::map<std::string, uint64_t>{{"hostReads", 1},
                                              {"hostWrites", 2},
                                              {"hostReadXacts", 10},
                                              {"hostWriteXacts", 20},
                                              {"numUnmap", 3},
                                              {"numUnmapSec", 2},
                                              {"numFlushes", 4}}));
  EXPECT_EQ(Fields(HostDiskFtlFields(*ParseBlockStat("0 0 0 0 0 0 0 0 0 0 0"), nullptr)).size(), 4u);

  // The health page's lifetime counts win; a data unit is 125 sectors of 4 KiB.
  NvmeHealth h;
  h.data_units_read = 8;
  h.data_units_written = kMax / 100;  // saturates when scaled
  h.host_read_commands = 5;
  h.host_write_commands = 6;
  h.percent_used = 104;
  h.available_spare = 100;
  h.power_on_hours = 9000;
  h.power_cycles = 300;
  h.unsafe_shutdowns = 11;
  h.media_errors = 1;
  h.critical_warning = 2;
  h.temperature_kelvin = 310;
  auto f = Fields(HostDiskFtlFields(stat, &h));
  EXPECT_EQ(f["hostReads"], 1000u);
  EXPECT_EQ(f["hostWrites"], kMax);
  EXPECT_EQ(f["hostReadXacts"], 5u);
  EXPECT_EQ(f["hostWriteXacts"], 6u);
  EXPECT_EQ(f["numFlushes"], 4u);  // the block layer's still
  EXPECT_EQ(f["percentUsed"], 104u);
  EXPECT_EQ(f["spareAvailablePercent"], 100u);
  EXPECT_EQ(f["powerOnHours"], 9000u);
  EXPECT_EQ(f["boots"], 300u);
  EXPECT_EQ(f["uncleanBoots"], 11u);
  EXPECT_EQ(f["ueccReads"], 1u);
  EXPECT_EQ(f["smartCritWarnings"], 2u);
  EXPECT_EQ(f["TempSensor"], 37u);
  for (uint16_t kelvin : {0, 200, 273}) {
    h.temperature_kelvin = kelvin;
    EXPECT_EQ(Fields(HostDiskFtlFields(stat, &h))["TempSensor"], 0u) << kelvin;
  }
}

// A sysfs tree of a few disks under a temporary directory.
class FakeSysfsTest : public ::testing::Test {
 protected:
  TempDir sys;
  void SetUp() override { testing::SetSysfsBase(sys.path()); }
  void TearDown() override { testing::SetSysfsBase(""); }
  void File(const std::string& rel, const std::string& text) { ASSERT_TRUE(WriteFileAtomically(sys / rel, text)); }
  void Disk(const std::string& name, const std::string& stat, const std::string& dev = "8:0") {
    File("block/" + name + "/stat", stat);
    File("block/" + name + "/dev", dev + "\n");
  }
};

TEST_F(FakeSysfsTest, ReadingDisksNormalMalformedAndMissing) {
  Disk("xvdq", "10 0 800 0 20 0 1608 0 0 0 0\n");
  Disk("xvdr", "10 0 800 0 20 0\n");
  Disk("nvme7n1", "1 0 8 0 2 0 16 0 0 0 0 1 0 8 0 1 0\n");
  Disk("nvme7n2", "1 0 8 0 2 0 24 0 0 0 0 1 0 8 0 1 0\n");
  File("class/nvme/nvme7/nvme7n1/x", "");
  File("class/nvme/nvme7/nvme7n2/x", "");
  File("class/nvme/nvme7/device", "");  // not a namespace
  File("class/nvme/nvme8/firmware_rev", "1\n");

  std::string why;
  auto r = ReadHostDisk("/dev/xvdq", &why);
  ASSERT_TRUE(r) << why;
  EXPECT_EQ(r->stat.sectors_written, 1608u);
  EXPECT_FALSE(r->health);
  r = ReadHostDisk("/dev/nvme7", &why);  // its namespaces added up
  ASSERT_TRUE(r) << why;
  EXPECT_EQ(r->stat.sectors_written, 40u);
  EXPECT_EQ(r->stat.flushes, std::optional<uint64_t>(2));

  struct Bad {
    const char* device;
    std::string why;
  };
  for (const Bad& b : {Bad{"/dev/xvdr", sys.path() + "/block/xvdr/stat is not a block statistics line"},
                       Bad{"/dev/xvds", "cannot open " + sys.path() + "/block/xvds/stat: No such file or directory"},
                       Bad{"/dev/nvme8", "the NVMe controller nvme8 has no namespaces in " + sys.path() +
                                             "/class/nvme/nvme8"},
                       Bad{"/dev/../etc", "\"/dev/../etc\" is not a device under /dev"},
                       Bad{"/dev/", "\"/dev/\" is not a device under /dev"},
                       Bad{"xvdq", "\"xvdq\" is not a device under /dev"},
                       Bad{"/dev/a/b", "\"/dev/a/b\" is not a device under /dev"}}) {
    why.clear();
    EXPECT_FALSE(ReadHostDisk(b.device, &why)) << b.device;
    EXPECT_EQ(why, b.why);
    EXPECT_FALSE(HostDiskStatisticsBuffer(b.device, &why)) << b.device;
  }

  // The buffer is a word-record buffer the statistics parser reads back.
  const auto buffer = HostDiskStatisticsBuffer("/dev/xvdq", &why);
  ASSERT_TRUE(buffer) << why;
  VSPParseCxt context;
  ASSERT_EQ(VSPParseBufferToCxt(&context, buffer->data(), static_cast<uint32_t>(buffer->size())), 1u);
  EXPECT_EQ(context.hostWrites, 201u);  // 1608 sectors of 512 bytes
  EXPECT_EQ(context.hostReads, 100u);
  VSPReleaseContext(&context);
}

TEST_F(FakeSysfsTest, IdentityFromSysfs) {
  Disk("sdq", "0 0 0 0 0 0 0 0 0 0 0");
  File("block/sdq/size", "1953525168\n");
  File("block/sdq/device/model", "Disk 2TB        \n");
  File("block/sdq/device/vendor", "ATA     \n");
  File("block/sdq/device/rev", "0001\n");
  File("block/sdq/serial", "\n");
  File("block/sdq/device/serial", "WD-123\n");
  DiskIdentity id = IdentifyHostDisk("/dev/sdq");
  EXPECT_EQ(id.model, "Disk 2TB");
  EXPECT_EQ(id.vendor, "ATA");
  EXPECT_EQ(id.firmware, "0001");
  EXPECT_EQ(id.serial, "WD-123");
  EXPECT_EQ(id.capacity_bytes, std::optional<uint64_t>(1953525168ull * 512));
  cf::Dictionary chars = HostDiskCharacteristics("/dev/sdq", id);
  EXPECT_EQ(chars.size(), 6u);
  EXPECT_EQ(*chars.Get("device").AsString(), "/dev/sdq");
  EXPECT_EQ(chars.Get("capacity").AsNumber()->AsUInt64(), 1953525168ull * 512);

  // A disk that says nothing about itself: only its path.
  Disk("vdq", "0 0 0 0 0 0 0 0 0 0 0");
  File("block/vdq/size", "garbage\n");
  id = IdentifyHostDisk("/dev/vdq");
  EXPECT_FALSE(id.capacity_bytes);
  EXPECT_EQ(HostDiskCharacteristics("/dev/vdq", id).size(), 1u);
}

TEST_F(FakeSysfsTest, ListingPutsTheDiskHoldingAPathFirst) {
  struct stat st;
  ASSERT_EQ(stat(sys.path().c_str(), &st), 0);
  const std::string here = std::to_string(major(st.st_dev)) + ":" + std::to_string(minor(st.st_dev));
  for (const char* skipped : {"loop0", "ram1", "zram0"}) Disk(skipped, "0 0 0 0 0 0 0 0 0 0 0", here);
  Disk("sdq", "0 0 0 0 0 0 0 0 0 0 0", "65535:1");
  Disk("vdq", "0 0 0 0 0 0 0 0 0 0 0", "65535:2");
  Disk("xvdq", "0 0 0 0 0 0 0 0 0 0 0", "65535:3");
  File("block/xvdq/xvdq2/dev", here + "\n");  // a partition of it holds the path
  EXPECT_EQ(ListHostDisks(sys.path()), (std::vector<std::string>{"/dev/xvdq", "/dev/sdq", "/dev/vdq"}));
  EXPECT_EQ(ListHostDisks(sys / "no/such/path"), (std::vector<std::string>{"/dev/sdq", "/dev/vdq", "/dev/xvdq"}));
}

// The "host" kind through the registry, as the storage service reaches it.
TEST_F(FakeSysfsTest, AHostServiceAnswersTheStatisticsCommandOnly) {
  Disk("xvdq", "10 0 800 0 20 0 1608 0 0 0 0\n");
  File("block/xvdq/size", "2048\n");
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope{root.path(), Backends{nullptr, log}};
  auto service = [](uint64_t id, const char* device) {
    cf::Dictionary d, properties;
    d.Set("class", "VelmoraEmbeddedNVMeController");
    d.Set("name", std::string(device).substr(5));
    d.Set("id", cf::Value::UInt64(id));
    d.Set("userClient", "host");
    properties.Set("device", device);
    d.Set("properties", properties);
    return cf::Value(d);
  };
  std::string bytes;
  ASSERT_TRUE(cf::WriteXMLPropertyList(cf::Array({service(1, "/dev/xvdgone"), service(2, "/dev/xvdq")}), bytes, nullptr));
  ASSERT_TRUE(WriteFileAtomically(root / "device/registry.plist", bytes));

  const io_service_t s = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching("VelmoraEmbeddedNVMeController"));
  ASSERT_NE(s, 0u);
  uint64_t id = 0;
  IORegistryEntryGetRegistryEntryID(s, &id);
  EXPECT_EQ(id, 2u);  // the unreadable disk is absent
  EXPECT_EQ(log->Count(root.path() + "/device/registry.plist: service xvdgone: the disk /dev/xvdgone cannot be read "
                       "(cannot open " + sys.path() + "/block/xvdgone/stat: No such file or directory); no controller there"),
            1u);
  const cf::Value chars = IORegistryEntryCreateCFProperty(s, "Controller Characteristics");
  ASSERT_TRUE(chars.AsDictionary());
  EXPECT_EQ(chars.AsDictionary()->Get("capacity").AsNumber()->AsUInt64(), 2048u * 512);

  io_connect_t c = 0;
  ASSERT_EQ(IOServiceOpen(s, mach_task_self(), 0, &c), kIOReturnSuccess);
  auto tunnel = [&](uint32_t command, uint32_t flags, void* out, size_t* size) {
    uint8_t record[24] = {};
    std::memcpy(record, &command, 4);
    std::memcpy(record + 4, &flags, 4);
    return IOConnectCallStructMethod(c, 9, record, sizeof record, out, size);
  };
  uint32_t announced = 0;
  size_t size = 4;
  ASSERT_EQ(tunnel(13, 1, &announced, &size), kIOReturnSuccess);
  EXPECT_EQ(size, 4u);
  std::string buffer(announced, '\0');
  size = buffer.size();
  // The disk moves on between the phases; the data phase still fits.
  Disk("xvdq", "10 0 800 0 20 0 999999999999 0 0 0 0\n");
  ASSERT_EQ(tunnel(13, 0, buffer.data(), &size), kIOReturnSuccess);
  EXPECT_EQ(size, announced);
  VSPParseCxt context;
  ASSERT_EQ(VSPParseBufferToCxt(&context, buffer.data(), static_cast<uint32_t>(size)), 1u);
  EXPECT_EQ(context.hostWrites, 201u);
  VSPReleaseContext(&context);

  for (uint32_t command : {11u, 15u, 17u, 22u, 39u, 145u, 221u}) {
    size = 4;
    EXPECT_EQ(tunnel(command, 1, &announced, &size), kIOReturnUnsupported) << command;
  }
  size = 4;
  EXPECT_EQ(IOConnectCallStructMethod(c, 5, nullptr, 0, &announced, &size), kIOReturnUnsupported);

  // A disk gone after the open: the command fails, said once.
  std::filesystem::remove_all(sys / "block/xvdq");
  for (int i = 0; i < 2; ++i) {
    size = 4;
    EXPECT_EQ(tunnel(13, 1, &announced, &size), kIOReturnNoDevice);
  }
  EXPECT_EQ(log->CountContaining("host disk /dev/xvdq can no longer be read"), 1u);
  EXPECT_EQ(IOServiceClose(c), kIOReturnSuccess);
  IOObjectRelease(s);
}

}  // namespace
}  // namespace platform
