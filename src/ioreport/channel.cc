// One channel: its type, IDs, names, unit and description, and the error
// objects of the library.
#include <errno.h>
#include <unistd.h>

#include <cstdio>

#include "cf/format.h"
#include "ioreport/internal.h"
#include "ioreport/ioreport.h"

namespace ioreport_internal {

void setError(IOReportErrorOut error, IOReturn code, const std::string& reason) {
  if (!error) return;
  *error = IOReportError{kIOReportMachErrorDomain, code, reason};
}

void setErrorIfEmpty(IOReportErrorOut error, IOReturn code, const std::string& reason) {
  if (error && !error->has_value()) setError(error, code, reason);
}

std::optional<int64_t> numberBits(const cf::Value& v) {
  const cf::Number* n = v.AsNumber();
  if (!n) return std::nullopt;
  return n->AsSInt64();
}

std::optional<uint64_t> channelType(const cf::Dictionary& channel) {
  const cf::Array* legend = channel.Get("LegendChannel").AsArray();
  if (!legend || legend->size() < 2) return std::nullopt;
  const auto type = numberBits((*legend)[1]);
  if (!type) return std::nullopt;
  return static_cast<uint64_t>(*type);
}

uint32_t queryOptions(const cf::Dictionary& aggregate) {
  const cf::Number* n = aggregate.Get("QueryOpts").AsNumber();
  return n ? n->AsUInt32() : 0;
}

std::optional<std::string> renderIDAsText(uint64_t id) {
  std::string text;
  for (int shift = 56; shift >= 0; shift -= 8) {
    const unsigned char byte = static_cast<unsigned char>(id >> shift);
    if (byte == 0) continue;
    if (byte < 0x20 || byte > 0x7e) return std::nullopt;
    text.push_back(static_cast<char>(byte));
  }
  if (text.empty()) return std::nullopt;
  return text;
}

bool isUTF8(std::string_view text) {
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const size_t n = text.size();
  for (size_t i = 0; i < n;) {
    const unsigned char b = p[i];
    size_t length;
    unsigned char lo = 0x80, hi = 0xBF;  // the second byte's range
    if (b < 0x80) length = 1;
    else if (b >= 0xC2 && b <= 0xDF) length = 2;
    else if (b >= 0xE0 && b <= 0xEF) {
      length = 3;
      if (b == 0xE0) lo = 0xA0;
      if (b == 0xED) hi = 0x9F;
    } else if (b >= 0xF0 && b <= 0xF4) {
      length = 4;
      if (b == 0xF0) lo = 0x90;
      if (b == 0xF4) hi = 0x8F;
    } else {
      return false;
    }
    if (length > n - i) return false;
    for (size_t k = 1; k < length; ++k) {
      const unsigned char c = p[i + k];
      if (c < (k == 1 ? lo : 0x80) || c > (k == 1 ? hi : 0xBF)) return false;
    }
    i += length;
  }
  return true;
}

}  // namespace ioreport_internal

using namespace ioreport_internal;

namespace {

// The label's prefix by the exact scale; a few scales name the whole label.
struct ScaleName {
  uint64_t scale;
  const char* text;
};
constexpr ScaleName kWholeLabels[] = {
    {0x7600000001, "1Gticks"},
    {0x7980000018, "24Mticks"},
    {0x1000000000000, "hwticks?"},
    {0x2000000000000, "hwpage?"},
};
constexpr ScaleName kPrefixes[] = {
    {0x7300000000, "p"},     {0x7600000000, "n"},     {0x7900000000, "u"},    {0x7c00000000, "m"},
    {0x8200000000, "k"},     {0x8500000000, "M"},     {0x8800000000, "G"},    {0x8b00000000, "T"},
    {0x890000000000, "Ki"},  {0x930000000000, "Mi"},  {0x9d0000000000, "Gi"}, {0xa70000000000, "Ti"},
    {0x8c0000000000, "KiB"}, {0x8c0000000004, "4KiB"}, {0x8c0000000008, "8KiB"}, {0x960000000000, "MiB"},
    {0xa00000000000, "GiB"}, {0xaa0000000000, "TiB"},
};

const char* quantityName(uint64_t quantity, uint64_t scale) {
  switch (quantity) {
    case 0: return "";
    case 1: return "s";
    case 2: return "W";
    case 3: return "J";
    case 4: return "A";
    case 5: return "V";
    case 6: return "F";
    case 7: return "H";
    case 8: return "Hz";
    case 9: return scale == 0x820000000000 ? "B" : scale == 0 ? "b" : "";
    case 10: return "C";
    case 100: return "events";
    case 101: return "packets";
    default: return "??";
  }
}

cf::Value stringOrNull(const cf::Value& v) { return v.AsString() ? v : cf::Value(); }

}  // namespace

std::string IOReportError::Description() const {
  std::string text = cf::Format("%s error %#x", domain, static_cast<uint32_t>(code));
  if (!failure_reason.empty()) text += ": " + failure_reason;
  return text;
}

cf::Value IOReportCreateAggregate(uint32_t options) {
  cf::Dictionary aggregate;
  aggregate.Set("QueryOpts", cf::Number::Make(cf::NumberType::kInt, static_cast<int32_t>(options)));
  return aggregate;
}

cf::Value IOReportCreateUnitInfo(uint64_t unit) {
  cf::Dictionary info;
  info.Set("IOReportChannelUnit", cf::Value::SInt64(static_cast<int64_t>(unit)));
  return info;
}

cf::Value IOReportCopyCurrentProcessName() {
  return cf::Format("%s <pid %d>", program_invocation_short_name, static_cast<int>(getpid()));
}

uint8_t IOReportChannelGetFormat(const cf::Dictionary& channel) {
  const auto type = channelType(channel);
  return type ? static_cast<uint8_t>(*type) : kIOReportFormatUnknown;
}

uint16_t IOReportChannelGetCategories(const cf::Dictionary& channel) {
  const auto type = channelType(channel);
  return type ? static_cast<uint16_t>(*type >> 16) : 0xFFFF;
}

int64_t IOReportChannelGetChannelID(const cf::Dictionary& channel) {
  const cf::Array* legend = channel.Get("LegendChannel").AsArray();
  if (!legend || legend->empty()) return kIOReportInvalidValue;
  return numberBits((*legend)[0]).value_or(kIOReportInvalidValue);
}

int64_t IOReportChannelGetDriverID(const cf::Dictionary& channel) {
  return numberBits(channel.Get("DriverID")).value_or(kIOReportInvalidValue);
}

cf::Value IOReportChannelGetDriverName(const cf::Dictionary& channel) { return stringOrNull(channel.Get("DriverName")); }
cf::Value IOReportChannelGetGroup(const cf::Dictionary& channel) {
  return stringOrNull(channel.Get("IOReportGroupName"));
}
cf::Value IOReportChannelGetSubGroup(const cf::Dictionary& channel) {
  return stringOrNull(channel.Get("IOReportSubGroupName"));
}

std::string IOReportChannelGetChannelName(const cf::Dictionary& channel) {
  if (const cf::String* cached = channel.Get("ChannelName").AsString()) return *cached;
  std::string name = "<unknown>";
  const cf::Array* legend = channel.Get("LegendChannel").AsArray();
  if (legend && legend->size() > 2 && legend->at(2).AsString()) {
    name = *legend->at(2).AsString();
  } else if (const int64_t id = IOReportChannelGetChannelID(channel); id != kIOReportInvalidValue) {
    // The marker itself reads as no ID: its one non-zero byte is not printable.
    if (auto text = renderIDAsText(static_cast<uint64_t>(id))) name = *text;
  }
  cf::Dictionary(channel).Set("ChannelName", name);
  return name;
}

int64_t IOReportChannelGetUnit(const cf::Dictionary& channel) {
  const cf::Dictionary* info = channel.Get("IOReportChannelInfo").AsDictionary();
  if (!info) return kIOReportInvalidValue;
  return numberBits(info->Get("IOReportChannelUnit")).value_or(kIOReportInvalidValue);
}

cf::Value IOReportChannelGetUnitLabel(const cf::Dictionary& channel) {
  if (const cf::Value& cached = channel.Get("UnitLabel"); cached.AsString()) return cached;
  const int64_t unit = IOReportChannelGetUnit(channel);
  if (unit == kIOReportInvalidValue) return cf::Value();
  const uint64_t bits = static_cast<uint64_t>(unit);
  const uint64_t scale = bits & 0x00FFFFFFFFFFFFFFull;
  std::string label;
  bool whole = false;
  for (const ScaleName& s : kWholeLabels)
    if (s.scale == scale) {
      label = s.text;
      whole = true;
    }
  if (!whole) {
    const char* prefix = "";
    for (const ScaleName& s : kPrefixes)
      if (s.scale == scale) prefix = s.text;
    label = cf::Format("%s%s", prefix, quantityName(bits >> 56, scale));
  }
  cf::Value text(label);
  cf::Dictionary(channel).Set("UnitLabel", text);
  return text;
}

cf::Value IOReportChannelCopyDescription(const cf::Dictionary& channel, const cf::Value&, const char* prefix) {
  const auto type = channelType(channel);
  if (!type) return cf::Value();
  const cf::Value none("(none)");
  const cf::Value group = IOReportChannelGetGroup(channel);
  const cf::Value subgroup = IOReportChannelGetSubGroup(channel);
  const cf::Value name(IOReportChannelGetChannelName(channel));
  const cf::Value unit = IOReportChannelGetUnitLabel(channel);
  return cf::Format("%s%@ %@ < %#llx (%@) | G/g %@/%@ | cat %#04x | format %#04x | elts %u >\n", prefix ? prefix : "",
                    channel.Get("DriverName"), name, static_cast<uint64_t>(IOReportChannelGetChannelID(channel)), unit,
                    group.IsNull() ? none : group, subgroup.IsNull() ? none : subgroup,
                    static_cast<uint32_t>((*type >> 16) & 0xFFFF), static_cast<uint32_t>(*type & 0xFF),
                    static_cast<uint32_t>((*type >> 32) & 0xFFFF));
}
