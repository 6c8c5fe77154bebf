// Loading a library of the device root at run time.
#pragma once

#include <string_view>

namespace platform {
// dlopen of a device path (resolved under the root) with lazy binding and
// local symbols; null when it cannot be loaded.
void* LoadLibrary(std::string_view device_path);
void* FindSymbol(void* library, const char* name);
}  // namespace platform
