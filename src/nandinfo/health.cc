// The health, lab and OTA views of the FTL statistics, and the controller's
// own word on deleting content. The daily run uses none of them; other
// clients on the device do.
#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "nandinfo/controller.h"
#include "nandinfo/helpers.h"
#include "nandinfo/views.h"
#include "parsers/context.h"
#include "platform/iokit.h"

namespace {

constexpr const char* kMaxPercentageNANDUsed = "com.velmora.NANDInfo.Health.MaxPercentageNANDUsed";
constexpr const char* kMaxE2EErrors = "com.velmora.NANDInfo.Health.MaxE2EErrors";
constexpr const char* kHostReadErrors = "com.velmora.NANDInfo.Health.HostReadErrors";
constexpr const char* kNumGrownBadBlocks = "com.velmora.NANDInfo.Health.NumGrownBadBlocks";
constexpr const char* kSpareAvailablePercent = "com.velmora.NANDInfo.Health.SpareAvailablePercent";
constexpr const char* kIsNANDRefurbishable = "com.velmora.NANDInfo.Health.IsNANDRefurbishable";
constexpr const char* kIsNANDRetirable = "com.velmora.NANDInfo.Health.IsNANDRetirable";
constexpr const char* kErrorMessageKey = "ESR_APIErrorMessage";

constexpr uint32_t kNoContentDeletion = 0xFFFFFFFF;
// A spare percentage from which the part may be retired rather than
// repaired.
constexpr int32_t kRetirableSpare = 4;

// The largest of the fields, each read as a signed 32-bit number; absent
// fields and negative values do not count.
int32_t MaxOf(const cf::Dictionary& ftl, const std::vector<std::string>& names) {
  int32_t max = 0;
  for (const std::string& name : names)
    if (const cf::Number* n = ftl.Get(name).AsNumber())
      if (const int32_t v = n->AsSInt32(); v > max) max = v;
  return max;
}

std::vector<std::string> E2ECounters() {
  std::vector<std::string> names;
  for (int i = 0; i < 12; ++i) names.push_back("E2EDPErrorCounters_" + std::to_string(i));
  return names;
}

// The views share one shape: the health figures they keep, to which each
// adds its own extras. Nothing when the figures cannot be had at all.
std::optional<cf::Dictionary> View(std::initializer_list<const char*> keys) {
  cf::Array allowed;
  for (const char* key : keys) allowed.Append(key);
  const cf::Value filtered = CreateFilteredDict(gatherNANDHealthInfo(), allowed);
  if (!filtered.AsDictionary()) {
    SetAPIErrorMessage("CopyHalvernNANDInfo: Unable to get health API fields");
    return std::nullopt;
  }
  return *filtered.AsDictionary();
}

}  // namespace

cf::Dictionary gatherNANDHealthInfo() {
  cf::Dictionary health;
  const cf::Value ftl_value = gatherVSPFTLData();
  const cf::Dictionary* ftl = ftl_value.AsDictionary();
  if (!ftl) {
    SetAPIErrorMessage("gatherNANDHealthInfo: Unable to get FTL fields");
    return health;
  }
  health.Set(kMaxPercentageNANDUsed,
             cf::Value::SInt32(MaxOf(*ftl, {"fwUpdatesPercentUsed", "slcPercentUsed", "percentUsed"})));
  health.Set(kMaxE2EErrors, cf::Value::SInt32(MaxOf(*ftl, E2ECounters())));
  health.Set(kHostReadErrors, cf::Value::SInt32(MaxOf(*ftl, {"ueccReads", "raidSmartErrors"})));
  if (const cf::Value* v = ftl->Find("numGrownBad")) health.Set(kNumGrownBadBlocks, *v);
  if (const cf::Value* v = ftl->Find("spareAvailablePercent")) health.Set(kSpareAvailablePercent, *v);
  return health;
}

cf::Value CopyHalvernNANDInfo() {
  std::optional<cf::Dictionary> view =
      View({kMaxPercentageNANDUsed, kHostReadErrors, kMaxE2EErrors, kNumGrownBadBlocks});
  if (!view) return {};
  view->Set(kIsNANDRefurbishable, cf::Value::SInt32(1));
  view->Set(kErrorMessageKey, GetAPIErrorMessage());
  return *view;
}

cf::Value CopyInternalLabNANDInfo() {
  std::optional<cf::Dictionary> view =
      View({kMaxPercentageNANDUsed, kHostReadErrors, kMaxE2EErrors, kSpareAvailablePercent, kNumGrownBadBlocks});
  if (!view) return {};
  const cf::Number* spare = view->Get(kSpareAvailablePercent).AsNumber();
  view->Set(kIsNANDRetirable, cf::Value::SInt32(spare && spare->AsSInt32() >= kRetirableSpare ? 1 : 0));
  view->Set(kErrorMessageKey, GetAPIErrorMessage());
  return *view;
}

cf::Value CopyOTANANDInfo() {
  std::optional<cf::Dictionary> view =
      View({kMaxPercentageNANDUsed, kHostReadErrors, kMaxE2EErrors, kNumGrownBadBlocks});
  if (!view) return {};
  return *view;
}

cf::Value NandRecommendsContentDeletion() {
  nand_exporter_t* e = nullptr;
  const io_service_t service = findNandExporter(&e);
  if (e->contentDeletionMethod == kNoContentDeletion) {
    if (service) IOObjectRelease(service);
    return cf::Value::Bool(false);
  }
  if (!service) {
    std::fputs("_load_nand_infoCould not get matching IOKit service for exporting classes\n", stderr);
    return cf::Value::Bool(false);
  }
  io_connect_t connection = 0;
  if (IOServiceOpen(service, mach_task_self(), 0, &connection) != kIOReturnSuccess) {
    std::fputs("Could not get connection to service\n", stderr);
    IOObjectRelease(service);
    return cf::Value::Bool(false);
  }
  uint32_t answer = 0;
  size_t answer_size = sizeof answer;
  const kern_return_t rc =
      IOConnectCallStructMethod(connection, e->contentDeletionMethod, nullptr, 0, &answer, &answer_size);
  const bool recommends = rc == kIOReturnSuccess && answer_size >= sizeof answer && answer != 0;
  if (IOServiceClose(connection) != kIOReturnSuccess) std::fputs("Could not close connection to service\n", stderr);
  IOObjectRelease(service);
  return cf::Value::Bool(recommends);
}
