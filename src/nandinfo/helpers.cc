#include "nandinfo/helpers.h"

#include <cctype>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <string_view>
#include <unordered_set>

#include "platform/log.h"

namespace {

// The names a collection allows: an array's strings, or a dictionary's keys.
std::unordered_set<std::string_view> AllowedNames(const cf::Value& allowed) {
  std::unordered_set<std::string_view> names;
  if (const cf::Array* a = allowed.AsArray()) {
    for (const cf::Value& v : *a)
      if (const cf::String* s = v.AsString()) names.insert(s->view());
  } else if (const cf::Dictionary* d = allowed.AsDictionary()) {
    for (const auto& [k, v] : *d)
      if (const cf::String* s = k.AsString()) names.insert(s->view());
  }
  return names;
}

bool Contains(const cf::Value& collection, const cf::Value& key) {
  if (const cf::Dictionary* d = collection.AsDictionary()) return d->Contains(key);
  if (const cf::Array* a = collection.AsArray()) {
    for (const cf::Value& v : *a)
      if (v == key) return true;
  }
  return false;
}

constexpr uint64_t kPowersOfTen[19] = {1ull,
                                       10ull,
                                       100ull,
                                       1000ull,
                                       10000ull,
                                       100000ull,
                                       1000000ull,
                                       10000000ull,
                                       100000000ull,
                                       1000000000ull,
                                       10000000000ull,
                                       100000000000ull,
                                       1000000000000ull,
                                       10000000000000ull,
                                       100000000000000ull,
                                       1000000000000000ull,
                                       10000000000000000ull,
                                       100000000000000000ull,
                                       1000000000000000000ull};

cf::Value NumberOfType(const void* value, int type) {
  switch (type) {
    case 1: { int8_t v; std::memcpy(&v, value, sizeof v); return cf::Number::SInt8(v); }
    case 2: { int16_t v; std::memcpy(&v, value, sizeof v); return cf::Number::SInt16(v); }
    case 3: { int32_t v; std::memcpy(&v, value, sizeof v); return cf::Number::SInt32(v); }
    case 9: { int32_t v; std::memcpy(&v, value, sizeof v); return cf::Number::Make(cf::NumberType::kInt, v); }
    case 4: { int64_t v; std::memcpy(&v, value, sizeof v); return cf::Number::SInt64(v); }
    case 5:
    case 12: { float v; std::memcpy(&v, value, sizeof v); return cf::Number::MakeDouble(static_cast<cf::NumberType>(type), v); }
    case 6:
    case 13: { double v; std::memcpy(&v, value, sizeof v); return cf::Number::MakeDouble(static_cast<cf::NumberType>(type), v); }
    default: return {};
  }
}

}  // namespace

cf::Dictionary CreateDictFromCxt(const GenericParserCxt& context, const cf::Value& allowed) {
  if (allowed.IsNull()) return cf::Dictionary::OfUnsigned(context.pairs.data(), context.pairs.size());
  const auto names = AllowedNames(allowed);
  std::vector<ParserPair> kept;
  for (const ParserPair& pair : context.pairs)
    if (names.count(pair.name)) kept.push_back(pair);
  return cf::Dictionary::OfUnsigned(kept.data(), kept.size());
}

cf::Value CreateFilteredDict(const cf::Value& dictionary, const cf::Value& allowed) {
  if (allowed.IsNull()) return dictionary;
  cf::Dictionary out;
  if (const cf::Dictionary* d = dictionary.AsDictionary())
    for (const auto& [k, v] : *d)
      if (Contains(allowed, k)) out.Set(k, v);
  return out;
}

cf::Value CreateFilteredDict_SigDig(const cf::Value& dictionary, const cf::Value& digits, bool round) {
  const cf::Dictionary* table = digits.AsDictionary();
  if (!table) return dictionary;
  cf::Dictionary out;
  if (const cf::Dictionary* d = dictionary.AsDictionary()) {
    for (const auto& [k, v] : *d) {
      const cf::Value* n = table->Find(k);
      if (!n) continue;
      if (round && v.AsNumber() && n->AsNumber())
        out.Set(k, cf::Value::UInt64(roundSig(v.AsNumber()->AsUInt64(), n->AsNumber()->AsUInt64())));
      else
        out.Set(k, v);
    }
  }
  return out;
}

cf::Value GetNumberFromDictionarySafe(const cf::Value& dictionary, const cf::Value& key) {
  const cf::Dictionary* d = dictionary.AsDictionary();
  const cf::Value* v = d ? d->Find(key) : nullptr;
  return v ? *v : cf::Value::SInt32(0);
}

cf::Value GetStringFromDictionarySafe(const cf::Value& dictionary, const cf::Value& key) {
  const cf::Dictionary* d = dictionary.AsDictionary();
  const cf::Value* v = d ? d->Find(key) : nullptr;
  return v ? *v : cf::Value("empty");
}

void setNumberValueForType(cf::Dictionary& dictionary, const cf::Value& key, const void* value, int type) {
  cf::Value n = value ? NumberOfType(value, type) : cf::Value();
  if (n.IsNull()) {
    platform::LogDefault("Failed to create CFNumber from value: %p", value);
    return;
  }
  dictionary.Set(key, n);
}

void appendNumberValueForType(cf::Array& array, const void* value, int type) {
  cf::Value n = value ? NumberOfType(value, type) : cf::Value();
  if (n.IsNull()) {
    platform::LogDefault("Failed to create CFNumber from value: %p", value);
    return;
  }
  array.Append(n);
}

void CopyDictionary(const cf::Value& key, const cf::Value& value, cf::Dictionary& target) { target.Set(key, value); }

uint8_t hexStringToByte(const char* text, size_t length) {
  uint32_t acc = 0;
  for (size_t i = 0; i < length && i < 2 && text; ++i) {
    const char c = static_cast<char>(std::tolower(static_cast<unsigned char>(text[i])));
    acc *= 16;
    if (c >= '0' && c <= '9') acc += static_cast<uint32_t>(c - '0');
    else if (c >= 'a' && c <= 'f') acc += static_cast<uint32_t>(c - 'a' + 10);
    else std::printf("unrecognized hex character: %c", text[i]);
  }
  return static_cast<uint8_t>(acc);
}

uint32_t hexStringToInt32(const char* text, size_t length) {
  const size_t n = std::min<size_t>(length, 8);
  uint8_t bytes[4] = {};
  size_t r = n;
  for (size_t at = 0; at < n; at += 2, r -= std::min<size_t>(r, 2)) {
    bytes[(r - 1) / 2] |= hexStringToByte(text + at, std::min<size_t>(r, 2));
  }
  return uint32_t{bytes[0]} | (uint32_t{bytes[1]} << 8) | (uint32_t{bytes[2]} << 16) | (uint32_t{bytes[3]} << 24);
}

int32_t GetUserCapacityInGB(uint32_t m) {
  // 1376256 to 1770495 MiB is sold as 1536 GB.
  if (((m - 1376256u) >> 10) < 385) return 1536;
  if (m == 0) return 0;
  const uint32_t fls = 32 - static_cast<uint32_t>(__builtin_clz(m));
  return static_cast<int32_t>((1u << (fls % 32)) / 1024);
}

uint64_t roundSig(uint64_t value, uint64_t digits) {
  if (value == 0) return 0;
  const uint64_t n = static_cast<uint64_t>(std::log10(static_cast<double>(value))) + 1;
  if (n <= digits) return value;
  const uint64_t e = n - digits;
  if (e > 18) return 0;
  const uint64_t p = kPowersOfTen[e];
  uint64_t q = value / p;
  const uint64_t r = value - q * p;
  if (r >= p / 2) ++q;
  return q * p;
}

void SayNANDInfo(std::string_view line) {
  if (!line.empty() && line.back() == '\n') line.remove_suffix(1);
  platform::LogDefault("%s", std::string(line));
  // Once on a person's terminal: the mirrored log has printed it already.
  if (!platform::LogMirroredToStderr()) std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
}
