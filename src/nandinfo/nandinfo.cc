#include "nandinfo/nandinfo.h"

#include <cstdio>
#include <optional>
#include <string>

#include "nandinfo/controller.h"
#include "nandinfo/helpers.h"
#include "nandinfo/nandinfo_dict.h"
#include "parsers/kcdata.h"
#include "platform/analytics.h"
#include "platform/clock.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/purgewell.h"
#include "platform/stackshot.h"
#include "platform/system.h"

namespace {

constexpr const char* kPurgeable = "ESR_Purgewell_totalPurgeable";
constexpr const char* kNonPurgeable = "ESR_Purgewell_totalNonPurgeable";

// A number of the dictionary read as a signed 32-bit number, or nothing.
std::optional<int32_t> S32(const cf::Dictionary& d, const std::string& key) {
  const cf::Number* n = d.Get(key).AsNumber();
  if (!n) return std::nullopt;
  return n->AsSInt32();
}

int64_t WeeksSince2000(int32_t t) {
  if (static_cast<uint32_t>(t) <= 946684800u) return 0;
  return (static_cast<int64_t>(t) - 946684800) / 604800;
}

}  // namespace

bool IsEventLensDay(char first, int64_t seconds) {
  int64_t x = 10;
  if (first >= '0' && first <= '9') x = first;
  else if (first >= 'A' && first <= 'F') x = first + 1;
  const int64_t day = seconds / 86400;
  return ((x ^ day) & 1) == 0;
}

cf::Dictionary getPurgewellInfo() {
  cf::Dictionary out;
  if (!platform::PurgewellAvailable()) return out;
  cf::Dictionary request;
  request.Set("PURGEWELL_VOLUME", "/private/var");
  const cf::Value answer = PurgewellCopyItemizedPurgeableSpaceWithInfo(request);
  const cf::Dictionary* a = answer.AsDictionary();
  if (!a) {
    SetAPIErrorMessage("getPurgewellInfo: unable to get output from PurgewellCopyItemizedPurgeableSpaceWithInfo");
    return out;
  }
  if (a->Contains("com.velmora.NANDInfo.Purgewell.Error")) return out;
  if (const cf::Value* v = a->Find("PURGEWELL_TOTAL_AVAILABLE")) out.Set(kPurgeable, *v);
  if (const cf::Value* v = a->Find("PURGEWELL_NONPURGEABLE_AMOUNT")) out.Set(kNonPurgeable, *v);
  return out;
}

cf::Dictionary CopyVMFreezerNANDInfo() {
  cf::Dictionary out;
  stackshot_config_t* config = stackshot_config_create();
  if (!config) return out;
  const void* buffer = nullptr;
  if (stackshot_config_set_flags(config, 0x10000) == 0 && stackshot_capture_with_config(config) == 0 &&
      (buffer = stackshot_config_get_stackshot_buffer(config)) != nullptr) {
    const auto* start = static_cast<const uint8_t*>(buffer);
    const uint8_t* end = start + stackshot_config_get_stackshot_size(config);
    const void* iostats = nullptr;
    if (getIOStatsWithThreadnameFromKCData(start, end, kVMFreezerThreadName, &iostats)) {
      const uint64_t written = KCDataDiskWriteBytes(iostats);
      out.Set("ESR_VMFreezer_bytesWritten", cf::Value::UInt64(written));
      out.Set(kNANDInfoVMFreezerNumPhysicalWritesKey, cf::Value::UInt64(written));
    }
  }
  stackshot_config_dealloc(config);
  return out;
}

cf::Dictionary gatherVSPFTLOtherData(const cf::Value& ftl_value) {
  cf::Dictionary out = getPurgewellInfo();
  for (const auto& [key, value] : CopyVMFreezerNANDInfo()) out.Set(key, value);

  const cf::Value usage = DVCopyAnswer(kDVQDiskUsage);
  const int64_t capacity = DiskUsageMiB(usage, kDVQDiskUsageTotalDiskCapacity);
  const int64_t available = DiskUsageMiB(usage, kDVQDiskUsageTotalDataAvailable);
  out.Set("ESR_DV_Capacity_GB", cf::Value::UInt64(static_cast<uint64_t>(
                                    GetUserCapacityInGB(static_cast<uint32_t>(capacity)))));
  if (available >= 1) out.Set("ESR_DV_Diskfullness_BP", cf::Value::SInt64(capacity == 0 ? 0 : available * 10000 / capacity));
  out.Set("ESR_storeDemoMode", cf::Value::SInt32(StoreDemoModeEnabled() ? 1 : 0));

  const cf::Dictionary* ftl = ftl_value.AsDictionary();
  if (!ftl) {
    SetAPIErrorMessage("gatherVSPFTLOtherData: ftlDict is NULL");
    return out;
  }
  const auto user_start = S32(*ftl, "userPartitionStart");
  const auto intermediate_start = S32(*ftl, "intermediatePartitionStart");
  if (user_start && intermediate_start)
    out.Set("ESR_intermediatePartitionSize", cf::Value::SInt64(int64_t{*user_start} - *intermediate_start));
  if (const auto t = S32(*ftl, "utilFormatTime")) out.Set("ESR_formatWeeksSince2000", cf::Value::SInt64(WeeksSince2000(*t)));
  for (const char* name : {"averageSLCPECycles", "averageTLCPECycles", "hostWrites"})
    if (const cf::Value* v = ftl->Find(name)) out.Set(std::string("ESR_") + name, *v);

  int64_t most = 0;
  for (int i = 0; i < 8; ++i) {
    const int64_t sum = int64_t{S32(*ftl, "numBootBlockRefreshSuccess_" + std::to_string(i)).value_or(0)} +
                        S32(*ftl, "numBootBlockRefreshFail_" + std::to_string(i)).value_or(0);
    if (i == 0 || sum > most) most = sum;
  }
  out.Set("ESR_numBootBlockRefreshes_max", cf::Value::SInt64(most));

  if (const cf::Number* per_msp = ftl->Get("mspBootBlockCountPerMsp").AsNumber()) {
    const uint64_t n = per_msp->AsUInt64();
    for (const char* kind : {"Read", "Prog", "Erase"}) {
      const std::string prefix = std::string("mspBootBlock") + kind + "Fails_";
      int64_t main_sum = 0, backup_sum = 0;
      for (uint64_t m = 0; m < 8; ++m) {
        const uint64_t base = m * n;
        main_sum += S32(*ftl, prefix + std::to_string(base)).value_or(0);
        for (uint64_t k = 1; k <= 3; ++k) backup_sum += S32(*ftl, prefix + std::to_string(base + k)).value_or(0);
      }
      out.Set("ESR_mspBootBlock" + std::string(kind) + "Fails_main", cf::Value::SInt64(main_sum));
      out.Set("ESR_mspBootBlock" + std::string(kind) + "Fails_backup", cf::Value::SInt64(backup_sum));
    }
  }
  return out;
}

cf::Value CopyNANDInfo() {
  VSPParseCxt context;
  nand_exporter_t* exporter = nullptr;
  if (!gatherVSPStatsData(&exporter, &context)) {
    if (exporter && exporter->releaseContext) exporter->releaseContext(&context);
    cf::Dictionary error;
    error.Set(std::string(kNANDInfoErrorKey), std::string(kNANDInfoErrorValue));
    error.Set(std::string(kNANDInfoErrorMessageKey), std::string(kNANDInfoErrorMessageValue));
    return error;
  }
  cf::Dictionary out = BuildNANDInfoDictFromStatsCxt(context, false);
  const cf::Dictionary purgeable = getPurgewellInfo();
  if (const cf::Value* v = purgeable.Find(kPurgeable)) out.Set("com.velmora.NANDInfo.Purgewell.TotalPurgeableBytes", *v);
  if (const cf::Value* v = purgeable.Find(kNonPurgeable))
    out.Set("com.velmora.NANDInfo.Purgewell.TotalNonPurgeableBytes", *v);
  exporter->releaseContext(&context);
  return out;
}

cf::Value CopyNANDInfoWithOptions(uint64_t options) {
  if (options & 2) {
    SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: testing ...");
    return createAndLogNANDFieldsToEventLens(0);
  }
  char session[100] = {};
  size_t size = sizeof session;
  const bool analytics_day = platform::Sysctl("kern.bootsessionuuid", session, &size) == 0 &&
                             IsEventLensDay(session[0], static_cast<int64_t>(platform::Now()));

  std::optional<cf::Dictionary> result;
  if (analytics_day) {
    SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: logging FTL data to EL");
    if (options & 1) {
      SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: logging FTL big views to EL");
      const cf::Value ftl = createAndLogNANDFieldsToEventLens(1);
      if (const cf::Dictionary* d = ftl.AsDictionary()) {
        result = *d;
      } else {
        SetAPIErrorMessage("CopyNANDInfoWithOptions: Unable to log FTL Fields to EL");
        SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: Unable to log FTL Fields to EL");
      }
    }
  }
  for (const auto& [selector, name] : {std::pair<int, const char*>{2, "MSP"}, {3, "StorageStats"}}) {
    SayNANDInfo(std::string("NANDInfo: CopyNANDInfoWithOptions: logging ") + (selector == 2 ? "MSP big view" : "StorageStats view") +
        " to EL");
    const cf::Value view = createAndLogNANDFieldsToEventLens(selector);
    if (const cf::Dictionary* d = view.AsDictionary()) {
      if (result)
        for (const auto& [key, value] : *d) result->Set(key, value);
    } else {
      SetAPIErrorMessage("CopyNANDInfoWithOptions: Unable to log %s Fields to EL", name);
      SayNANDInfo(std::string("NANDInfo: CopyNANDInfoWithOptions: Unable to log ") + name + " Fields to EL");
    }
  }

  cf::Value tbkd;
  if (analytics_day && (options & 1)) {
    SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: logging FTL smaller views to EL");
    if (platform::AnalyticsAvailable()) {
      const cf::Dictionary esr = gatherVSPFTLOtherData(cf::Value());
      const int64_t freezer = S32(esr, "ESR_VMFreezer_bytesWritten").value_or(0);
      const int32_t capacity_mb =
          static_cast<int32_t>(static_cast<uint32_t>(S32(esr, "ESR_DV_Capacity_GB").value_or(0)) << 10);
      const int64_t free_mb = int64_t{S32(esr, "ESR_DV_Diskfullness_BP").value_or(0)} * capacity_mb / 10000;
      const cf::Value groups_tbkd = CopyNANDInfo();
      if (!groups_tbkd.IsNull()) SendReferenceMapGroupEvents(groups_tbkd, freezer, capacity_mb, free_mb);
    }
  } else if (!analytics_day) {
    SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: obtaining FTL data for TBKD");
    tbkd = CopyNANDInfo();
    if (tbkd.IsNull()) {
      SetAPIErrorMessage("CopyNANDInfoWithOptions: Unable to get FTL Fields for TBKD");
      SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: Unable to get FTL Fields for TBKD");
    }
  }
  if (result) result->Set("com.velmora.NANDInfo.ErrorMessage", GetAPIErrorMessage());
  if (analytics_day) {
    if (result) result->Set("ESR_APIErrorMessage", GetAPIErrorMessage());
    SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: returning EL dictionary");
    return result ? cf::Value(*result) : cf::Value();
  }
  SayNANDInfo("NANDInfo: CopyNANDInfoWithOptions: returning TBKD dictionary");
  return tbkd;
}
