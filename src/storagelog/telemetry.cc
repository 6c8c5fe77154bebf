#include "storagelog/telemetry.h"

#include <algorithm>
#include <bit>
#include <cstdio>
#include <cstring>
#include <span>
#include <string>

#include "cf/bytes.h"
#include "nandinfo/helpers.h"
#include "platform/diagnostics.h"
#include "storagelog/telemetry_layouts.h"

namespace storagelog {
namespace {

// The structured-data record type of one bus's counters.
constexpr int kTelemetryRecordType = 176;

// NAND id keys (maker code and device code without its lowest byte).
constexpr uint64_t kFirstMaker1xA = 0x4582603A5700;
constexpr uint64_t kFirstMaker1xB = 0x458260DE5700;
constexpr uint64_t kSecondMaker1x = 0xAD8252232100;
constexpr uint64_t kNandKeyMask = 0xFFFFFFFFFF00;

constexpr size_t kChipIdBytes = 64;

void CopyRuns(std::span<const WordRun> runs, const uint8_t* block, VendorCounters* counters) {
  for (const WordRun& r : runs)
    for (size_t i = 0; i < r.count; ++i) counters->words[r.dest + i] = cf::LoadLE32(block + 4 * (r.src + i));
}

void parseOnlyAlgoGenericCounters(const uint8_t* block, VendorCounters* counters) {
  CopyRuns(kLayoutAlgoGeneric, block, counters);
}

void parseOnlyAlgoGenericCountersK4(const uint8_t* block, VendorCounters* counters) {
  CopyRuns(kLayoutAlgoGenericK4, block, counters);
}

// The maker code is the value of the first four hex digits, the device code
// that of the digits after them (at most eight are read).
uint64_t NandIdKey(const std::string& text) {
  const size_t maker_digits = std::min<size_t>(text.size(), 4);
  const uint64_t maker = hexStringToInt32(text.data(), maker_digits);
  const uint64_t device = hexStringToInt32(text.data() + maker_digits, text.size() - maker_digits);
  return ((maker << 32) | device) & kNandKeyMask;
}

using Parser = void (*)(const uint8_t*, VendorCounters*);

Parser ParserFor(ChipKind chip, uint64_t nand_key) {
  switch (chip) {
    case ChipKind::kK3R:
      return parseCountersAlgoGeneric;
    case ChipKind::kK4R:
      return parseCountersAlgoGenericK4;
    case ChipKind::kOther:
      break;
  }
  if (nand_key == kFirstMaker1xA || nand_key == kFirstMaker1xB) return parseCounters1xSandisk;
  if (nand_key == kSecondMaker1x) return parseCounters1xHynix;
  return parseCounters1y;
}

// The text of a string entry, or null after saying why there is none.
const cf::String* StringEntry(const cf::Dictionary& characteristics, const char* key) {
  const cf::Value* v = characteristics.Find(cf::Value(key));
  if (!v || v->IsNull()) {
    std::fprintf(stderr, "ERROR: Could not determine the %s\n", key);
    return nullptr;
  }
  const cf::String* text = v->AsString();
  if (!text) std::fprintf(stderr, "ERROR: %s is not stored as a CFStringTypeID\n", key);
  return text;
}

}  // namespace

void parseCounters1y(const uint8_t* block, VendorCounters* counters) { CopyRuns(kLayout1y, block, counters); }

void parseCounters1xSandisk(const uint8_t* block, VendorCounters* counters) {
  CopyRuns(kLayout1xSandisk, block, counters);
}

void parseCounters1xHynix(const uint8_t* block, VendorCounters* counters) {
  CopyRuns(kLayout1xHynix, block, counters);
}

void parseCountersAlgoGeneric(const uint8_t* block, VendorCounters* counters) {
  parseOnlyAlgoGenericCounters(block, counters);
}

void parseCountersAlgoGenericK4(const uint8_t* block, VendorCounters* counters) {
  parseOnlyAlgoGenericCountersK4(block, counters);
}

}  // namespace storagelog

bool ParseTelemetryList(const uint8_t* data, size_t size, const cf::Value& characteristics,
                        std::string_view /*class_name*/) {
  using namespace storagelog;
  // The record lives on the stack: there is no allocation to fail.
  VendorCounters counters;

  const cf::Dictionary* chars = characteristics.AsDictionary();
  if (!chars) {
    std::fputs("ERROR: Could not parse the Device Characteristics dictionary\n", stderr);
    return false;
  }

  // The chip's name must fit a 64-byte C buffer with its terminator.
  const cf::String* chip_id = StringEntry(*chars, "chip-id");
  if (!chip_id) return false;
  if (chip_id->size() >= kChipIdBytes) {
    std::fprintf(stderr,
                 "ERROR: Unable to obtain %s as conversion from the UniChar contents of CFString failed, or the "
                 "buffer of %d bytes is too small\n",
                 "chip-id", static_cast<int>(kChipIdBytes));
    return false;
  }
  const ChipKind chip = *chip_id == "K3R" ? ChipKind::kK3R : *chip_id == "K4R" ? ChipKind::kK4R : ChipKind::kOther;

  // The part's id is read as C text; one holding a NUL byte has none.
  const cf::String* manufacturer_id = StringEntry(*chars, "manufacturer-id");
  if (!manufacturer_id) return false;
  if (manufacturer_id->find('\0') != std::string::npos) {
    std::fprintf(stderr, "ERROR: %s is NULL\n", "manufacturer-id");
    return false;
  }
  const uint64_t nand_key = NandIdKey(*manufacturer_id);

  const cf::Value* num_bus_value = chars->Find(cf::Value("num-bus"));
  const cf::Number* num_bus_number = num_bus_value ? num_bus_value->AsNumber() : nullptr;
  if (!num_bus_number) {
    std::fputs("ERROR: could not determine the number of channels\n", stderr);
    return false;
  }
  // Negative counts are as far out of bounds as huge ones; in 64 bits the
  // product of a 32-bit count cannot wrap.
  const int64_t num_bus = num_bus_number->AsSInt32();
  if (num_bus < 0 || static_cast<uint64_t>(num_bus) * kTelemetryBusBytes > size) {
    std::fputs("ERROR: Attempting to parse beyond the bounds of the buffer\n", stderr);
    return false;
  }

  const Parser parse = ParserFor(chip, nand_key);
  const size_t kind = static_cast<size_t>(chip);
  const uint8_t* summaries = data + static_cast<size_t>(num_bus) * kTelemetryBlockBytes;
  char name[64];
  for (size_t bus = 0; bus < static_cast<size_t>(num_bus); ++bus) {
    counters.words.fill(0);
    parse(data + bus * kTelemetryBlockBytes, &counters);

    cf::Dictionary record;
    record.Reserve(std::size(kBusSummaryKeys) + kVendorCounterWords);
    const uint8_t* summary = summaries + bus * kTelemetrySummaryBytes;
    for (size_t i = 0; i < std::size(kBusSummaryKeys); ++i)
      record.AppendUnique(kBusSummaryKeys[i], cf::Value::SInt32(static_cast<int32_t>(cf::LoadLE32(summary + 4 * i))));
    for (const CounterNames& group : kCounterNames) {
      for (int i = 0; i < group.count[kind]; ++i) {
        std::snprintf(name, sizeof name, "%s[%d]", group.name, i);
        record.AppendUnique(name, cf::Value::SInt32(static_cast<int32_t>(counters.words[group.first + i])));
      }
    }
    FKLogStructuredData(kTelemetryRecordType, record);
  }
  return true;
}
