// How a run of the day's work went, kept under the root for the person and
// the scheduler who cannot see the job's exit status (always 0) or its
// system log. The run driver opens and closes the record; the services below
// it note what only they see (a failed submission, a store that would not
// open). The record is replaced atomically and privately at the start of the
// work ("running") and at its end.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "cf/value.h"

namespace platform {

inline constexpr const char* kRunRecordPath = "/var/tallyrun/last-run.plist";

// The job's preference domain and, in it, the gate record: the last day a
// gated run handled. The driver writes it; `tallybook status` reads it.
inline constexpr const char* kTallyrunDomain = "com.velmora.tallybookd.tallyrun";
inline constexpr const char* kGateKey = "LastCrashLogSerializationDateInDaysSince1970";

// The outcomes, as the record spells them.
inline constexpr const char* kOutcomeRunning = "running";
inline constexpr const char* kOutcomeSubmitted = "submitted";  // an aggregated log was written
inline constexpr const char* kOutcomeUnchanged = "unchanged";  // the gate had handled the day already
inline constexpr const char* kOutcomeNothingWhitelisted = "nothing-whitelisted";
inline constexpr const char* kOutcomeSubmissionOff = "submission-off";
inline constexpr const char* kOutcomeFailed = "failed";

// How many error lines the record quotes.
inline constexpr size_t kRunRecordQuotedErrors = 5;

struct RunRecord {
  std::string mode;  // "-d", "-f", "-t", "service"
  std::optional<int32_t> day;
  bool gated = false;  // the day's work went through the once-a-day gate
  double started = 0;
  std::optional<double> ended;  // none while running (or after a crash)
  std::string outcome;
  int64_t pid = 0;
  std::string log;  // the file name of the aggregated log submitted, if any
  uint64_t error_count = 0;
  std::vector<std::string> errors;    // the first error lines
  std::vector<std::string> failures;  // why the run failed

  cf::Value ToValue() const;
  // Nothing when value is not a record (a damaged or foreign file).
  static std::optional<RunRecord> FromValue(const cf::Value& value);
};

// The mode this process runs in, for the record.
void SetRunMode(const std::string& mode);
// Starts the record of this process's run and writes it with the outcome
// "running"; later calls do nothing. The day's work calls it, so a service
// that only answered a message leaves the last run's record as it was.
void BeginRun();
// The day the run works on, and whether the once-a-day gate let it through
// (what a gated run submits is submitted once per day; see diagnostics.h).
void NoteRunDay(int32_t day);
void NoteGatedRun();
std::optional<int32_t> RunDay();
bool RunIsGated();
// A reason the run failed: a root, store, submission or preference that
// could not be used. Kept even before BeginRun.
void NoteRunFailure(const std::string& why);
// The aggregated log that was submitted (its file name).
void NoteSubmittedLog(const std::string& file);
void NoteDayUnchanged();
void NoteSubmissionOff();
// Whether a log was submitted in this run, and whether it failed so far (a
// failure noted or an error line logged), for the driver's lines.
bool RunSubmittedLog();
bool RunHasFailed();
// Finishes the record and writes it; nothing when no run was begun. The
// outcome: failed when a failure was noted or an error line logged, else
// unchanged, submitted, submission-off or nothing-whitelisted.
std::optional<RunRecord> EndRun();

// The record of the root's last run; nothing when there is none, with the
// reason in *error when one exists but cannot be read.
std::optional<RunRecord> ReadRunRecord(std::string* error);

// Called by the log for every error or fault line: counted, and the first
// ones quoted in the record.
void CountErrorLine(std::string_view text);

}  // namespace platform
