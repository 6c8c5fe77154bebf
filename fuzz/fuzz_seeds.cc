// Writes a small seed corpus for every fuzz target, made by the encoders.
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "cf/plist.h"
#include "platform/run_record.h"
#include "platform/service.h"
#include "sim/default_device.h"
#include "sim/kcdata.h"
#include "sim/storage_lists.h"
#include "sim/statistics_buffers.h"
#include "sim/storage_lists.h"

namespace {

std::string g_root;

void Seed(const std::string& target, const std::string& name, const std::string& bytes) {
  std::filesystem::create_directories(g_root + "/" + target);
  std::ofstream(g_root + "/" + target + "/" + name, std::ios::binary) << bytes;
}

std::string U16(uint16_t v) { return std::string{static_cast<char>(v >> 8), static_cast<char>(v)}; }

std::string BigEndian(uint64_t v, int bytes) {
  std::string out;
  for (int i = bytes - 1; i >= 0; --i) out += static_cast<char>(v >> (8 * i));
  return out;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: fuzz_seeds DIR\n");
    return 2;
  }
  g_root = argv[1];
  const std::string ftl = sim::CompleteFtlBuffer();
  sim::WordRecordBuffer odd;
  odd.Header(2, 0).Record(14, {1, 2, 3}).Record(14, {1}).Record(700, {1}).Record(53, {(1ull << 32) + 2}).End().Record(3, {1});
  sim::WordRecordBuffer truncated;
  truncated.Record(265, {1, 2, 3, 4, 5}).Header(4, 9).Word(1);
  for (const char* target : {"ftl", "stats"}) {
    Seed(target, "complete", ftl);
    Seed(target, "odd", odd.bytes());
    Seed(target, "truncated", truncated.bytes());
  }
  Seed("msp", "complete", sim::CompleteMspBuffer());
  sim::ByteRecordBuffer msp;
  msp.Filler().RecordBytes(0x2FFE, "xyz").RecordBytes(4200, "abc").Record(8195, std::vector<uint32_t>(10, 3))
      .RecordBytes(4096, "123456").End().Record(4097, {1});
  Seed("msp", "odd", msp.bytes());

  std::vector<uint32_t> words(63);
  for (uint32_t i = 0; i < 63; ++i) words[i] = i * 1001;
  Seed("snapshot", "two-records", U16(64) + sim::FixedSnapshotRecord(words) + sim::FixedSnapshotRecord(words));
  Seed("snapshot", "tiny-output", U16(2) + sim::FixedSnapshotRecord(words));

  sim::SnapshotBuilder snap(6, 40);
  snap.Legend("A - alpha").Field(0, 0, 0, "A=%u").Field(2, 4, 0, " B=%u.%02u").Field(3, 8, 24, " Q%s=");
  for (uint32_t r = 0; r < 6; ++r) snap.Record({r % 3, 1234 * r, 1, 2, 3, 4, 5, 6});
  const std::string header = snap.Header();
  for (uint8_t capacity : {uint8_t{16}, uint8_t{40}, uint8_t{255}}) {
    const std::string input = std::string(1, static_cast<char>(capacity)) +
                              U16(static_cast<uint16_t>(header.size())) + header + snap.Data();
    Seed("snapshot_inplace", "capacity-" + std::to_string(capacity), input);
  }

  cf::Dictionary message;
  message.Set("operation", cf::Value::SInt64(2));
  cf::Dictionary app;
  app.Set("bundle_id", "com.example.a");
  app.Set("uuid", cf::Value::Bytes(cf::Data(16, 7)));
  message.Set("app_data", cf::Array({cf::Value(app)}));
  std::string bytes;
  cf::WriteBinaryPropertyList(message, bytes, nullptr);
  Seed("plist", "message.bplist", bytes);
  cf::WriteXMLPropertyList(message, bytes, nullptr);
  Seed("plist", "message.xml", bytes);
  Seed("plist", "message.json", R"({"operation": 2, "app_data": [{"bundle_id": "x", "adam_id": -1}]})");
  platform::RunRecord record;
  record.mode = "-d";
  record.day = 20778;
  record.started = 1795435200;
  record.ended = 1795435201;
  record.outcome = "failed";
  record.errors = {"Couldn't load whitelist"};
  record.failures = {"the gate record for day 20778 could not be written"};
  cf::WriteXMLPropertyList(record.ToValue(), bytes, nullptr);
  Seed("plist", "run-record.xml", bytes);

  // Stackshots: the encoder's layout, then the shapes the search must survive.
  auto thread = [](const char* name, int64_t writes) {
    cf::Dictionary t;
    t.Set("name", name);
    if (writes >= 0) t.Set("diskWrites", cf::Value::SInt64(writes));
    return cf::Value(t);
  };
  auto task = [](const char* name, std::vector<cf::Value> threads) {
    cf::Dictionary t;
    t.Set("name", name);
    t.Set("threads", cf::Array(std::move(threads)));
    return cf::Value(t);
  };
  const cf::Array tasks({task("launchd", {thread("main", 512)}),
                         task("kernel_task", {thread("idle", -1), thread("VM_swapout", 4096)})});
  const std::string stackshot = *sim::EncodeKCDataStackshot(tasks, nullptr);
  Seed("kcdata", "stackshot", stackshot);
  Seed("kcdata", "truncated", stackshot.substr(0, stackshot.size() - 60));
  Seed("kcdata", "no-stats", *sim::EncodeKCDataStackshot(cf::Array({task("k", {thread("VM_swapout", -1)})}), nullptr));
  sim::KCDataBuilder second;
  second.Begin(1).Begin(3).ThreadName("other").IOStats(1).End(3).End(1).Begin(2).Begin(4).ThreadName("VM_swapout")
      .IOStats(4096).End(4).End(2).BufferEnd();
  Seed("kcdata", "second-container", second.bytes());
  sim::KCDataBuilder odd_items;
  odd_items.Item(0x2A, std::string(20, 'a')).Item(0x13, "ab", 7).Begin(1).IOStats(9).Begin(2).ThreadName("VM", 2)
      .IOStatsFields({1, 2, 3}).End(1 + (1ull << 32)).End(2).Item(0x20, second.bytes()).End(1).BufferEnd();
  Seed("kcdata", "odd-items", odd_items.bytes());
  sim::KCDataBuilder wrapping;
  wrapping.Begin(1).ThreadName("VM_swapout").Header(0x901, 0xFFFFFFFF).IOStats(1);
  Seed("kcdata", "wrapping-size", wrapping.bytes());
  sim::KCDataBuilder deep;
  for (uint64_t id = 1; id <= 70; ++id) deep.Begin(id);
  deep.ThreadName("VM_swapout").IOStats(64);
  Seed("kcdata", "deep", deep.bytes());

  // The controller's lists, from the default device's descriptions.
  const sim::DefaultDevice device = sim::DefaultStorageDevice();
  const cf::Dictionary& lists = *device.controller.AsDictionary();
  const std::string validity = *sim::EncodeValidityList(*lists.Get("bandStats").AsDictionary(), nullptr);
  Seed("validity", "default", validity);
  Seed("validity", "one-byte-short", validity.substr(0, validity.size() - 1));
  const std::string defects = *sim::EncodeDefectsList(*lists.Get("defects").AsDictionary(), nullptr);
  Seed("defects", "default", std::string(1, '\0') + defects);
  Seed("defects", "storage-kind-cut", std::string(1, '\1') + defects.substr(0, defects.size() - 5));

  // Registries: a controller under a parent, a parent loop, a bad entry; and
  // the same files as a controller's answers.
  auto service = [](const char* cls, uint64_t id, uint64_t parent, const char* client) {
    cf::Dictionary d;
    d.Set("class", cls);
    d.Set("id", cf::Value::UInt64(id));
    if (parent) d.Set("parent", cf::Value::UInt64(parent));
    if (*client) d.Set("userClient", client);
    cf::Dictionary characteristics;
    characteristics.Set("chip-id", "K3R");
    cf::Dictionary properties;
    properties.Set("Controller Characteristics", characteristics);
    d.Set("properties", properties);
    return d;
  };
  auto xml = [](const cf::Value& v) {
    std::string out;
    cf::WriteXMLPropertyList(v, out, nullptr);
    return out;
  };
  Seed("registry", "controller",
       xml(cf::Array({service("Root", 1, 0, ""), service("VelmoraVNS3NVMeController", 2, 1, "nvme"),
                      service("VSPStorage", 3, 2, "nvme")})));
  Seed("registry", "parent-loop", xml(cf::Array({service("A", 1, 2, "nvme"), service("B", 2, 1, "")})));
  Seed("registry", "bad-entry", xml(cf::Array({service("A", 1, 0, "nvme"), cf::Value("x")})));
  cf::Dictionary stats;
  stats.Set("hostWrites", cf::Value::UInt64(5));
  stats.Set("hostWriteLogHisto", cf::Array({cf::Value::SInt32(1), cf::Value::SInt32(2)}));
  cf::Dictionary controller;
  controller.Set("stats", stats);
  controller.Set("msp", cf::Array({stats}));
  controller.Set("failCommands", cf::Array({cf::Value::SInt32(15)}));
  Seed("registry", "controller-answers", xml(controller));

  // Frame streams: a read-size byte, then what a peer sends.
  std::string frame, small;
  platform::EncodeServiceFrame(message, &frame, nullptr);
  cf::Dictionary run_day;
  run_day.Set("operation", cf::Value::SInt64(1));
  run_day.Set("value", cf::Value::SInt64(20778));
  platform::EncodeServiceFrame(run_day, &small, nullptr);
  auto length = [](uint32_t n) { return BigEndian(n, 4); };
  std::string array;
  cf::WriteBinaryPropertyList(cf::Array({cf::Value("x")}), array, nullptr);
  Seed("service_frames", "one", "\xff" + frame);
  Seed("service_frames", "two-byte-by-byte", std::string(1, '\0') + frame + small);
  Seed("service_frames", "then-over-limit", "\x07" + small + length(platform::kMaxServiceFrame + 1) + "xx");
  Seed("service_frames", "not-a-dictionary", "\x03" + length(static_cast<uint32_t>(array.size())) + array);
  Seed("service_frames", "junk-body", "\x10" + length(5) + "junk!" + small);
  Seed("service_frames", "truncated", "\x05" + frame.substr(0, frame.size() - 3));
  Seed("service_frames", "empty-body", "\x01" + length(0) + small);
  Seed("service_frames", "partial-header", "\x02" + small + small.substr(0, 2));
  Seed("service_frames", "announces-1MiB", "\x20" + length(platform::kMaxServiceFrame) + "bplist00");
  // One 200-byte string in each of 1000 array slots: small to send, large to decode.
  std::string shared = "bplist00";
  shared += "\xAF\x11" + BigEndian(1000, 2) + std::string(1000, '\x01');
  const size_t leaf = shared.size();
  shared += "\x5F\x10\xC8" + std::string(200, 's');
  const size_t table = shared.size();
  shared += BigEndian(8, 2) + BigEndian(leaf, 2);
  shared += std::string(6, '\0') + "\x02\x01" + BigEndian(2, 8) + BigEndian(0, 8) + BigEndian(table, 8);
  Seed("service_frames", "shared-string", "\xff" + length(static_cast<uint32_t>(shared.size())) + shared);
  Seed("plist", "shared-string.bplist", shared);

  // Telemetry lists: a byte that picks the characteristics (chip in bits
  // 0-1, NAND part in bits 2-4, bus count form in bits 5-7), the bus count,
  // then the list.
  auto telemetry_bus = [](uint32_t seed) {
    cf::Dictionary words;
    for (uint32_t r : {0u, 8u, 19u, 26u, 75u, 106u, 122u, 256u, 262u, 301u, 372u, 532u, 1023u})
      words.Set(std::to_string(r), cf::Value::UInt64(r * 1000 + seed));
    words.Set("18", cf::Value::SInt64(-1));
    cf::Dictionary bus;
    bus.Set("RD", cf::Value::UInt64(18000 + seed));
    bus.Set("num_pages", cf::Value::UInt64(1536));
    bus.Set("words", words);
    return cf::Value(bus);
  };
  cf::Dictionary two_buses;
  two_buses.Set("buses", cf::Array({telemetry_bus(1), telemetry_bus(2)}));
  const std::string two = *sim::EncodeTelemetryList(two_buses, nullptr);
  auto telemetry = [](uint8_t pick, uint32_t buses, const std::string& list) {
    std::string count;
    for (int i = 0; i < 4; ++i) count += static_cast<char>(buses >> (8 * i));
    return std::string(1, static_cast<char>(pick)) + count + list;
  };
  Seed("telemetry", "k3r-two-buses", telemetry(0x00, 2, two));
  Seed("telemetry", "k4r-two-buses", telemetry(0x01, 2, two));
  Seed("telemetry", "first-maker-1x", telemetry(0x02 | (1 << 2), 2, two));
  Seed("telemetry", "second-maker-1x", telemetry(0x02 | (2 << 2), 2, two));
  Seed("telemetry", "1y-one-of-two", telemetry(0x02 | (3 << 2), 1, two));
  Seed("telemetry", "one-byte-short", telemetry(0x00, 2, two.substr(0, two.size() - 1)));
  Seed("telemetry", "no-buses", telemetry(0x00, 0, ""));
  Seed("telemetry", "negative-count", telemetry(0x01, 0xFFFFFFFF, two));

  // Legends and hub buffers: options, legend length, legend, then elements.
  auto element = [](uint64_t driver, uint64_t id, uint64_t type, std::vector<int64_t> values) {
    std::string e(64, '\0');
    std::memcpy(e.data(), &driver, 8);
    std::memcpy(e.data() + 8, &id, 8);
    std::memcpy(e.data() + 16, &type, 8);
    for (size_t i = 0; i < values.size() && i < 4; ++i) std::memcpy(e.data() + 32 + 8 * i, &values[i], 8);
    return e;
  };
  auto legend_channel = [](int64_t id, uint64_t type, const char* name) {
    cf::Array c({cf::Value::SInt64(id), cf::Value::SInt64(static_cast<int64_t>(type))});
    if (name) c.Append(name);
    return cf::Value(c);
  };
  constexpr uint64_t kSimple = 1 | (0x100ull << 16) | (1ull << 32), kState = 2 | (2ull << 32),
                     kHistogram = 3 | (3ull << 32), kArray = 4 | (2ull << 32);
  cf::Dictionary energy;
  energy.Set("IOReportGroupName", "G");
  energy.Set("IOReportSubGroupName", "g");
  cf::Dictionary info;
  info.Set("IOReportChannelUnit", cf::Value::SInt64(0x0100007c00000000));
  const int32_t segments[] = {10, 0, 0, 2, 2, 1, 1, 1};
  info.Set("IOReportChannelConfig", cf::Value::Bytes(cf::Data(reinterpret_cast<const uint8_t*>(segments),
                                                              reinterpret_cast<const uint8_t*>(segments) + 32)));
  energy.Set("IOReportChannelInfo", info);
  energy.Set("IOReportChannels", cf::Array({legend_channel(1, kSimple, "Total"), legend_channel(0x4F4E, kState, nullptr),
                                            legend_channel(3, kHistogram, "Latency"), legend_channel(4, kArray, "Lanes"),
                                            legend_channel(5, 0, nullptr)}));
  cf::Dictionary orphan;
  orphan.Set("IOReportSubGroupName", "x");
  orphan.Set("IOReportChannels", cf::Array({legend_channel(6, kSimple, "Never")}));
  const std::string legend = xml(cf::Array({cf::Value(energy), cf::Value(orphan)}));
  std::string hub = element(0x10, 1, kSimple, {250}) + element(0x10, 0x4F4E, kState, {0x4F4E, 1, 30}) +
                    element(0x10, 0x4F4E, kState, {0x4F4646, 2, 10});
  for (int i = 0; i < 3; ++i) hub += element(0x10, 3, kHistogram, {i, 5, 9, 5 * i});
  hub += element(0x10, 4, kArray, {1, 2, 3, 4}) + element(0x10, 4, kArray, {5, 6, 7, 8}) +
         element(0x10, 5, kSimple, {9});
  auto input = [&](char options, const std::string& list, const std::string& raw) {
    return std::string(1, options) + BigEndian(list.size(), 2) + list + raw;
  };
  for (char options : {'\0', '\3'}) Seed("ioreport_legend", std::string("by-") + char('0' + options), input(options, legend, hub));
  Seed("ioreport_legend", "short-buffer", input('\1', legend, hub.substr(0, 100)));
  Seed("ioreport_legend", "overrun", input('\2', legend, element(0x10, 1, 1 | (9ull << 32), {1})));
  Seed("ioreport_legend", "zero-elements", input('\0', legend, element(0x10, 7, 1, {1}) + hub));
  Seed("ioreport_legend", "not-a-legend", input('\0', xml(info), hub));

  // Raw samples against the fixed aggregate of fuzz_ioreport_raw: simple 1,
  // state 2 (three elements), histogram 3 (three), array 4 (two), unknown 5,
  // state 6 (legend says two), simple 7; all of driver 0x10.
  auto type = [](uint8_t format, uint16_t elements) { return format | (0x100ull << 16) | (uint64_t{elements} << 32); };
  std::string raw = element(0x10, 1, type(1, 1), {250});
  for (int i = 0; i < 3; ++i) raw += element(0x10, 2, type(2, 3), {0x4F4E + i, i, 10 * i});
  for (int i = 0; i < 3; ++i) raw += element(0x10, 3, type(3, 3), {i, 5, 9, 5 * i});
  raw += element(0x10, 4, type(4, 2), {1, 2, 3, 4}) + element(0x10, 4, type(4, 2), {5, 6, 7, 8});
  raw += element(0x10, 5, type(1, 1), {9});
  for (int i = 0; i < 3; ++i) raw += element(0x10, 6, type(2, 3), {0x4F46 + i, 1, 1});
  raw += element(0x10, 7, type(1, 1), {-1});
  Seed("ioreport_raw", "valid", raw);
  Seed("ioreport_raw", "100-bytes", raw.substr(0, 100));
  Seed("ioreport_raw", "count-overflows", element(0x10, 1, type(1, 1), {1}) + element(0x10, 2, type(2, 0xFFFF), {1}) +
                                              raw.substr(64, 3 * 64));
  Seed("ioreport_raw", "cut-mid-record", raw.substr(0, 64 * 5 + 24));

  // Health pages laid out as the controller writes them: counters are
  // 16-byte little-endian numbers.
  auto counter = [](std::string& page, size_t at, uint64_t low, uint64_t high) {
    for (int i = 0; i < 8; ++i) {
      page[at + i] = static_cast<char>(low >> (8 * i));
      page[at + 8 + i] = static_cast<char>(high >> (8 * i));
    }
  };
  std::string health(512, '\0');
  health[0] = 0x02, health[1] = 0x2C, health[2] = 0x01, health[3] = 100, health[4] = 10, health[5] = 3;
  for (size_t at = 32; at <= 176; at += 16) counter(health, at, at * 1000, 0);
  Seed("health_page", "healthy", health);
  std::string saturated = health;
  counter(saturated, 48, 5, 1);
  counter(saturated, 32, UINT64_MAX, 0);
  Seed("health_page", "saturated", saturated);
  Seed("health_page", "short", health.substr(0, 511));
  std::string identify(4096, ' ');
  identify.replace(4, 6, "SN0001").replace(24, 10, "Disk Model").replace(64, 4, "1.0A");
  identify.replace(280, 16, std::string("\0\0\0\0\x74\0\0\0\0\0\0\0\0\0\0\0", 16));
  Seed("health_page", "identify", identify);

  Seed("block_stat", "seventeen-fields",
       "  503119    19226 14209554   282923  1402809    93775 212010024   708508        0   341220  1218110   417972"
       "       43 170862800   126164   323660   100514\n");
  Seed("block_stat", "eleven-fields", "1 2 3 4 5 6 7 8 9 10 11\n");
  Seed("block_stat", "fifteen-fields", "1 2 3 4 5 6 7 8 9 10 11 12 13 14 15");
  Seed("block_stat", "too-few", "1 2 3 4 5 6 7 8 9 10");
  Seed("block_stat", "overflow", "0 0 18446744073709551616 0 0 0 0 0 0 0 0");
  Seed("block_stat", "junk", "1 2 3 4 5 6 x 8 9 10 11");
  return 0;
}
