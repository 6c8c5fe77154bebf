// Samples as text, and text to a descriptor.
#include <cmath>
#include <cstring>

#include "cf/format.h"
#include "ioreport/internal.h"
#include "ioreport/samples.h"
#include "platform/files.h"

using namespace ioreport_internal;

namespace {

constexpr uint64_t kSecondsUnit = 0x0100000000000000;
constexpr IOReturn kIOReturnIOError = static_cast<IOReturn>(0xE00002CA);
constexpr IOReturn kIOReturnShortWrite = static_cast<IOReturn>(0xE00002E7);

// The number of whole elements the sample holds, when its first has the
// channel's format.
size_t elementCount(const cf::Dictionary& sample, uint8_t format) {
  const cf::Data* data = sample.Get("RawElements").AsData();
  if (!data || data->size() < kIOReportElementSize || (*data)[16] != format) return 0;
  return data->size() / kIOReportElementSize;
}

bool present(int64_t v) { return v != kIOReportInvalidValue; }

}  // namespace

cf::Value IOReportSampleCopyDescription(const cf::Dictionary& sample, const cf::Value&, const char* prefix) {
  const std::string lead = prefix ? prefix : "";
  const uint8_t format = IOReportChannelGetFormat(sample);
  if (format == kIOReportFormatUnknown || format > kIOReportFormatSimpleArray) return cf::Value();
  const cf::Value unit = IOReportChannelGetUnitLabel(sample);
  const size_t count = elementCount(sample, format);
  if (count == 0) return cf::Value();
  std::string name = IOReportChannelGetChannelName(sample);
  if (!isUTF8(name)) {
    // A name that is not text goes by the channel ID of its first element.
    uint64_t id;
    std::memcpy(&id, sample.Get("RawElements").AsData()->data() + 8, 8);
    name = cf::Format("%#llx", id).substr(0, 9);
  }
  // What every state of a state channel shares is worked out once, not once
  // per state: a legend may claim 65535 states.
  double state_total = 0;
  bool state_names = true;
  for (size_t k = 0; format == kIOReportFormatState && k < count; ++k)
    state_total += static_cast<double>(IOReportStateGetResidency(sample, static_cast<int>(k)));
  std::string text;
  for (size_t k = 0; k < count; ++k) {
    const int i = static_cast<int>(k);
    switch (format) {
      case kIOReportFormatSimple: {
        const int64_t value = IOReportSimpleGetIntegerValue(sample, nullptr);
        if (!present(value)) return cf::Value();
        text += cf::Format("%s%32s = { %12lld %@ }\n", lead, name, value, unit);
        break;
      }
      case kIOReportFormatState: {
        const int64_t transitions = IOReportStateGetInTransitions(sample, i);
        const int64_t residency = IOReportStateGetResidency(sample, i);
        if (!present(transitions) || !present(residency)) return cf::Value();
        cf::Value state = state_names ? IOReportStateGetNameForIndex(sample, i) : cf::Value();
        // Names are kept in the sample once all of them render; when none
        // was kept, no index has one.
        if (state.IsNull() && !sample.Get("StateNames").AsArray()) state_names = false;
        if (state.IsNull())
          state = cf::Format("%#llx", static_cast<uint64_t>(IOReportStateGetIDForIndex(sample, i))).substr(0, 19);
        const double seconds =
            IOReportScaleValue(static_cast<uint64_t>(residency), static_cast<uint64_t>(IOReportChannelGetUnit(sample)),
                               kSecondsUnit);
        text += cf::Format("%s%20s[%8s] = { # %-8llu %9.3e %s / %4.1f%% }\n", lead, name, state,
                           static_cast<uint64_t>(transitions), seconds, "s",
                           (state_total == 0 ? std::nan("") : static_cast<double>(residency) / state_total) * 100);
        break;
      }
      case kIOReportFormatHistogram: {
        int64_t lower = 0, upper = 0;
        const int64_t hits = IOReportHistogramGetBucketHits(sample, i);
        if (!present(hits) || IOReportHistogramGetBucketBounds(sample, i, &lower, &upper) != kIOReturnSuccess)
          return cf::Value();
        if (hits != 0) {
          text += cf::Format("%s%20s[%12lld - %12lld %@] = { m %12lld; M %12lld; s %12lld; # %12llu }\n", lead, name,
                             lower, upper, unit, IOReportHistogramGetBucketMinValue(sample, i),
                             IOReportHistogramGetBucketMaxValue(sample, i), IOReportHistogramGetBucketSum(sample, i),
                             static_cast<uint64_t>(hits));
        } else {
          text += cf::Format("%s%20s[%12lld - %12lld %@] = { <no hits>; # 0 }\n", lead, name, lower, upper, unit);
        }
        break;
      }
      default:
        text += "arrays unsupported?";
        break;
    }
  }
  return text;
}

IOReturn IOReportWriteStringUTF8(int fd, const cf::Value& string) {
  const cf::String* text = string.AsString();
  if (!text) return kIOReturnBadArgument;
  if (!isUTF8(*text)) return kIOReturnNoMemory;  // no UTF-8 form to write
  const ssize_t written = platform::WriteToDescriptor(fd, *text);
  if (written < 0) return kIOReturnIOError;
  if (static_cast<size_t>(written) != text->size()) return kIOReturnShortWrite;
  return kIOReturnSuccess;
}
