#include "sim/storage_lists.h"

#include <cstdint>
#include <initializer_list>
#include <string_view>

namespace sim {

namespace {

void PutU32(std::string& out, uint32_t v) {
  for (int i = 0; i < 4; ++i) out += static_cast<char>(v >> (8 * i));
}

// A 32-bit word from a whole number: 0 to 4294967295, or a negative number
// down to -2147483648 written as its two's complement.
bool WordOf(const cf::Value& v, const std::string& what, uint32_t* word, std::string* error) {
  const cf::Number* n = v.AsNumber();
  const bool whole = n && !n->IsFloat();
  if (whole && n->IsUnsigned() ? n->AsUInt64() <= UINT32_MAX
                               : whole && n->AsSInt64() >= INT32_MIN && n->AsSInt64() <= int64_t{UINT32_MAX}) {
    *word = static_cast<uint32_t>(n->AsSInt64());
    return true;
  }
  if (error) *error = what + ": expected a whole number of 32 bits, not " + v.Description();
  return false;
}

// The words of a record dictionary in the order of names; a missing name is
// 0, a name not listed an error.
bool RecordWords(const cf::Value& record, const std::string& what, std::initializer_list<std::string_view> names,
                 std::vector<uint32_t>* words, std::string* error) {
  const cf::Dictionary* d = record.AsDictionary();
  if (!d) {
    if (error) *error = what + ": expected a dictionary, not " + cf::TypeNameWithArticle(record.type());
    return false;
  }
  for (const auto& [key, value] : *d) {
    bool known = false;
    for (std::string_view name : names) known = known || (key.AsString() && *key.AsString() == name);
    if (!known) {
      if (error) *error = what + ": unknown key " + key.Description();
      return false;
    }
  }
  words->clear();
  for (std::string_view name : names) {
    uint32_t w = 0;
    const cf::Value v = d->Get(std::string(name));
    if (!v.IsNull() && !WordOf(v, what + " \"" + std::string(name) + "\"", &w, error)) return false;
    words->push_back(w);
  }
  return true;
}

// The array under key (none: empty), each element a record.
const cf::Array* RecordList(const cf::Dictionary& fields, const char* key, std::string* error) {
  static const cf::Array kNone;
  const cf::Value v = fields.Get(key);
  if (v.IsNull()) return &kNone;
  if (const cf::Array* a = fields.Find(key)->AsArray()) return a;
  if (error) *error = std::string("\"") + key + "\": expected an array, not " + cf::TypeNameWithArticle(v.type());
  return nullptr;
}

// A list's description: one header number and an array of records under
// list_key. The records, or null (reason in *error).
const cf::Array* ListParts(const cf::Dictionary& fields, const std::string& what, std::string_view header_key,
                           const char* list_key, uint32_t* header, std::string* error) {
  cf::Dictionary top;
  for (const auto& [key, value] : fields)
    if (!key.AsString() || *key.AsString() != list_key) top.Set(key, value);
  std::vector<uint32_t> words;
  if (!RecordWords(top, what, {header_key}, &words, error)) return nullptr;
  *header = words[0];
  return RecordList(fields, list_key, error);
}

}  // namespace

std::optional<std::string> EncodeValidityList(const cf::Dictionary& fields, std::string* error) {
  uint32_t extra = 0;
  const cf::Array* entries = ListParts(fields, "validity list", "extra", "entries", &extra, error);
  if (!entries) return std::nullopt;
  if (8 + 8 * uint64_t{extra} + 20 * uint64_t{entries->size()} > kMaxEncodedListBytes) {
    if (error) *error = "validity list: more than " + std::to_string(kMaxEncodedListBytes) + " bytes";
    return std::nullopt;
  }
  std::string out;
  PutU32(out, static_cast<uint32_t>(entries->size()));
  PutU32(out, extra);
  out.append(size_t{8} * extra, '\0');
  std::vector<uint32_t> words;
  for (size_t i = 0; i < entries->size(); ++i) {
    if (!RecordWords((*entries)[i], "validity entry " + std::to_string(i), {"list", "value"}, &words, error))
      return std::nullopt;
    for (uint32_t w : {static_cast<uint32_t>(i), words[0], words[1], 0u, 0u}) PutU32(out, w);
  }
  return out;
}

std::optional<std::string> EncodeDefectsList(const cf::Dictionary& fields, std::string* error) {
  uint32_t factory_count = 0;
  const cf::Array* defects = ListParts(fields, "defects list", "factoryCount", "defects", &factory_count, error);
  if (!defects) return std::nullopt;
  if (12 + 32 * uint64_t{defects->size()} > kMaxEncodedListBytes) {
    if (error) *error = "defects list: more than " + std::to_string(kMaxEncodedListBytes) + " bytes";
    return std::nullopt;
  }
  std::string out;
  PutU32(out, 0);
  PutU32(out, factory_count);
  PutU32(out, static_cast<uint32_t>(defects->size()));
  std::vector<uint32_t> w;
  for (size_t i = 0; i < defects->size(); ++i) {
    if (!RecordWords((*defects)[i], "defect " + std::to_string(i),
                     {"Bus", "CE", "CAU", "Block", "Cycle", "Reason", "Page", "Temperature", "mode"}, &w, error))
      return std::nullopt;
    if (w[0] > 0xFFFF || w[1] > 0xFFFF) {
      if (error) *error = "defect " + std::to_string(i) + ": \"Bus\" and \"CE\" hold 16 bits each";
      return std::nullopt;
    }
    for (uint32_t word : {w[0] | (w[1] << 16), w[2], w[3], w[4], w[5], w[6], w[7] & 0xFF, w[8]}) PutU32(out, word);
  }
  return out;
}

}  // namespace sim
