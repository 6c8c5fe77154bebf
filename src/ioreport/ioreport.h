// The reporting-channel client: channels published by drivers through their
// registry legends, gathered into aggregates that can be walked, pruned,
// merged and selected from, and the accessors of one channel.
//
// Aggregates and channel dictionaries are plain values. Channel dictionaries
// are shared and the accessors write their caches ("ChannelName",
// "UnitLabel") into the dictionary they are given.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "cf/value.h"
#include "platform/iokit.h"

// What every 64-bit accessor answers for a value that is missing or cannot
// be read.
inline constexpr int64_t kIOReportInvalidValue = INT64_MIN;

// Walk codes: returned by callbacks and by the walks.
inline constexpr int kIOReportIterOk = 0;
inline constexpr int kIOReportIterFailed = 0x1;    // bit 0: stop with failure
inline constexpr int kIOReportIterSkipped = 0x10;  // prune or leave out this channel
inline constexpr int kIOReportIterWalkFailed = 0x111;  // malformed aggregate, no memory

// "QueryOpts" bits.
inline constexpr uint32_t kIOReportByDriver = 0x1;
inline constexpr uint32_t kIOReportByGroup = 0x2;
inline constexpr uint32_t kIOReportPrintFailedDrivers = 0x80000000u;

// Channel formats (the low byte of a channel type).
inline constexpr uint8_t kIOReportFormatUnknown = 0;
inline constexpr uint8_t kIOReportFormatSimple = 1;
inline constexpr uint8_t kIOReportFormatState = 2;
inline constexpr uint8_t kIOReportFormatHistogram = 3;
inline constexpr uint8_t kIOReportFormatSimpleArray = 4;

// The field category that the daily collection samples.
inline constexpr uint16_t kIOReportCategoryField = 0x0100;

// A channel type: the format in bits 0-7, the categories in bits 16-31 and
// the element count in bits 32-47 (the element index above is not used).
constexpr int64_t IOReportChannelType(uint8_t format, uint16_t categories, uint16_t elements) {
  return static_cast<int64_t>(format | (uint64_t{categories} << 16) | (uint64_t{elements} << 32));
}

// Return codes this library adds to the registry's own.
inline constexpr IOReturn kIOReturnBadLegend = static_cast<IOReturn>(0xE00002C9);
inline constexpr IOReturn kIOReturnRegistryChanged = static_cast<IOReturn>(0xE00002EB);

// An error object in the Mach error domain: the code is an IOKit return
// code and the failure reason a short message (empty when none was given).
struct IOReportError {
  std::string domain;
  IOReturn code = 0;
  std::string failure_reason;

  // "Mach error 0xe00002c9: bad legend"
  std::string Description() const;
};
inline constexpr const char* kIOReportMachErrorDomain = "Mach";

// The error out-parameter: filled on failure only, and only when given.
using IOReportErrorOut = std::optional<IOReportError>*;

// A walk callback: one channel dictionary in, a walk code out.
using IOReportChannelCallback = std::function<int(const cf::Dictionary& channel)>;

// Aggregates.
cf::Value IOReportCreateAggregate(uint32_t options);
cf::Value IOReportCopyAllChannels(uint32_t options, IOReportErrorOut error);
cf::Value IOReportCopyChannelsForDriver(io_service_t driver, uint32_t options, IOReportErrorOut error);
cf::Value IOReportCopyChannelsForDrivers(const cf::Value& matching, uint32_t options, IOReportErrorOut error);
cf::Value IOReportCopyChannelsInCategories(uint16_t categories, uint32_t options, IOReportErrorOut error);
cf::Value IOReportCopyChannelsOfFormat(uint8_t format, uint32_t options, IOReportErrorOut error);
cf::Value IOReportCopyChannelsWithUnit(uint64_t unit, uint32_t options, IOReportErrorOut error);
// group and subgroup: strings or null.
cf::Value IOReportCopyChannelsInGroup(const cf::Value& group, const cf::Value& subgroup, uint32_t options,
                                      IOReportErrorOut error);
cf::Value IOReportCopyChannelsWithID(const cf::Value& matching, int64_t channelID, IOReportErrorOut error);
int IOReportSelectChannelsInGroup(const cf::Value& aggregate, const cf::Value& group, const cf::Value& subgroup,
                                  IOReportErrorOut error);
int IOReportMergeChannels(const cf::Value& destination, const cf::Value& source, IOReportErrorOut error);
// driverName, channelName, group, subgroup: strings or null; info: a
// dictionary or null.
IOReturn IOReportAddChannelDescription(const cf::Value& aggregate, uint64_t driverID, const cf::Value& driverName,
                                       int64_t channelID, int64_t channelType, const cf::Value& channelName,
                                       const cf::Value& group, const cf::Value& subgroup, const cf::Value& info,
                                       IOReportErrorOut error);
cf::Value IOReportCreateUnitInfo(uint64_t unit);
cf::Value IOReportCopyDriverName(io_service_t driver);
cf::Value IOReportCopyCurrentProcessName();

// Walks.
int IOReportIterate(const cf::Value& aggregate, const IOReportChannelCallback& callback);
int IOReportPrune(const cf::Value& aggregate, const IOReportChannelCallback& callback);
int IOReportGetChannelCount(const cf::Value& aggregate);

// One channel.
uint8_t IOReportChannelGetFormat(const cf::Dictionary& channel);
uint16_t IOReportChannelGetCategories(const cf::Dictionary& channel);
int64_t IOReportChannelGetChannelID(const cf::Dictionary& channel);
int64_t IOReportChannelGetDriverID(const cf::Dictionary& channel);
cf::Value IOReportChannelGetDriverName(const cf::Dictionary& channel);
cf::Value IOReportChannelGetGroup(const cf::Dictionary& channel);
cf::Value IOReportChannelGetSubGroup(const cf::Dictionary& channel);
std::string IOReportChannelGetChannelName(const cf::Dictionary& channel);
int64_t IOReportChannelGetUnit(const cf::Dictionary& channel);
cf::Value IOReportChannelGetUnitLabel(const cf::Dictionary& channel);
cf::Value IOReportChannelCopyDescription(const cf::Dictionary& channel, const cf::Value& unused, const char* prefix);

// Adds the channels of one driver's legend (the "IOReportLegend" value) to
// an aggregate, stopping quietly at the first malformed entry. The registry
// reading above uses it; it is apart so that legends can be read without a
// registry.
IOReturn addLegendChannels(const cf::Value& aggregate, const cf::Value& legend, uint64_t driverID,
                           const cf::Value& driverName, IOReportErrorOut error);
