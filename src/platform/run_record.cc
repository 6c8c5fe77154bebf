#include "platform/run_record.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <mutex>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

namespace {

// The record being made; error lines and failures noted before the run
// begins go into it too.
struct RunState {
  std::mutex mu;
  bool begun = false;
  bool unchanged = false;
  bool submission_off = false;
  RunRecord record;
};

RunState& State() {
  static auto* const state = new RunState;  // never destroyed: late log lines still count
  return *state;
}

// Every record file is padded to this size, so that a run on a full disk
// can still write its end over its start (see Write); quoted lines are cut
// so that a record fits.
constexpr size_t kRecordBytes = 16384;
constexpr size_t kQuotedLineBytes = 256;

std::string Quoted(std::string_view line) {
  if (line.size() <= kQuotedLineBytes) return std::string(line);
  size_t cut = kQuotedLineBytes;
  while (cut > 0 && (static_cast<unsigned char>(line[cut]) & 0xC0) == 0x80) --cut;  // whole characters
  return std::string(line.substr(0, cut)) + "...";
}

// Written through the file layer, so privately, atomically and never
// through a link. When the disk is too full for a replacement, the record
// is written over the one there (the run's start, or the last run's), whose
// padding leaves room: a full disk is when a scheduler most needs to hear
// that the run failed. A record that cannot be written at all is one more
// error line: it cannot fail the run it describes.
void Write(const RunRecord& record) {
  std::string bytes, error;
  if (!cf::WriteXMLPropertyList(record.ToValue(), bytes, &error)) {
    LogError("Could not record how the run went: %s", error);
    return;
  }
  if (bytes.size() < kRecordBytes) bytes.append(kRecordBytes - bytes.size(), '\n');
  const std::string path = Context::Current().Path(kRunRecordPath);
  if (WriteFileAtomically(path, bytes, &error)) return;
  std::string in_place_error;
  const size_t slash = path.rfind('/');
  auto dir = Directory::Open(path.substr(0, slash), false, &in_place_error);
  if (dir && dir->Overwrite(path.substr(slash + 1), bytes, &in_place_error)) {
    LogDefault("Recorded how the run went over the last record: %s", error);
    return;
  }
  LogError("Could not record how the run went: %s", error);
}

}  // namespace

cf::Value RunRecord::ToValue() const {
  cf::Dictionary d;
  d.Set("mode", mode);
  if (day) d.Set("day", cf::Value::SInt32(*day));
  if (gated) d.Set("gated", cf::Value::Bool(true));
  d.Set("started", cf::Date{started});
  if (ended) d.Set("ended", cf::Date{*ended});
  d.Set("outcome", outcome);
  d.Set("pid", cf::Value::SInt64(pid));
  if (!log.empty()) d.Set("log", log);
  d.Set("errorCount", cf::Value::UInt64(error_count));
  cf::Array quoted, why;
  for (const std::string& e : errors) quoted.Append(e);
  for (const std::string& f : failures) why.Append(f);
  d.Set("errors", quoted);
  d.Set("failures", why);
  return d;
}

std::optional<RunRecord> RunRecord::FromValue(const cf::Value& value) {
  const cf::Dictionary* d = value.AsDictionary();
  if (!d) return std::nullopt;
  auto text = [&](const char* key) -> const cf::String* { return d->Get(key).AsString(); };
  const cf::Value& started = d->Get("started");
  if (!text("mode") || !text("outcome") || !started.AsDate()) return std::nullopt;
  RunRecord r;
  r.mode = text("mode")->str();
  r.outcome = text("outcome")->str();
  r.started = started.AsDate()->seconds;
  if (const cf::Date* ended = d->Get("ended").AsDate()) r.ended = ended->seconds;
  if (const cf::Number* day = d->Get("day").AsNumber()) {
    const int64_t v = day->AsSInt64();
    if (v < INT32_MIN || v > INT32_MAX) return std::nullopt;
    r.day = static_cast<int32_t>(v);
  }
  r.gated = d->Get("gated").AsBool() && *d->Get("gated").AsBool();
  if (const cf::Number* pid = d->Get("pid").AsNumber()) r.pid = pid->AsSInt64();
  if (const cf::String* log = text("log")) r.log = log->str();
  if (const cf::Number* count = d->Get("errorCount").AsNumber()) r.error_count = count->AsUInt64();
  for (const auto& [key, list] : {std::pair{"errors", &r.errors}, std::pair{"failures", &r.failures}})
    if (const cf::Array* a = d->Get(key).AsArray())
      for (const cf::Value& v : *a)
        if (const cf::String* s = v.AsString()) list->push_back(s->str());
  return r;
}

void SetRunMode(const std::string& mode) {
  std::lock_guard<std::mutex> lock(State().mu);
  State().record.mode = mode;
}

void BeginRun() {
  RunRecord snapshot;
  {
    RunState& s = State();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.begun) return;
    s.begun = true;
    s.record.started = Now();
    s.record.pid = getpid();
    s.record.outcome = kOutcomeRunning;
    snapshot = s.record;
  }
  Write(snapshot);
}

void NoteRunDay(int32_t day) {
  std::lock_guard<std::mutex> lock(State().mu);
  State().record.day = day;
}

void NoteGatedRun() {
  std::lock_guard<std::mutex> lock(State().mu);
  State().record.gated = true;
}

std::optional<int32_t> RunDay() {
  std::lock_guard<std::mutex> lock(State().mu);
  return State().record.day;
}

bool RunIsGated() {
  std::lock_guard<std::mutex> lock(State().mu);
  return State().record.gated;
}

void NoteRunFailure(const std::string& why) {
  std::lock_guard<std::mutex> lock(State().mu);
  std::vector<std::string>& failures = State().record.failures;
  if (failures.size() < kRunRecordQuotedErrors) failures.push_back(Quoted(why));
}

void NoteSubmittedLog(const std::string& file) {
  std::lock_guard<std::mutex> lock(State().mu);
  State().record.log = file;
}

void NoteDayUnchanged() {
  std::lock_guard<std::mutex> lock(State().mu);
  State().unchanged = true;
}

void NoteSubmissionOff() {
  std::lock_guard<std::mutex> lock(State().mu);
  State().submission_off = true;
}

bool RunSubmittedLog() {
  std::lock_guard<std::mutex> lock(State().mu);
  return !State().record.log.empty();
}

bool RunHasFailed() {
  std::lock_guard<std::mutex> lock(State().mu);
  return !State().record.failures.empty() || State().record.error_count > 0;
}

std::optional<RunRecord> EndRun() {
  RunRecord r;
  {
    RunState& s = State();
    std::lock_guard<std::mutex> lock(s.mu);
    if (!s.begun) return std::nullopt;
    r = s.record;
    // An error line is a step that went wrong; what a machine merely lacks
    // is logged below that level and leaves the run fine.
    r.outcome = !r.failures.empty() || r.error_count > 0 ? kOutcomeFailed
                : s.unchanged                            ? kOutcomeUnchanged
                : !r.log.empty()                         ? kOutcomeSubmitted
                : s.submission_off                       ? kOutcomeSubmissionOff
                                                         : kOutcomeNothingWhitelisted;
  }
  r.ended = Now();
  Write(r);
  return r;
}

std::optional<RunRecord> ReadRunRecord(std::string* error) {
  const std::string path = Context::Current().Path(kRunRecordPath);
  struct stat st;
  if (lstat(path.c_str(), &st) != 0 && errno == ENOENT) return std::nullopt;
  const auto bytes = ReadRegularFile(path, 1 << 20, error);
  if (!bytes) return std::nullopt;
  auto record = RunRecord::FromValue(cf::ParsePropertyList(*bytes).value);
  if (!record && error) *error = path + " is not a run record";
  return record;
}

void CountErrorLine(std::string_view text) {
  std::lock_guard<std::mutex> lock(State().mu);
  RunRecord& record = State().record;
  ++record.error_count;
  if (record.errors.size() < kRunRecordQuotedErrors) record.errors.push_back(Quoted(text));
}

}  // namespace platform
