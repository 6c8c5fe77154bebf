// Fixed-layout snapshot buffers into an output buffer of any capacity.
#include <cstdlib>
#include <cstring>
#include <vector>

#include "parsers/parsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2) return 0;
  // The first two bytes choose the capacity, so small and large outputs both run.
  const uint32_t capacity = 1 + ((uint32_t{data[0]} << 8 | data[1]) * 8);
  std::vector<char> out(capacity + 16, '\x7f');
  uint32_t out_size = capacity;
  const int result = VSPParseSnapshotBuffer(data + 2, static_cast<uint32_t>(size - 2), out.data(), &out_size);
  for (size_t i = capacity; i < out.size(); ++i)
    if (out[i] != '\x7f') std::abort();  // nothing written past the capacity
  if (result == 1 && (out_size >= capacity || std::strlen(out.data()) != out_size)) std::abort();
  if (result == 0 && out_size != capacity) std::abort();
  return 0;
}
