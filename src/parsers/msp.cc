#include <algorithm>
#include <cstring>

#include "parsers/msp_table.h"
#include "parsers/parsers.h"

namespace {

constexpr uint32_t kFillerKey = 0x2FFE;
constexpr uint32_t kEndKey = 0x2FFF;

uint32_t Le16(const uint8_t* p) { return uint32_t{p[0]} | (uint32_t{p[1]} << 8); }

}  // namespace

uint32_t VSPMSPParseBufferToCxt(GenericParserCxt* context, const void* buffer, uint32_t size) {
  if (!buffer || size == 0) {
    SetAPIErrorMessage("VSPMSPParseBufferToCxt: Passed in invalid buffer or empty buffer");
    return 0;
  }
  const auto* bytes = static_cast<const uint8_t*>(buffer);
  uint32_t at = 0, count = 0;
  if (context) ReservePairs(*context, size / 4);
  for (;;) {
    if (size - at < 4) return count;
    const uint32_t key = Le16(bytes + at);
    const uint32_t length = Le16(bytes + at + 2);
    at += 4;
    if (length == 0) continue;  // a 4-byte filler; its key is not looked at
    if (length > size - at) return count;
    if (key == kFillerKey) {
      at += length;
      continue;
    }
    if (key == kEndKey) return count;
    if (const parsers::MspField* f = parsers::FindMspField(key)) {
      if (length != f->count * 4)
        SetAPIErrorMessage("VSPMSPParseBufferToCxt: %s(%u): cfg %u elements; (%u*4) cfg bytes != (%d) buffer bytes",
                           f->name, f->key, f->count, f->count, static_cast<int32_t>(length));
      const uint32_t n = std::min(length / 4, f->count);
      if (!AddMultipleFieldsToGenericContext(context, f->name, bytes + at, 4, n)) {
        SetAPIErrorMessage("VSPMSPParseBufferToCxt: %s(%u): Error adding %u elements to context", f->name, f->key,
                           f->count);
        return count;
      }
      count += n;
    }
    at += length;
  }
}
