#include <algorithm>
#include <bit>
#include <cstring>

#include "cf/bytes.h"
#include "parsers/ftl_table.h"
#include "parsers/parsers.h"

static_assert(std::endian::native == std::endian::little, "the controller's buffers are little-endian");

namespace {

constexpr uint32_t kEndKey = 0xFFFF;
constexpr uint32_t kMaxKey = 0x30000000;

uint64_t Word(const uint8_t* words, uint64_t i) {
  uint64_t w;
  std::memcpy(&w, words + i * 8, 8);
  return w;
}

// The fixed fields of the full statistics context, by key.
void StoreFixedField(VSPParseCxt* c, uint32_t key, uint64_t v) {
  switch (key) {
    case 4: c->hostWrites = v; break;
    case 7: c->hostReads = v; break;
    case 12: c->IND_pool_free = v; break;
    case 13: c->IND_pool_count = v; break;
    case 17: c->wearLevMoves = v; break;
    case 18: c->nandWrites = v; break;
    case 19: c->nandReads = v; break;
    case 20: c->bandErases = v; break;
    case 28: c->numSleepOps = v; break;
    case 45: c->maxHighEnduranceBlockErases = v; break;
    case 48: c->numFreeVirtualBlocks = v; break;
    case 49: c->bytesPerPage = static_cast<uint32_t>(v); break;
    case 50: c->pagesPerVirtualBlock = static_cast<uint32_t>(v); break;
    case 51: c->blocksPerVirtualBlock = static_cast<uint32_t>(v); break;
    case 52: c->numVirtualBlocks = static_cast<uint32_t>(v); break;
    case 53: c->exportVersion = static_cast<uint32_t>(v); break;
    case 56: c->utilFormatTime = v; break;
    default: break;
  }
}

}  // namespace

uint32_t VSPFTLParseBufferToCxt(GenericParserCxt* context, const void* buffer, uint32_t size) {
  if (!buffer) return 0;
  const auto* words = static_cast<const uint8_t*>(buffer);
  uint64_t remaining = size / 8, at = 0;
  uint32_t count = 0;
  char array_name[kMaxParserNameLength + 2];  // name_
  if (context) ReservePairs(*context, remaining);
  while (remaining > 0) {
    const uint64_t header = Word(words, at++);
    --remaining;
    const uint32_t key = static_cast<uint32_t>(header);
    const uint32_t length = static_cast<uint32_t>(header >> 32);
    if (length == 0) continue;
    if (key == kEndKey || key > kMaxKey || length > remaining) return count;
    remaining -= length;
    if (const parsers::FtlField* f = parsers::FindFtlField(key)) {
      if (!f->is_array()) {
        if (!context || !AddNamedValue(*context, f->name_view(), Word(words, at)))
          SetAPIErrorMessage("VSPFTLParseBufferToCxt: %s(%u) cannot add 1 element to context", f->name, f->key);
        ++count;
      } else {
        if (length != f->count)
          SetAPIErrorMessage("VSPFTLParseBufferToCxt: %s(%u): (#%u) cfg elements != (%d) buffer elements", f->name,
                             f->key, f->count, static_cast<int32_t>(length));
        const uint32_t n = std::min(length, f->count);
        const size_t name_length = std::min<size_t>(f->length, kMaxParserNameLength);
        cf::CopyShort(array_name, f->name, name_length);
        array_name[name_length] = '_';
        // Without a context only an empty array counts as added.
        const int added =
            context ? AddNamedArray(*context, std::string_view(array_name, name_length + 1), words + at * 8, 8, n)
                    : n == 0;
        if (!added) {
          SetAPIErrorMessage("VSPFTLParseBufferToCxt: %s(%u): Cannot add %u elements to context", f->name, f->key,
                             f->count);
          return count;
        }
        count += n;
      }
    }
    at += length;
  }
  return count;
}

uint32_t VSPParseBufferToCxt(VSPParseCxt* context, const void* buffer, uint32_t size) {
  if (!context) return 0;
  context->driverVersion = 0xFFFFFFFF;
  if (size < 8 || !buffer) return 0;
  const auto* words = static_cast<const uint8_t*>(buffer);
  uint64_t remaining = size / 8, at = 0;
  ReservePairs(*context, remaining);
  for (;;) {
    const uint64_t header = Word(words, at);
    const uint32_t key = static_cast<uint32_t>(header);
    const uint32_t length = static_cast<uint32_t>(header >> 32);
    if (key > kMaxKey || length > remaining - 1) {
      context->exportVersion = 0;
      return 0;
    }
    remaining -= 1 + uint64_t{length};
    ++at;
    const parsers::FtlField* f = length > 0 ? parsers::FindFtlField(key) : nullptr;
    if (f && !f->is_array()) {
      const uint64_t v = Word(words, at);
      AddNamedValue(*context, f->name_view(), v);
      StoreFixedField(context, key, v);
    } else if (f) {
      const uint32_t n = std::min(length, f->count);
      AddNamedArray(*context, f->name_view(), words + at * 8, 8, n);
      if (key == 265)
        for (uint32_t i = 0; i < n && i < 5; ++i) context->readCountHisto[i] = Word(words, at + i);
    }
    at += length;
    if (remaining == 0) return 1;
  }
}
