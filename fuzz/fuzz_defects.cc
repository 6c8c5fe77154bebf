// The controller's defects list as it may arrive: any bytes, for either
// kind of controller (the first byte chooses).
#include "storagelog/storagelog.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  cf::Dictionary characteristics;
  characteristics.Set("nand-device-desc", cf::Value::SInt64(data[0]));
  size_t records = 0;
  const bool read = ForEachDefectRecord(data + 1, size - 1, cf::Value(characteristics),
                                        data[0] & 1 ? "VSPStorage" : "other",
                                        [&](const cf::Dictionary&) { ++records; });
  // The header, then one record per whole 32-byte entry at most.
  if (read ? records < 1 || records > 1 + (size - 1) / 32 : records != 0) __builtin_trap();
  return 0;
}
