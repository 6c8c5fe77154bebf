// The device's kernel and system facts: system version, kernel variables,
// page size, the monotonic timebase, installed apps and the locale.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>

#include "cf/value.h"

// {"ProductVersion", "ProductBuildVersion", ...} from
// $ROOT/device/system-version.plist, else built from /etc/os-release.
cf::Value _CFCopySystemVersionDictionary();

namespace platform {

// sysctlbyname-style read of a kernel variable into a buffer of *size bytes.
// Values come from $ROOT/device/sysctl.plist: an integer is read as 4 or 8
// bytes (the buffer's size); data, and a string with its terminating NUL, go
// into any buffer at least as large, *size becoming their length.
// "vm.swapusage" and "kern.bootsessionuuid" come from Linux unless the
// profile names them. Returns 0, or -1 with errno: ENOENT for an unknown
// name, ENOMEM for a buffer of the wrong size (too small for bytes).
int Sysctl(const char* name, void* buffer, size_t* size);

// The kernel's page size in bytes.
uint64_t PageSize();

}  // namespace platform

struct mach_timebase_info_data_t {
  uint32_t numer;
  uint32_t denom;
};
// Nanoseconds of the monotonic clock (not advancing in suspend).
uint64_t mach_absolute_time();
// 0 and 1/1 (the clock counts nanoseconds); non-zero when the clock backend
// cannot say.
int mach_timebase_info(mach_timebase_info_data_t* info);

// The app registry, from $ROOT/device/apps.plist: an array of dictionaries
// with "bundleIdentifier" and "bundleType" ("User" or "System").
inline constexpr const char* LSUserApplicationType = "User";
struct LSBundleProxy {
  std::string bundleIdentifier;
  std::string bundleType;
};
class LSApplicationWorkspace {
 public:
  static LSApplicationWorkspace& defaultWorkspace();
  // Type 1: applications. Every bundle of the registry is one.
  void enumerateBundlesOfType(int type, const std::function<void(const LSBundleProxy&)>& block);
};

// Locale. Preferred languages from LANGUAGE (colon-separated), else LANG, as
// tags ("en_US.UTF-8" gives "en-US"); none for C and POSIX.
cf::Array preferredLanguages();
// $ROOT/device/answers.plist "SystemLanguages", default ["en"].
cf::Array systemLanguages();
// The best of available for the preferences: the first preference found
// exactly, else by its language; an empty array when nothing matches.
cf::Array preferredLocalizationsFromArray(const cf::Array& available, const cf::Array& preferences);
// The territory of LANG ("en_US.UTF-8" gives "US"); null when it has none.
cf::Value CurrentLocaleCountryCode();
