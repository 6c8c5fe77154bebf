// Header-driven snapshot dumps: a hostile header and data, printed in pieces.
#include <cstdlib>
#include <cstring>
#include <vector>

#include "parsers/parsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 4) return 0;
  // Byte 0: output capacity; bytes 1-2: header size; the rest: header, then records.
  const uint32_t capacity = 1 + data[0] * 4u;
  const size_t header_size = std::min<size_t>(uint32_t{data[1]} << 8 | data[2], size - 3);
  // Copies, so that reads past either part are caught on their own.
  const std::vector<uint8_t> header(data + 3, data + 3 + header_size);
  const std::vector<uint8_t> records(data + 3 + header_size, data + size);
  uint32_t index = 0;
  if (header.empty()) {
    // No header at all: the dump refuses and leaves the output alone.
    char out[8] = "keep";
    uint32_t out_size = sizeof out;
    if (VSPParseSnapshotBufferWithInplaceParser(records.data(), 0, out, &out_size, nullptr, 0, &index) != 0 ||
        out_size != sizeof out || std::strcmp(out, "keep") != 0)
      std::abort();
    return 0;
  }
  for (int call = 0; call < 64; ++call) {
    std::vector<char> out(capacity + 16, '\x7f');
    uint32_t out_size = capacity;
    const uint32_t before = index;
    const int result = VSPParseSnapshotBufferWithInplaceParser(
        records.data(), static_cast<uint32_t>(records.size()), out.data(), &out_size, header.data(),
        static_cast<uint32_t>(header.size()), &index);
    for (size_t i = capacity; i < out.size(); ++i)
      if (out[i] != '\x7f') std::abort();
    // The text may hold a NUL of its own (a device format "%c" of 0); its
    // terminator must sit right where outSize says.
    if (out_size == 0 || out_size > capacity || out[out_size - 1] != '\0') std::abort();
    if (result == 1) break;
    if (index == before && before != 0) std::abort();  // a resumed dump always moves on
  }
  return 0;
}
