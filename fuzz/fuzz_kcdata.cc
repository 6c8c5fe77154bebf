// Stackshot buffers in kcdata form, searched for the freezer's thread the way
// a caller would: the first top-level container, then each one behind it.
#include <cstdlib>
#include <cstring>

#include "parsers/kcdata.h"

namespace {

uint32_t Le32(const uint8_t* p) {
  uint32_t v;
  std::memcpy(&v, p, 4);
  return v;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const uint8_t* end = data + size;
  const uint8_t* at = data;
  for (;;) {
    const void* stats = nullptr;
    KCDataCursor cursor;
    const int found = getIOStatsWithThreadnameFromKCDataHelper(at, end, kVMFreezerThreadName, &stats, &cursor);
    const auto* stop = static_cast<const uint8_t*>(cursor.position);
    if (cursor.end != end || stop < at || stop > end) std::abort();
    const void* again = nullptr;
    if (getIOStatsWithThreadnameFromKCData(at, end, kVMFreezerThreadName, &again) != found || again != stats)
      std::abort();
    if (found && stats) {
      // The payload of a whole I/O-statistics item inside the buffer.
      const auto* payload = static_cast<const uint8_t*>(stats);
      if (payload < at + kKCDataItemHeaderSize || payload > end) std::abort();
      if (Le32(payload - 16) != STACKSHOT_KCTYPE_IOSTATS || Le32(payload - 12) > static_cast<size_t>(end - payload))
        std::abort();
      (void)KCDataDiskWriteBytes(stats);
    }
    if (found || stop == at) return 0;
    at = stop;  // every call moves on, so this ends
  }
}
