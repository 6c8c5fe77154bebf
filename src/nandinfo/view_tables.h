// The fixed tables of the analytics views: the three significant-digit
// whitelists, the field list of each analytics event, and the reference map
// that groups NAND info keys into the group events. Data only.
#pragma once

#include <span>
#include <string_view>

namespace nandinfo {

// A whitelisted field and its number of significant digits. Each whitelist is
// sorted by name in byte order, with no name twice, so a lookup may
// binary-search it; a name not in it is dropped from the view.
struct SigDigits {
  std::string_view name;
  int digits;
};

// WhitelistedRawNANDFTLCounters_SigDigDict (931 names).
std::span<const SigDigits> WhitelistedRawNANDFTLCounters();
// WhitelistedRawNANDMSPCounters_SigDigDict (261 names).
std::span<const SigDigits> WhitelistedRawNANDMSPCounters();
// WhitelistedStorageStats_SigDigDict (16 names).
std::span<const SigDigits> WhitelistedStorageStats();

// One event of EventLensConfigDetails: its name and the fields it carries,
// in stored order.
struct EventFields {
  std::string_view event;
  std::span<const std::string_view> fields;
};
inline constexpr std::string_view kFTLCountersEvent = "com.velmora.massStorage.NANDInfo.FTLCounters_1";
inline constexpr std::string_view kFTLHistogramsEvent = "com.velmora.massStorage.NANDInfo.FTLHistograms_1";
inline constexpr std::string_view kMSPCountersEvent = "com.velmora.massStorage.NANDInfo.MSPCounters_1";
inline constexpr std::string_view kStorageStatsEvent = "com.velmora.massStorage.NANDInfo.StorageStats_1";
// The four events (FTL counters 364 names, FTL histograms 570, MSP counters
// 295, storage statistics 17), in that order.
std::span<const EventFields> EventLensConfigDetails();
// The fields of one of the four events; empty for any other name.
std::span<const std::string_view> EventLensFields(std::string_view event);

// kEventLensRefJson: the reference map, a JSON object of 36 groups, each
// analytics field name -> a NAND info key, kNANDInfoTbkdPlaceholder or
// kNANDInfoLogELOnly (1,043 entries in all).
extern const std::string_view kEventLensRefJson;
inline constexpr std::string_view kNANDInfoTbkdPlaceholder = "tbkd.key.placeholder";
inline constexpr std::string_view kNANDInfoLogELOnly = "log.only.to.EL";
// kEventLensEvents: the 36 group names in send order.
std::span<const std::string_view> EventLensEvents();

}  // namespace nandinfo
