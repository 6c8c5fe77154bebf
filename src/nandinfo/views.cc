// The whitelisted views of the controller's statistics, their senders to the
// analytics service, and the reference map's group events.
#include "nandinfo/views.h"

#include <functional>
#include <string>
#include <utility>

#include "cf/plist.h"
#include "nandinfo/controller.h"
#include "nandinfo/helpers.h"
#include "nandinfo/nandinfo.h"
#include "nandinfo/view_tables.h"
#include "platform/analytics.h"

namespace {

using nandinfo::SigDigits;

constexpr const char* kErrorMessageField = "ESR_APIErrorMessage";

// A whitelist as a dictionary name -> digits, built once: the filters look
// each field up by hash.
cf::Value DigitsDictionary(std::span<const SigDigits> table) {
  cf::Dictionary d;
  d.Reserve(table.size());
  for (const SigDigits& row : table) d.AppendUnique(cf::Value(row.name), cf::Value::SInt32(row.digits));
  return d;
}

const cf::Value& FTLDigits() {
  static const cf::Value d = DigitsDictionary(nandinfo::WhitelistedRawNANDFTLCounters());
  return d;
}
const cf::Value& MSPDigits() {
  static const cf::Value d = DigitsDictionary(nandinfo::WhitelistedRawNANDMSPCounters());
  return d;
}
const cf::Value& StorageStatsDigits() {
  static const cf::Value d = DigitsDictionary(nandinfo::WhitelistedStorageStats());
  return d;
}

// An event's field list as a dictionary name -> true, built once per event.
const cf::Value& EventFieldSet(std::string_view event) {
  static const auto sets = [] {
    std::vector<std::pair<std::string_view, cf::Value>> out;
    for (const nandinfo::EventFields& e : nandinfo::EventLensConfigDetails()) {
      cf::Dictionary d;
      d.Reserve(e.fields.size());
      for (std::string_view name : e.fields) d.Set(cf::Value(name), cf::Value::Bool(true));
      out.emplace_back(e.event, d);
    }
    return out;
  }();
  for (const auto& [name, set] : sets)
    if (name == event) return set;
  static const cf::Value empty = cf::Dictionary();
  return empty;
}

// The name an event goes by in the log lines.
std::string LogName(std::string_view event) {
  std::string out(event.substr(event.find("massStorage")));
  for (char& c : out)
    if (c == '.') c = '_';
  return out;
}

void MergeInto(cf::Dictionary& target, const cf::Value& source) {
  if (const cf::Dictionary* d = source.AsDictionary())
    for (const auto& [key, value] : *d) target.Set(key, value);
}

// Sends one event whose payload is `payload`, logging as `function` does;
// true when the analytics service accepted it.
bool SendAndSay(std::string_view function, std::string_view event, const cf::Value& payload) {
  const bool accepted = AnalyticsSendEventLazy(event, [payload] { return payload; });
  SayNANDInfoF("NANDInfo: %s: %s %s using AnalyticsSendEventLazy\n", std::string(function),
               accepted ? "SUCCESS in logging" : "FAILED to log", LogName(event));
  return accepted;
}

void SayEnabled(std::string_view function, std::string_view event) {
  SayNANDInfoF("NANDInfo: %s: %@ enabled=%d\n", std::string(function), cf::Value(event),
               AnalyticsIsEventUsed(event) ? 1 : 0);
}

// The FTL and storage statistics senders: each event of `events` gets the
// source cut to its field list; the union of what was accepted.
cf::Value SendEvents(std::string_view function, const cf::Value& source, std::initializer_list<std::string_view> events) {
  cf::Dictionary result;
  for (std::string_view event : events) {
    SayEnabled(function, event);
    const cf::Value payload = CreateFilteredDict(source, EventFieldSet(event));
    if (SendAndSay(function, event, payload)) MergeInto(result, payload);
  }
  return result;
}

struct ImageFigure {
  const char* field;
  uint64_t (*query)(uint32_t key);
  uint32_t key;
};

constexpr uint32_t FourCC(const char (&code)[5]) {
  return static_cast<uint32_t>(static_cast<uint8_t>(code[0])) << 24 |
         static_cast<uint32_t>(static_cast<uint8_t>(code[1])) << 16 |
         static_cast<uint32_t>(static_cast<uint8_t>(code[2])) << 8 | static_cast<uint32_t>(static_cast<uint8_t>(code[3]));
}

// The image figures of the storage statistics, asked in this order.
const ImageFigure kImageFigures[] = {
    {"EAN_imageSize_BIC", GetEANImageSize, FourCC("dBIC")},
    {"EAN_imageSize_LTH", GetEANImageSize, FourCC("dLTH")},
    {"EAN_updateCount_FW", GetEANUpdateCount, FourCC("ifw1")},
    {"EAN_updateCount_BIC", GetEANUpdateCount, FourCC("dBIC")},
    {"EAN_updateCount_LTH", GetEANUpdateCount, FourCC("dLTH")},
    {"EAN_updateCount_dConfig", GetEANUpdateCount, FourCC("dCfg")},
    {"EAN_updateCount_fConfig", GetEANUpdateCount, FourCC("fCfg")},
    {"EAN_updateCount_NonEssentialFW", GetEANUpdateCount, FourCC("nefw")},
    {"EAN_updateCount_LowPowerEM", GetEANUpdateCount, FourCC("LPEM")},
};
static_assert(FourCC("dBIC") == 0x64424943 && FourCC("LPEM") == 0x4C50454D);

constexpr std::string_view kGroupMain = "com.velmora.massstorage.NANDInfo";
constexpr std::string_view kGroupSecond = "com.velmora.massstorage.NANDInfo_2";
constexpr std::string_view kGroupSixth = "com.velmora.massstorage.NANDInfo_6";

}  // namespace

cf::Value CopyWhitelistedNANDFTLInfo(bool round) {
  const cf::Value ftl = gatherVSPFTLData();
  cf::Value result = cf::Dictionary();
  if (const cf::Dictionary* f = ftl.AsDictionary()) {
    // The cached FTL dictionary keeps the derived figures for later callers.
    cf::Dictionary cached = *f;
    for (const auto& [key, value] : gatherVSPFTLOtherData(ftl)) cached.Set(key, value);
    result = CreateFilteredDict_SigDig(ftl, FTLDigits(), round);
  } else {
    SetAPIErrorMessage("CopyWhitelistedNANDFTLInfo: Unable to gather other FTL fields");
  }
  cf::Dictionary out = *result.AsDictionary();
  out.Set(kErrorMessageField, GetAPIErrorMessage());
  return out;
}

cf::Dictionary gatherVSPOtherData() {
  cf::Dictionary out;
  const cf::Value ftl = gatherVSPFTLData();
  if (ftl.IsNull()) {
    SetAPIErrorMessage("gatherVSPOtherData: Unable to get FTL counters");
    return out;
  }
  const cf::Dictionary other = gatherVSPFTLOtherData(ftl);
  for (const char* name : {"ESR_formatWeeksSince2000", "ESR_DV_Capacity_GB", "ESR_averageSLCPECycles",
                           "ESR_averageTLCPECycles", "ESR_hostWrites", "ESR_DV_Diskfullness_BP"})
    if (const cf::Value* v = other.Find(name)) out.Set(name, *v);
  return out;
}

cf::Value CopyWhitelistedNANDMSPInfo(bool round) {
  cf::Dictionary out;
  const cf::Value msp = gatherVSPMSPData();
  if (const cf::Dictionary* m = msp.AsDictionary()) {
    const cf::Dictionary other = gatherVSPOtherData();
    for (const auto& [index, fields] : *m) {
      // A new dictionary: the whitelist is never null.
      cf::Dictionary view = *CreateFilteredDict_SigDig(fields, MSPDigits(), round).AsDictionary();
      for (const auto& [key, value] : other) view.Set(key, value);
      out.Set(index, view);
    }
  } else {
    SetAPIErrorMessage("CopyWhitelistedNANDMSPInfo: Unable to gather MSP fields");
  }
  out.Set(kErrorMessageField, GetAPIErrorMessage());
  return out;
}

cf::Value CopyWhitelistedStorageStats(bool round) {
  cf::Dictionary stats = gatherVSPOtherData();
  for (const ImageFigure& figure : kImageFigures) stats.Set(figure.field, cf::Value::UInt64(figure.query(figure.key)));
  cf::Dictionary out = *CreateFilteredDict_SigDig(stats, StorageStatsDigits(), round).AsDictionary();
  out.Set(kErrorMessageField, GetAPIErrorMessage());
  return out;
}

cf::Value createAndLogFTLFieldsToEventLensForEvent() {
  const cf::Value source = CopyWhitelistedNANDFTLInfo(false);
  return SendEvents("createAndLogFTLFieldsToEventLensForEvent", source,
                    {nandinfo::kFTLCountersEvent, nandinfo::kFTLHistogramsEvent});
}

cf::Value createAndLogStorageStatsToEventLensForEvent() {
  const cf::Value source = CopyWhitelistedStorageStats(false);
  return SendEvents("createAndLogStorageStatsToEventLensForEvent", source, {nandinfo::kStorageStatsEvent});
}

cf::Value createAndLogMSPFieldsToEventLensForEvent() {
  constexpr std::string_view kFunction = "createAndLogMSPFieldsToEventLensForEvent";
  const std::string_view event = nandinfo::kMSPCountersEvent;
  cf::Dictionary views = *CopyWhitelistedNANDMSPInfo(false).AsDictionary();
  views.Remove(kErrorMessageField);
  const size_t count = views.size();
  SayEnabled(kFunction, event);
  cf::Dictionary result;
  for (const auto& [index, view] : views) {
    cf::Dictionary payload = *CreateFilteredDict(view, EventFieldSet(event)).AsDictionary();
    payload.Set("msp_index", index);
    payload.Set("total_nof_msps", cf::Value::UInt64(count));
    if (SendAndSay(kFunction, event, payload)) {
      result.Set("msp_index", payload);
    } else {
      SetAPIErrorMessage("createAndLogMSPFieldsToEventLensForEvent: AnalyticsSendEventLazy failed to log to EL");
    }
  }
  SayNANDInfoF("NANDInfo: %s: %@ completed (total_nof_msps:%lu)\n", std::string(kFunction), cf::Value(event),
               static_cast<unsigned long>(count));
  return result;
}

cf::Value createAndLogNANDFieldsToEventLens(int selector) {
  if (!platform::AnalyticsAvailable()) {
    SetAPIErrorMessage("createAndLogNANDFieldsToEventLens: Unable call EL API AnalyticsSendEventLazy");
    return {};
  }
  switch (selector) {
    case 0: {
      const cf::Value ftl = createAndLogFTLFieldsToEventLensForEvent();
      const cf::Value msp = createAndLogMSPFieldsToEventLensForEvent();
      const cf::Value stats = createAndLogStorageStatsToEventLensForEvent();
      if (!ftl.AsDictionary()) return ftl;
      cf::Dictionary merged = *ftl.AsDictionary();  // the FTL result itself
      MergeInto(merged, msp);
      MergeInto(merged, stats);
      return merged;
    }
    case 1: return createAndLogFTLFieldsToEventLensForEvent();
    case 2: return createAndLogMSPFieldsToEventLensForEvent();
    case 3: return createAndLogStorageStatsToEventLensForEvent();
    default: return {};
  }
}

cf::Dictionary BuildGroupEventPayload(std::string_view groupName, const cf::Dictionary& group, const cf::Dictionary& tbkd,
                                      int64_t freezerBytes, int64_t capacityMB, int64_t freeMB) {
  cf::Dictionary payload;
  payload.Reserve(group.size());
  for (const auto& [field, key] : group) {
    const cf::Value* v = tbkd.Find(key);
    payload.Set(field, v ? *v : cf::Value::SInt32(0));
  }
  const auto text_or_empty = [&](const char* field, const char* key) {
    const cf::Value* v = tbkd.Find(key);
    payload.Set(field, v ? *v : cf::Value("empty"));
  };
  if (groupName == kGroupMain) text_or_empty("Error", "com.velmora.NANDInfo.Error");
  if (groupName == kGroupSecond) {
    text_or_empty("ErrorMessage", "com.velmora.NANDInfo.ErrorMessage");
    payload.Set("DiskUsageUserBlocksFree", cf::Value::SInt64(freeMB));
    payload.Set("DiskUsageUserTotalBlocks", cf::Value::SInt64(capacityMB));
  }
  if (groupName == kGroupSixth)
    payload.Set("VMFreezer_NumPhysicalWrites", cf::Value::UInt64(static_cast<uint64_t>(freezerBytes)));
  return payload;
}

void SendReferenceMapGroupEvents(const cf::Value& tbkd, int64_t freezerBytes, int64_t capacityMB, int64_t freeMB) {
  const cf::Dictionary* t = tbkd.AsDictionary();
  if (!t) return;
  // The map is parsed anew each time, as the analytics service may keep a
  // payload block past this call.
  const cf::ParseResult parsed = cf::ParseJSON(nandinfo::kEventLensRefJson);
  const cf::Dictionary* map = parsed.value.AsDictionary();
  if (!map) return;
  for (std::string_view name : nandinfo::EventLensEvents()) {
    // A group the map lacks still goes out, with its special fields only.
    const cf::Dictionary* group = map->Get(cf::Value(name)).AsDictionary();
    AnalyticsSendEventLazy(name, [name, g = group ? *group : cf::Dictionary(), tbkd_copy = *t, freezerBytes, capacityMB,
                                  freeMB] {
      return cf::Value(BuildGroupEventPayload(name, g, tbkd_copy, freezerBytes, capacityMB, freeMB));
    });
  }
}
