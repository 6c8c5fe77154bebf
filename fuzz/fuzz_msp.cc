// MSP statistics buffers from the controller.
#include <cstdlib>

#include "parsers/parsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  GenericParserCxt context;
  const uint32_t count = VSPMSPParseBufferToCxt(&context, data, static_cast<uint32_t>(size));
  if (count != context.pairs.size()) std::abort();  // every value counted was added
  ReleaseGenericParserCxt(&context);
  parsers::testing::ResetAPIErrorMessage();
  return 0;
}
