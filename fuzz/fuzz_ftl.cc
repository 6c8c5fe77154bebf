// FTL statistics buffers from the controller, through the parse and into a
// dictionary.
#include <cstdlib>

#include "nandinfo/helpers.h"
#include "parsers/parsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  GenericParserCxt context;
  const uint32_t count = VSPFTLParseBufferToCxt(&context, data, static_cast<uint32_t>(size));
  if (count > context.pairs.size() + size / 8) std::abort();  // each counted value cost a word
  for (const ParserPair& p : context.pairs)
    if (p.name.size() > kMaxParserNameLength) std::abort();
  const cf::Dictionary d = CreateDictFromCxt(context);
  if (d.size() > context.pairs.size()) std::abort();
  ReleaseGenericParserCxt(&context);
  parsers::testing::ResetAPIErrorMessage();
  return 0;
}
