#include "platform/host_disk_pages.h"

#include <limits>
#include <vector>

namespace platform {

namespace {

constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();

uint64_t SaturatedAdd(uint64_t a, uint64_t b) { return a > kMax - b ? kMax : a + b; }
uint64_t SaturatedMul(uint64_t a, uint64_t b) { return b != 0 && a > kMax / b ? kMax : a * b; }

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::optional<uint64_t> Decimal(std::string_view digits) {
  if (digits.empty()) return std::nullopt;
  uint64_t v = 0;
  for (char c : digits) {
    if (c < '0' || c > '9') return std::nullopt;
    const uint64_t d = static_cast<uint64_t>(c - '0');
    if (v > (kMax - d) / 10) return std::nullopt;
    v = v * 10 + d;
  }
  return v;
}

const unsigned char* Bytes(std::string_view s) { return reinterpret_cast<const unsigned char*>(s.data()); }

uint16_t LE16(const unsigned char* p) { return static_cast<uint16_t>(p[0] | p[1] << 8); }

uint64_t LE64(const unsigned char* p) {
  uint64_t v = 0;
  for (int i = 7; i >= 0; --i) v = v << 8 | p[i];
  return v;
}

// Space-padded ASCII as the identify data holds it.
std::string AsciiField(std::string_view data, size_t offset, size_t size) {
  std::string out;
  for (char c : data.substr(offset, size)) out += c >= 0x20 && c < 0x7F ? c : (c == '\0' ? ' ' : '?');
  return TrimmedText(out);
}

}  // namespace

std::string TrimmedText(std::string_view text) {
  size_t start = 0, end = text.size();
  while (start < end && IsBlank(text[start])) ++start;
  while (end > start && IsBlank(text[end - 1])) --end;
  return std::string(text.substr(start, end - start));
}

std::optional<BlockStat> ParseBlockStat(std::string_view text) {
  std::vector<uint64_t> fields;
  size_t i = 0;
  while (i < text.size()) {
    if (IsBlank(text[i])) {
      ++i;
      continue;
    }
    size_t end = i;
    while (end < text.size() && !IsBlank(text[end])) ++end;
    const auto v = Decimal(text.substr(i, end - i));
    if (!v) return std::nullopt;
    fields.push_back(*v);
    i = end;
  }
  if (fields.size() < 11) return std::nullopt;
  BlockStat s;
  s.reads = fields[0];
  s.sectors_read = fields[2];
  s.writes = fields[4];
  s.sectors_written = fields[6];
  if (fields.size() >= 15) {
    s.discards = fields[11];
    s.sectors_discarded = fields[13];
  }
  if (fields.size() >= 17) s.flushes = fields[15];
  return s;
}

void AddBlockStat(BlockStat& into, const BlockStat& more) {
  into.reads = SaturatedAdd(into.reads, more.reads);
  into.sectors_read = SaturatedAdd(into.sectors_read, more.sectors_read);
  into.writes = SaturatedAdd(into.writes, more.writes);
  into.sectors_written = SaturatedAdd(into.sectors_written, more.sectors_written);
  auto add = [](std::optional<uint64_t>& a, const std::optional<uint64_t>& b) {
    a = a && b ? std::optional<uint64_t>(SaturatedAdd(*a, *b)) : std::nullopt;
  };
  add(into.discards, more.discards);
  add(into.sectors_discarded, more.sectors_discarded);
  add(into.flushes, more.flushes);
}

uint64_t SaturatedCounter128(const unsigned char* p) { return LE64(p + 8) != 0 ? kMax : LE64(p); }

std::optional<NvmeHealth> DecodeNvmeHealthPage(std::string_view page) {
  if (page.size() < kNvmeHealthPageBytes) return std::nullopt;
  const unsigned char* p = Bytes(page);
  NvmeHealth h;
  h.critical_warning = p[0];
  h.temperature_kelvin = LE16(p + 1);
  h.available_spare = p[3];
  h.percent_used = p[5];
  h.data_units_read = SaturatedCounter128(p + 32);
  h.data_units_written = SaturatedCounter128(p + 48);
  h.host_read_commands = SaturatedCounter128(p + 64);
  h.host_write_commands = SaturatedCounter128(p + 80);
  h.power_cycles = SaturatedCounter128(p + 112);
  h.power_on_hours = SaturatedCounter128(p + 128);
  h.unsafe_shutdowns = SaturatedCounter128(p + 144);
  h.media_errors = SaturatedCounter128(p + 160);
  return h;
}

std::optional<DiskIdentity> DecodeNvmeIdentifyController(std::string_view data) {
  if (data.size() < kNvmeIdentifyBytes) return std::nullopt;
  DiskIdentity id;
  id.serial = AsciiField(data, 4, 20);
  id.model = AsciiField(data, 24, 40);
  id.firmware = AsciiField(data, 64, 8);
  const unsigned char* capacity = Bytes(data) + 280;
  if (LE64(capacity + 8) == 0 && LE64(capacity) != 0) id.capacity_bytes = LE64(capacity);
  return id;
}

cf::Dictionary HostDiskFtlFields(const BlockStat& stat, const NvmeHealth* health) {
  const uint64_t per_sector = kFtlSectorBytes / 512;
  cf::Dictionary f;
  auto set = [&f](const char* name, uint64_t v) { f.Set(name, cf::Value::UInt64(v)); };
  if (health) {
    // Lifetime counts of the controller, as a flash controller keeps them.
    const uint64_t per_unit = 1000 * 512 / kFtlSectorBytes;  // 125
    set("hostReads", SaturatedMul(health->data_units_read, per_unit));
    set("hostWrites", SaturatedMul(health->data_units_written, per_unit));
    set("hostReadXacts", health->host_read_commands);
    set("hostWriteXacts", health->host_write_commands);
  } else {
    set("hostReads", stat.sectors_read / per_sector);
    set("hostWrites", stat.sectors_written / per_sector);
    set("hostReadXacts", stat.reads);
    set("hostWriteXacts", stat.writes);
  }
  if (stat.discards) set("numUnmap", *stat.discards);
  if (stat.sectors_discarded) set("numUnmapSec", *stat.sectors_discarded / per_sector);
  if (stat.flushes) set("numFlushes", *stat.flushes);
  if (health) {
    set("percentUsed", health->percent_used);
    set("spareAvailablePercent", health->available_spare);
    set("powerOnHours", health->power_on_hours);
    set("boots", health->power_cycles);
    set("uncleanBoots", health->unsafe_shutdowns);
    set("ueccReads", health->media_errors);
    set("smartCritWarnings", health->critical_warning);
    // Degrees Celsius; a controller that reports no temperature (0 K) or
    // one below freezing gives 0.
    if (health->temperature_kelvin > 273) set("TempSensor", health->temperature_kelvin - 273u);
    else set("TempSensor", 0);
  }
  return f;
}

cf::Dictionary HostDiskCharacteristics(const std::string& device, const DiskIdentity& identity) {
  cf::Dictionary d;
  d.Set("device", device);
  for (const auto& [key, text] : {std::pair<const char*, const std::string*>{"model", &identity.model},
                                  {"serial", &identity.serial},
                                  {"firmware", &identity.firmware},
                                  {"vendor", &identity.vendor}})
    if (!text->empty()) d.Set(key, *text);
  if (identity.capacity_bytes) d.Set("capacity", cf::Value::UInt64(*identity.capacity_bytes));
  return d;
}

}  // namespace platform
