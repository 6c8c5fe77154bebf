#include "tools/status.h"

#include <signal.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <string>

#include "platform/clock.h"
#include "platform/context.h"
#include "platform/prefs.h"
#include "platform/run_record.h"
#include "platform/store.h"
#include "tools/output.h"

namespace tools {

namespace {

bool ProcessAlive(int64_t pid) { return pid > 0 && (kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM); }

std::string Moment(double t) { return platform::LocalStamp(t, "%Y-%m-%d %H:%M:%S %z"); }

std::string Duration(double seconds) {
  const auto s = static_cast<long long>(std::llround(std::fabs(seconds)));
  char buf[64];
  if (s < 120) std::snprintf(buf, sizeof buf, "%lld s", s);
  else if (s < 2 * 3600) std::snprintf(buf, sizeof buf, "%lld min", s / 60);
  else if (s < 2 * 86400) std::snprintf(buf, sizeof buf, "%.1f h", static_cast<double>(s) / 3600);
  else std::snprintf(buf, sizeof buf, "%.1f days", static_cast<double>(s) / 86400);
  return buf;
}

}  // namespace

int PrintRunStatus(bool json, double max_age_seconds) {
  const double now = platform::Now();
  const int32_t yesterday = TBDaysSince1970() - 1;
  std::string read_error;
  const auto record = platform::ReadRunRecord(&read_error);
  const cf::Value gate_value = DGVPreferencesGetValue(platform::kGateKey, platform::kTallyrunDomain);
  const cf::Number* gate_number = gate_value.AsNumber();
  const bool gate_ahead = gate_number && gate_number->AsSInt64() > yesterday;

  // The verdict, most serious first.
  std::string state, why;
  int status = kStatusOk;
  double age = 0;
  if (!record) {
    state = read_error.empty() ? "none" : "unreadable";
    why = read_error.empty() ? "no run has been recorded in this root" : read_error;
    status = read_error.empty() ? kStatusStale : kStatusFailed;
  } else {
    age = now - record->ended.value_or(record->started);
    const bool running = record->outcome == platform::kOutcomeRunning;
    if (record->outcome == platform::kOutcomeFailed) {
      state = "failed", status = kStatusFailed;
      why = !record->failures.empty() ? record->failures.front()
            : !record->errors.empty() ? "an error line: " + record->errors.front()
                                      : "the run failed";
    } else if (running && !ProcessAlive(record->pid)) {
      state = "interrupted", status = kStatusFailed;
      why = "the run stopped before it ended (killed, crashed or the machine went down)";
    } else if (gate_ahead) {
      state = "held", status = kStatusStale;
      const int64_t gate = gate_number->AsSInt64();
      why = "the gate record holds day " + std::to_string(gate) + " (" + IsoDate(gate) +
            "), ahead of yesterday: gated runs do nothing until " + IsoDate(gate + 2);
    } else if (age > max_age_seconds) {
      state = "stale", status = kStatusStale;
      why = "the last run is older than " + Duration(max_age_seconds);
    } else {
      state = running ? "running" : "ok";
    }
  }

  if (json) {
    cf::Dictionary out;
    out.Set("root", platform::Context::Current().root());
    out.Set("state", state);
    out.Set("exitStatus", cf::Value::SInt64(status));
    if (!why.empty()) out.Set("reason", why);
    out.Set("maxAgeSeconds", cf::Value::Float64(max_age_seconds));
    if (record) {
      cf::Dictionary r = *record->ToValue().AsDictionary();
      if (record->day) r.Set("date", IsoDate(*record->day));
      out.Set("lastRun", r);
      out.Set("ageSeconds", cf::Value::Float64(age));
    }
    if (gate_number) {
      cf::Dictionary gate;
      gate.Set("day", cf::Value::SInt64(gate_number->AsSInt64()));
      gate.Set("date", IsoDate(gate_number->AsSInt64()));
      gate.Set("aheadOfClock", cf::Value::Bool(gate_ahead));
      if (gate_ahead) gate.Set("heldUntil", IsoDate(gate_number->AsSInt64() + 2));
      out.Set("gate", gate);
    }
    std::printf("%s\n", JSONText(out, 2).c_str());
    return status;
  }

  std::printf("state:    %s%s%s\n", state.c_str(), why.empty() ? "" : ": ", why.c_str());
  if (record) {
    std::printf("run:      %s", record->mode.c_str());
    if (record->day) std::printf(" for day %d (%s)", *record->day, IsoDate(*record->day).c_str());
    std::printf("\noutcome:  %s%s%s\n", record->outcome.c_str(), record->log.empty() ? "" : ", ", record->log.c_str());
    std::printf("started:  %s (%s ago)\n", Moment(record->started).c_str(), Duration(now - record->started).c_str());
    if (record->ended)
      std::printf("ended:    %s (took %s)\n", Moment(*record->ended).c_str(),
                  Duration(*record->ended - record->started).c_str());
    std::printf("errors:   %llu line%s\n", static_cast<unsigned long long>(record->error_count),
                record->error_count == 1 ? "" : "s");
    for (const std::string& e : record->errors) std::printf("  %s\n", e.c_str());
    for (const std::string& f : record->failures) std::printf("failure:  %s\n", f.c_str());
  }
  if (gate_number)
    std::printf("gate:     day %lld (%s)\n", static_cast<long long>(gate_number->AsSInt64()),
                IsoDate(gate_number->AsSInt64()).c_str());
  return status;
}

}  // namespace tools
