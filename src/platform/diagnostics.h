// Diagnostics and crash-report support services: log submission, the OS
// version, the device's answers, structured-data log housekeeping and the
// service-and-repair log roll.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "cf/value.h"

namespace platform {

// What a submission writer writes into.
class LogOutput {
 public:
  virtual ~LogOutput() = default;
  virtual bool Write(std::string_view bytes) = 0;
};

inline constexpr const char* kSubmissionsDir = "/var/diagvault/submissions";

// A log standing in the submissions folder, as its description tells it.
struct Submission {
  std::string file;            // the log's file name
  double created = 0;          // when it was written
  std::optional<int32_t> day;  // the day the run that wrote it worked on
  bool gated = false;          // that run went through the once-a-day gate
};
// The logs of this name (e.g. "log-aggregated") in the submissions folder
// that have their description beside them, oldest first. The folder is the
// record of what went out: a gated run asks it before submitting a day again.
std::vector<Submission> ListSubmissions(std::string_view name);

// The "id" of an appended line: the MD5 of what identifies it, in hex.
std::string LineId(std::string_view identity);

}  // namespace platform

// One file per log in $ROOT/var/diagvault/submissions/, named
// <name>_<YYYY-MM-DD-HHMMSS>.<type> (local time; "-N" before the dot when the
// name is taken), holding exactly the writer's bytes, with <file>.json beside
// it: {"type", "name", "options", "created"} and, when the run works on a
// day, "day" and "gated". False, and nothing left behind, when it cannot be
// written.
bool DGVWriteLogForSubmission(std::string_view type, std::string_view name, const cf::Value& options,
                              const cf::Value& reserved, const std::function<void(platform::LogOutput&)>& writer);

// "<ProductVersion> (<ProductBuildVersion>)" from $ROOT/device/system-version.plist,
// else from /etc/os-release.
std::string DGVOSVersion();

// From $ROOT/device/answers.plist: "DiagnosticLogSubmissionEnabled" (default true).
bool DiagnosticLogSubmissionEnabled();
// A boolean answer of $ROOT/device/answers.plist; false when absent.
bool DVGetBoolAnswer(std::string_view question);
// The answer to a device-property question from $ROOT/device/answers.plist,
// or null. "DiskUsage" without an entry there is measured with statvfs of
// the root; "DiskUsage" = false means the device gives no answer.
cf::Value DVCopyAnswer(std::string_view question);
inline constexpr const char* kDVQDiskUsage = "DiskUsage";
inline constexpr const char* kDVQDiskUsageTotalDiskCapacity = "TotalDiskCapacity";
inline constexpr const char* kDVQDiskUsageTotalDataAvailable = "TotalDataAvailable";
// An entry of the "DiskUsage" answer in whole MiB (bytes shifted right by
// 20), or -1 when the answer or the entry is missing.
int64_t DiskUsageMiB(const cf::Value& answer, const char* entry);

// The facts of a storage log's header, as the crash-report support library
// gives them. The system id: "SysID" of $ROOT/device/answers.plist, else
// /etc/machine-id, else "unknown"; with a description, followed by where it
// came from (" (answers)" or " (machine-id)").
std::string GetSysIDWithDescription(bool with_description);
// "HardwareModel" of answers.plist, else the DMI product name, else "unknown".
std::string GetHardwareModel();
// The system version as DGVOSVersion gives it.
std::string GetSystemVersion();
// A fresh random (version 4) UUID in upper case, one per incident.
std::string GetIncidentID();

// Appends one record as a JSON line {"id", "time", "type", "record"} (data
// in base64) to $ROOT/var/faultkeep/structured_<YYYY-MM-DD>.jsonl, dated by
// the platform clock in local time, unless the file holds that line already:
// the "id" stands for the type, the record and how many equal records this
// process logged before. False (with an error line) when it cannot.
bool FKLogStructuredData(int type, const cf::Value& record);

// Moves the structured-data logs of days before today from
// $ROOT/var/faultkeep/ into $ROOT/var/faultkeep/old/: a log named for its
// day by that day, any other file by the day it was last written (which its
// new name then carries). Never fails the caller.
void FKDumpAllOldStructuredDataLogs();
// Keeps the newest 7 files of $ROOT/var/halvern/ and removes the rest.
void rollHalvernLogs();

// Appends "<ISO-8601 time> <name>" to $ROOT/var/run/notifications.log.
void notify_post(std::string_view name);

// MD5 of the bytes, as 16 raw bytes.
std::string CC_MD5(std::string_view bytes);
