// The FaultkeepSupport library. It serves the preferences of the device root
// it is installed in, whatever the loading process's own root.
#include <dlfcn.h>

#include <cstdlib>
#include <string>

#include "platform/context.h"
#include "platform/faultkeep.h"
#include "platform/files.h"
#include "platform/prefs.h"

namespace {

platform::Context& LibraryContext() {
  static platform::Context* context = [] {
    Dl_info info{};
    std::string root = "/";
    if (dladdr(reinterpret_cast<void*>(&LibraryContext), &info) && info.dli_fname) {
      const std::string path = info.dli_fname;
      const std::string suffix = kFaultkeepSupportPath;
      if (path.size() > suffix.size() && path.compare(path.size() - suffix.size(), suffix.size(), suffix) == 0)
        root = path.substr(0, path.size() - suffix.size());
    }
    auto* c = new platform::Context(root, platform::Backends{});
    // Pending values reach the disk at exit, unless the root went away.
    std::atexit([] {
      if (platform::FileExists(LibraryContext().root())) LibraryContext().SynchronizeAllPreferences();
    });
    return c;
  }();
  return *context;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int64_t DGVPreferencesGetIntegerValue(const char* key,
                                                                                         const char* domain,
                                                                                         bool* exists) {
  if (!key || !domain) return 0;
  const cf::Value v = LibraryContext().preferences().Get(domain, std::string(key));
  int64_t out = 0;
  bool ok = false;
  if (const cf::Number* n = v.AsNumber()) out = n->AsSInt64(), ok = true;
  else if (const bool* b = v.AsBool()) out = *b, ok = true;
  if (exists) *exists = ok;
  return out;
}

extern "C" __attribute__((visibility("default"))) void DGVPreferencesSetValue(const char* key, const cf::Value* value,
                                                                              const char* domain) {
  if (!key || !domain) return;
  LibraryContext().preferences().Set(domain, std::string(key), value ? *value : cf::Value());
}
