// Writes a small seed corpus for every fuzz target, made by the encoders.
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

#include "cf/plist.h"
#include "platform/service.h"
#include "sim/statistics_buffers.h"

namespace {

std::string g_root;

void Seed(const std::string& target, const std::string& name, const std::string& bytes) {
  std::filesystem::create_directories(g_root + "/" + target);
  std::ofstream(g_root + "/" + target + "/" + name, std::ios::binary) << bytes;
}

std::string U16(uint16_t v) { return std::string{static_cast<char>(v >> 8), static_cast<char>(v)}; }

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
  return 0;
}
