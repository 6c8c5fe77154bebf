// The default device root that `devsim init` writes.
#pragma once

#include <string>

// Writes the whitelist, the device profile and a store holding a realistic
// yesterday and today (relative to the platform clock) into root.
bool WriteDefaultRoot(const std::string& root, std::string* error);
