// NVMe health log pages and identify-controller data from a real disk.
#include <cstdlib>
#include <string_view>

#include "platform/host_disk_pages.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const auto health = platform::DecodeNvmeHealthPage(bytes);
  if (health.has_value() != (size >= platform::kNvmeHealthPageBytes)) std::abort();
  if (health) {
    const cf::Dictionary fields = platform::HostDiskFtlFields(platform::BlockStat{}, &*health);
    if (fields.Get("hostWrites").AsNumber()->AsUInt64() / 125 < health->data_units_written &&
        fields.Get("hostWrites").AsNumber()->AsUInt64() != UINT64_MAX)
      std::abort();  // scaling may saturate, never wrap
  }
  const auto identity = platform::DecodeNvmeIdentifyController(bytes);
  if (identity.has_value() != (size >= platform::kNvmeIdentifyBytes)) std::abort();
  if (identity && (identity->model.size() > 40 || identity->serial.size() > 20 || identity->firmware.size() > 8))
    std::abort();
  return 0;
}
