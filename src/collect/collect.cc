#include "collect/collect.h"

#include <errno.h>

#include <algorithm>
#include <chrono>
#include <exception>
#include <memory>
#include <semaphore>
#include <string>
#include <utility>

#include "collect/datausage.h"
#include "collect/ioreport_keys.h"
#include "nandinfo/nandinfo.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/store.h"
#include "platform/system.h"
#include "platform/usage.h"
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
// structured-data log before the next is read.
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
    // An event that cannot be recorded is not read past: it stays queued
    // for the next run (the device lets an event go only at the next read).
    if (!FKLogStructuredData(172, event)) return;
    // The size keeps what the last read stored, as the kernel's callers do.
    failed = platform::Sysctl("kern.next_ecc_event", &record, &size) != 0;
  }
  // Only a failed read says why the reading stopped.
  if (failed && errno != ENOENT && errno != EBUSY) LogDefault("Unexpected errno (%d) reading ECC events from kernel", errno);
}

// Step 5: per-process network usage. The reply comes on the service's
// thread and holds its own references, so that one arriving after the wait
// is still handled (see collect/datausage.h for what it may touch).
void CollectDataUsage() {
  auto workspace = std::make_shared<AnalyticsWorkspace>(kVitalisAnalyticsServiceEndpoint);
  auto feed = std::make_shared<UsageFeed>(workspace);
  auto done = std::make_shared<std::counting_semaphore<>>(0);
  feed->UsageToDateFor({}, kUsageProcessProcName, [feed, workspace, done](const cf::Array& records) {
    ProcessDataUsageReply(records, *done);
  });
  if (!done->try_acquire_for(std::chrono::seconds(10))) LogDefault("Vitalis timed out, no datausage available");
}

}  // namespace

void CollectDailyScalars() {
  // Each step stands alone: one that fails, even by throwing (a device file
  // asking for more memory than there is), leaves the others to run.
  const std::pair<const char*, void (*)()> steps[] = {
      {"disk usage", CollectDiskUsage},   {"storage structured log", CollectStorageStructuredLog},
      {"NAND info", CollectNANDInfo},     {"ECC events", CollectECCEvents},
      {"data usage", CollectDataUsage},   {"reporting channels", CollectReportingChannels},
  };
  for (const auto& [name, step] : steps) {
    try {
      step();
    } catch (const std::exception& e) {
      platform::LogError("The daily collection's %s step failed: %s", std::string(name), std::string(e.what()));
    }
  }
}
