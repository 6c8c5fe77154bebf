#include "platform/loader.h"

#include <dlfcn.h>

#include <string>

#include "platform/context.h"

void* platform::LoadLibrary(std::string_view device_path) {
  return dlopen(Context::Current().Path(device_path).c_str(), RTLD_LAZY | RTLD_LOCAL);
}

void* platform::FindSymbol(void* library, const char* name) { return library ? dlsym(library, name) : nullptr; }
