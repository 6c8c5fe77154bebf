// The default device root that `devsim init` writes.
#pragma once

#include <string>

// Writes the whitelist, the device profile (answers, version, kernel
// variables, apps, the usage service's counters, the storage device of
// sim/default_device.h), the enabled analytics events, the crash-report
// support library (copied from support_library) and a store holding a
// realistic yesterday and today (relative to the platform clock) into root.
bool WriteDefaultRoot(const std::string& root, const std::string& support_library, std::string* error);

