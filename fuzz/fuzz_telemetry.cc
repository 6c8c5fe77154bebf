// The telemetry list as a controller (or a broken one) sends it, with the
// characteristics the input picks. The first byte chooses the chip name,
// the NAND part's id and how the bus count is stored; the next four are
// the bus count; the rest is the list. The handler must succeed exactly
// when the characteristics are usable and the list holds every bus, and
// then log one record per bus; otherwise nothing.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>

#include "platform/clock.h"
#include "platform/context.h"
#include "platform/log.h"
#include "scratch_root.h"
#include "storagelog/telemetry.h"

namespace {

std::string g_root;

// Records logged since the last call, which removes them.
size_t TakeRecords() {
  const std::string dir = g_root + "/var/faultkeep";
  std::error_code ec;
  size_t lines = 0;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    std::ifstream in(entry.path(), std::ios::binary);
    lines += static_cast<size_t>(std::count(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>(), '\n'));
    std::filesystem::remove(entry.path(), ec);
  }
  return lines;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // Lives for the whole run: every record goes under the scratch root.
  g_root = fuzz::ScratchRoot("telemetry");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 5) return 0;
  const uint8_t pick = data[0];
  int32_t num_bus;
  std::memcpy(&num_bus, data + 1, 4);
  const uint8_t* list = data + 5;
  const size_t list_size = size - 5;

  static const std::string kChips[] = {"K3R", "K4R", "K3", std::string(64, 'K')};
  static const std::string kParts[] = {"4582603A5700", "458260DE57AB", "AD8252232100", "ECD7",
                                       "",             "4582603A57",   "AD82522321FF", std::string("45\0" "82", 5)};
  const std::string& chip = kChips[pick & 3];
  const std::string& part = kParts[(pick >> 2) & 7];
  const unsigned count_form = pick >> 5;  // 0-5 signed 32-bit, 6 unsigned 64-bit, 7 absent

  cf::Dictionary characteristics;
  characteristics.Set("chip-id", chip);
  characteristics.Set("manufacturer-id", part);
  if (count_form == 6) {
    characteristics.Set("num-bus", cf::Value::UInt64(static_cast<uint32_t>(num_bus) | (uint64_t{pick} << 32)));
  } else if (count_form < 6) {
    characteristics.Set("num-bus", cf::Value::SInt32(num_bus));
  }

  // The handler copies nothing it does not bound; giving it an exact-size
  // heap copy lets the sanitizer see any read past the end.
  std::unique_ptr<uint8_t[]> copy(new uint8_t[list_size ? list_size : 1]);
  if (list_size) std::memcpy(copy.get(), list, list_size);
  const bool ok = ParseTelemetryList(list_size ? copy.get() : nullptr, list_size, characteristics, "fuzz");

  const bool usable = chip.size() < 64 && part.find('\0') == std::string::npos && count_form != 7;
  const bool fits = num_bus >= 0 && uint64_t(num_bus) * 4128 <= list_size;
  if (ok != (usable && fits)) std::abort();
  if (TakeRecords() != (ok ? static_cast<size_t>(num_bus) : 0)) std::abort();
  return 0;
}
