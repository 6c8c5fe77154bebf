// The telemetry list, described bus by bus: the summary words by name and
// the counter block as raw word index -> value. A word can be given as an
// unsigned 32-bit number or as a negative one down to -2^31, which the list
// carries in two's complement (-1 is 0xFFFFFFFF). Words not given are 0.
#include <array>
#include <cstdint>
#include <string>
#include <string_view>

#include "sim/storage_lists.h"

namespace sim {
namespace {

constexpr size_t kBlockWords = 1024;  // 4096 bytes
constexpr std::array<std::string_view, 7> kSummaryKeys = {"RD", "PE", "Max_PE_rate", "t0", "Ret", "block_type",
                                                          "num_pages"};

void PutLe32(std::string& out, size_t offset, uint32_t v) {
  for (size_t i = 0; i < 4; ++i) out[offset + i] = static_cast<char>((v >> (8 * i)) & 0xFF);
}

bool Fail(std::string* error, const std::string& why) {
  if (error) *error = why;
  return false;
}

bool Word(const cf::Value& value, const std::string& where, uint32_t* out, std::string* error) {
  const cf::Number* n = value.AsNumber();
  bool ok = n && !n->IsFloat();
  if (ok && n->IsUnsigned()) {
    ok = n->AsUInt64() <= UINT32_MAX;
  } else if (ok) {
    ok = n->AsSInt64() >= INT32_MIN && n->AsSInt64() <= int64_t{UINT32_MAX};
  }
  if (!ok) return Fail(error, where + ": values must be integers from -2147483648 to 4294967295");
  *out = static_cast<uint32_t>(n->AsSInt64());
  return true;
}

// "0" to "1023", written without leading zeros so that one word has one name.
bool WordIndex(const cf::Value& key, size_t* index) {
  const cf::String* text = key.AsString();
  if (!text || text->empty() || text->size() > 4 || ((*text)[0] == '0' && text->size() > 1)) return false;
  size_t v = 0;
  for (char c : *text) {
    if (c < '0' || c > '9') return false;
    v = v * 10 + static_cast<size_t>(c - '0');
  }
  *index = v;
  return v < kBlockWords;
}

bool EncodeBus(const cf::Value& bus, size_t b, std::string& block, std::string& summary, std::string* error) {
  const std::string where = "bus " + std::to_string(b);
  const cf::Dictionary* fields = bus.AsDictionary();
  if (!fields) return Fail(error, where + ": expected a dictionary, not " + cf::TypeNameWithArticle(bus.type()));
  for (const auto& [key, value] : *fields) {
    const cf::String* name = key.AsString();
    if (name && *name == "words") {
      const cf::Dictionary* words = value.AsDictionary();
      if (!words)
        return Fail(error, where + " \"words\": expected a dictionary, not " + cf::TypeNameWithArticle(value.type()));
      for (const auto& [index_key, word] : *words) {
        size_t index = 0;
        if (!WordIndex(index_key, &index))
          return Fail(error, where + " \"words\": \"" + index_key.Description() +
                                 "\" is not a word index from 0 to " + std::to_string(kBlockWords - 1));
        uint32_t v = 0;
        if (!Word(word, where + " word " + std::to_string(index), &v, error)) return false;
        PutLe32(block, 4 * index, v);
      }
      continue;
    }
    size_t slot = kSummaryKeys.size();
    for (size_t i = 0; name && i < kSummaryKeys.size(); ++i)
      if (*name == kSummaryKeys[i]) slot = i;
    if (slot == kSummaryKeys.size()) return Fail(error, where + ": unknown key \"" + key.Description() + "\"");
    uint32_t v = 0;
    if (!Word(value, where + " \"" + *name + "\"", &v, error)) return false;
    PutLe32(summary, 4 * slot, v);
  }
  return true;
}

}  // namespace

std::optional<std::string> EncodeTelemetryList(const cf::Dictionary& fields, std::string* error) {
  const cf::Array* buses = nullptr;
  for (const auto& [key, value] : fields) {
    const cf::String* name = key.AsString();
    if (!name || *name != "buses") {
      Fail(error, "unknown telemetry key \"" + key.Description() + "\"");
      return std::nullopt;
    }
    buses = value.AsArray();
    if (!buses) {
      Fail(error, "\"buses\": expected an array, not " + cf::TypeNameWithArticle(value.type()));
      return std::nullopt;
    }
  }
  // Without "buses" the list has none: no bytes at all.
  if (!buses) return std::string();
  if (buses->size() > kMaxEncodedListBytes / (kBlockWords * 4 + 32)) {
    Fail(error, "\"buses\": more than a list of " + std::to_string(kMaxEncodedListBytes) + " bytes holds");
    return std::nullopt;
  }
  std::string blocks, summaries;
  for (size_t b = 0; b < buses->size(); ++b) {
    std::string block(kBlockWords * 4, '\0'), summary(32, '\0');
    if (!EncodeBus((*buses)[b], b, block, summary, error)) return std::nullopt;
    blocks += block;
    summaries += summary;
  }
  return blocks + summaries;
}

}  // namespace sim
