// Little-endian words in byte buffers, as devices and their files lay them
// out, read and written without alignment.
#pragma once

#include <bit>
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

}  // namespace cf
