#include "cf/plist.h"

#include <plist/plist.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>

namespace cf {

bool ParseBinaryPropertyList(std::string_view bytes, Value& out, std::string& error);

namespace {

// Seconds between 1970-01-01 and the property-list epoch 2001-01-01.
constexpr double kPlistEpoch = 978307200.0;

struct PlistFree {
  void operator()(void* p) const { plist_free(static_cast<plist_t>(p)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// libplist keeps the sign of an integer privately; an integer whose 64 bits
// read as negative is unsigned exactly when its XML text has no minus sign.
bool IsUnsignedInteger(plist_t node) {
  PlistPtr copy(plist_copy(node));
  char* xml = nullptr;
  uint32_t len = 0;
  plist_to_xml(copy.get(), &xml, &len);
  if (!xml) return false;
  const bool negative = std::strstr(xml, "<integer>-") != nullptr;
  free(xml);
  return !negative;
}

bool FromPlist(plist_t node, int depth, Value& out, std::string& error) {
  if (depth > kMaxNesting) {
    error = "property list nested too deeply";
    return false;
  }
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      out = Value::Bool(b != 0);
      return true;
    }
    case PLIST_UINT: {
      uint64_t v = 0;
      plist_get_uint_val(node, &v);
      if (v > static_cast<uint64_t>(INT64_MAX) && IsUnsignedInteger(node))
        out = Number::UInt64(v);
      else
        out = Number::SInt64(static_cast<int64_t>(v));
      return true;
    }
    case PLIST_UID: {
      uint64_t v = 0;
      plist_get_uid_val(node, &v);
      out = Number::UInt64(v);
      return true;
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      out = Number::Float64(d);
      return true;
    }
    case PLIST_STRING: {
      // By pointer and length: the copying getter aborts on text with a NUL
      // inside. The reader keeps nothing after such a NUL, so neither do we.
      uint64_t length = 0;
      const char* text = plist_get_string_ptr(node, &length);
      out = text ? std::string(text, strnlen(text, length)) : std::string();
      return true;
    }
    case PLIST_DATA: {
      uint64_t length = 0;
      const char* bytes = plist_get_data_ptr(node, &length);
      const auto* begin = reinterpret_cast<const uint8_t*>(bytes);
      out = Value::Bytes(bytes ? Data(begin, begin + length) : Data());
      return true;
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      out = Date{kPlistEpoch + sec + usec / 1e6};
      return true;
    }
    case PLIST_ARRAY: {
      Array a;
      const uint32_t n = plist_array_get_size(node);
      for (uint32_t i = 0; i < n; ++i) {
        Value item;
        if (!FromPlist(plist_array_get_item(node, i), depth + 1, item, error)) return false;
        a.Append(std::move(item));
      }
      out = a;
      return true;
    }
    case PLIST_DICT: {
      Dictionary d;
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      bool ok = true;
      while (it) {
        char* key = nullptr;
        plist_t child = nullptr;
        plist_dict_next_item(node, it, &key, &child);
        if (!child) {
          free(key);
          break;
        }
        Value v;
        ok = FromPlist(child, depth + 1, v, error);
        if (ok) d.Set(std::string(key ? key : ""), std::move(v));
        free(key);
        if (!ok) break;
      }
      free(it);
      if (!ok) return false;
      out = d;
      return true;
    }
    default:
      error = "unsupported property-list node";
      return false;
  }
}

// Rough nesting bound measured on the raw bytes, so a hostile document
// never reaches the recursive reader with thousands of open containers.
bool NestingWithinBound(std::string_view bytes) {
  int depth = 0;
  for (size_t i = 0; i + 1 < bytes.size(); ++i) {
    if (bytes[i] != '<') continue;
    if (bytes.compare(i, 6, "<array") == 0 || bytes.compare(i, 5, "<dict") == 0) {
      const size_t close = bytes.find('>', i);
      if (close != std::string_view::npos && bytes[close - 1] == '/') continue;
      if (++depth > kMaxNesting) return false;
    } else if (bytes.compare(i, 7, "</array") == 0 || bytes.compare(i, 6, "</dict") == 0) {
      --depth;
    }
  }
  return true;
}

}  // namespace

ParseResult ParsePropertyList(std::string_view bytes) {
  ParseResult r;
  if (bytes.empty()) {
    r.error = "empty property list";
    return r;
  }
  if (bytes.size() > UINT32_MAX) {
    r.error = "property list too large";
    return r;
  }
  if (bytes.size() >= 8 && std::memcmp(bytes.data(), "bplist00", 8) == 0) {
    if (!ParseBinaryPropertyList(bytes, r.value, r.error)) r.value = Value();
    return r;
  }
  // XML cannot hold a NUL character; libplist's reader misbehaves on one.
  if (bytes.find('\0') != std::string_view::npos) {
    r.error = "malformed XML property list (NUL byte)";
    return r;
  }
  if (!NestingWithinBound(bytes)) {
    r.error = "property list nested too deeply";
    return r;
  }
  plist_t root = nullptr;
  plist_from_xml(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
  if (!root) {
    r.error = "malformed XML property list";
    return r;
  }
  PlistPtr owner(root);
  if (!FromPlist(root, 0, r.value, r.error)) r.value = Value();
  return r;
}

// ---- text a property list can carry ----

bool IsPropertyListString(std::string_view s, std::string* why) {
  auto fail = [&](const char* what, uint32_t c, size_t at) {
    if (why) {
      char buf[80];
      if (c == UINT32_MAX) std::snprintf(buf, sizeof buf, "%s at byte %zu", what, at);
      else std::snprintf(buf, sizeof buf, "%s U+%04X at byte %zu", what, static_cast<unsigned>(c), at);
      *why = buf;
    }
    return false;
  };
  const auto* p = reinterpret_cast<const unsigned char*>(s.data());
  const size_t n = s.size();
  for (size_t i = 0; i < n;) {
    const unsigned char b = p[i];
    if (b < 0x80) {
      if (b < 0x20 && b != '\t' && b != '\n' && b != '\r') return fail("control character", b, i);
      ++i;
      continue;
    }
    // The shortest form only, no surrogates, nothing past U+10FFFF: the
    // second byte's range depends on the first.
    size_t length = 0;
    unsigned char lo = 0x80, hi = 0xBF;
    uint32_t c = 0;
    if (b >= 0xC2 && b <= 0xDF) length = 2, c = b & 0x1F;
    else if (b >= 0xE0 && b <= 0xEF) length = 3, c = b & 0x0F, lo = b == 0xE0 ? 0xA0 : 0x80, hi = b == 0xED ? 0x9F : 0xBF;
    else if (b >= 0xF0 && b <= 0xF4) length = 4, c = b & 0x07, lo = b == 0xF0 ? 0x90 : 0x80, hi = b == 0xF4 ? 0x8F : 0xBF;
    else return fail("invalid UTF-8", UINT32_MAX, i);
    if (n - i < length) return fail("invalid UTF-8", UINT32_MAX, i);
    for (size_t k = 1; k < length; ++k) {
      const unsigned char cont = p[i + k];
      if (cont < (k == 1 ? lo : 0x80) || cont > (k == 1 ? hi : 0xBF)) return fail("invalid UTF-8", UINT32_MAX, i);
      c = (c << 6) | (cont & 0x3F);
    }
    if (c == 0xFFFE || c == 0xFFFF) return fail("noncharacter", c, i);
    i += length;
  }
  return true;
}

// ---- XML writer ----

namespace {

void AppendEscaped(std::string& out, const std::string& s) {
  for (char c : s) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      default: out += c;
    }
  }
}

std::string RealText(double d) {
  if (std::isnan(d)) return "nan";
  if (std::isinf(d)) return d > 0 ? "+infinity" : "-infinity";
  char buf[64];
  auto res = std::to_chars(buf, buf + sizeof buf, d);
  return std::string(buf, res.ptr);
}

bool WriteXMLNode(const Value& v, int depth, std::string& out, std::string& error) {
  if (depth > kMaxNesting) {
    error = "value nested too deeply";
    return false;
  }
  const std::string indent(static_cast<size_t>(depth), '\t');
  out += indent;
  switch (v.type()) {
    case Type::kNull:
      error = "null cannot be written to a property list";
      return false;
    case Type::kBoolean:
      out += *v.AsBool() ? "<true/>\n" : "<false/>\n";
      return true;
    case Type::kNumber: {
      const Number& n = *v.AsNumber();
      if (n.IsFloat()) out += "<real>" + RealText(n.AsFloat64()) + "</real>\n";
      else out += "<integer>" + n.Description() + "</integer>\n";
      return true;
    }
    case Type::kString:
      if (std::string why; !IsPropertyListString(*v.AsString(), &why)) {
        error = "string cannot be written to a property list: " + why;
        return false;
      }
      out += "<string>";
      AppendEscaped(out, *v.AsString());
      out += "</string>\n";
      return true;
    case Type::kData:
      out += "<data>" + Base64Encode(*v.AsData()) + "</data>\n";
      return true;
    case Type::kDate:
      out += "<date>" + ISO8601(*v.AsDate()) + "</date>\n";
      return true;
    case Type::kArray: {
      const Array& a = *v.AsArray();
      if (a.empty()) {
        out += "<array/>\n";
        return true;
      }
      out += "<array>\n";
      for (const Value& item : a)
        if (!WriteXMLNode(item, depth + 1, out, error)) return false;
      out += indent + "</array>\n";
      return true;
    }
    case Type::kDictionary: {
      const Dictionary& d = *v.AsDictionary();
      if (d.empty()) {
        out += "<dict/>\n";
        return true;
      }
      out += "<dict>\n";
      for (const auto& [k, val] : d) {
        const cf::String* key = k.AsString();
        if (!key) {
          error = "dictionary key of type " + std::string(TypeName(k.type())) +
                  " cannot be written to a property list";
          return false;
        }
        if (std::string why; !IsPropertyListString(*key, &why)) {
          error = "key cannot be written to a property list: " + why;
          return false;
        }
        out += indent + "\t<key>";
        AppendEscaped(out, *key);
        out += "</key>\n";
        if (!WriteXMLNode(val, depth + 1, out, error)) return false;
      }
      out += indent + "</dict>\n";
      return true;
    }
  }
  return false;
}

}  // namespace

bool WriteXMLPropertyList(const Value& v, std::string& out, std::string* error) {
  std::string body, err;
  if (!WriteXMLNode(v, 0, body, err)) {
    if (error) *error = err;
    return false;
  }
  out = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<plist version=\"1.0\">\n" +
        body + "</plist>\n";
  return true;
}

// ---- binary writer (through libplist) ----

namespace {

plist_t ToPlist(const Value& v, int depth, std::string& error) {
  if (depth > kMaxNesting) {
    error = "value nested too deeply";
    return nullptr;
  }
  switch (v.type()) {
    case Type::kNull:
      error = "null cannot be written to a property list";
      return nullptr;
    case Type::kBoolean: return plist_new_bool(*v.AsBool());
    case Type::kNumber: {
      const Number& n = *v.AsNumber();
      if (n.IsFloat()) return plist_new_real(n.AsFloat64());
      return plist_new_uint(n.AsUInt64());
    }
    case Type::kString: return plist_new_string(v.AsString()->c_str());
    case Type::kData:
      return plist_new_data(reinterpret_cast<const char*>(v.AsData()->data()), v.AsData()->size());
    case Type::kDate: {
      // The binary writer keeps 32-bit seconds from 2001: dates beyond clamp.
      const double rel = std::isnan(v.AsDate()->seconds) ? 0 : v.AsDate()->seconds - kPlistEpoch;
      const double whole = std::min(std::max(std::floor(rel), -2147483648.0), 2147483647.0);
      const double fraction = std::min(std::max(rel - whole, 0.0), 0.999999);
      return plist_new_date(static_cast<int32_t>(whole), static_cast<int32_t>(fraction * 1e6));
    }
    case Type::kArray: {
      plist_t a = plist_new_array();
      for (const Value& item : *v.AsArray()) {
        plist_t child = ToPlist(item, depth + 1, error);
        if (!child) {
          plist_free(a);
          return nullptr;
        }
        plist_array_append_item(a, child);
      }
      return a;
    }
    case Type::kDictionary: {
      plist_t d = plist_new_dict();
      for (const auto& [k, val] : *v.AsDictionary()) {
        if (!k.AsString()) {
          error = "dictionary key of type " + std::string(TypeName(k.type())) +
                  " cannot be written to a property list";
          plist_free(d);
          return nullptr;
        }
        plist_t child = ToPlist(val, depth + 1, error);
        if (!child) {
          plist_free(d);
          return nullptr;
        }
        plist_dict_set_item(d, k.AsString()->c_str(), child);
      }
      return d;
    }
  }
  return nullptr;
}

}  // namespace

bool WriteBinaryPropertyList(const Value& v, std::string& out, std::string* error) {
  std::string err;
  PlistPtr root(ToPlist(v, 0, err));
  if (!root) {
    if (error) *error = err;
    return false;
  }
  char* bin = nullptr;
  uint32_t len = 0;
  plist_to_bin(root.get(), &bin, &len);
  if (!bin) {
    if (error) *error = "binary property list could not be written";
    return false;
  }
  out.assign(bin, len);
  free(bin);
  return true;
}

std::string Base64Encode(const Data& d) {
  static const char* kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  out.reserve((d.size() + 2) / 3 * 4);
  size_t i = 0;
  for (; i + 2 < d.size(); i += 3) {
    const uint32_t n = (d[i] << 16) | (d[i + 1] << 8) | d[i + 2];
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += kAlphabet[n & 63];
  }
  if (i + 1 == d.size()) {
    const uint32_t n = d[i] << 16;
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += "==";
  } else if (i + 2 == d.size()) {
    const uint32_t n = (d[i] << 16) | (d[i + 1] << 8);
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += '=';
  }
  return out;
}

std::string ISO8601(const Date& d) { return FormatUTC(d, true); }

}  // namespace cf
