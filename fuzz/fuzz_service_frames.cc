// The service's frame reader on a peer's byte stream, cut into reads of one
// size as the socket might deliver it.
#include <algorithm>
#include <string_view>

#include "cf/value.h"
#include "platform/service.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  // The first byte sets the read size: 1 to 256 bytes.
  const size_t chunk = size_t{data[0]} + 1;
  const char* bytes = reinterpret_cast<const char*>(data);
  platform::ServiceFrameReader reader;
  for (size_t at = 1; at < size; at += chunk) {
    reader.Append(std::string_view(bytes + at, std::min(chunk, size - at)));
    for (;;) {
      cf::Value message;
      std::string error;
      const auto result = reader.Next(&message, &error);
      if (result == platform::ServiceFrameReader::Result::kNeedMore) break;
      if (result == platform::ServiceFrameReader::Result::kBad) {
        if (error.empty() || !message.IsNull()) __builtin_trap();
        return 0;
      }
      if (!message.AsDictionary()) __builtin_trap();
    }
    // Only bytes that arrived are held, whatever length a frame announces.
    if (reader.capacity() > 2 * size + 32) __builtin_trap();
  }
  return 0;
}
