// The block layer's statistics line, /sys/block/<dev>/stat.
#include <cstdlib>
#include <string_view>

#include "platform/host_disk_pages.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto stat = platform::ParseBlockStat(text);
  if (!stat) return 0;
  if (stat->flushes && !stat->discards) std::abort();  // flushes came after discards
  const cf::Dictionary fields = platform::HostDiskFtlFields(*stat, nullptr);
  if (fields.Get("hostWrites").AsNumber()->AsUInt64() != stat->sectors_written / 8) std::abort();
  platform::BlockStat sum = *stat;
  platform::AddBlockStat(sum, *stat);
  if (sum.sectors_read < stat->sectors_read) std::abort();  // saturates, never wraps
  return 0;
}
