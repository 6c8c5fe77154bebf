// Stackshots: a picture of every task and thread in kcdata form. Behind the
// seam the simulated device takes it from $ROOT/device/stackshot.kcdata (the
// bytes as they are) or $ROOT/device/stackshot.plist (tasks and threads,
// encoded at capture); with neither, a capture fails.
#pragma once

#include <cstdint>

struct stackshot_config_t;

stackshot_config_t* stackshot_config_create();
// 0, or an errno value: only the kcdata format (0x10000) is supported.
int stackshot_config_set_flags(stackshot_config_t* config, uint64_t flags);
// 0, or an errno value (EINVAL before set_flags, ENOENT without a stackshot).
int stackshot_capture_with_config(stackshot_config_t* config);
// The captured bytes, owned by the configuration; null before a capture.
const void* stackshot_config_get_stackshot_buffer(stackshot_config_t* config);
uint32_t stackshot_config_get_stackshot_size(stackshot_config_t* config);
int stackshot_config_dealloc(stackshot_config_t* config);
