// The crash-report support library that the report resolves at run time:
// a real shared library, installed in the device root, exporting two
// preference functions with C linkage.
#pragma once

#include <cstdint>

#include "cf/value.h"

inline constexpr const char* kFaultkeepSupportPath =
    "/System/Library/PrivateFrameworks/FaultkeepSupport.framework/FaultkeepSupport";

// The exported functions. Values cross as pointers to cf::Value; the
// library and the program are built from the same sources.
using DGVPreferencesGetIntegerValueFn = int64_t (*)(const char* key, const char* domain, bool* exists);
using DGVPreferencesSetValueFn = void (*)(const char* key, const cf::Value* value, const char* domain);
