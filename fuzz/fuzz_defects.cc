// The controller's defects list as it may arrive: any bytes, for either
// kind of controller (the first byte chooses).
#include "storagelog/storagelog.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  cf::Dictionary characteristics;
  characteristics.Set("nand-device-desc", cf::Value::SInt64(data[0]));
  const auto records =
      DefectRecords(data + 1, size - 1, cf::Value(characteristics), data[0] & 1 ? "VSPStorage" : "other");
  if (records && records->size() > 1 + (size - 1) / 32) __builtin_trap();  // one per 32-byte entry at most
  return 0;
}
