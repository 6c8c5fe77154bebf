// Encoders of the controller's diagnostic lists, so that controller.plist
// can describe them field by field. Each gives nothing (reason in *error)
// for an unknown key or a value that is not a number of the right range.
#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "cf/value.h"

namespace sim {

// The most bytes an encoded list may take; a description asking for more
// is refused rather than held in memory.
inline constexpr size_t kMaxEncodedListBytes = size_t{64} << 20;

// {"extra": number of skipped 8-byte items (default 0),
//  "entries": [{"list": n, "value": n}, ...]}
std::optional<std::string> EncodeValidityList(const cf::Dictionary& fields, std::string* error);
// {"factoryCount": n, "defects": [{"Bus", "CE", "CAU", "Block", "Cycle",
//  "Reason", "Page", "Temperature", "mode"}, ...]}; a missing key is 0.
std::optional<std::string> EncodeDefectsList(const cf::Dictionary& fields, std::string* error);
// {"buses": [{"RD", "PE", "Max_PE_rate", "t0", "Ret", "block_type",
//  "num_pages", "words": {"<raw word index>": value, ...}}, ...]}; one
// 4096-byte block per bus, then the 32-byte bus summaries.
std::optional<std::string> EncodeTelemetryList(const cf::Dictionary& fields, std::string* error);

}  // namespace sim
