#include "parsers/context.h"

#include <algorithm>
#include <charconv>
#include <cstring>
#include <new>
#include <utility>

namespace parsers::testing {
int64_t g_adds_before_failure = -1;
}

namespace {
std::string* g_api_error = nullptr;  // null until the first message
}

struct ParserNameArena::Block {
  Block* previous;
  char* data() { return reinterpret_cast<char*>(this + 1); }
};

ParserNameArena::ParserNameArena(ParserNameArena&& other) noexcept
    : head_(std::exchange(other.head_, nullptr)),
      cursor_(std::exchange(other.cursor_, nullptr)),
      left_(std::exchange(other.left_, 0)),
      next_block_size_(std::exchange(other.next_block_size_, kFirstBlockSize)) {}

ParserNameArena& ParserNameArena::operator=(ParserNameArena&& other) noexcept {
  if (this != &other) {
    Release();
    head_ = std::exchange(other.head_, nullptr);
    cursor_ = std::exchange(other.cursor_, nullptr);
    left_ = std::exchange(other.left_, 0);
    next_block_size_ = std::exchange(other.next_block_size_, kFirstBlockSize);
  }
  return *this;
}

char* ParserNameArena::NewBlock(size_t n) {
  // Doubling blocks: a few allocations for a whole buffer's names.
  const size_t size = std::max(n, next_block_size_);
  auto* block = static_cast<Block*>(::operator new(sizeof(Block) + size));
  block->previous = head_;
  head_ = block;
  cursor_ = block->data();
  left_ = size;
  next_block_size_ = std::min<size_t>(size * 2, 1 << 20);
  return cursor_;
}

void ParserNameArena::Rewind(const Mark& mark) {
  while (head_ && head_ != mark.block) ::operator delete(std::exchange(head_, head_->previous));
  cursor_ = mark.cursor;
  left_ = mark.left;
}

void ParserNameArena::Release() {
  Rewind({nullptr, nullptr, 0});
  next_block_size_ = kFirstBlockSize;
}

std::string ParserPairValueText(const ParserPair& pair) {
  char text[20];
  return std::string(text, std::to_chars(text, text + sizeof text, pair.value).ptr);
}

namespace {

// The test hook's stand-in for an exhausted heap: throws where an
// allocation would.
inline void ChargeOneAdd() {
  int64_t& budget = parsers::testing::g_adds_before_failure;
  if (budget == 0) throw std::bad_alloc();
  if (budget > 0) --budget;
}

// Copies a name. A general block move costs more to start than copying a
// name of a few dozen characters takes; up to four overlapping moves from
// both ends do that without a loop.
inline void CopyShort(char* out, const char* in, size_t n) {
  auto move = [&](size_t at, size_t width) { std::memcpy(out + at, in + at, width); };
  if (n > 64) {
    std::memcpy(out, in, n);
  } else if (n > 32) {
    move(0, 16), move(16, 16), move(n - 32, 16), move(n - 16, 16);
  } else if (n > 16) {
    move(0, 16), move(n - 16, 16);
  } else if (n >= 8) {
    move(0, 8), move(n - 8, 8);
  } else if (n >= 4) {
    move(0, 4), move(n - 4, 4);
  } else if (n > 0) {
    move(0, 1), move(n / 2, 1), move(n - 1, 1);
  }
}

// An element's elementSize bytes as the low-order bytes of a 64-bit zero
// (little-endian), with the two widths the parsers use made plain loads.
inline uint64_t Element(const uint8_t* p, uint32_t size) {
  if (size == 8) {
    uint64_t v;
    std::memcpy(&v, p, 8);
    return v;
  }
  if (size == 4) {
    uint32_t v;
    std::memcpy(&v, p, 4);
    return v;
  }
  uint64_t v = 0;
  std::memcpy(&v, p, size);
  return v;
}

// Appends the pair whose name was just written at the arena's room, then
// keeps the name; nothing is kept when the pair cannot be added.
inline void AppendPair(GenericParserCxt& context, const char* name, size_t length, uint64_t value) {
  context.pairs.push_back({std::string_view(name, length), value});
  context.names.Commit(length);
}

}  // namespace

int AddSingleValueToGenericContext(GenericParserCxt* context, const char* prefix, const char* name, uint64_t value) {
  if (!context) return 0;
  try {
    ChargeOneAdd();
    const size_t prefix_length = prefix && *prefix ? std::min(std::strlen(prefix), kMaxParserNameLength) : 0;
    const size_t name_length = name ? std::min(std::strlen(name), kMaxParserNameLength - prefix_length) : 0;
    char* out = context->names.Room(prefix_length + name_length);
    CopyShort(out, prefix, prefix_length);
    CopyShort(out + prefix_length, name, name_length);
    AppendPair(*context, out, prefix_length + name_length, value);
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
  if (count == 1) return AddSingleValueToGenericContext(context, "", name, Element(bytes, elementSize));
  if (!context) return 0;
  constexpr size_t kIndexDigits = 5;  // 65535 at most
  const size_t name_length = name ? std::min(std::strlen(name), kMaxParserNameLength) : 0;
  // All or nothing: a failure takes back the pairs and names this call added.
  const size_t before = context->pairs.size();
  const ParserNameArena::Mark mark = context->names.Position();
  try {
    context->pairs.reserve(before + count);
    for (uint32_t i = 0; i < count; ++i) {
      ChargeOneAdd();
      char* out = context->names.Room(name_length + kIndexDigits);
      CopyShort(out, name, name_length);
      const char* end = std::to_chars(out + name_length, out + name_length + kIndexDigits, i).ptr;
      AppendPair(*context, out, std::min<size_t>(end - out, kMaxParserNameLength),
                 Element(bytes + static_cast<size_t>(i) * elementSize, elementSize));
    }
  } catch (const std::bad_alloc&) {
    context->pairs.erase(context->pairs.begin() + static_cast<ptrdiff_t>(before), context->pairs.end());
    context->names.Rewind(mark);
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
  context->names.Release();
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
