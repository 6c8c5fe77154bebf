#include <cstdio>
#include <cstdlib>
#include <string>

#include "driver/driver.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/run_record.h"
#include "platform/service.h"
#include "platform/store.h"
#include "platform/upkeep.h"

using platform::LogDefault;

namespace {

constexpr const char* kUsage =
    "usage: tallyrun [-d | -f | -t]\n"
    "  -d   the gated daily run: yesterday's work, at most once per day (what the daily timer runs)\n"
    "  -f   yesterday's work now, whatever the gate says (the gate record is left as it is)\n"
    "  -t   today's work so far\n"
    "  without an argument: serve the service socket until ten quiet seconds pass\n"
    "\n"
    "Environment:\n"
    "  TALLYRUN_ROOT         the device root (default /var/lib/tallyrun; make one with devsim init DIR)\n"
    "  TALLYRUN_NOW          run as if at this moment (epoch seconds or ISO-8601)\n"
    "  TALLYRUN_LOG_STDERR=1 also write the log to standard error\n"
    "  TALLYRUN_LOG_DEBUG=1  keep debug lines\n"
    "  TALLYRUN_GROUP        a group that may read what the job writes\n"
    "\n"
    "The log goes to syslog under the name tallyrun (journalctl -t tallyrun).\n"
    "The exit status is always 0; `tallybook status` tells how the last run went.\n";

// How long the service waits for an event before it ends: 10 seconds, or
// TALLYRUN_SERVICE_IDLE_SECONDS for tests and debugging.
double IdleSeconds() {
  const std::string text = platform::EnvOr("TALLYRUN_SERVICE_IDLE_SECONDS", "");
  char* end = nullptr;
  const double v = text.empty() ? 0 : std::strtod(text.c_str(), &end);
  return !text.empty() && end && *end == '\0' && v > 0 && v <= 3600 ? v : 10.0;
}

// A problem that stops the run before it starts: to the log, and to a
// person's terminal once.
void SayStop(const std::string& message) {
  platform::LogError("%s", message);
  if (!platform::LogMirroredToStderr()) std::fprintf(stderr, "tallyrun: %s\n", message.c_str());
}

// The record's name for a mode, or empty for an argument that runs nothing.
std::string ModeOf(int argc, char** argv) {
  if (argc == 1) return "service";
  if (argc < 2) return "";
  const std::string arg = argv[1];
  return arg == "-d" || arg == "-f" || arg == "-t" ? arg : "";
}

// The line that closes a run: how it went, as the record says. Preferences
// still pending are written first (they would be at exit anyway), so that
// one that cannot be written counts against the run.
void LogRunEnd() {
  platform::Context::Current().SynchronizeAllPreferences();
  const auto record = platform::EndRun();
  if (!record) return;
  std::string line = "run " + record->outcome;
  if (record->day) line += " for day " + std::to_string(*record->day) + " (" + platform::DayDate(*record->day) + ")";
  if (!record->log.empty()) line += ": " + record->log;
  line += "; " + std::to_string(record->error_count) + (record->error_count == 1 ? " error line" : " error lines");
  if (record->outcome == platform::kOutcomeFailed) platform::LogError("%s", line);
  else LogDefault("%s", line);
}

}  // namespace

int TallyrunMain(int argc, char** argv) {
  platform::ApplyPrivateUmask();
  LogDefault("tallyrun started");
  const std::string mode = ModeOf(argc, argv);
  if (argc >= 2 && mode.empty()) {
    const std::string arg = argv[1];
    LogDefault("Unknown arg: %s", arg);
    if (arg == "--version") std::fprintf(stderr, "tallyrun %s\n", TALLYRUN_VERSION);
    else if (arg == "--help" || arg == "-h") std::fputs(kUsage, stderr);
    else std::fprintf(stderr, "tallyrun: unknown option '%s'; nothing was run (tallyrun --help for the options)\n", arg.c_str());
    LogDefault("tallyrun ended");
    return 0;
  }
  if (argc < 1) {
    LogDefault("tallyrun ended");
    return 0;
  }
  // A mistyped root is never made into one, and a directory that is not a
  // root is never touched.
  const platform::RootCheck root = platform::CheckDeviceRoot(platform::Context::Current().root());
  if (!root.ok()) {
    SayStop(root.message + "; nothing was run");
    LogDefault("tallyrun ended");
    return 0;
  }
  platform::SetRunMode(mode);
  // A mistyped moment would put the day's work on the wrong day: nothing
  // runs, and the record says why.
  if (const auto clock_error = platform::ClockOverrideError()) {
    SayStop(*clock_error + "; nothing was run");
    platform::NoteRunFailure(*clock_error);
    platform::BeginRun();
    LogRunEnd();
    LogDefault("tallyrun ended");
    return 0;
  }
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
  } else {
    // The daily work opens the run's record itself.
    const int32_t today = TBDaysSince1970();
    if (mode == "-d") {
      RunDailyTasksIfDayChanged(cf::Value());
    } else if (mode == "-f") {
      LogDefault("yesterday's work, forced: day %d (%s)", today - 1, platform::DayDate(today - 1));
      RunDailyTasks(today - 1, cf::Value());
    } else {
      LogDefault("today's work so far: day %d (%s)", today, platform::DayDate(today));
      RunDailyTasks(today, cf::Value());
    }
  }
  LogRunEnd();
  LogDefault("tallyrun ended");
  return 0;
}
