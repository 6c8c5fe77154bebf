#include "sim/storage_lists.h"

namespace sim {
// Placeholder until the telemetry encoder lands.
std::optional<std::string> EncodeTelemetryList(const cf::Dictionary&, std::string* error) {
  if (error) *error = "telemetry lists are given as raw data for now";
  return std::nullopt;
}
}  // namespace sim
