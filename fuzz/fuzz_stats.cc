// Full statistics buffers from the controller.
#include <cstdlib>

#include "parsers/parsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  VSPParseCxt context;
  const uint32_t result = VSPParseBufferToCxt(&context, data, static_cast<uint32_t>(size));
  if (result > 1 || context.driverVersion != 0xFFFFFFFF) std::abort();
  if (context.pairs.size() > size) std::abort();
  VSPReleaseContext(&context);
  return 0;
}
