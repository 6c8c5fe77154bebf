// The purgeable-space service: how much of a volume could be given back.
// Behind the seam the answer is $ROOT/device/purgeable.plist (a dictionary);
// no file means the service answers null.
#pragma once

#include "cf/value.h"

namespace platform {
// False where the service is absent (it is weakly linked): callers then do
// not ask.
bool PurgewellAvailable();
}  // namespace platform

// The answer to request ({"PURGEWELL_VOLUME": path}), or null.
cf::Value PurgewellCopyItemizedPurgeableSpaceWithInfo(const cf::Value& request);
