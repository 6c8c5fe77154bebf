// Loading code from the device root at run time.
#pragma once

#include <string>
#include <string_view>

namespace platform {
// dlopen of a device path (resolved under the root) with lazy binding and
// local symbols; null when it is absent, cannot be loaded, or is not trusted
// (an error line then says why).
void* LoadLibrary(std::string_view device_path);
void* FindSymbol(void* library, const char* name);

// Code is trusted when the file and every directory from the root down to it
// are owned by root or the running user and writable by nobody else, and no
// link stands on the way below the root. *why says what failed.
bool IsTrustedCode(const std::string& root, const std::string& path, std::string* why);
}  // namespace platform
