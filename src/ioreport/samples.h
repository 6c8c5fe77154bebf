// Reading channel values: subscribing to channels through the reporting
// hub, taking samples, reading values by format, deltas between samples and
// conversions between units.
//
// A sample aggregate is a copy of the subscribed channels whose channel
// dictionaries also hold "RawElements", the channel's record of 64-byte
// elements; it owns those bytes and outlives the subscription.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "cf/value.h"
#include "ioreport/ioreport.h"

// A registration with the hub: the connection and the shared buffer it
// fills. The buffer is unmapped and the connection closed with the last
// reference.
class IOReportSubscription {
 public:
  IOReportSubscription() = default;
  ~IOReportSubscription();
  IOReportSubscription(const IOReportSubscription&) = delete;
  IOReportSubscription& operator=(const IOReportSubscription&) = delete;

  io_connect_t connection = 0;
  uint64_t buffer_token = 0;
  mach_vm_address_t mapped_address = 0;
  mach_vm_size_t mapped_size = 0;
};
using IOReportSubscriptionRef = std::shared_ptr<IOReportSubscription>;

// The size of one element of a channel record.
inline constexpr size_t kIOReportElementSize = 64;

// allocator and options are accepted and not used.
IOReportSubscriptionRef IOReportCreateSubscription(const void* allocator, const cf::Value& channels,
                                                   cf::Value* subscribed, uint64_t options, IOReportErrorOut error);
cf::Value IOReportCreateSamples(const IOReportSubscriptionRef& subscription, const cf::Value& subscribed,
                                IOReportErrorOut error);
// raw: data.
cf::Value IOReportCreateSamplesRaw(const cf::Value& channels, const cf::Value& raw, IOReportErrorOut error);
// Later less earlier, channel by channel, with the later aggregate's
// nesting; a channel without an earlier partner keeps its own values.
cf::Value IOReportCreateSamplesDelta(const cf::Value& earlier, const cf::Value& later, IOReportErrorOut error);
// One pair of channel samples; the result copies the earlier one.
cf::Value IOReportSampleCreateDelta(const cf::Value& earlier, const cf::Value& later, IOReportErrorOut error);

int64_t IOReportSimpleGetIntegerValue(const cf::Dictionary& sample, int64_t* unit);
int64_t IOReportArrayGetValueAtIndex(const cf::Dictionary& sample, int index);

int IOReportStateGetCount(const cf::Dictionary& channel);
int64_t IOReportStateGetIDForIndex(const cf::Dictionary& sample, int index);
int64_t IOReportStateGetInTransitions(const cf::Dictionary& sample, int index);
int64_t IOReportStateGetResidency(const cf::Dictionary& sample, int index);
int IOReportStateGetIndexForID(const cf::Dictionary& sample, int64_t id);
cf::Value IOReportStateGetNameForIndex(const cf::Dictionary& sample, int index);
double IOReportStateGetDutyCycle(const cf::Dictionary& sample, int index);
int IOReportStateGetCurrent(const cf::Dictionary& sample);

int IOReportHistogramGetBucketCount(const cf::Dictionary& channel);
int64_t IOReportHistogramGetBucketHits(const cf::Dictionary& sample, int index);
int64_t IOReportHistogramGetBucketMinValue(const cf::Dictionary& sample, int index);
int64_t IOReportHistogramGetBucketMaxValue(const cf::Dictionary& sample, int index);
int64_t IOReportHistogramGetBucketSum(const cf::Dictionary& sample, int index);
int64_t IOReportHistogramGetMinValue(const cf::Dictionary& sample);
int64_t IOReportHistogramGetMaxValue(const cf::Dictionary& sample);
// Either bound may be omitted.
IOReturn IOReportHistogramGetBucketBounds(const cf::Dictionary& channel, int index, int64_t* lower, int64_t* upper);

double IOReportScaleValue(uint64_t value, uint64_t fromUnit, uint64_t toUnit);

// One line per element, each beginning with prefix; null for a sample of
// unknown format or one whose lines cannot all be made.
cf::Value IOReportSampleCopyDescription(const cf::Dictionary& sample, const cf::Value& unused, const char* prefix);
// Writes the string's bytes; a short write is an error of its own.
IOReturn IOReportWriteStringUTF8(int fd, const cf::Value& string);

// Cuts a raw buffer into the channels' records without copying it first;
// IOReportCreateSamplesRaw and the subscription's samples both end here.
cf::Value createSamplesFromBytes(const cf::Value& channels, std::string_view raw, IOReportErrorOut error);
