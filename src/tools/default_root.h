// The default device root that `devsim init` writes.
#pragma once

#include <string>

#include "cf/value.h"

// Writes the whitelist, the device profile (answers, version, kernel
// variables, apps), the enabled analytics events, the crash-report support
// library (copied from support_library) and a store holding a realistic
// yesterday and today (relative to the platform clock) into root.
bool WriteDefaultRoot(const std::string& root, const std::string& support_library, std::string* error);

// The storage half of the default device: device/registry.plist,
// controller.plist, stackshot.plist, purgeable.plist and the boot session's
// id for sysctl.plist.
struct DefaultDevice {
  cf::Value registry;
  cf::Value controller;
  cf::Value stackshot;
  cf::Value purgeable;
  std::string boot_session_uuid;
};
DefaultDevice StorageDevice();
