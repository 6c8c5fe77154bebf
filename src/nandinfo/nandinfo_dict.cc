#include "nandinfo/nandinfo_dict.h"

#include <algorithm>
#include <cstdint>

#include "nandinfo/helpers.h"
#include "nandinfo/keymap_table.h"
#include "platform/prefs.h"

namespace {

constexpr int kTypeSInt64 = 4;
constexpr int kTypeInt = 9;

// Marks a partition start the context did not carry.
constexpr uint64_t kNoPartitionStart = 0xFFFFFFFF;

constexpr uint64_t kUnixTimeOf2000 = 946684800;  // 2000-01-01 00:00:00 UTC
constexpr uint64_t kSecondsPerWeek = 604800;

constexpr std::string_view kKeyPrefix = "com.velmora.NANDInfo.";

void SetInt(cf::Dictionary& dict, std::string_view suffix, uint32_t value) {
  const int32_t v = static_cast<int32_t>(value);
  setNumberValueForType(dict, cf::Value(std::string(kKeyPrefix) + std::string(suffix)), &v, kTypeInt);
}

void SetSInt64Key(cf::Dictionary& dict, std::string_view key, uint64_t value) {
  const int64_t v = static_cast<int64_t>(value);
  setNumberValueForType(dict, cf::Value(key), &v, kTypeSInt64);
}

void SetSInt64(cf::Dictionary& dict, std::string_view suffix, uint64_t value) {
  SetSInt64Key(dict, std::string(kKeyPrefix) + std::string(suffix), value);
}

// The key says days, but the value has always been whole weeks.
uint64_t WeeksSince2000(uint64_t t) {
  if (t == 0 || t < kUnixTimeOf2000 + 1) return 0;
  return (t - kUnixTimeOf2000) / kSecondsPerWeek;
}

// Index of name in a fail triple (name0..name2), or -1.
int TripleIndex(std::string_view name, std::string_view stem) {
  if (name.size() != stem.size() + 1 || !name.starts_with(stem)) return -1;
  const char digit = name.back();
  return digit >= '0' && digit <= '2' ? digit - '0' : -1;
}

}  // namespace

bool StoreDemoModeEnabled() {
  bool valid = false;
  const bool on = CFPreferencesGetAppBooleanValue(cf::Value("StoreDemoMode"), "com.velmora.demo-settings", &valid);
  return valid && on;
}

cf::Dictionary BuildNANDInfoDictFromStatsCxt(const VSPParseCxt& context, bool omitVersionKeys) {
  cf::Dictionary dict;
  dict.Reserve(32 + std::min(context.pairs.size(), kKeyMapSize));

  if (!omitVersionKeys) {
    SetInt(dict, "ExportVersion", context.exportVersion);
    // The parser leaves 0xFFFFFFFF when the buffer has no driver version;
    // as an int that is -1.
    SetInt(dict, "DriverVersion", context.driverVersion);
    SetSInt64(dict, "DemoMode", StoreDemoModeEnabled() ? 1 : 0);
  }

  SetInt(dict, "NumVirtualBlocks", context.numVirtualBlocks);
  SetInt(dict, "PagesPerVirtualBlock", context.pagesPerVirtualBlock);
  SetInt(dict, "BytesPerPage", context.bytesPerPage);
  SetSInt64(dict, "NumLogicalReads", context.hostReads);
  SetSInt64(dict, "NumLogicalWrites", context.hostWrites);
  SetSInt64(dict, "NumFreeVirtualBlocks", context.numFreeVirtualBlocks);
  SetSInt64(dict, "NumWearLevelOps", context.wearLevMoves);
  SetSInt64(dict, "NumPhysicalReads", context.nandReads);
  SetSInt64(dict, "NumPhysicalWrites", context.nandWrites);
  SetSInt64(dict, "NumPhysicalErases", context.bandErases);
  SetSInt64(dict, "NodesFree", context.IND_pool_free);
  SetSInt64(dict, "NodesTotal", context.IND_pool_count);
  SetSInt64(dict, "formatDaysSince2000", WeeksSince2000(context.utilFormatTime));
  SetSInt64(dict, "NumSleepOps", context.numSleepOps);
  SetSInt64(dict, "HighEnduranceBlockEraseCount", context.maxHighEnduranceBlockErases);
  SetInt(dict, "BlocksPerVirtualBlock", context.blocksPerVirtualBlock);
  SetSInt64(dict, "ReadsBeforeErasure0", context.readCountHisto[0]);
  SetSInt64(dict, "ReadsBeforeErasure50000", context.readCountHisto[1]);
  SetSInt64(dict, "ReadsBeforeErasure100000", context.readCountHisto[2]);
  SetSInt64(dict, "ReadsBeforeErasure150000", context.readCountHisto[3]);
  SetSInt64(dict, "ReadsBeforeErasure200000", context.readCountHisto[4]);

  uint64_t userStart = kNoPartitionStart;
  uint64_t intermediateStart = kNoPartitionStart;
  uint64_t maintenanceRequests = 0;
  uint64_t failedRead = 0;
  uint64_t failedProg = 0;
  uint64_t failedErase = 0;

  // Names count to 100 characters; the names below are far shorter, so
  // whole-name equality gives the same answer.
  for (const ParserPair& pair : context.pairs) {
    const std::string_view name = pair.name;
    const uint64_t value = pair.value;
    if (name == "userPartitionStart") {
      userStart = value;
    } else if (name == "intermediatePartitionStart") {
      intermediateStart = value;
    } else if (name == "numBootBlockRefreshSuccess0" || name == "numBootBlockRefreshFail0") {
      maintenanceRequests += value;
    } else if (TripleIndex(name, "mspBootBlockReadFail") >= 0) {
      failedRead += value != 0;
    } else if (TripleIndex(name, "mspBootBlockProgFail") >= 0) {
      failedProg += value != 0;
    } else if (TripleIndex(name, "mspBootBlockEraseFail") >= 0) {
      failedErase += value != 0;
    } else if (const KeyMapRecord* record = FindKeyMapRecord(name)) {
      // The two peak durations are kept to three significant digits, from
      // their low 32 bits.
      const bool rounded = name == "maxMemLowDuration" || name == "maxMemChokeDuration";
      SetSInt64Key(dict, record->key, rounded ? roundSig(static_cast<uint32_t>(value), 3) : value);
    }
  }

  if (userStart != kNoPartitionStart && intermediateStart != kNoPartitionStart)
    SetSInt64(dict, "IntermediatePartitionSize", userStart - intermediateStart);

  SetSInt64(dict, "NumMaintenanceRequests", maintenanceRequests);
  SetSInt64(dict, "MaintenanceRequestsFailedRead", failedRead);
  SetSInt64(dict, "MaintenanceRequestsFailedProg", failedProg);
  SetSInt64(dict, "MaintenanceRequestsFailedErase", failedErase);
  return dict;
}
