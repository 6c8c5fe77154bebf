// The default device root that `devsim init` writes.
#pragma once

#include <string>
#include <vector>

// Writes the whitelist, the device profile (answers, version, kernel
// variables, apps, the usage service's counters, the storage device of
// sim/default_device.h), the enabled analytics events, the crash-report
// support library (copied from support_library) and a store holding a
// realistic yesterday and today (relative to the platform clock) into root.
bool WriteDefaultRoot(const std::string& root, const std::string& support_library, std::string* error);

// The same root for this machine: the whitelist, the answers, the enabled
// analytics events, the support library and the store, and a registry that
// lists the machine's disks as "host" controllers (the disk holding root
// first). Nothing else is simulated: kernel variables, the system version
// and the hardware model come from Linux. The disks listed go to *disks.
bool WriteHostRoot(const std::string& root, const std::string& support_library, std::vector<std::string>* disks,
                   std::string* error);

