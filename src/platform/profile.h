// Reading the device profile files of the root (internal to the seam).
//
// Only regular files of at most kMaxProfileFileBytes are read (a FIFO, a
// device or a huge file is refused with one error line), and a file's parse
// is kept per context until its stamp (modification time in nanoseconds,
// size, inode) changes, so callers may read a file as often as they like.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "cf/value.h"

namespace platform {

inline constexpr int64_t kMaxProfileFileBytes = int64_t{16} << 20;

// The dictionary in a property-list file of the root; empty when the file
// is missing, and empty with one error line when it is not a dictionary.
cf::Dictionary ReadProfileDictionary(const std::string& device_path);
// Any property-list value in a file of the root; null when missing or bad.
cf::Value ReadProfileValue(const std::string& device_path);
// One entry of ReadProfileDictionary, without copying the rest.
cf::Value ReadProfileEntry(const std::string& device_path, std::string_view key);

// The raw bytes of a device file under the same rules; nothing when it is
// missing (*error empty) or refused (*error says why).
std::optional<std::string> ReadDeviceBytes(const std::string& device_path, std::string* error);

// KEY=value pairs of /etc/os-release, quotes removed.
std::map<std::string, std::string> ReadOsRelease();

}  // namespace platform
