// The run driver: entry point and modes, the once-a-day gate, the ordered
// daily tasks, the service's message handlers and the tasking update.
#pragma once

#include <cstdint>

#include "cf/value.h"
#include "platform/run_record.h"
#include "platform/service.h"

inline constexpr const char* kServiceName = "com.velmora.tallybookd.tallyrun";
inline constexpr const char* kInstanceLockPath = "/var/run/tallyrun.lock";
using platform::kGateKey;
inline constexpr const char* kLoggingNotification = "com.velmora.tallybookd.tallyrun.logging";

// Operation codes of service messages.
enum TallyrunOperation : int32_t {
  kOperationLoggingStatus = 0,
  kOperationRunDay = 1,
  kOperationAppData = 2,
};

// Set when the app tracker announced that app information is coming.
extern bool gAppInfoRequested;

int TallyrunMain(int argc, char** argv);
// Runs the daily tasks for yesterday at most once per day.
void RunDailyTasksIfDayChanged(const cf::Value& appInfo);
// The ordered daily tasks for one day; appInfo is an array of app entries or null.
void RunDailyTasks(int32_t day, const cf::Value& appInfo);

void HandleServiceConnection(const platform::XPCEvent& event);
void HandleServiceMessage(const platform::XPCEvent& event);
// One "app_data" record as an AppInfoEntry; null when it lacks a field.
cf::Value AppInfoEntryFromRecord(const cf::Value& record);

// Applies or withdraws the remote tasking payload and records OS changes.
void UpdateTasking();
