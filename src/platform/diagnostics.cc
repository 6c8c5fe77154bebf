#include "platform/diagnostics.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>
#include <cmath>
#include <cstring>
#include <ctime>
#include <fstream>
#include <map>
#include <mutex>
#include <random>
#include <vector>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/run_record.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"
#include "platform/service.h"
#include "platform/store.h"

namespace platform {
namespace {

// The writer's bytes are gathered first, so that the file is written and
// named in one go.
class StringOutput : public LogOutput {
 public:
  bool Write(std::string_view bytes) override {
    bytes_.append(bytes);
    return true;
  }
  const std::string& bytes() const { return bytes_; }

 private:
  std::string bytes_;
};

struct Entry {
  std::string name;
  int64_t mtime_ns;
};

std::vector<Entry> RegularFiles(const std::string& dir) {
  std::vector<Entry> out;
  DIR* d = opendir(dir.c_str());
  if (!d) return out;
  while (struct dirent* e = readdir(d)) {
    if (e->d_name[0] == '.') continue;
    struct stat st;
    const std::string path = dir + "/" + e->d_name;
    if (lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) continue;
    out.push_back({e->d_name, static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec});
  }
  closedir(d);
  return out;
}

}  // namespace
}  // namespace platform

using namespace platform;

namespace {

// The submission itself; its file name goes to *submitted.
bool WriteSubmission(std::string_view type, std::string_view name, const cf::Value& options,
                     const std::function<void(LogOutput&)>& writer, std::string* submitted) {
  const std::string dir = Context::Current().Path(kSubmissionsDir);
  if (type.empty() || name.empty() || type.find('/') != std::string_view::npos ||
      name.find('/') != std::string_view::npos) {
    LogError("Refusing log submission with type \"%s\" and name \"%s\"", std::string(type), std::string(name));
    return false;
  }
  std::string error;
  std::optional<Directory> d = Directory::Open(dir, true, &error);
  if (!d) {
    LogError("Cannot create %s: %s", dir, std::strerror(errno));
    return false;
  }
  StringOutput out;
  writer(out);
  const double now = Now();
  cf::Dictionary meta;
  meta.Set("type", std::string(type));
  meta.Set("name", std::string(name));
  meta.Set("options", options.AsDictionary() ? options : cf::Value(cf::Dictionary()));
  meta.Set("created", cf::ISO8601(cf::Date{now}));
  if (const std::optional<int32_t> day = RunDay()) {
    meta.Set("day", cf::Value::SInt32(*day));
    meta.Set("gated", cf::Value::Bool(RunIsGated()));
  }
  std::string json;
  if (!cf::WriteJSON(meta, json, &error, 2)) {
    LogError("Cannot describe the submission of %s: %s", std::string(name), error);
    return false;
  }
  json += "\n";

  // Both files are complete and synced under temporary names before either
  // gets its own. The description takes its name first and the log last, so
  // a log never stands without its description; a description left alone by
  // a crash is removed by the next run. link() claims a name without ever
  // replacing a log that is already there.
  std::string log_temp, json_temp;
  if (!d->WriteTemp("submission", out.bytes(), 0, &log_temp, &error) ||
      !d->WriteTemp("submission-description", json, 0, &json_temp, &error)) {
    LogError("Cannot write the submission of %s: %s", std::string(name), error);
    if (!log_temp.empty()) d->Unlink(log_temp);
    return false;
  }
  const std::string base = std::string(name) + "_" + LocalStamp(now, "%Y-%m-%d-%H%M%S");
  std::string final_name;
  for (int n = 0; n < 10000 && final_name.empty(); ++n) {
    const std::string candidate = base + (n == 0 ? "" : "-" + std::to_string(n)) + "." + std::string(type);
    if (!d->Link(json_temp, candidate + ".json", &error)) {
      if (errno == EEXIST) continue;
      break;
    }
    if (!d->Link(log_temp, candidate, &error)) {
      const bool taken = errno == EEXIST;
      d->Unlink(candidate + ".json");
      if (taken) continue;
      break;
    }
    final_name = candidate;
  }
  d->Unlink(log_temp);
  d->Unlink(json_temp);
  if (final_name.empty()) {
    LogError("Cannot name the submission of %s in %s: %s", std::string(name), dir, error);
    return false;
  }
  if (!d->Sync()) LogError("Cannot sync %s: %s", dir, std::strerror(errno));
  *submitted = final_name;
  return true;
}

}  // namespace

std::vector<Submission> platform::ListSubmissions(std::string_view name) {
  const std::string dir = Context::Current().Path(kSubmissionsDir);
  const std::string prefix = std::string(name) + "_", suffix = ".json";
  std::vector<Submission> found;
  for (const Entry& e : RegularFiles(dir)) {
    if (e.name.size() <= prefix.size() + suffix.size() || e.name.compare(0, prefix.size(), prefix) != 0 ||
        e.name.compare(e.name.size() - suffix.size(), suffix.size(), suffix) != 0)
      continue;
    Submission s;
    s.file = e.name.substr(0, e.name.size() - suffix.size());
    struct stat st;
    if (lstat((dir + "/" + s.file).c_str(), &st) != 0 || !S_ISREG(st.st_mode)) continue;
    const std::optional<std::string> text = ReadRegularFile(dir + "/" + e.name, 64 * 1024);
    if (!text) continue;
    const cf::ParseResult parsed = cf::ParseJSON(*text);
    const cf::Dictionary* d = parsed.value.AsDictionary();
    const cf::String* logged_name = d ? d->Get("name").AsString() : nullptr;
    const cf::String* created = d ? d->Get("created").AsString() : nullptr;
    if (!logged_name || *logged_name != name || !created) continue;
    const std::optional<double> at = ParseInstant(created->str());
    if (!at) continue;
    s.created = *at;
    if (const cf::Number* day = d->Get("day").AsNumber(); day && day->AsSInt64() >= INT32_MIN && day->AsSInt64() <= INT32_MAX)
      s.day = static_cast<int32_t>(day->AsSInt64());
    s.gated = d->Get("gated").AsBool() && *d->Get("gated").AsBool();
    found.push_back(std::move(s));
  }
  std::sort(found.begin(), found.end(), [](const Submission& a, const Submission& b) { return a.created < b.created; });
  return found;
}

bool DGVWriteLogForSubmission(std::string_view type, std::string_view name, const cf::Value& options,
                              const cf::Value& /*reserved*/, const std::function<void(LogOutput&)>& writer) {
  std::string submitted;
  if (!WriteSubmission(type, name, options, writer, &submitted)) {
    NoteRunFailure("the " + std::string(name) + " log could not be submitted");
    return false;
  }
  if (name == "log-aggregated") NoteSubmittedLog(submitted);
  return true;
}

std::string DGVOSVersion() {
  const cf::Dictionary sv = ReadProfileDictionary("/device/system-version.plist");
  const cf::Value version = sv.Get("ProductVersion");
  const cf::Value build = sv.Get("ProductBuildVersion");
  if (version.AsString() && build.AsString()) return *version.AsString() + " (" + *build.AsString() + ")";

  // No device profile: describe the Linux system itself.
  auto release = ReadOsRelease();
  const std::string version_id = release["VERSION_ID"].empty() ? "unknown" : release["VERSION_ID"];
  const std::string build_id = !release["BUILD_ID"].empty()           ? release["BUILD_ID"]
                               : !release["VERSION_CODENAME"].empty() ? release["VERSION_CODENAME"]
                                                                      : "unknown";
  return version_id + " (" + build_id + ")";
}

namespace {
// The first line of a small host file, without surrounding blanks; empty
// when the file is missing or says nothing.
std::string FirstLineOf(const char* path) {
  std::ifstream in(path);
  std::string line;
  if (!in || !std::getline(in, line)) return {};
  const size_t begin = line.find_first_not_of(" \t\r");
  if (begin == std::string::npos) return {};
  return line.substr(begin, line.find_last_not_of(" \t\r") + 1 - begin);
}

// A non-empty string answer, else the host's file, else "unknown".
std::string AnswerOrHostFact(std::string_view question, const char* host_path, std::string* source) {
  const cf::Value answer = DVCopyAnswer(question);
  if (const cf::String* s = answer.AsString(); s && !s->empty()) {
    *source = "answers";
    return *s;
  }
  std::string fact = FirstLineOf(host_path);
  if (fact.empty()) return "unknown";
  *source = std::strrchr(host_path, '/') + 1;
  return fact;
}
}  // namespace

std::string GetSysIDWithDescription(bool with_description) {
  std::string source;
  const std::string id = AnswerOrHostFact("SysID", "/etc/machine-id", &source);
  return with_description && !source.empty() ? id + " (" + source + ")" : id;
}

std::string GetHardwareModel() {
  std::string source;
  return AnswerOrHostFact("HardwareModel", "/sys/class/dmi/id/product_name", &source);
}

std::string GetSystemVersion() { return DGVOSVersion(); }

std::string GetIncidentID() {
  std::array<uint8_t, 16> bytes{};
  std::random_device random;
  for (size_t i = 0; i < bytes.size(); i += 4) {
    const uint32_t r = random();
    std::memcpy(&bytes[i], &r, 4);
  }
  bytes[6] = (bytes[6] & 0x0F) | 0x40;  // version 4
  bytes[8] = (bytes[8] & 0x3F) | 0x80;  // the usual variant
  return uuid_unparse(bytes);
}

cf::Value DVCopyAnswer(std::string_view question) {
  const cf::Dictionary answers = ReadProfileDictionary("/device/answers.plist");
  const cf::Value* answer = answers.Find(cf::Value(std::string(question)));
  if (question != kDVQDiskUsage) return answer ? *answer : cf::Value();
  if (answer) return answer->AsBool() && !*answer->AsBool() ? cf::Value() : *answer;
  // Measured on the filesystem that holds the root.
  struct statvfs fs;
  if (statvfs(Context::Current().root().c_str(), &fs) != 0) return {};
  cf::Dictionary usage;
  usage.Set(kDVQDiskUsageTotalDiskCapacity, cf::Value::SInt64(static_cast<int64_t>(fs.f_blocks * fs.f_frsize)));
  usage.Set(kDVQDiskUsageTotalDataAvailable, cf::Value::SInt64(static_cast<int64_t>(fs.f_bavail * fs.f_frsize)));
  return usage;
}

int64_t DiskUsageMiB(const cf::Value& answer, const char* entry) {
  const cf::Dictionary* d = answer.AsDictionary();
  const cf::Number* n = d ? d->Get(entry).AsNumber() : nullptr;
  return n ? n->AsSInt64() >> 20 : -1;
}

namespace {
// A boolean answer (a boolean or a number), or the default when absent.
bool BoolAnswer(std::string_view question, bool absent) {
  const cf::Value v = DVCopyAnswer(question);
  if (auto b = v.AsBool()) return *b;
  if (auto n = v.AsNumber()) return n->AsSInt64() != 0;
  return absent;
}
}  // namespace

bool DVGetBoolAnswer(std::string_view question) { return BoolAnswer(question, false); }

bool DiagnosticLogSubmissionEnabled() { return BoolAnswer("DiagnosticLogSubmissionEnabled", true); }

namespace {
constexpr const char* kStructuredPrefix = "structured_";
constexpr const char* kStructuredSuffix = ".jsonl";

// The day in a name such as "structured_2026-11-21.jsonl" (YYYY-MM-DD,
// compared as text), or empty.
std::string DayInName(const std::string& name) {
  const std::string prefix = kStructuredPrefix, suffix = kStructuredSuffix;
  if (name.size() != prefix.size() + 10 + suffix.size() || name.compare(0, prefix.size(), prefix) != 0 ||
      name.compare(name.size() - suffix.size(), suffix.size(), suffix) != 0)
    return {};
  const std::string day = name.substr(prefix.size(), 10);
  for (size_t i = 0; i < day.size(); ++i)
    if (i == 4 || i == 7 ? day[i] != '-' : !std::isdigit(static_cast<unsigned char>(day[i]))) return {};
  return day;
}
}  // namespace

std::string platform::LineId(std::string_view identity) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (const unsigned char c : CC_MD5(identity)) {
    hex += kDigits[c >> 4];
    hex += kDigits[c & 15];
  }
  return hex;
}

bool FKLogStructuredData(int type, const cf::Value& record) {
  const double now = Now();
  std::string record_json, json, error;
  if (!cf::WriteJSON(record, record_json, &error)) {
    LogError("Cannot log structured data of type %d: %s", type, error);
    return false;
  }
  // A record is identified by its type, its content and how many equal
  // ones this process logged before it: a run repeated after a crash logs
  // the same records in the same order and finds each in the day's log,
  // while two equal records of one run (two alike buses) are both kept.
  std::string identity = std::to_string(type) + " " + record_json;
  {
    static std::mutex mu;
    static std::map<std::string, int> logged;
    std::lock_guard<std::mutex> lock(mu);
    if (logged.size() >= 100000) logged.clear();  // a process of endless records (a fuzzer) stays bounded
    identity += " #" + std::to_string(++logged[LineId(identity)]);
  }
  const std::string id = LineId(identity);
  cf::Dictionary line;
  line.Set("id", id);
  line.Set("time", cf::ISO8601(cf::Date{now}));
  line.Set("type", cf::Value::SInt32(type));
  line.Set("record", record);
  const std::string path = Context::Current().Path("/var/faultkeep/") + kStructuredPrefix +
                           LocalStamp(now, "%Y-%m-%d") + kStructuredSuffix;
  const std::string mark = "\"id\":\"" + id + "\"";
  AppendOnce once{mark};
  if (!cf::WriteJSON(line, json, &error) || !AppendToFile(path, json + "\n", &error, &once)) {
    LogError("Cannot log structured data of type %d: %s", type, error);
    return false;
  }
  if (once.present) LogInfo("Structured data of type %d %s is in today's log already", type, id);
  return true;
}

void FKDumpAllOldStructuredDataLogs() {
  const std::string path = Context::Current().Path("/var/faultkeep");
  const std::string today = LocalStamp(StartOfDay(TBDaysSince1970()), "%Y-%m-%d");
  std::optional<Directory> dir;
  std::optional<Directory> old_dir;
  std::string error;
  for (const Entry& e : RegularFiles(path)) {
    // A log named for its day rolls by that day, so a clock fixed by
    // TALLYRUN_NOW never moves a file written earlier in the same run.
    const std::string named = DayInName(e.name);
    const std::string day = named.empty() ? LocalStamp(static_cast<double>(e.mtime_ns) / 1e9, "%Y-%m-%d") : named;
    if (day >= today) continue;
    if (!dir) dir = Directory::Open(path, false, &error);
    if (dir && !old_dir) old_dir = Directory::Open(path + "/old", true, &error);
    if (!dir || !old_dir) {
      LogError("%s", error);
      return;
    }
    // Another file keeps the day it was last written in its new name.
    const size_t dot = e.name.find_last_of('.');
    const std::string stem = dot == std::string::npos || dot == 0 ? e.name : e.name.substr(0, dot);
    const std::string ext = dot == std::string::npos || dot == 0 ? "" : e.name.substr(dot);
    const std::string base = named.empty() ? stem + "-" + day : stem;
    bool moved = false;
    for (int n = 0; n < 1000 && !moved; ++n) {
      moved = dir->MoveTo(e.name, *old_dir, base + (n ? "-" + std::to_string(n) : "") + ext, &error);
      if (!moved && errno != EEXIST) break;
    }
    if (!moved) LogError("%s", error);
  }
}

void rollHalvernLogs() {
  constexpr size_t kKeep = 7;
  const std::string path = Context::Current().Path("/var/halvern");
  std::vector<Entry> files = RegularFiles(path);
  if (files.size() <= kKeep) return;
  std::string error;
  std::optional<Directory> dir = Directory::Open(path, false, &error);
  if (!dir) {
    LogError("%s", error);
    return;
  }
  std::sort(files.begin(), files.end(), [](const Entry& a, const Entry& b) {
    return a.mtime_ns != b.mtime_ns ? a.mtime_ns > b.mtime_ns : a.name > b.name;
  });
  for (size_t i = kKeep; i < files.size(); ++i)
    if (!dir->Unlink(files[i].name)) LogError("Cannot remove %s/%s: %s", path, files[i].name, std::strerror(errno));
}

void notify_post(std::string_view name) {
  const std::string line = cf::ISO8601(cf::Date{Now()}) + " " + std::string(name) + "\n";
  std::string error;
  if (!AppendToFile(Context::Current().Path("/var/run/notifications.log"), line, &error))
    LogError("Cannot post notification %s: %s", std::string(name), error);
}

std::string CC_MD5(std::string_view bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &len, EVP_md5(), nullptr);
  return std::string(reinterpret_cast<char*>(digest), len);
}
