#include <cstdarg>
#include <cstdio>
#include <algorithm>
#include <cstring>
#include <vector>
#include <string>

#include "cf/format.h"
#include "parsers/parsers.h"

const char kSnapshotLegend[] =
    "Key: \nT   - Timestamp\nE   - Erased bands during this time interval\nHR  - Host Reads (in 4k sectors)\n"
    "HW  - Host Writes (in 4k sectors)\nNR  - Nand Reads (in 4k sectors)\nNW  - Nand Writes (in 4k sectors)\n"
    "TH  - Time in Hysteresis in this time interval (in ms)\n"
    "GC  - Number of sectors (4k bytes) completed GC in this time interval\n"
    "W   - Number of wear level bands completed in this time interval\n"
    "BI  - Bands Intermediate (SLC) PendingErase\nBU  - Bands User (MLC) PendingErase\nV   - Number of Free Nodes\n"
    "BF  - Buffer Fragments/BufferHighWater\nP   - Percent of time in DoPreempt rather than DoNormal\n"
    "H   - Qos Delays: Normal/Extreme\nX   - Successful expedite commands/Failed expedite commands\n"
    "L   - Age of the oldest command in ms (calculated every second)/Qos Interval (in 100us units)\n"
    "C   - Command tags in use by host (Min/Max)S   - Number of free segs\nU   - Sectors of host unmaps\n"
    "RO  - Num read ops for this time interval: priority0/priority1/...\n"
    "RL  - Total Read Latency (in us) for this time interval: priority0/priority1/...\n"
    "RM  - Max Read Latency (int us) for this time interval: priority0/priority1/...\n"
    "WO  - Num write ops for this time interval: priority0/priority1/...\n"
    "WL  - Total write latency (in us) for this time interval: priority0/priority1/...\n"
    "WM  - Max write latency (in us) for this time interval: priority0/priority1/...\n\n";

namespace {

constexpr uint32_t kEntryWords = 63;
constexpr uint32_t kEntryBytes = kEntryWords * 4;

uint32_t Le32(const uint8_t* p) {
  uint32_t v;
  std::memcpy(&v, p, 4);
  return v;
}

// Bounded writing into a caller's buffer: a piece that needs all of the
// room left, or more, is refused.
class Output {
 public:
  Output(char* out, uint32_t capacity) : out_(out), capacity_(capacity) {}
  __attribute__((format(printf, 2, 3))) bool Printf(const char* format, ...) {
    const size_t room = capacity_ - length_;
    va_list args;
    va_start(args, format);
    const int n = std::vsnprintf(out_ + length_, room, format, args);
    va_end(args);
    if (n < 0 || static_cast<size_t>(n) >= room) return false;
    length_ += static_cast<uint32_t>(n);
    return true;
  }
  bool Append(const std::string& piece) {
    if (piece.size() >= capacity_ - length_) return false;
    std::memcpy(out_ + length_, piece.data(), piece.size());
    length_ += static_cast<uint32_t>(piece.size());
    out_[length_] = '\0';
    return true;
  }
  uint32_t length() const { return length_; }
  void CutTo(uint32_t length) {
    length_ = length;
    out_[length_] = '\0';
  }

 private:
  char* out_;
  uint32_t capacity_;
  uint32_t length_ = 0;
};

bool PrintFixedRecord(Output& out, const uint8_t* record) {
  uint32_t w[kEntryWords];
  for (uint32_t i = 0; i < kEntryWords; ++i) w[i] = Le32(record + i * 4);
  if (!out.Printf("T=%04u E=%02u HR=%4u HW=%4u NR=%4u NW=%4u TH=%8u.%02u GC=%4u W=%2u BI=%3u BU=%3u V=%5u "
                  "BF=%2u/%2u P=%2u H=%2u/%2u X=%2u/%2u L=%3u/%3u C=%2u/%2u S=%4u U=%8u RO=%4u",
                  w[0], w[26], w[27], w[28], w[29], w[30], w[39] / 1000, (w[39] % 1000) / 10, w[31], w[33], w[36],
                  w[37], w[45], w[47], w[48], w[1], w[41], w[40], w[50], w[51], w[43], w[44], w[53], w[54], w[42],
                  w[52], w[14]))
    return false;
  // Each priority owns three words: operations, total latency, maximum.
  struct Run {
    const char* first;
    const char* rest;
    uint32_t word;
  };
  const Run runs[] = {{nullptr, "/%4u", 14}, {" RL=%7u", "/%7u", 15}, {" RM=%5u", "/%5u", 16},
                      {" WO=%4u", "/%4u", 2},  {" WL=%7u", "/%7u", 3},  {" WM=%5u", "/%5u", 4}};
  for (const Run& run : runs)
    for (uint32_t p = run.first ? 0 : 1; p < 4; ++p)
      if (!out.Printf(p == 0 ? run.first : run.rest, w[run.word + 3 * p])) return false;
  return out.Printf("\n");
}

}  // namespace

int VSPParseSnapshotBuffer(const void* entries, uint32_t size, char* out, uint32_t* outSize) {
  if (!out || !outSize || *outSize == 0) return 0;
  Output text(out, *outSize);
  out[0] = '\0';
  if (!text.Printf("%s", kSnapshotLegend)) return 0;
  const auto* bytes = static_cast<const uint8_t*>(entries);
  const uint32_t records = bytes ? size / kEntryBytes : 0;
  for (uint32_t i = 0; i < records; ++i)
    if (!PrintFixedRecord(text, bytes + static_cast<size_t>(i) * kEntryBytes)) return 0;
  if (!text.Printf("\n")) return 0;
  *outSize = text.length();
  return 1;
}

namespace {

// The controller's self-describing header, read within its size only.
class SnapshotHeader {
 public:
  SnapshotHeader(const uint8_t* bytes, uint32_t size) : bytes_(bytes), size_(size) {}
  uint32_t U32(uint64_t offset) const { return offset + 4 <= size_ ? Le32(bytes_ + offset) : 0; }
  uint32_t version() const { return U32(4); }
  uint32_t entrySize() const { return U32(8); }
  uint32_t entryCount() const { return U32(12); }
  // The legend at offset 36, up to its NUL or the end of the header.
  std::string Legend() const {
    if (size_ <= 36) return {};
    const char* start = reinterpret_cast<const char*>(bytes_ + 36);
    return std::string(start, strnlen(start, size_ - 36));
  }
  // Descriptors that lie wholly inside the header.
  uint32_t DescriptorCount() const {
    const uint64_t table = U32(24);
    if (table + 8 > size_) return 0;
    const uint64_t fit = (size_ - table - 8) / 28;
    return static_cast<uint32_t>(std::min<uint64_t>(U32(table), fit));
  }
  const uint8_t* Descriptor(uint32_t i) const { return bytes_ + U32(24) + 8 + uint64_t{i} * 28; }

 private:
  const uint8_t* bytes_;
  uint32_t size_;
};

struct FieldDesc {
  uint16_t type;
  uint32_t offset;
  uint32_t size;
  std::string format;  // at most 15 characters
};

FieldDesc ReadDescriptor(const uint8_t* d) {
  FieldDesc f;
  f.type = static_cast<uint16_t>(d[0] | (d[1] << 8));
  f.offset = Le32(d + 4);
  f.size = Le32(d + 8);
  f.format.assign(reinterpret_cast<const char*>(d + 12), strnlen(reinterpret_cast<const char*>(d + 12), 16));
  if (f.format.size() > 15) f.format.resize(15);
  return f;
}

// The descriptor formats come from the device: they go through our own
// formatter, which cannot be made to read or write outside its arguments.
bool PrintRecord(Output& out, const uint8_t* record, uint32_t record_size, const std::vector<FieldDesc>& fields) {
  auto value = [&](uint64_t offset, uint32_t* v) {
    if (offset + 4 > record_size) return false;
    *v = Le32(record + offset);
    return true;
  };
  for (const FieldDesc& f : fields) {
    uint32_t v = 0;
    switch (f.type) {
      case 0:
      case 1:
        if (!f.format.empty() && value(f.offset, &v) && !out.Append(cf::Format(f.format, v))) return false;
        break;
      case 2:
        if (value(f.offset, &v) && !out.Append(cf::Format(f.format, v / 1000, (v % 1000) / 10))) return false;
        break;
      case 3: {
        const uint32_t triples = f.size / 12;
        const char* letters[] = {"O", "L", "M"};
        const char* first[] = {"%4u", "%7u", "%5u"};
        const char* rest[] = {"/%4u", "/%7u", "/%5u"};
        for (int part = 0; part < 3; ++part) {
          if (!out.Append(cf::Format(f.format, letters[part]))) return false;
          for (uint32_t t = 0; t < triples; ++t) {
            if (!value(f.offset + uint64_t{t} * 12 + part * 4, &v)) break;
            if (!out.Append(cf::Format(t == 0 ? first[part] : rest[part], v))) return false;
          }
        }
        break;
      }
      default:
        break;
    }
  }
  return out.Append("\n");
}

}  // namespace

int VSPParseSnapshotBufferWithInplaceParser(const void* data, uint32_t dataSize, char* out, uint32_t* outSize,
                                            const void* header, uint32_t headerSize, uint32_t* index) {
  if (!header || !out || !outSize || !index || *outSize == 0) return 0;
  const SnapshotHeader h(static_cast<const uint8_t*>(header), headerSize);
  Output text(out, *outSize);
  out[0] = '\0';
  auto finish = [&](int result) {
    *outSize = text.length() + 1;
    return result;
  };
  if (*index == 0) {
    const std::string preamble =
        h.version() >= 6 ? "- VSP Snapshot - \n" + h.Legend() + "\n" : std::string(kSnapshotLegend);
    if (!text.Append(preamble)) {
      text.CutTo(0);
      return finish(0);
    }
  }
  const int64_t last = static_cast<int64_t>(h.entryCount()) - 1;  // the last record is never printed
  if (static_cast<int64_t>(*index) >= last) {
    text.CutTo(0);
    return finish(1);
  }
  std::vector<FieldDesc> fields;
  const uint32_t descriptors = h.DescriptorCount();
  fields.reserve(descriptors);
  for (uint32_t i = 0; i < descriptors; ++i) fields.push_back(ReadDescriptor(h.Descriptor(i)));

  const uint64_t entry_size = h.entrySize();
  const auto* records = static_cast<const uint8_t*>(data);
  for (; static_cast<int64_t>(*index) < last; ++*index) {
    const uint64_t start = uint64_t{*index} * entry_size;
    // Records beyond the data are not printed.
    if (!records || entry_size == 0 || start + entry_size > dataSize) break;
    const uint8_t* record = records + start;
    uint32_t first = 0;
    if (fields.empty() || fields[0].offset + uint64_t{4} > entry_size) continue;
    first = Le32(record + fields[0].offset);
    if (first == 0) continue;  // an empty interval
    const uint32_t complete = text.length();
    if (!PrintRecord(text, record, static_cast<uint32_t>(entry_size), fields)) {
      text.CutTo(complete);
      ++*index;  // a record that did not fit is not retried
      return finish(0);
    }
  }
  return finish(1);
}
