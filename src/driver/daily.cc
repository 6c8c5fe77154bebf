#include "collect/collect.h"
#include "driver/driver.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/run_record.h"
#include "platform/store.h"
#include "report/report.h"

using platform::LogDefault;

void RunDailyTasksIfDayChanged(const cf::Value& appInfo) {
  platform::BeginRun();
  const int32_t yesterday = TBDaysSince1970() - 1;
  platform::NoteRunDay(yesterday);
  const int64_t last = DGVPreferencesGetIntegerValue(kGateKey, kTallyrunDomain);
  if (last < yesterday) {
    platform::NoteGatedRun();
    RunDailyTasks(yesterday, appInfo);
    // Recorded after the tasks, whatever they achieved.
    DGVPreferencesSetValue(kGateKey, cf::Value::SInt32(yesterday), kTallyrunDomain);
    if (!DGVPreferencesSynchronize(kTallyrunDomain))
      platform::NoteRunFailure("the gate record for day " + std::to_string(yesterday) + " could not be written");
  } else {
    LogDefault("Day unchanged since last run");
    platform::NoteDayUnchanged();
    // A gate ahead of the clock holds every day back until the clock passes it.
    if (last > yesterday)
      LogDefault("The gate record says day %lld, ahead of yesterday (day %d): no day runs until day %lld",
                 static_cast<long long>(last), yesterday, static_cast<long long>(last) + 1);
  }
}

namespace {
// The aggregated log a gated run already submitted for the day. The gate
// record is written only after all the tasks, so a gated run that was
// stopped after its submission comes back to the same day; the submissions
// folder tells it that the day went out.
std::optional<platform::Submission> GatedLogOf(int32_t day) {
  if (!platform::RunIsGated()) return std::nullopt;
  for (const platform::Submission& s : platform::ListSubmissions("log-aggregated"))
    if (s.gated && s.day == day) return s;
  return std::nullopt;
}
}  // namespace

void RunDailyTasks(int32_t day, const cf::Value& appInfo) {
  platform::BeginRun();
  platform::NoteRunDay(day);
  LogDefault("daily tasks for day %d", day);
  TBClientCheckpoint();
  if (const auto submitted = GatedLogOf(day)) {
    LogDefault("The aggregated log for day %d went out already (%s); it is not submitted twice", day, submitted->file);
    platform::NoteSubmittedLog(submitted->file);
  } else if (DiagnosticLogSubmissionEnabled()) {
    TBReport report;
    report.writeLogForYesterday(day, appInfo);
    if (!platform::RunSubmittedLog() && !platform::RunHasFailed())
      LogDefault("No aggregated log for day %d: nothing the store holds for it is whitelisted", day);
  } else {
    LogDefault("No aggregated log for day %d: diagnostic log submission is off", day);
    platform::NoteSubmissionOff();
  }
  CollectDailyScalars();
  FKDumpAllOldStructuredDataLogs();
  UpdateTasking();
  rollHalvernLogs();
}
