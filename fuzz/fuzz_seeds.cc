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

  auto binary = [](const cf::Value& v) {
    std::string out;
    cf::WriteBinaryPropertyList(v, out, nullptr);
    return out;
  };
  auto numbers = [](std::initializer_list<std::pair<const char*, int64_t>> entries) {
    cf::Dictionary d;
    for (const auto& [k, v] : entries) d.Set(k, cf::Value::SInt64(v));
    return cf::Value(d);
  };

  // controller.plist: the default controller, raw answers with the failure
  // switches, and descriptions each list encoder must refuse.
  const std::string default_controller = xml(device.controller);
  Seed("controller_lists", "default.xml", default_controller);
  Seed("controller_lists", "default.bplist", binary(device.controller));
  Seed("controller_lists", "truncated.xml", default_controller.substr(0, default_controller.size() / 2));
  cf::Dictionary raw_answers;
  const std::string complete_ftl = sim::CompleteFtlBuffer(), complete_msp = sim::CompleteMspBuffer();
  raw_answers.Set("stats", cf::Value::Bytes(cf::Data(complete_ftl.begin(), complete_ftl.end())));
  raw_answers.Set("msp", cf::Array({cf::Value::Bytes(cf::Data(complete_msp.begin(), complete_msp.end())), "x"}));
  raw_answers.Set("bandStats", cf::Value::Bytes(cf::Data(validity.begin(), validity.end())));
  raw_answers.Set("defects", lists.Get("defects"));
  raw_answers.Set("failCommands", cf::Array({cf::Value::SInt32(15)}));
  raw_answers.Set("failDataCommands", cf::Array({cf::Value::SInt32(17), cf::Value::Float64(13.0)}));
  raw_answers.Set("contentDeletion", cf::Value::SInt64(7));
  Seed("controller_lists", "raw-and-failing", xml(raw_answers));
  cf::Dictionary short_answers = lists.MutableCopy();
  short_answers.Set("shortData", numbers({{"13", 100}, {"11", -5}, {"15", 1 << 20}}));
  short_answers.Set("contentDeletion", cf::Value::Bytes(cf::Data(3, 9)));
  Seed("controller_lists", "short-data", xml(short_answers));
  cf::Dictionary refused;
  refused.Set("stats", numbers({{"hostWrites", -1}}));
  refused.Set("msp", cf::Array({numbers({{"noSuchField", 1}}), cf::Value(cf::Array())}));
  refused.Set("bandStats", numbers({{"extra", 4294967295}}));
  refused.Set("defects", cf::Dictionary::Of({{"defects", cf::Array({numbers({{"Bus", 65536}})})}}));
  refused.Set("telemetry",
              cf::Dictionary::Of({{"0", cf::Dictionary::Of({{"buses", "x"}})},
                                  {"1", cf::Dictionary::Of({{"buses", cf::Array({cf::Value(cf::Dictionary::Of(
                                                                          {{"words", numbers({{"01", 1}})}}))})}})},
                                  {"2", cf::Dictionary::Of({{"buses", cf::Array({numbers({{"RD", -2147483649}})})}})}}));
  Seed("controller_lists", "refused-fields", xml(refused));
  cf::Dictionary odd_lists;
  odd_lists.Set("bandStats", cf::Dictionary::Of({{"extra", cf::Value::SInt64(3)},
                                                 {"entries", cf::Array({numbers({{"list", -1}, {"value", -7}}),
                                                                        numbers({{"value", 4}}),
                                                                        numbers({{"list", 15}}),
                                                                        numbers({{"list", 16}})})}}));
  odd_lists.Set("defects", cf::Dictionary::Of({{"factoryCount", cf::Value::UInt64(4294967295)}}));
  odd_lists.Set("telemetry", cf::Dictionary::Of({{"0", cf::Dictionary()}, {"1", cf::Value::Bytes(cf::Data(8, 1))}}));
  odd_lists.Set("stats", "not a list");
  odd_lists.Set("msp", cf::Dictionary());
  Seed("controller_lists", "odd-lists", xml(odd_lists));
  Seed("controller_lists", "not-a-dictionary.xml", xml(cf::Array({device.controller})));

  // The hub: flags, the registry's length, the registry, then the values.
  auto hub_input = [&](uint8_t flags, const std::string& registry, const std::string& values) {
    return std::string(1, static_cast<char>(flags)) + BigEndian(registry.size(), 2) + registry + values;
  };
  const std::string default_registry = xml(device.registry), default_values = xml(device.ioreport);
  Seed("hub", "default", hub_input(0, default_registry, default_values));
  Seed("hub", "default-unknown-twice", hub_input(3, default_registry, default_values));
  Seed("hub", "default-binary", hub_input(0, binary(device.registry), binary(device.ioreport)));
  Seed("hub", "no-values", hub_input(0, default_registry, ""));
  Seed("hub", "cut-registry", hub_input(0, default_registry.substr(0, default_registry.size() - 40), default_values));
  auto hub_registry = [&](const cf::Dictionary& hub_properties, const cf::Value& legend) {
    return xml(cf::Array({cf::Value(cf::Dictionary::Of({{"class", "IOReportHub"},
                                                         {"id", cf::Value::UInt64(1)},
                                                         {"userClient", "hub"},
                                                         {"properties", hub_properties}})),
                          cf::Value(cf::Dictionary::Of({{"class", "PMGR"},
                                                         {"id", cf::Value::UInt64(0x20)},
                                                         {"properties",
                                                          cf::Dictionary::Of({{"IOReportLegend", legend}})}}))}));
  };
  auto channel_type = [](uint8_t format, uint16_t elements) {
    return cf::Value::SInt64(static_cast<int64_t>(format | (0x100ull << 16) | (uint64_t{elements} << 32)));
  };
  const cf::Value small_legend = cf::Array({cf::Value(cf::Dictionary::Of(
      {{"IOReportGroupName", "G"},
       {"IOReportChannels", cf::Array({cf::Value(cf::Array({cf::Value::SInt64(1), channel_type(1, 1), "One"})),
                                       cf::Value(cf::Array({cf::Value::SInt64(2), channel_type(2, 3)})),
                                       cf::Value(cf::Array({cf::Value::SInt64(3), channel_type(4, 0)})),
                                       cf::Value(cf::Array({cf::Value::SInt64(4), "type"})),
                                       cf::Value(cf::Array({cf::Value::SInt64(5)}))})}}))});
  const cf::Value odd_values = cf::Dictionary::Of(
      {{"32", cf::Dictionary::Of({{"1", "text"},
                                  {"2", cf::Array({cf::Value(cf::Dictionary::Of(
                                                       {{"values", cf::Array({cf::Value::SInt64(1)})},
                                                        {"time", cf::Value::Float64(1e300)}})),
                                                   cf::Value(cf::Array({cf::Value::SInt64(-1), cf::Value::SInt64(2),
                                                                        cf::Value::SInt64(3), cf::Value::SInt64(4),
                                                                        cf::Value::SInt64(5)})),
                                                   cf::Value::SInt64(9), cf::Value::SInt64(10)})},
                                  {"3", cf::Value::UInt64(UINT64_MAX)}})},
       {"x", cf::Value::SInt64(1)}});
  Seed("hub", "odd-values", hub_input(0, hub_registry(cf::Dictionary(), small_legend), xml(odd_values)));
  Seed("hub", "fails-interests",
       hub_input(0, hub_registry(cf::Dictionary::Of({{"failSelectors", cf::Array({cf::Value::SInt64(2)})}}),
                                 small_legend),
                 xml(odd_values)));
  Seed("hub", "fails-map",
       hub_input(1, hub_registry(cf::Dictionary::Of({{"failMap", cf::Value::Bool(true)}}), small_legend), ""));
  cf::Array wide;
  for (int64_t id = 1; id <= 17; ++id) wide.Append(cf::Array({cf::Value::SInt64(id), channel_type(1, 0xFFFF)}));
  Seed("hub", "over-the-buffer-limit",
       hub_input(0, hub_registry(cf::Dictionary(),
                                 cf::Array({cf::Value(cf::Dictionary::Of({{"IOReportChannels", wide}}))})),
                 ""));
  Seed("hub", "values-not-a-dictionary", hub_input(2, default_registry, xml(cf::Array({device.ioreport}))));

  // ean.plist: the default images, then figures the driver must refuse.
  const std::string default_ean = xml(device.ean);
  Seed("ean", "default.xml", default_ean);
  Seed("ean", "default.bplist", binary(device.ean));
  Seed("ean", "truncated.xml", default_ean.substr(0, default_ean.size() - 30));
  cf::Dictionary odd_images;
  odd_images.Set("dBIC", "not an image");
  odd_images.Set("dLTH", numbers({{"size", -1}, {"updates", 2}}));
  odd_images.Set("ifw1", cf::Dictionary::Of({{"size", cf::Value::Float64(1.5)}, {"updates", "often"}}));
  odd_images.Set("dCfg", cf::Dictionary());
  odd_images.Set("fCfg", cf::Dictionary::Of({{"size", cf::Value::UInt64(UINT64_MAX)}}));
  odd_images.Set(std::string("\x01\x02\x03\x04", 4), numbers({{"size", 5}}));
  odd_images.Set("ab", numbers({{"size", 6}}));
  Seed("ean", "odd-images.bplist", binary(odd_images));
  Seed("ean", "not-a-dictionary.xml", xml(cf::Array({device.ean})));

  // stackshot.plist: the default tasks, then descriptions the encoder must
  // refuse and ones whose search is easy to get wrong.
  const std::string default_stackshot = xml(device.stackshot);
  Seed("stackshot", "default.xml", default_stackshot);
  Seed("stackshot", "default.bplist", binary(device.stackshot));
  Seed("stackshot", "truncated.xml", default_stackshot.substr(0, default_stackshot.size() - 25));
  Seed("stackshot", "fixtures.xml", xml(tasks));
  Seed("stackshot", "swapout-twice.xml",
       xml(cf::Array({task("kernel_task", {thread("VM_swapout", -1), thread("VM_swapout", 8192)}),
                      task("VM_swapout", {thread("VM_swapou", 1), thread("VM_swapout_", 2)})})));
  cf::Dictionary huge_writes;
  huge_writes.Set("name", "VM_swapout");
  huge_writes.Set("diskWrites", cf::Value::UInt64(UINT64_MAX));
  Seed("stackshot", "huge-writes.xml", xml(cf::Array({task("k", {cf::Value(huge_writes)}), task("empty", {})})));
  cf::Dictionary no_threads;
  no_threads.Set("name", "launchd");
  Seed("stackshot", "no-threads.xml", xml(cf::Array({cf::Value(no_threads)})));
  Seed("stackshot", "long-name.xml", xml(cf::Array({task("k", {thread(std::string(64, 'n').c_str(), 1)})})));
  const cf::Value nul_in_name = cf::Dictionary::Of({{"name", std::string("VM_swapout\0x", 12)}});
  Seed("stackshot", "nul-in-name.bplist", binary(cf::Array({task("k", {nul_in_name})})));
  const cf::Value negative_writes =
      cf::Dictionary::Of({{"name", "t"}, {"threads", cf::Array({numbers({{"diskWrites", -5}})})}});
  Seed("stackshot", "negative-writes.xml", xml(cf::Array({task("k", {thread("VM_swapout", -1)}), negative_writes})));
  cf::Dictionary real_writes;
  real_writes.Set("name", "VM_swapout");
  real_writes.Set("diskWrites", cf::Value::Float64(4096.5));
  Seed("stackshot", "real-writes.xml", xml(cf::Array({task("k", {cf::Value(real_writes)})})));
  const cf::Value unknown_key =
      cf::Dictionary::Of({{"name", "k"}, {"threads", cf::Array()}, {"pid", cf::Value::SInt64(1)}});
  Seed("stackshot", "unknown-key.xml", xml(cf::Array({unknown_key})));
  Seed("stackshot", "threads-not-an-array.xml",
       xml(cf::Array({cf::Value(cf::Dictionary::Of({{"name", "k"}, {"threads", "VM_swapout"}}))})));
  Seed("stackshot", "not-an-array.xml", xml(cf::Dictionary::Of({{"name", "kernel_task"}})));
  cf::Array many;
  for (int t = 0; t < 40; ++t)
    many.Append(task(("task" + std::to_string(t)).c_str(),
                     {thread("main", t), thread(t == 39 ? "VM_swapout" : "worker", 1000 + t)}));
  Seed("stackshot", "many-tasks.bplist", binary(many));

  // usage.plist, dated from the clock of fuzz_usage (1.75e9, mid-afternoon
  // UTC), with the target's own "baseline" and "names" keys.
  constexpr double kUsageNow = 1.75e9;
  const cf::Value today = cf::Date{kUsageNow - 3600}, yesterday = cf::Date{kUsageNow - 86400},
                  last_week = cf::Date{kUsageNow - 7 * 86400};
  auto usage_record = [](const char* proc, const cf::Value& since, int64_t wifi_in, int64_t wifi_out,
                         int64_t wwan_in, int64_t wwan_out) {
    return cf::Value(cf::Dictionary::Of({{"procName", proc},
                                         {"sinceTime", since},
                                         {"wifiInBytes", cf::Value::SInt64(wifi_in)},
                                         {"wifiOutBytes", cf::Value::SInt64(wifi_out)},
                                         {"wwanInBytes", cf::Value::SInt64(wwan_in)},
                                         {"wwanOutBytes", cf::Value::SInt64(wwan_out)}}));
  };
  cf::Dictionary maps = *usage_record("Maps", today, 5 << 20, 300 << 10, 0, 2048).AsDictionary();
  maps.Set("bundleName", "com.example.maps");
  const cf::Array usage_records({usage_record("mDNSResponder", yesterday, 1 << 20, 1 << 19, 4096, 1023), maps,
                                 usage_record("nsurlsessiond", last_week, 1 << 30, 1 << 20, 0, 0)});
  auto baseline_entry = [](const cf::Value& since, int64_t a, int64_t b, int64_t c, int64_t d) {
    return cf::Value(cf::Array({since, cf::Value::SInt64(a), cf::Value::SInt64(b), cf::Value::SInt64(c),
                                cf::Value::SInt64(d)}));
  };
  auto usage_file = [&](std::initializer_list<std::pair<const char*, cf::Value>> entries) {
    return cf::Value(cf::Dictionary::Of(entries));
  };
  Seed("usage", "records.xml", xml(usage_file({{"records", usage_records}, {"delaySeconds", cf::Value::SInt64(0)},
                                               {"neverReply", cf::Value::Bool(false)}})));
  Seed("usage", "records.bplist", binary(usage_file({{"records", usage_records}})));
  const cf::Value baseline = cf::Dictionary::Of(
      {{"mDNSResponder", baseline_entry(yesterday, 1 << 19, 1 << 19, 8192, 0)},  // grew, shrank
       {"com.example.maps", baseline_entry(yesterday, 1, 1, 1, 1)},             // a new start date
       {"nsurlsessiond", baseline_entry(last_week, INT64_MIN, 0, 0, INT64_MAX)},
       {"gone", baseline_entry(today, 1, 2, 3, 4)}});
  Seed("usage", "with-baseline.xml", xml(usage_file({{"records", usage_records}, {"baseline", baseline}})));
  const cf::Value hostile_baseline = cf::Dictionary::Of(
      {{"mDNSResponder", cf::Array({yesterday, cf::Value::SInt64(1)})},
       {"com.example.maps", cf::Array({cf::Value::SInt64(1), cf::Value::SInt64(2), cf::Value::SInt64(3),
                                       cf::Value::SInt64(4), cf::Value::SInt64(5)})},
       {"nsurlsessiond", baseline_entry(last_week, 1, 2, 3, 4).AsArray()->MutableCopy()}});
  Seed("usage", "hostile-baseline.xml", xml(usage_file({{"records", usage_records}, {"baseline", hostile_baseline}})));
  Seed("usage", "baseline-not-a-dictionary.xml",
       xml(usage_file({{"records", usage_records}, {"baseline", cf::Array({baseline})}})));
  Seed("usage", "named.xml",
       xml(usage_file({{"records", usage_records}, {"names", cf::Array({"mDNSResponder", "Maps", "absent"})}})));
  auto records_and = [&](const char* key, const cf::Value& value) {
    return xml(usage_file({{"records", usage_records}, {key, value}}));
  };
  Seed("usage", "never-reply.xml", records_and("neverReply", cf::Value::Bool(true)));
  Seed("usage", "delayed.xml", records_and("delaySeconds", cf::Value::Float64(2.5)));
  Seed("usage", "delay-too-long.xml", records_and("delaySeconds", cf::Value::SInt64(5000)));
  Seed("usage", "delay-not-a-number.xml", records_and("delaySeconds", "soon"));
  Seed("usage", "never-reply-not-a-boolean.xml", xml(usage_file({{"neverReply", cf::Value::SInt64(1)}})));
  Seed("usage", "records-not-an-array.xml", xml(usage_file({{"records", maps}})));
  Seed("usage", "no-records.xml", xml(usage_file({})));
  cf::Dictionary nameless = *usage_record("", today, 1, 2, 3, 4).AsDictionary();
  cf::Dictionary text_counter = *usage_record("Text", today, 1, 2, 3, 4).AsDictionary();
  text_counter.Set("wwanOutBytes", "12");
  cf::Dictionary undated = *usage_record("Undated", today, 1, 2, 3, 4).AsDictionary();
  undated.Remove(cf::Value("sinceTime"));
  // The start dates at the ends of what the preferences keep (the XML
  // writer brings the far ones to years 1 and 9999).
  auto odd_records = [&](const cf::Value& early, const cf::Value& far) {
    return usage_file({{"records", cf::Array({cf::Value(nameless), cf::Value(text_counter), cf::Value(undated),
                                              usage_record("Far", far, 1, 2, 3, 4),
                                              usage_record("Early", early, 1, 2, 3, 4),
                                              usage_record("Extremes", today, INT64_MAX, INT64_MIN, -1, 1 << 10),
                                              usage_record("Twice", today, 1 << 20, 0, 0, 0),
                                              usage_record("Twice", yesterday, 1 << 21, 0, 0, 0), "x"})}});
  };
  Seed("usage", "odd-records.xml", xml(odd_records(cf::Date{-7e10}, cf::Date{4e11})));
  // Beyond them: the binary writer clamps dates to 32-bit seconds from
  // 2001, so two placeholder dates are overwritten in its output.
  constexpr double kBinaryDateEpoch = 978307200;
  auto date_item = [&](double seconds) {
    const double from_2001 = seconds - kBinaryDateEpoch;
    uint64_t bits;
    std::memcpy(&bits, &from_2001, 8);
    return "\x33" + BigEndian(bits, 8);
  };
  std::string beyond = binary(odd_records(cf::Date{kBinaryDateEpoch + 1111111}, cf::Date{kBinaryDateEpoch + 2222222}));
  for (const auto& [placeholder, date] : {std::pair{1111111.0, -7e10}, std::pair{2222222.0, 4e11}})
    if (const size_t at = beyond.find(date_item(kBinaryDateEpoch + placeholder)); at != std::string::npos)
      beyond.replace(at, 9, date_item(date));
  Seed("usage", "odd-records-beyond.bplist", beyond);
  const std::string records_xml = xml(usage_file({{"records", usage_records}}));
  Seed("usage", "truncated.xml", records_xml.substr(0, records_xml.size() - 40));
  Seed("usage", "not-a-dictionary.xml", xml(usage_records));
  Seed("usage", "junk", "not a property list");
  return 0;
}
