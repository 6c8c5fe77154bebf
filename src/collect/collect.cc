#include "collect/collect.h"

#include "nandinfo/nandinfo.h"
#include "platform/log.h"
#include "platform/store.h"

using platform::LogDefault;

namespace {

// Step 1: the disk's capacity and free space. (A seam until the collection
// work builds it.)
void CollectDiskUsage() {}

// Step 2: the storage structured log. (A seam until the storage log is built.)
void CollectStorageStructuredLog() {}

// Step 3: every number of the NAND info dictionary, merged with the memory
// freezer's writes, becomes today's scalar of its key.
void CollectNANDInfo() {
  const cf::Value info = CopyNANDInfoWithOptions(1);
  const cf::Dictionary* d = info.AsDictionary();
  if (!d) {
    LogDefault("failed to get NAND info dict");
    return;
  }
  cf::Dictionary merged = d->MutableCopy();
  for (const auto& [key, value] : CopyVMFreezerNANDInfo()) merged.Set(key, value);
  if (const cf::Value* error = merged.Find("com.velmora.NANDInfo.Error")) {
    LogDefault("error reading nand info, error %@ with message %@", *error,
               merged.Get("com.velmora.NANDInfo.ErrorMessage"));
    return;
  }
  TBClientWriteInOneTransaction([&] {
    for (const auto& [key, value] : merged)
      if (key.AsString() && value.AsNumber()) TBClientSetValueForScalarKey(*key.AsString(), value.AsNumber()->AsSInt64());
  });
}

// Step 4: the kernel's pending ECC events. (A seam until the collection work
// builds it.)
void CollectECCEvents() {}

// Step 5: per-process network usage. (A seam until the collection work builds it.)
void CollectDataUsage() {}

// Step 6: the reporting channels of the field category. (A seam until the
// reporting channels are built.)
void CollectReportingChannels() {}

}  // namespace

void CollectDailyScalars() {
  CollectDiskUsage();
  CollectStorageStructuredLog();
  CollectNANDInfo();
  CollectECCEvents();
  CollectDataUsage();
  CollectReportingChannels();
}
