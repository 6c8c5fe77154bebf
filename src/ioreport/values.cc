// Reading a sample's values by format, histogram bucket bounds and unit
// conversions.
#include <cmath>
#include <cstring>
#include <limits>

#include "ioreport/internal.h"
#include "ioreport/samples.h"

using namespace ioreport_internal;

namespace {

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

// Offsets within an element.
constexpr size_t kTypeOffset = 16;
constexpr size_t kTimeOffset = 24;
constexpr size_t kValuesOffset = 32;

// A sample's element bytes, when they hold at least one element and the
// first element has the format asked for.
struct Elements {
  const uint8_t* bytes = nullptr;
  size_t count = 0;

  uint64_t At(size_t element, size_t offset) const {
    uint64_t v;
    std::memcpy(&v, bytes + element * kIOReportElementSize + offset, 8);
    return v;
  }
  int64_t Value(size_t element, size_t slot) const {
    return static_cast<int64_t>(At(element, kValuesOffset + 8 * slot));
  }
};

std::optional<Elements> elementsOf(const cf::Dictionary& sample, uint8_t format) {
  const cf::Data* data = sample.Get("RawElements").AsData();
  if (!data || data->size() < kIOReportElementSize) return std::nullopt;
  if ((*data)[kTypeOffset] != format) return std::nullopt;
  return Elements{data->data(), data->size() / kIOReportElementSize};
}

// State and histogram samples: the legend's format and element count must
// agree with the elements the sample holds.
std::optional<Elements> checkedElements(const cf::Dictionary& sample, uint8_t format) {
  const auto type = channelType(sample);
  if (!type || static_cast<uint8_t>(*type) != format) return std::nullopt;
  const auto elements = elementsOf(sample, format);
  if (!elements || ((*type >> 32) & 0xFFFF) != elements->count) return std::nullopt;
  return elements;
}

int64_t valueAt(const cf::Dictionary& sample, uint8_t format, int index, size_t slot) {
  const auto elements = checkedElements(sample, format);
  if (!elements || index < 0 || static_cast<size_t>(index) >= elements->count) return kIOReportInvalidValue;
  return elements->Value(static_cast<size_t>(index), slot);
}

int countOf(const cf::Dictionary& channel, uint8_t format) {
  const auto type = channelType(channel);
  if (!type || static_cast<uint8_t>(*type) != format) return -1;
  return static_cast<int>((*type >> 32) & 0xFFFF);
}

// A unit's scale as a fraction; none for special units.
struct Fraction {
  double num = 1;
  double den = 1;
};
std::optional<Fraction> scaleOf(uint64_t unit) {
  Fraction f;
  if ((unit >> 48) & 0xFF) return std::nullopt;
  const uint64_t constant = unit & 0x7FFFFFFF;
  const double c = constant == 0 ? 1 : static_cast<double>(constant);
  if (unit & 0x80000000) f.den *= c;
  else f.num *= c;
  const int decimal = static_cast<int>((unit >> 32) & 0xFF);
  if (decimal > 127) f.num *= std::pow(10.0, decimal - 127);
  else if (decimal != 0 && decimal < 127) f.den *= std::pow(10.0, 127 - decimal);
  const int binary = static_cast<int>((unit >> 40) & 0xFF);
  if (binary > 127) f.num = std::ldexp(f.num, binary - 127);
  else if (binary != 0 && binary < 127) f.den = std::ldexp(f.den, 127 - binary);
  return f;
}

}  // namespace

int64_t IOReportSimpleGetIntegerValue(const cf::Dictionary& sample, int64_t* unit) {
  if (unit) *unit = IOReportChannelGetUnit(sample);
  const auto elements = elementsOf(sample, kIOReportFormatSimple);
  if (!elements || elements->count != 1) return kIOReportInvalidValue;
  return elements->Value(0, 0);
}

int64_t IOReportArrayGetValueAtIndex(const cf::Dictionary& sample, int index) {
  const auto elements = elementsOf(sample, kIOReportFormatSimpleArray);
  if (!elements || index < 0 || static_cast<size_t>(index) / 4 >= elements->count) return kIOReportInvalidValue;
  return elements->Value(static_cast<size_t>(index) / 4, static_cast<size_t>(index) % 4);
}

int IOReportStateGetCount(const cf::Dictionary& channel) { return countOf(channel, kIOReportFormatState); }

int64_t IOReportStateGetIDForIndex(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatState, index, 0);
}
int64_t IOReportStateGetInTransitions(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatState, index, 1);
}
int64_t IOReportStateGetResidency(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatState, index, 2);
}

int IOReportStateGetIndexForID(const cf::Dictionary& sample, int64_t id) {
  const auto elements = checkedElements(sample, kIOReportFormatState);
  if (!elements) return -1;
  for (size_t i = elements->count; i-- > 0;)
    if (elements->Value(i, 0) == id) return static_cast<int>(i);
  return -1;
}

cf::Value IOReportStateGetNameForIndex(const cf::Dictionary& sample, int index) {
  if (const cf::Array* cached = sample.Get("StateNames").AsArray()) {
    if (index < 0) return cf::Value();
    const cf::Value& name = cached->at(static_cast<size_t>(index));
    return name.AsString() ? name : cf::Value();
  }
  const int count = IOReportStateGetCount(sample);
  if (count < 0) return cf::Value();
  cf::Array names;
  for (int i = 0; i < count; ++i) {
    const int64_t id = IOReportStateGetIDForIndex(sample, i);
    if (id == kIOReportInvalidValue) return cf::Value();
    const auto text = renderIDAsText(static_cast<uint64_t>(id));
    if (!text) return cf::Value();
    names.Append(*text);
  }
  cf::Dictionary(sample).Set("StateNames", names);
  if (index < 0 || index >= count) return cf::Value();
  return names[static_cast<size_t>(index)];
}

double IOReportStateGetDutyCycle(const cf::Dictionary& sample, int index) {
  const auto elements = checkedElements(sample, kIOReportFormatState);
  if (!elements || elements->count == 0 || index < 0 || static_cast<size_t>(index) >= elements->count) return kNaN;
  double total = 0;
  for (size_t i = 0; i < elements->count; ++i) {
    const int64_t residency = elements->Value(i, 2);
    if (residency == kIOReportInvalidValue) return kNaN;
    total += static_cast<double>(residency);
  }
  if (total == 0) return kNaN;
  return static_cast<double>(elements->Value(static_cast<size_t>(index), 2)) / total;
}

int IOReportStateGetCurrent(const cf::Dictionary& sample) {
  const auto elements = checkedElements(sample, kIOReportFormatState);
  if (!elements) return -1;
  int current = -1;
  uint64_t latest = 0;  // update times are unsigned
  for (size_t i = 0; i < elements->count; ++i) {
    const uint64_t time = elements->At(i, kTimeOffset);
    if (time > latest) {
      latest = time;
      current = static_cast<int>(i);
    }
  }
  return current;
}

int IOReportHistogramGetBucketCount(const cf::Dictionary& channel) {
  return countOf(channel, kIOReportFormatHistogram);
}
int64_t IOReportHistogramGetBucketHits(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatHistogram, index, 0);
}
int64_t IOReportHistogramGetBucketMinValue(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatHistogram, index, 1);
}
int64_t IOReportHistogramGetBucketMaxValue(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatHistogram, index, 2);
}
int64_t IOReportHistogramGetBucketSum(const cf::Dictionary& sample, int index) {
  return valueAt(sample, kIOReportFormatHistogram, index, 3);
}

int64_t IOReportHistogramGetMinValue(const cf::Dictionary& sample) {
  const auto elements = checkedElements(sample, kIOReportFormatHistogram);
  if (!elements) return kIOReportInvalidValue;
  for (size_t i = 0; i < elements->count; ++i)
    if (elements->Value(i, 0) != 0) return elements->Value(i, 1);
  return kIOReportInvalidValue;
}

int64_t IOReportHistogramGetMaxValue(const cf::Dictionary& sample) {
  const auto elements = checkedElements(sample, kIOReportFormatHistogram);
  if (!elements) return kIOReportInvalidValue;
  for (size_t i = elements->count; i-- > 0;)
    if (elements->Value(i, 0) != 0) return elements->Value(i, 2);
  return kIOReportInvalidValue;
}

IOReturn IOReportHistogramGetBucketBounds(const cf::Dictionary& channel, int index, int64_t* lower, int64_t* upper) {
  const cf::Array* bounds = channel.Get("ProcessedChannelConfig").AsArray();
  cf::Array computed;
  if (!bounds) {
    const int capacity = IOReportHistogramGetBucketCount(channel);
    const cf::Dictionary* info = channel.Get("IOReportChannelInfo").AsDictionary();
    const cf::Data* config = info ? info->Get("IOReportChannelConfig").AsData() : nullptr;
    if (capacity < 0 || !config || config->size() < 16) return kIOReturnError;
    int64_t previous = 0;
    for (size_t at = 0; at + 16 <= config->size(); at += 16) {
      uint32_t width, exponential;
      int32_t buckets;
      std::memcpy(&width, config->data() + at, 4);
      std::memcpy(&exponential, config->data() + at + 4, 4);
      std::memcpy(&buckets, config->data() + at + 12, 4);
      // Bounds restart in every segment; each must still rise above the last.
      // Exact integers; a bound beyond 64 signed bits cannot be stored.
      int64_t bound = 1;
      for (int32_t j = 0; j < buckets; ++j) {
        const bool overflow = exponential ? __builtin_mul_overflow(bound, int64_t{width}, &bound)
                                          : __builtin_mul_overflow(int64_t{width}, int64_t{j} + 1, &bound);
        if (overflow || bound <= previous) return kIOReturnError;
        if (computed.size() >= static_cast<size_t>(capacity)) return kIOReturnError;
        previous = bound;
        computed.Append(cf::Value::SInt64(previous));
      }
    }
    cf::Dictionary(channel).Set("ProcessedChannelConfig", computed);
    bounds = &computed;
  }
  if (index < 0 || static_cast<size_t>(index) >= bounds->size()) return kIOReturnError;
  const auto bound = [&](size_t i) { return numberBits(bounds->at(i)).value_or(kIOReportInvalidValue); };
  if (upper) *upper = bound(static_cast<size_t>(index));
  if (lower) *lower = index == 0 ? 0 : bound(static_cast<size_t>(index) - 1);
  return kIOReturnSuccess;
}

double IOReportScaleValue(uint64_t value, uint64_t fromUnit, uint64_t toUnit) {
  if ((fromUnit >> 56) != (toUnit >> 56)) return kNaN;
  const auto from = scaleOf(fromUnit);
  const auto to = scaleOf(toUnit);
  if (!from || !to) return kNaN;
  return static_cast<double>(value) * from->num / from->den / to->num * to->den;
}
