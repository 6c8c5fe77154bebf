#include "parsers/context.h"

#include <algorithm>
#include <charconv>
#include <cstring>
#include <new>
#include <utility>

#include "cf/bytes.h"

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
// allocation would, after the adds the budget still allows.
inline void ChargeAdds(int64_t n) {
  int64_t& budget = parsers::testing::g_adds_before_failure;
  if (budget < 0) return;
  if (budget < n) {
    budget = 0;
    throw std::bad_alloc();
  }
  budget -= n;
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

// Writes count pairs (name0, name1, ...; the elements) from pair on, their
// names from out on, each with up to five digits and eight bytes written
// for them; returns where the names end. kSize, when not 0, is elementSize.
template <uint32_t kSize>
char* WriteArrayPairs(ParserPair* pair, char* out, std::string_view name, const uint8_t* bytes, uint32_t elementSize,
                      uint32_t count) {
  const uint32_t size = kSize ? kSize : elementSize;
  // The index as text, first digit in the low byte, counted up in a
  // register rather than printed each time.
  uint64_t digits = '0';
  size_t digit_count = 1;
  unsigned last_shift = 0;  // of the last digit
  for (uint32_t i = 0; i < count; ++i) {
    cf::CopyShort(out, name.data(), name.size());
    std::memcpy(out + name.size(), &digits, sizeof digits);
    const size_t length = std::min(name.size() + digit_count, kMaxParserNameLength);
    pair[i].name = std::string_view(out, length);
    pair[i].value = Element(bytes + static_cast<size_t>(i) * size, size);
    out += length;
    if ((digits >> last_shift & 0xff) != '9') {
      digits += uint64_t{1} << last_shift;
      continue;
    }
    size_t k = digit_count;
    for (; k > 0; --k) {
      const uint64_t unit = uint64_t{1} << (8 * (k - 1));
      if ((digits >> (8 * (k - 1)) & 0xff) != '9') {
        digits += unit;
        break;
      }
      digits -= 9 * unit;  // a 9 turns 0 and carries
    }
    if (k == 0) {
      digits = digits << 8 | '1';
      ++digit_count;
      last_shift += 8;
    }
  }
  return out;
}

// Room for n more pairs, growing by doubling: contexts filled by many small
// adds do not copy their pairs each time.
inline void ReserveMore(std::vector<ParserPair>& pairs, size_t n) {
  if (pairs.capacity() - pairs.size() < n) pairs.reserve(std::max(pairs.size() + n, pairs.capacity() * 2));
}

// Appends the pair whose name of n characters was just written at out (the
// arena's room, with a free pair in the vector), then keeps the name.
inline void AppendPair(GenericParserCxt& context, const char* out, size_t n, uint64_t value) {
  ParserPair& pair = context.pairs.emplace_back();
  pair.name = std::string_view(out, n);
  pair.value = value;
  context.names.Commit(n);
}

// Appends (prefix + name, cut to 98 characters; value).
int AddJoined(GenericParserCxt& context, std::string_view prefix, std::string_view name, uint64_t value) {
  try {
    ChargeAdds(1);
    prefix = prefix.substr(0, kMaxParserNameLength);
    name = name.substr(0, kMaxParserNameLength - prefix.size());
    ReserveMore(context.pairs, 1);
    char* out = context.names.Room(prefix.size() + name.size());
    cf::CopyShort(out, prefix.data(), prefix.size());
    cf::CopyShort(out + prefix.size(), name.data(), name.size());
    AppendPair(context, out, prefix.size() + name.size(), value);
  } catch (const std::bad_alloc&) {
    return 0;
  }
  return 1;
}

}  // namespace

int AddSingleValueToGenericContext(GenericParserCxt* context, const char* prefix, const char* name, uint64_t value) {
  if (!context) return 0;
  return AddJoined(*context, prefix ? std::string_view(prefix) : std::string_view(),
                   name ? std::string_view(name) : std::string_view(), value);
}

[[gnu::flatten]] int AddNamedValue(GenericParserCxt& context, std::string_view name, uint64_t value) {
  // Most adds find room for the pair and its name at hand; the rest, and
  // every add while the test hook counts, take the general path.
  name = name.substr(0, kMaxParserNameLength);
  char* out = context.names.RoomAtHand(name.size());
  if (!out || context.pairs.size() == context.pairs.capacity() || parsers::testing::g_adds_before_failure >= 0)
    return AddJoined(context, {}, name, value);
  cf::CopyShort(out, name.data(), name.size());
  AppendPair(context, out, name.size(), value);
  return 1;
}

int AddMultipleFieldsToGenericContext(GenericParserCxt* context, const char* name, const void* source,
                                      uint32_t elementSize, uint32_t count) {
  if (elementSize == 0 || count == 0) return 1;
  if (!context) return 0;
  return AddNamedArray(*context, name ? std::string_view(name) : std::string_view(), source, elementSize, count);
}

int AddNamedArray(GenericParserCxt& context, std::string_view name, const void* source, uint32_t elementSize,
                  uint32_t count) {
  if (elementSize == 0 || count == 0) return 1;
  if (elementSize > 8 || !source || count > kMaxParserArrayElements) return 0;
  const auto* bytes = static_cast<const uint8_t*>(source);
  if (count == 1) return AddNamedValue(context, name, Element(bytes, elementSize));
  name = name.substr(0, kMaxParserNameLength);
  // All or nothing: a failure takes back the pairs and names this call added.
  const size_t before = context.pairs.size();
  const ParserNameArena::Mark mark = context.names.Position();
  try {
    ChargeAdds(count);
    ReserveMore(context.pairs, count);
    context.pairs.resize(before + count);
    // Room for every name at once, each with up to five digits, and for the
    // eight bytes the last one's digits are written with.
    constexpr size_t kIndexDigits = 5;  // 65535 at most
    char* const start = context.names.Room((name.size() + kIndexDigits) * count + 8);
    ParserPair* const pairs = context.pairs.data() + before;
    char* end = nullptr;
    switch (elementSize) {  // the two widths the parsers use, made constants
      case 8: end = WriteArrayPairs<8>(pairs, start, name, bytes, elementSize, count); break;
      case 4: end = WriteArrayPairs<4>(pairs, start, name, bytes, elementSize, count); break;
      default: end = WriteArrayPairs<0>(pairs, start, name, bytes, elementSize, count); break;
    }
    context.names.Commit(static_cast<size_t>(end - start));
  } catch (const std::bad_alloc&) {
    context.pairs.erase(context.pairs.begin() + static_cast<ptrdiff_t>(before), context.pairs.end());
    context.names.Rewind(mark);
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
