#include "collect/collect.h"

#include <errno.h>

#include <algorithm>
#include <string>

#include "collect/ioreport_keys.h"
#include "nandinfo/nandinfo.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/store.h"
#include "platform/system.h"
#include "storagelog/storagelog.h"

using platform::LogDefault;

namespace {

// Step 1: the disk's capacity and free space in MiB, -1 where unknown.
void CollectDiskUsage() {
  const cf::Value usage = DVCopyAnswer(kDVQDiskUsage);
  TBClientSetValueForScalarKey("com.velmora.homedeck.DiskUsageUserTotalBlocks",
                               DiskUsageMiB(usage, kDVQDiskUsageTotalDiskCapacity));
  TBClientSetValueForScalarKey("com.velmora.homedeck.DiskUsageUserBlocksFree",
                               DiskUsageMiB(usage, kDVQDiskUsageTotalDataAvailable));
}

// Step 2: the storage structured log; its failures are its own to report.
void CollectStorageStructuredLog() { DumpStorageStructuredLog(false); }

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

// Step 4: up to ten of the kernel's pending ECC events, each to the
// structured-data log.
void CollectECCEvents() {
  struct EccEventRecord {
    uint8_t id;
    uint8_t count;
    uint8_t padding[6];
    int64_t reg[8];
  } record{};
  static_assert(sizeof(EccEventRecord) == 72);
  size_t size = sizeof record;
  bool failed = platform::Sysctl("kern.next_ecc_event", &record, &size) != 0;
  for (int allowed = 10; !failed && allowed > 0; --allowed) {
    cf::Dictionary event;
    event.Set("id", cf::Value::SInt32(record.id));
    event.Set("count", cf::Value::SInt32(record.count));
    // The record holds eight registers; a larger count names no more.
    for (int i = 0; i < std::min<int>(record.count, 8); ++i)
      event.Set("reg" + std::to_string(i), cf::Value::SInt64(record.reg[i]));
    FKLogStructuredData(172, event);
    // The size keeps what the last read stored, as the kernel's callers do.
    failed = platform::Sysctl("kern.next_ecc_event", &record, &size) != 0;
  }
  // Only a failed read says why the reading stopped.
  if (failed && errno != ENOENT && errno != EBUSY) LogDefault("Unexpected errno (%d) reading ECC events from kernel", errno);
}

// Step 5: per-process network usage. (A seam until the collection work builds it.)
void CollectDataUsage() {}

}  // namespace

void CollectDailyScalars() {
  CollectDiskUsage();
  CollectStorageStructuredLog();
  CollectNANDInfo();
  CollectECCEvents();
  CollectDataUsage();
  CollectReportingChannels();  // step 6: the field category's simple channels
}
