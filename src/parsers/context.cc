#include "parsers/context.h"

#include <algorithm>
#include <cstring>
#include <new>

namespace parsers::testing {
int64_t g_adds_before_failure = -1;
}

namespace {
std::string* g_api_error = nullptr;  // null until the first message
}

std::string ParserPairValueText(const ParserPair& pair) { return std::to_string(pair.value); }

namespace {

// The test hook's stand-in for an exhausted heap: throws where an
// allocation would.
void ChargeOneAdd() {
  int64_t& budget = parsers::testing::g_adds_before_failure;
  if (budget == 0) throw std::bad_alloc();
  if (budget > 0) --budget;
}

void AppendPair(GenericParserCxt& context, const char* prefix, const char* name, uint64_t value) {
  ChargeOneAdd();
  const size_t prefix_length = prefix ? std::strlen(prefix) : 0;
  const size_t name_length = name ? std::strlen(name) : 0;
  std::string full;
  full.reserve(std::min(kMaxParserNameLength, prefix_length + name_length));
  full.append(prefix ? prefix : "", std::min(prefix_length, kMaxParserNameLength));
  full.append(name ? name : "", std::min(name_length, kMaxParserNameLength - full.size()));
  context.pairs.push_back({std::move(full), value});
}

}  // namespace

int AddSingleValueToGenericContext(GenericParserCxt* context, const char* prefix, const char* name, uint64_t value) {
  if (!context) return 0;
  try {
    AppendPair(*context, prefix, name, value);
  } catch (const std::bad_alloc&) {
    return 0;
  }
  return 1;
}

int AddMultipleFieldsToGenericContext(GenericParserCxt* context, const char* name, const void* source,
                                      uint32_t elementSize, uint32_t count) {
  if (elementSize == 0 || count == 0) return 1;
  if (elementSize > 8 || !source || count > kMaxParserArrayElements) return 0;
  const auto* bytes = static_cast<const uint8_t*>(source);
  auto element = [&](uint32_t i) {
    uint64_t v = 0;
    std::memcpy(&v, bytes + static_cast<size_t>(i) * elementSize, elementSize);  // low-order bytes (little-endian)
    return v;
  };
  if (count == 1) return AddSingleValueToGenericContext(context, "", name, element(0));
  if (!context) return 0;
  // All or nothing: a failure takes back the pairs this call added.
  const size_t before = context->pairs.size();
  try {
    context->pairs.reserve(before + count);
    char index[8];
    for (uint32_t i = 0; i < count; ++i) {
      std::snprintf(index, sizeof index, "%u", i);
      AppendPair(*context, name, index, element(i));
    }
  } catch (const std::bad_alloc&) {
    context->pairs.erase(context->pairs.begin() + static_cast<ptrdiff_t>(before), context->pairs.end());
    return 0;
  }
  return 1;
}

void ReservePairs(GenericParserCxt& context, uint64_t max_values) {
  try {
    context.pairs.reserve(context.pairs.size() + static_cast<size_t>(std::min<uint64_t>(max_values, 4096)));
  } catch (const std::bad_alloc&) {
  }
}

void ReleaseGenericParserCxt(GenericParserCxt* context) {
  if (!context) return;
  std::vector<ParserPair>().swap(context->pairs);
}

void VSPReleaseContext(VSPParseCxt* context) {
  if (!context) return;
  *context = VSPParseCxt();
}

void SetAPIErrorMessageText(std::string_view text) {
  if (g_api_error) return;
  try {
    g_api_error = new std::string(text.substr(0, 1023));
  } catch (const std::bad_alloc&) {
  }
}

bool HasAPIErrorMessage() { return g_api_error != nullptr; }

std::string GetAPIErrorMessage() { return g_api_error ? *g_api_error : "NA"; }

void parsers::testing::ResetAPIErrorMessage() {
  delete g_api_error;
  g_api_error = nullptr;
}
