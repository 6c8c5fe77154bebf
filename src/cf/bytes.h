// Little-endian words in byte buffers, as devices and their files lay them
// out, read and written without alignment; and short copies.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace cf {

inline uint32_t LoadLE32(const void* p) {
  uint32_t v;
  std::memcpy(&v, p, 4);
  if constexpr (std::endian::native == std::endian::big) v = __builtin_bswap32(v);
  return v;
}

inline uint64_t LoadLE64(const void* p) {
  uint64_t v;
  std::memcpy(&v, p, 8);
  if constexpr (std::endian::native == std::endian::big) v = __builtin_bswap64(v);
  return v;
}

inline void StoreLE64(void* p, uint64_t v) {
  if constexpr (std::endian::native == std::endian::big) v = __builtin_bswap64(v);
  std::memcpy(p, &v, 8);
}

// Copies n bytes of a short text such as a name. A general block move costs
// more to start than copying a few dozen bytes takes; up to four
// overlapping moves from both ends do that without a loop.
[[gnu::always_inline]] inline void CopyShort(char* out, const char* in, size_t n) {
  auto move = [&](size_t at, size_t width) { std::memcpy(out + at, in + at, width); };
  if (n >= 16 && n <= 32) {  // the usual name, first
    move(0, 16), move(n - 16, 16);
  } else if (n > 64) {
    std::memcpy(out, in, n);
  } else if (n > 32) {
    move(0, 16), move(16, 16), move(n - 32, 16), move(n - 16, 16);
  } else if (n >= 8) {
    move(0, 8), move(n - 8, 8);
  } else if (n >= 4) {
    move(0, 4), move(n - 4, 4);
  } else if (n > 0) {
    move(0, 1), move(n / 2, 1), move(n - 1, 1);
  }
}

}  // namespace cf
