#include "platform/log.h"

#include <errno.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "platform/context.h"
#include "platform/run_record.h"

namespace platform {

const char* LogLevelName(LogLevel level) {
  switch (level) {
    case LogLevel::kDefault: return "default";
    case LogLevel::kInfo: return "info";
    case LogLevel::kDebug: return "debug";
    case LogLevel::kError: return "error";
    case LogLevel::kFault: return "fault";
  }
  return "?";
}

bool LogMirroredToStderr() { return EnvOr("TALLYRUN_LOG_STDERR", "0") == "1"; }

SyslogSink::SyslogSink()
    : mirror_(LogMirroredToStderr()), debug_(EnvOr("TALLYRUN_LOG_DEBUG", "0") == "1") {
  openlog(program_invocation_short_name, LOG_PID, LOG_USER);
}

void SyslogSink::Write(LogLevel level, std::string_view text) {
  if (level == LogLevel::kDebug && !debug_) return;
  int priority = LOG_NOTICE;
  switch (level) {
    case LogLevel::kDefault: priority = LOG_NOTICE; break;
    case LogLevel::kInfo: priority = LOG_INFO; break;
    case LogLevel::kDebug: priority = LOG_DEBUG; break;
    case LogLevel::kError: priority = LOG_ERR; break;
    case LogLevel::kFault: priority = LOG_CRIT; break;
  }
  const std::string line(text);
  syslog(priority, "%s", line.c_str());
  if (mirror_)
    std::fprintf(stderr, "%s[%d] <%s>: %s\n", program_invocation_short_name, static_cast<int>(getpid()),
                 LogLevelName(level), line.c_str());
}

void CaptureLog::Write(LogLevel level, std::string_view text) {
  std::lock_guard<std::mutex> lock(mu_);
  lines_.push_back({level, std::string(text)});
}

std::vector<CaptureLog::Line> CaptureLog::lines() const {
  std::lock_guard<std::mutex> lock(mu_);
  return lines_;
}

size_t CaptureLog::Count(std::string_view text) const {
  std::lock_guard<std::mutex> lock(mu_);
  size_t n = 0;
  for (const auto& l : lines_) n += l.text == text;
  return n;
}

size_t CaptureLog::CountContaining(std::string_view fragment) const {
  std::lock_guard<std::mutex> lock(mu_);
  size_t n = 0;
  for (const auto& l : lines_) n += l.text.find(fragment) != std::string::npos;
  return n;
}

void CaptureLog::Clear() {
  std::lock_guard<std::mutex> lock(mu_);
  lines_.clear();
}

void Log(LogLevel level, std::string_view text) {
  if (level == LogLevel::kError || level == LogLevel::kFault) CountErrorLine(text);
  Context::Current().log().Write(level, text);
}

}  // namespace platform
