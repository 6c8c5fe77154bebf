#include "collect/collect.h"
#include "driver/driver.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/store.h"
#include "report/report.h"

using platform::LogDefault;

void RunDailyTasksIfDayChanged(const cf::Value& appInfo) {
  const int32_t yesterday = TBDaysSince1970() - 1;
  const int64_t last = DGVPreferencesGetIntegerValue(kGateKey, kTallyrunDomain);
  if (last < yesterday) {
    RunDailyTasks(yesterday, appInfo);
    // Recorded after the tasks, whatever they achieved.
    DGVPreferencesSetValue(kGateKey, cf::Value::SInt32(yesterday), kTallyrunDomain);
    DGVPreferencesSynchronize(kTallyrunDomain);
  } else {
    LogDefault("Day unchanged since last run");
  }
}

void RunDailyTasks(int32_t day, const cf::Value& appInfo) {
  LogDefault("daily tasks for day %d", day);
  TBClientCheckpoint();
  if (DiagnosticLogSubmissionEnabled()) {
    TBReport report;
    report.writeLogForYesterday(day, appInfo);
  }
  CollectDailyScalars();
  FKDumpAllOldStructuredDataLogs();
  UpdateTasking();
  rollHalvernLogs();
}
