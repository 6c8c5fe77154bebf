// The storage half of the default device, as devsim init writes it and the
// tests and benchmarks use it: a registry with one controller of the first
// kind and its answers (every FTL field, two MSP buffers, the validity and
// defects lists and the telemetry list of each of the three modes), a
// stackshot with the memory freezer's thread, a purgeable-space answer,
// pending ECC events, the boot session's id, a reporting hub with two
// drivers' channels, and the image driver with its seven images.
#pragma once

#include <string>

#include "cf/value.h"

namespace sim {

struct DefaultDevice {
  cf::Value registry;    // device/registry.plist
  cf::Value controller;  // device/controller.plist
  cf::Value stackshot;   // device/stackshot.plist
  cf::Value purgeable;   // device/purgeable.plist
  cf::Value ecc_events;  // device/ecc-events.plist
  cf::Value ioreport;    // device/ioreport.plist
  cf::Value ean;         // device/ean.plist
  std::string boot_session_uuid;  // "kern.bootsessionuuid" of device/sysctl.plist
};
DefaultDevice DefaultStorageDevice();

}  // namespace sim
