// Reading the device profile files of the root (internal to the seam).
#pragma once

#include <map>
#include <string>

#include "cf/value.h"

namespace platform {

// The dictionary in a property-list file of the root; empty when the file
// is missing, and empty with one error line when it is not a dictionary.
cf::Dictionary ReadProfileDictionary(const std::string& device_path);
// Any property-list value in a file of the root; null when missing or bad.
cf::Value ReadProfileValue(const std::string& device_path);

// KEY=value pairs of /etc/os-release, quotes removed.
std::map<std::string, std::string> ReadOsRelease();

}  // namespace platform
