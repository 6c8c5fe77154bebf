#include "platform/stackshot.h"

#include <errno.h>

#include <string>

#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"
#include "sim/kcdata.h"

struct stackshot_config_t {
  uint64_t flags = 0;
  bool flags_set = false;
  bool captured = false;
  std::string bytes;
};

namespace {
constexpr uint64_t kKCDataFormat = 0x10000;
}

stackshot_config_t* stackshot_config_create() { return new stackshot_config_t; }

int stackshot_config_set_flags(stackshot_config_t* config, uint64_t flags) {
  if (!config || flags != kKCDataFormat) return EINVAL;
  config->flags = flags;
  config->flags_set = true;
  return 0;
}

int stackshot_capture_with_config(stackshot_config_t* config) {
  if (!config || !config->flags_set) return EINVAL;
  const platform::Context& context = platform::Context::Current();
  std::string error;
  if (auto raw = platform::ReadDeviceBytes("/device/stackshot.kcdata", &error)) {
    config->bytes = std::move(*raw);
  } else if (!error.empty()) {
    platform::LogError("%s", error);
    return EIO;
  } else {
    const cf::Value tasks = platform::ReadProfileValue("/device/stackshot.plist");
    if (tasks.IsNull()) return ENOENT;
    auto encoded = sim::EncodeKCDataStackshot(tasks, &error);
    if (!encoded) {
      platform::LogError("%s: %s", context.Path("/device/stackshot.plist"), error);
      return EINVAL;
    }
    config->bytes = std::move(*encoded);
  }
  config->captured = true;
  return 0;
}

const void* stackshot_config_get_stackshot_buffer(stackshot_config_t* config) {
  return config && config->captured ? config->bytes.data() : nullptr;
}

uint32_t stackshot_config_get_stackshot_size(stackshot_config_t* config) {
  return config && config->captured ? static_cast<uint32_t>(config->bytes.size()) : 0;
}

int stackshot_config_dealloc(stackshot_config_t* config) {
  delete config;
  return 0;
}
