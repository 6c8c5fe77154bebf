// The telemetry list: per-bus read-algorithm counters of the NAND, in a
// layout that depends on the controller chip and the NAND part, brought
// into one record per bus and sent to the structured-data log.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "cf/value.h"

bool ParseTelemetryList(const uint8_t* data, size_t size, const cf::Value& characteristics,
                        std::string_view class_name);
