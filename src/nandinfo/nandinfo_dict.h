// The NAND info dictionary that the statistics store keeps once a day: the
// controller's fixed counters, the named statistics of keyMap, and a few
// figures derived from them.
#pragma once

#include <string_view>

#include "cf/value.h"
#include "parsers/context.h"

// What CopyNANDInfo returns when the statistics cannot be fetched or parsed:
// these two keys, both holding strings.
inline constexpr std::string_view kNANDInfoErrorKey = "com.velmora.NANDInfo.Error";
inline constexpr std::string_view kNANDInfoErrorValue = "1";
inline constexpr std::string_view kNANDInfoErrorMessageKey = "com.velmora.NANDInfo.ErrorMessage";
inline constexpr std::string_view kNANDInfoErrorMessageValue = "Unable to parse buffer";

// True when the preference "StoreDemoMode" of "com.velmora.demo-settings"
// exists, reads as a boolean and is true.
bool StoreDemoModeEnabled();

// A new dictionary from a filled statistics context. 32-bit keys hold
// numbers of type int (code 9), all others signed 64-bit (code 4).
// omitVersionKeys drops ExportVersion, DriverVersion and DemoMode, for
// callers that merge the result into a record that has its own.
cf::Dictionary BuildNANDInfoDictFromStatsCxt(const VSPParseCxt& context, bool omitVersionKeys);
