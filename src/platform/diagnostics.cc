#include "platform/diagnostics.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <ctime>
#include <vector>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"
#include "platform/store.h"

namespace platform {
namespace {

class FdOutput : public LogOutput {
 public:
  explicit FdOutput(int fd) : fd_(fd) {}
  bool Write(std::string_view bytes) override {
    while (!bytes.empty()) {
      const ssize_t n = ::write(fd_, bytes.data(), bytes.size());
      if (n < 0) {
        if (errno == EINTR) continue;
        failed_ = true;
        return false;
      }
      bytes.remove_prefix(static_cast<size_t>(n));
    }
    return true;
  }
  bool failed() const { return failed_; }

 private:
  int fd_;
  bool failed_ = false;
};

std::string LocalStamp(double t, const char* format) {
  const time_t secs = static_cast<time_t>(std::floor(t));
  struct tm tm;
  localtime_r(&secs, &tm);
  char buf[64];
  std::strftime(buf, sizeof buf, format, &tm);
  return buf;
}

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

bool DGVWriteLogForSubmission(std::string_view type, std::string_view name, const cf::Value& options,
                              const cf::Value& /*reserved*/, const std::function<void(LogOutput&)>& writer) {
  const std::string dir = Context::Current().Path(kSubmissionsDir);
  if (type.empty() || name.empty() || type.find('/') != std::string_view::npos ||
      name.find('/') != std::string_view::npos) {
    LogError("Refusing log submission with type \"%s\" and name \"%s\"", std::string(type), std::string(name));
    return false;
  }
  if (!MakeDirectories(dir)) {
    LogError("Cannot create %s: %s", dir, std::strerror(errno));
    return false;
  }
  // The bytes go to a temp file first; the final name is claimed with link(),
  // which fails rather than replace a log that is already there.
  std::string temp = dir + "/.submission.XXXXXX";
  const int fd = mkstemp(temp.data());
  if (fd < 0) {
    LogError("Cannot create a submission file in %s: %s", dir, std::strerror(errno));
    return false;
  }
  FdOutput out(fd);
  writer(out);
  const bool written = !out.failed() && fsync(fd) == 0;
  close(fd);
  if (!written) {
    LogError("Cannot write the submission of %s", std::string(name));
    unlink(temp.c_str());
    return false;
  }
  chmod(temp.c_str(), 0644);
  const double now = Now();
  const std::string base = std::string(name) + "_" + LocalStamp(now, "%Y-%m-%d-%H%M%S");
  std::string final_path;
  for (int n = 0; n < 10000; ++n) {
    const std::string candidate =
        dir + "/" + base + (n == 0 ? "" : "-" + std::to_string(n)) + "." + std::string(type);
    if (link(temp.c_str(), candidate.c_str()) == 0) {
      final_path = candidate;
      break;
    }
    if (errno != EEXIST) break;
  }
  unlink(temp.c_str());
  if (final_path.empty()) {
    LogError("Cannot name the submission of %s in %s", std::string(name), dir);
    return false;
  }
  cf::Dictionary meta;
  meta.Set("type", std::string(type));
  meta.Set("name", std::string(name));
  meta.Set("options", options.AsDictionary() ? options : cf::Value(cf::Dictionary()));
  meta.Set("created", cf::ISO8601(cf::Date{now}));
  std::string json, error;
  if (!cf::WriteJSON(meta, json, &error, 2) || !WriteFileAtomically(final_path + ".json", json + "\n", &error)) {
    LogError("Cannot write the description of %s: %s", final_path, error);
    unlink(final_path.c_str());
    return false;
  }
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

cf::Value DVCopyAnswer(std::string_view question) {
  return ReadProfileDictionary("/device/answers.plist").Get(std::string(question));
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

void FKDumpAllOldStructuredDataLogs() {
  const std::string dir = Context::Current().Path("/var/faultkeep");
  const double today_start = StartOfDay(TBDaysSince1970());
  for (const Entry& e : RegularFiles(dir)) {
    if (static_cast<double>(e.mtime_ns) / 1e9 >= today_start) continue;
    const std::string old_dir = dir + "/old";
    if (!MakeDirectories(old_dir)) {
      LogError("Cannot create %s: %s", old_dir, std::strerror(errno));
      return;
    }
    // Keep the day the file was last written in its new name.
    const size_t dot = e.name.find_last_of('.');
    const std::string stem = dot == std::string::npos || dot == 0 ? e.name : e.name.substr(0, dot);
    const std::string ext = dot == std::string::npos || dot == 0 ? "" : e.name.substr(dot);
    std::string target = old_dir + "/" + stem + "-" + LocalStamp(static_cast<double>(e.mtime_ns) / 1e9, "%Y-%m-%d") + ext;
    for (int n = 1; FileExists(target) && n < 1000; ++n)
      target = old_dir + "/" + stem + "-" + LocalStamp(static_cast<double>(e.mtime_ns) / 1e9, "%Y-%m-%d") + "-" +
               std::to_string(n) + ext;
    if (rename((dir + "/" + e.name).c_str(), target.c_str()) != 0)
      LogError("Cannot move %s/%s to %s: %s", dir, e.name, target, std::strerror(errno));
  }
}

void rollHalvernLogs() {
  constexpr size_t kKeep = 7;
  const std::string dir = Context::Current().Path("/var/halvern");
  std::vector<Entry> files = RegularFiles(dir);
  if (files.size() <= kKeep) return;
  std::sort(files.begin(), files.end(), [](const Entry& a, const Entry& b) {
    return a.mtime_ns != b.mtime_ns ? a.mtime_ns > b.mtime_ns : a.name > b.name;
  });
  for (size_t i = kKeep; i < files.size(); ++i)
    if (unlink((dir + "/" + files[i].name).c_str()) != 0)
      LogError("Cannot remove %s/%s: %s", dir, files[i].name, std::strerror(errno));
}

void notify_post(std::string_view name) {
  const std::string dir = Context::Current().Path("/var/run");
  if (!MakeDirectories(dir)) {
    LogError("Cannot create %s: %s", dir, std::strerror(errno));
    return;
  }
  const std::string line = cf::ISO8601(cf::Date{Now()}) + " " + std::string(name) + "\n";
  const int fd = open((dir + "/notifications.log").c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0 || write(fd, line.data(), line.size()) != static_cast<ssize_t>(line.size()))
    LogError("Cannot post notification %s: %s", std::string(name), std::strerror(errno));
  if (fd >= 0) close(fd);
}

std::string CC_MD5(std::string_view bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &len, EVP_md5(), nullptr);
  return std::string(reinterpret_cast<char*>(digest), len);
}
