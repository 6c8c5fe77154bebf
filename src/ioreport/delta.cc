// Differences between two samples of the same channels.
#include <cstring>

#include "ioreport/internal.h"
#include "ioreport/samples.h"

using namespace ioreport_internal;

namespace {

constexpr IOReturn kIOReturnUnknownFormat = static_cast<IOReturn>(0xE00002E6);
constexpr size_t kValuesOffset = 32;
constexpr int kMaxDepth = 32;

int64_t slot(const cf::Data& d, size_t element, size_t i) {
  int64_t v;
  std::memcpy(&v, d.data() + element * kIOReportElementSize + kValuesOffset + 8 * i, 8);
  return v;
}
void setSlot(cf::Data& d, size_t element, size_t i, int64_t v) {
  std::memcpy(d.data() + element * kIOReportElementSize + kValuesOffset + 8 * i, &v, 8);
}

// Element bytes of a whole number of elements, at least one, of the format.
const cf::Data* elementData(const cf::Dictionary& sample, uint8_t format) {
  const cf::Data* d = sample.Get("RawElements").AsData();
  if (!d || d->size() < kIOReportElementSize || d->size() % kIOReportElementSize != 0) return nullptr;
  return (*d)[16] == format ? d : nullptr;
}

bool present(int64_t v) { return v != kIOReportInvalidValue; }

// The later sample less the earlier one, into result's "RawElements".
IOReturn difference(const cf::Dictionary& earlier, const cf::Dictionary& later, cf::Dictionary& result,
                    IOReportErrorOut error) {
  const uint8_t format = IOReportChannelGetFormat(later);
  if (IOReportChannelGetFormat(earlier) != format) {
    setError(error, kIOReturnBadArgument, "mismatched formats");
    return kIOReturnBadArgument;
  }
  if (format == kIOReportFormatUnknown || format > kIOReportFormatSimpleArray) {
    setError(error, kIOReturnUnknownFormat, "unknown report format");
    return kIOReturnUnknownFormat;
  }
  const cf::Data* e = elementData(earlier, format);
  const cf::Data* l = elementData(later, format);
  if (!e || !l || e->size() != l->size()) return kIOReturnError;
  const size_t count = l->size() / kIOReportElementSize;
  cf::Data out = *e;
  for (size_t k = 0; k < count; ++k)
    for (size_t i = 0; i < 4; ++i) setSlot(out, k, i, kIOReportInvalidValue);
  switch (format) {
    case kIOReportFormatSimple: {
      if (count != 1 || !present(slot(*l, 0, 0)) || !present(slot(*e, 0, 0))) return kIOReturnError;
      setSlot(out, 0, 0, static_cast<int64_t>(static_cast<uint64_t>(slot(*l, 0, 0)) - static_cast<uint64_t>(slot(*e, 0, 0))));
      break;
    }
    case kIOReportFormatState: {
      out = *l;
      for (size_t k = 0; k < count; ++k)
        for (size_t i : {1, 2}) {
          if (!present(slot(*l, k, i)) || !present(slot(*e, k, i))) return kIOReturnError;
          setSlot(out, k, i, static_cast<int64_t>(static_cast<uint64_t>(slot(*l, k, i)) - static_cast<uint64_t>(slot(*e, k, i))));
        }
      break;
    }
    case kIOReportFormatHistogram: {
      out = *l;
      for (size_t k = 0; k < count; ++k) {
        const int64_t hits_l = slot(*l, k, 0), hits_e = slot(*e, k, 0);
        setSlot(out, k, 0, static_cast<int64_t>(static_cast<uint64_t>(hits_l) - static_cast<uint64_t>(hits_e)));
        if (hits_l != hits_e) {
          const uint64_t earlier_sum = hits_e != 0 ? static_cast<uint64_t>(slot(*e, k, 3)) : 0;
          setSlot(out, k, 3, static_cast<int64_t>(static_cast<uint64_t>(slot(*l, k, 3)) - earlier_sum));
        } else {
          setSlot(out, k, 3, kIOReportInvalidValue);
        }
      }
      break;
    }
    case kIOReportFormatSimpleArray: {
      out = *l;
      for (size_t k = 0; k < count; ++k)
        for (size_t i = 0; i < 4; ++i) {
          const int64_t a = slot(*e, k, i), b = slot(*l, k, i);
          setSlot(out, k, i,
                  !present(a) ? b : !present(b) ? a
                                               : static_cast<int64_t>(static_cast<uint64_t>(b) - static_cast<uint64_t>(a)));
        }
      break;
    }
  }
  result.Set("RawElements", cf::Value::Bytes(std::move(out)));
  return kIOReturnSuccess;
}

struct Key {
  int64_t driver, id;
  uint64_t type;
  bool operator==(const Key&) const = default;
};
std::optional<Key> keyOf(const cf::Dictionary& channel) {
  const auto type = channelType(channel);
  if (!type) return std::nullopt;
  return Key{IOReportChannelGetDriverID(channel), IOReportChannelGetChannelID(channel), *type};
}

const cf::Array* channelsOf(const cf::Dictionary& level, bool* malformed) {
  const cf::Value* v = level.Find("IOReportChannels");
  if (!v) return nullptr;
  const cf::Array* a = v->AsArray();
  if (!a) {
    *malformed = true;
    return nullptr;
  }
  for (const cf::Value& c : *a)
    if (!c.AsDictionary()) *malformed = true;
  return a;
}

int differenceLevel(const cf::Dictionary& later, const cf::Dictionary& earlier, cf::Dictionary& out,
                    IOReportErrorOut error, int depth) {
  if (depth > kMaxDepth) return kIOReportIterWalkFailed;
  bool malformed = false;
  const cf::Array* l = channelsOf(later, &malformed);
  const cf::Array* e = channelsOf(earlier, &malformed);
  if (malformed) return kIOReportIterWalkFailed;
  if (l) {
    cf::Array results;
    std::optional<size_t> stopped;
    for (size_t i = 0; i < l->size(); ++i) {
      const cf::Dictionary& channel = *(*l)[i].AsDictionary();
      const auto key = keyOf(channel);
      if (!key) return kIOReportIterFailed;
      const cf::Dictionary* partner = nullptr;
      // Every channel compared must have a type that can be read.
      bool unreadable = false;
      const auto matches = [&](size_t j) {
        const auto other = keyOf(*(*e)[j].AsDictionary());
        unreadable = unreadable || !other;
        return other == key;
      };
      if (e && i < e->size() && matches(i)) {
        partner = (*e)[i].AsDictionary();
      } else if (e) {
        size_t j = stopped.value_or(i + 1);
        while (j < e->size() && !matches(j)) ++j;
        if (j < e->size()) partner = (*e)[j].AsDictionary();
        stopped = j < e->size() ? j + 1 : j;
      }
      if (unreadable) return kIOReportIterFailed;
      cf::Dictionary result = channel.MutableCopy();
      if (partner && difference(*partner, channel, result, error) != kIOReturnSuccess) return kIOReportIterFailed;
      results.Append(result);
    }
    out.Set("IOReportChannels", results);
  }
  for (const char* nesting : {"IOReportDrivers", "IOReportChannelGroups"}) {
    const cf::Value* lv = later.Find(nesting);
    if (!lv) continue;
    const cf::Dictionary* levels = lv->AsDictionary();
    const cf::Dictionary* earlier_levels = earlier.Get(nesting).AsDictionary();
    if (!levels || !earlier_levels) return kIOReportIterWalkFailed;
    cf::Dictionary copied;
    for (const auto& [name, nested] : levels->entries()) {
      if (!name.AsString() || !nested.AsDictionary()) continue;
      const cf::Dictionary* earlier_nested = earlier_levels->Get(name).AsDictionary();
      if (!earlier_nested) return kIOReportIterWalkFailed;
      cf::Dictionary nested_out;
      const int r = differenceLevel(*nested.AsDictionary(), *earlier_nested, nested_out, error, depth + 1);
      if (r & kIOReportIterFailed) return r;
      copied.Set(name, nested_out);
    }
    out.Set(nesting, copied);
  }
  return kIOReportIterOk;
}

}  // namespace

cf::Value IOReportCreateSamplesDelta(const cf::Value& earlier, const cf::Value& later, IOReportErrorOut error) {
  const cf::Dictionary* e = earlier.AsDictionary();
  const cf::Dictionary* l = later.AsDictionary();
  if (!e || !l) {
    setError(error, kIOReturnBadArgument);
    return cf::Value();
  }
  cf::Dictionary out;
  if (differenceLevel(*l, *e, out, error, 0) & kIOReportIterFailed) return cf::Value();
  return out;
}

cf::Value IOReportSampleCreateDelta(const cf::Value& earlier, const cf::Value& later, IOReportErrorOut error) {
  const cf::Dictionary* e = earlier.AsDictionary();
  const cf::Dictionary* l = later.AsDictionary();
  if (!e || !l) {
    setError(error, kIOReturnBadArgument);
    return cf::Value();
  }
  cf::Dictionary result = e->MutableCopy();
  if (difference(*e, *l, result, error) != kIOReturnSuccess) return cf::Value();
  return result;
}
