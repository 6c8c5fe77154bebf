#include <cstdlib>
#include <string>

#include "driver/driver.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/service.h"
#include "platform/store.h"
#include "platform/upkeep.h"

using platform::LogDefault;

namespace {

// How long the service waits for an event before it ends: 10 seconds, or
// TALLYRUN_SERVICE_IDLE_SECONDS for tests and debugging.
double IdleSeconds() {
  const std::string text = platform::EnvOr("TALLYRUN_SERVICE_IDLE_SECONDS", "");
  char* end = nullptr;
  const double v = text.empty() ? 0 : std::strtod(text.c_str(), &end);
  return !text.empty() && end && *end == '\0' && v > 0 && v <= 3600 ? v : 10.0;
}

}  // namespace

int TallyrunMain(int argc, char** argv) {
  platform::ApplyPrivateUmask();
  LogDefault("tallyrun started");
  // One instance at a time: a run waits for the one before it (and then
  // finds its gate record); a service that finds another one running leaves
  // that one its socket. A service the service manager started for a
  // waiting peer waits its turn instead: leaving would hand the socket back
  // still readable, and the manager would start it again at once, over and
  // over.
  const bool serve_alone = argc == 1 && !platform::ServiceSocketHandedOver();
  std::string lock_error;
  const auto lock = platform::FileLock::Acquire(
      platform::Context::Current().Path(kInstanceLockPath),
      serve_alone ? platform::FileLock::Wait::kTry : platform::FileLock::Wait::kBlock, &lock_error);
  if (!lock && lock_error.empty()) {
    LogDefault("Another tallyrun is running; leaving the work to it");
    LogDefault("tallyrun ended");
    return 0;
  }
  // A lock file that cannot be had at all must not cost the day's work.
  if (!lock) platform::LogError("Running without the instance lock: %s", lock_error);
  platform::TidyRoot();
  if (argc == 1) {
    platform::xpc_connection_t listener =
        xpc_connection_create_mach_service(kServiceName, platform::XPC_CONNECTION_MACH_SERVICE_LISTENER);
    if (listener) {
      xpc_connection_set_event_handler(listener, HandleServiceConnection);
      xpc_connection_resume(listener);
    }
    const double idle = IdleSeconds();
    while (CFRunLoopRunInMode(idle, true) != platform::kCFRunLoopRunTimedOut) {
    }
    xpc_connection_cancel(listener);  // removes the socket we bound
    if (gAppInfoRequested) {
      LogDefault("never received requested AAI, so moving along without it");
      RunDailyTasksIfDayChanged(cf::Value());
    }
  } else if (argc >= 2) {
    const int32_t today = TBDaysSince1970();
    const std::string arg = argv[1];
    if (arg == "-d") RunDailyTasksIfDayChanged(cf::Value());
    else if (arg == "-f") RunDailyTasks(today - 1, cf::Value());
    else if (arg == "-t") RunDailyTasks(today, cf::Value());
    else LogDefault("Unknown arg: %s", arg);
  }
  LogDefault("tallyrun ended");
  return 0;
}
