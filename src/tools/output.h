// Text the tools print for people and for other programs: dates of day
// numbers, real numbers, and values as JSON.
#pragma once

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <string>

#include "cf/plist.h"
#include "cf/value.h"
#include "platform/clock.h"

namespace tools {

inline std::string IsoDate(int64_t day) { return platform::DayDate(day); }

// The shortest text that reads back as the same double.
inline std::string RealText(double d) {
  char buf[64];
  const auto [end, ec] = std::to_chars(buf, buf + sizeof buf, d);
  return ec == std::errc() ? std::string(buf, end) : std::string("nan");
}

// A real as JSON: its shortest text, or null for the non-finite ones JSON lacks.
inline std::string JSONReal(double d) { return std::isfinite(d) ? RealText(d) : "null"; }

inline std::string JSONString(const std::string& s) {
  // Bytes that are not UTF-8 become U+FFFD rather than invalid JSON.
  return nlohmann::json(s).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

// JSON as cf::WriteJSON writes it (data as base64, dates as ISO-8601 text,
// non-string keys as their description), except that reals are the shortest
// text that reads back (non-finite ones, which JSON lacks, as null).
// indent < 0 writes one line.
inline void AppendJSON(const cf::Value& v, int indent, int depth, std::string& out) {
  auto newline = [&](int level) {
    if (indent < 0) return;
    out += '\n';
    out.append(static_cast<size_t>(indent) * static_cast<size_t>(level), ' ');
  };
  const char* colon = indent < 0 ? ":" : ": ";
  switch (v.type()) {
    case cf::Type::kNull: out += "null"; return;
    case cf::Type::kBoolean: out += *v.AsBool() ? "true" : "false"; return;
    case cf::Type::kNumber: {
      const cf::Number& n = *v.AsNumber();
      if (n.IsFloat()) out += JSONReal(n.AsFloat64());
      else if (n.IsUnsigned()) out += std::to_string(n.AsUInt64());
      else out += std::to_string(n.AsSInt64());
      return;
    }
    case cf::Type::kString: out += JSONString(*v.AsString()); return;
    case cf::Type::kData: out += JSONString(cf::Base64Encode(*v.AsData())); return;
    case cf::Type::kDate: out += JSONString(cf::ISO8601(*v.AsDate())); return;
    case cf::Type::kArray: {
      const cf::Array& a = *v.AsArray();
      if (a.size() == 0) {
        out += "[]";
        return;
      }
      out += '[';
      bool first = true;
      for (const cf::Value& item : a) {
        if (!first) out += ',';
        first = false;
        newline(depth + 1);
        AppendJSON(item, indent, depth + 1, out);
      }
      newline(depth);
      out += ']';
      return;
    }
    case cf::Type::kDictionary: {
      const cf::Dictionary& d = *v.AsDictionary();
      if (d.size() == 0) {
        out += "{}";
        return;
      }
      out += '{';
      bool first = true;
      for (const auto& [k, item] : d) {
        if (!first) out += ',';
        first = false;
        newline(depth + 1);
        out += JSONString(k.AsString() ? *k.AsString() : k.Description());
        out += colon;
        AppendJSON(item, indent, depth + 1, out);
      }
      newline(depth);
      out += '}';
      return;
    }
  }
}

inline std::string JSONText(const cf::Value& v, int indent = -1) {
  std::string out;
  AppendJSON(v, indent, 0, out);
  return out;
}

}  // namespace tools
