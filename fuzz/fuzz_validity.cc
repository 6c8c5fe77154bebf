// The controller's band validity list as it may arrive: any bytes.
#include "storagelog/storagelog.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const auto lists = ValidityValues(data, size);
  if (lists) {
    size_t values = 0;
    for (const cf::Array& list : *lists) values += list.size();
    if (values > size / 20) __builtin_trap();  // every value came from a 20-byte entry
  }
  return 0;
}
