// The system log: levels default, info, debug, error and fault.
#pragma once

#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "cf/format.h"

namespace platform {

enum class LogLevel { kDefault, kInfo, kDebug, kError, kFault };

const char* LogLevelName(LogLevel level);

class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void Write(LogLevel level, std::string_view text) = 0;
};

// syslog(3) under the program's name; mirrored to stderr when
// TALLYRUN_LOG_STDERR=1. Debug lines are dropped unless TALLYRUN_LOG_DEBUG=1.
class SyslogSink : public LogSink {
 public:
  SyslogSink();
  void Write(LogLevel level, std::string_view text) override;

 private:
  bool mirror_;
  bool debug_;
};

// Keeps every line (debug too) for tests to read.
class CaptureLog : public LogSink {
 public:
  struct Line {
    LogLevel level;
    std::string text;
  };
  void Write(LogLevel level, std::string_view text) override;
  std::vector<Line> lines() const;
  // How many lines equal text exactly (at any level).
  size_t Count(std::string_view text) const;
  bool Contains(std::string_view text) const { return Count(text) > 0; }
  // How many lines contain the fragment.
  size_t CountContaining(std::string_view fragment) const;
  void Clear();

 private:
  mutable std::mutex mu_;
  std::vector<Line> lines_;
};

void Log(LogLevel level, std::string_view text);

// True when TALLYRUN_LOG_STDERR=1 mirrors the system log to standard error,
// so that what must reach a person's terminal is printed there once.
bool LogMirroredToStderr();

template <typename... A>
void LogDefault(std::string_view fmt, const A&... a) { Log(LogLevel::kDefault, cf::Format(fmt, a...)); }
template <typename... A>
void LogInfo(std::string_view fmt, const A&... a) { Log(LogLevel::kInfo, cf::Format(fmt, a...)); }
template <typename... A>
void LogDebug(std::string_view fmt, const A&... a) { Log(LogLevel::kDebug, cf::Format(fmt, a...)); }
template <typename... A>
void LogError(std::string_view fmt, const A&... a) { Log(LogLevel::kError, cf::Format(fmt, a...)); }
template <typename... A>
void LogFault(std::string_view fmt, const A&... a) { Log(LogLevel::kFault, cf::Format(fmt, a...)); }

}  // namespace platform
