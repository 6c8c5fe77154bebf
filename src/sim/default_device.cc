#include "sim/default_device.h"

#include <cstring>
#include <iterator>
#include <map>
#include <string>

#include "parsers/ftl_table.h"
#include "parsers/msp_table.h"

namespace sim {

namespace {

// A controller about a year into its life: 256 GB, a few TB written, a
// couple of percent of its erase budget used.
const std::map<std::string, uint64_t>& Known() {
  static const std::map<std::string, uint64_t> known = {
      {"version", 1000},
      {"exportVersion", 17},
      {"driverVersion", 0x0203},
      {"numVirtualBlocks", 3968},
      {"blocksPerVirtualBlock", 32},
      {"pagesPerVirtualBlock", 1536},
      {"bytesPerPage", 16384},
      {"hostReads", 2917341184},
      {"hostWrites", 1843261440},
      {"nandReads", 3120455680},
      {"nandWrites", 2480128000},
      // A write amplification of 2.30, above the default threshold of 2.
      {"bandErases", 690000},
      {"pagesPerVirtualBlockSlc", 512},
      {"intermediateBandErases", 41000},
      {"numFreeVirtualBlocks", 512},
      {"wearLevMoves", 3410},
      {"utilFormatTime", 1735689600},  // 2025-01-01
      {"numSleepOps", 18211},
      {"maxHighEnduranceBlockErases", 2100},
      {"IND_pool_free", 7340},
      {"IND_pool_count", 16384},
      {"intermediatePartitionStart", 4096},
      {"userPartitionStart", 36864},
      {"maxMemChokeDuration", 123456},
      {"memChokeDuration", 123456},
      {"percentUsed", 2},
      {"slcPercentUsed", 4},
      {"averageSLCPECycles", 410},
      {"averageTLCPECycles", 61},
      {"mspBootBlockCountPerMsp", 4},
      {"spareAvailablePercent", 100},
  };
  return known;
}

// Values that differ from field to field and stay small, as most counters are.
uint64_t Plausible(uint32_t key, uint32_t element) {
  uint64_t x = (uint64_t{key} << 16 | element) * 0x9E3779B97F4A7C15ULL;
  x ^= x >> 29;
  return x % 5000;
}

cf::Dictionary FtlFields() {
  cf::Dictionary fields;
  for (const parsers::FtlField& f : parsers::FtlFields()) {
    const auto known = Known().find(f.name);
    if (!f.is_array()) {
      fields.Set(f.name, cf::Value::UInt64(known != Known().end() ? known->second : Plausible(f.key, 0)));
      continue;
    }
    cf::Array values;
    for (uint32_t i = 0; i < f.count; ++i) {
      uint64_t v = Plausible(f.key, i);
      // A healthy boot area: one failed read of a backup copy, nothing else.
      if (std::string(f.name).rfind("mspBootBlock", 0) == 0 && std::string(f.name).find("Fail") != std::string::npos)
        v = std::string(f.name) == "mspBootBlockReadFail" && i == 1 ? 1 : 0;
      values.Append(cf::Value::UInt64(v));
    }
    fields.Set(f.name, values);
  }
  return fields;
}

cf::Dictionary MspFields(uint32_t msp) {
  cf::Dictionary fields;
  for (const parsers::MspField& f : parsers::MspFields()) {
    if (f.count == 1) {
      fields.Set(f.name, cf::Value::UInt64(Plausible(f.key, msp)));
      continue;
    }
    cf::Array values;
    for (uint32_t i = 0; i < f.count; ++i) values.Append(cf::Value::UInt64(Plausible(f.key, msp * 256 + i)));
    fields.Set(f.name, values);
  }
  return fields;
}

cf::Dictionary Entry(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  return cf::Dictionary::Of(entries);
}

cf::Dictionary Numbers(std::initializer_list<std::pair<const char*, int64_t>> entries) {
  cf::Dictionary d;
  for (const auto& [k, v] : entries) d.Set(k, cf::Value::SInt64(v));
  return d;
}

// Valid pages per band in three of the lists, and one entry of a list
// number that is never reported.
cf::Dictionary ValidityList() {
  const std::pair<int64_t, int64_t> entries[] = {{0, 1200}, {0, 1180}, {2, 17}, {2, 4}, {2, 9}, {5, 640}, {16, 1}};
  cf::Array list;
  for (const auto& [number, value] : entries) list.Append(Numbers({{"list", number}, {"value", value}}));
  return Entry({{"extra", cf::Value::SInt64(2)}, {"entries", list}});
}

// Eleven factory defects and two grown ones, one retired by a program
// failure (mode 1) and one by an erase failure (mode 2).
cf::Dictionary DefectsList() {
  return Entry({{"factoryCount", cf::Value::SInt64(11)},
                {"defects", cf::Array({Numbers({{"Bus", 0}, {"CE", 1}, {"CAU", 2}, {"Block", 812}, {"Cycle", 143},
                                                {"Reason", 7}, {"Page", 96}, {"Temperature", 41}, {"mode", 1}}),
                                       Numbers({{"Bus", 1}, {"CE", 0}, {"CAU", 1}, {"Block", 2050}, {"Cycle", 151},
                                                {"Reason", 3}, {"Page", 0}, {"Temperature", -4}, {"mode", 2}})})}});
}

// The read-algorithm counters of the two buses the characteristics claim,
// in the chip's own layout: most reads done at the first stage, a few
// needing the later ones. Each mode's list is described the same way, with
// counts that grow a little from mode to mode.
cf::Dictionary TelemetryFields(uint32_t mode) {
  cf::Array buses;
  for (uint32_t bus = 0; bus < 2; ++bus) {
    const uint32_t scale = 1 + mode + bus;
    cf::Dictionary words;
    const uint32_t read_stages[] = {981234, 10422, 2210, 640, 97, 12, 3};
    for (uint32_t i = 0; i < std::size(read_stages); ++i)
      words.Set(std::to_string(i), cf::Value::UInt64(uint64_t{read_stages[i]} * scale));
    words.Set("20", cf::Value::UInt64(991001 * scale));  // the first initial read stage
    words.Set("28", cf::Value::UInt64(3));               // the stage of life
    words.Set("45", cf::Value::UInt64(420 * scale));     // the first error bins
    words.Set("46", cf::Value::UInt64(37 * scale));
    words.Set("106", cf::Value::UInt64(1204 * scale));   // NAND accesses
    buses.Append(Entry({{"RD", cf::Value::UInt64(18000 + 1000 * bus)},
                        {"PE", cf::Value::UInt64(410 + bus)},
                        {"Max_PE_rate", cf::Value::UInt64(3000)},
                        {"t0", cf::Value::UInt64(1735689600)},
                        {"Ret", cf::Value::UInt64(12)},
                        {"block_type", cf::Value::UInt64(1)},
                        {"num_pages", cf::Value::UInt64(1536)},
                        {"words", words}}));
  }
  return Entry({{"buses", buses}});
}

// A legend channel: ID, type (format, categories, element count), name.
cf::Value LegendChannel(int64_t id, uint8_t format, uint16_t categories, uint16_t elements, const char* name) {
  cf::Array channel({cf::Value::SInt64(id),
                     cf::Value::SInt64(static_cast<int64_t>(format | (uint64_t{categories} << 16) |
                                                            (uint64_t{elements} << 32)))});
  if (name) channel.Append(name);
  return channel;
}

// One linear segment of a histogram's configuration: buckets of width.
cf::Value HistogramConfig(uint32_t width, int32_t buckets) {
  uint8_t segment[16] = {};
  std::memcpy(segment, &width, 4);
  std::memcpy(segment + 12, &buckets, 4);
  return cf::Value::Bytes(cf::Data(segment, segment + 16));
}

cf::Value Values(std::initializer_list<int64_t> values) {
  cf::Array a;
  for (int64_t v : values) a.Append(cf::Value::SInt64(v));
  return a;
}

}  // namespace

DefaultDevice DefaultStorageDevice() {
  DefaultDevice device;
  const cf::Dictionary characteristics = Entry({{"chip-id", "K3R"},
                                                {"manufacturer-id", "45822603A5710"},
                                                {"num-bus", cf::Value::SInt32(2)},
                                                {"nand-device-desc", cf::Value::SInt32(0x2203)}});
  device.registry = cf::Array({
      Entry({{"class", "IOPlatformExpertDevice"}, {"name", "device-tree"}, {"id", cf::Value::UInt64(0x100000100)}}),
      Entry({{"class", "VelmoraVNS3NVMeController"},
             {"name", "nvme0"},
             {"id", cf::Value::UInt64(0x100000A2F)},
             {"parent", cf::Value::UInt64(0x100000100)},
             {"userClient", "nvme"},
             {"properties", Entry({{"Controller Characteristics", characteristics}})}}),
      // The image driver sits below the controller whose images it keeps.
      Entry({{"class", "VelmoraNVMeEAN"},
             {"name", "ean"},
             {"id", cf::Value::UInt64(0x100000A40)},
             {"parent", cf::Value::UInt64(0x100000A2F)},
             {"userClient", "ean"}}),
      // The reporting hub and two drivers that publish reporting channels:
      // simple ones of the field category become the daily ioreport keys,
      // the state, histogram and other-category ones do not.
      Entry({{"class", "IOReportHub"},
             {"name", "IOReportHub"},
             {"id", cf::Value::UInt64(0x100000B00)},
             {"parent", cf::Value::UInt64(0x100000100)},
             {"userClient", "hub"}}),
      Entry({{"class", "PowerManager"},
             {"name", "pmgr"},
             {"id", cf::Value::UInt64(0x100000B10)},
             {"parent", cf::Value::UInt64(0x100000100)},
             {"properties",
              Entry({{"IOReportLegendPublic", cf::Value::Bool(true)},
                     {"IOReportLegend",
                      cf::Array({Entry({{"IOReportGroupName", "Energy Model"},
                                        {"IOReportChannelInfo",
                                         Entry({{"IOReportChannelUnit", cf::Value::SInt64(0x0300007c00000000)}})},
                                        {"IOReportChannels",
                                         cf::Array({LegendChannel(0x43505530, 1, 0x0100, 1, nullptr),
                                                    LegendChannel(2, 1, 0x0100, 1, "GPUEnergy")})}}),
                                 Entry({{"IOReportGroupName", "CPU States"},
                                        {"IOReportChannelInfo",
                                         Entry({{"IOReportChannelUnit", cf::Value::SInt64(0x0100007900000000)}})},
                                        {"IOReportChannels",
                                         cf::Array({LegendChannel(3, 2, 0x0100, 3, "PerformanceStates")})}})})}})}}),
      Entry({{"class", "StorageReporter"},
             {"name", "nvme-report"},
             {"id", cf::Value::UInt64(0x100000B20)},
             {"parent", cf::Value::UInt64(0x100000A2F)},
             {"properties",
              Entry({{"IOReportLegendPublic", cf::Value::Bool(true)},
                     {"IOReportLegend",
                      cf::Array({Entry({{"IOReportGroupName", "Storage"},
                                        {"IOReportChannelInfo",
                                         Entry({{"IOReportChannelUnit", cf::Value::SInt64(0x0900960000000000)}})},
                                        {"IOReportChannels", cf::Array({LegendChannel(1, 1, 0x0100, 1, "HostReadMiB")})}}),
                                 Entry({{"IOReportGroupName", "Storage"},
                                        {"IOReportChannels", cf::Array({LegendChannel(2, 1, 0x0002, 1, "QueueDepth")})}}),
                                 // Read latency in microseconds, four buckets of 100.
                                 Entry({{"IOReportGroupName", "Storage"},
                                        {"IOReportSubGroupName", "Latency"},
                                        {"IOReportChannelInfo",
                                         Entry({{"IOReportChannelUnit", cf::Value::SInt64(0x0100007900000000)},
                                                {"IOReportChannelConfig", HistogramConfig(100, 4)}})},
                                        {"IOReportChannels",
                                         cf::Array({LegendChannel(3, 3, 0x0100, 4, "ReadLatency")})}})})}})}}),
  });
  // Values of the hub's channels: driver entry ID → channel ID → value, or
  // one [v0, v1, v2, v3] per element.
  device.ioreport = Entry(
      {{"4294970128",
        Entry({{"1129338160", cf::Value::SInt64(52840)},
               {"2", cf::Value::SInt64(1200)},
               {"3", cf::Array({Values({0x4F4646, 40, 61200000}), Values({0x4C4F57, 310, 18000000}),
                                Values({0x48494748, 275, 7200000})})}})},
       {"4294970144",
        Entry({{"1", cf::Value::SInt64(30512)},
               {"2", cf::Value::SInt64(7)},
               {"3", cf::Array({Values({120, 20, 95, 7600}), Values({40, 105, 198, 5800}), Values({3, 210, 290, 750}),
                                Values({0, 0, 0, 0})})}})}});
  // The images: boot and firmware images written a handful of times in
  // the device's life, configurations more often. The last one reports only
  // its updates.
  device.ean = Entry({{"dBIC", Numbers({{"size", 262144}, {"updates", 3}})},
                      {"dLTH", Numbers({{"size", 1048576}, {"updates", 12}})},
                      {"ifw1", Numbers({{"size", 786432}, {"updates", 4}})},
                      {"dCfg", Numbers({{"size", 16384}, {"updates", 27}})},
                      {"fCfg", Numbers({{"size", 8192}, {"updates", 9}})},
                      {"nefw", Numbers({{"size", 2097152}, {"updates", 4}})},
                      {"LPEM", Numbers({{"updates", 1}})}});
  device.controller = Entry({{"stats", FtlFields()},
                             {"msp", cf::Array({MspFields(0), MspFields(1)})},
                             {"bandStats", ValidityList()},
                             {"defects", DefectsList()},
                             {"telemetry", Entry({{"0", TelemetryFields(0)},
                                                  {"1", TelemetryFields(1)},
                                                  {"2", TelemetryFields(2)}})}});
  device.stackshot = cf::Array({
      Entry({{"name", "kernel_task"},
             {"threads", cf::Array({Entry({{"name", "VM_swapout"}, {"diskWrites", cf::Value::UInt64(2147483648)}}),
                                    Entry({{"name", "VM_compressor"}, {"diskWrites", cf::Value::UInt64(0)}})})}}),
      Entry({{"name", "launchd"},
             {"threads", cf::Array({Entry({{"name", "main"}, {"diskWrites", cf::Value::UInt64(4194304)}})})}}),
  });
  device.purgeable = Entry({{"PURGEWELL_TOTAL_AVAILABLE", cf::Value::SInt64(6442450944)},
                            {"PURGEWELL_NONPURGEABLE_AMOUNT", cf::Value::SInt64(91268055040)}});
  // Two corrected read errors and one with no registers captured.
  device.ecc_events = cf::Array({
      Entry({{"id", cf::Value::SInt64(3)},
             {"count", cf::Value::SInt64(2)},
             {"reg", cf::Array({cf::Value::SInt64(0x1F400), cf::Value::SInt64(-1)})}}),
      Entry({{"id", cf::Value::SInt64(3)},
             {"count", cf::Value::SInt64(3)},
             {"reg", cf::Array({cf::Value::SInt64(0x2A000), cf::Value::SInt64(7), cf::Value::SInt64(0)})}}),
      Entry({{"id", cf::Value::SInt64(9)}, {"count", cf::Value::SInt64(0)}}),
  });
  // Its first digit decides the analytics days: 7 is odd, so odd days (in
  // UTC) send the full views and even days write the store's NAND keys.
  device.boot_session_uuid = "7E3C1F0A-5B2D-4C8E-9A61-2F4D8B0C3E95";
  return device;
}

}  // namespace sim
