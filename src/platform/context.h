// The process-wide platform context: the device root and the installed
// backends. Production code reaches every service through Context::Current();
// tests install their own with a ContextScope.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

namespace platform {

class Clock;
class DeviceModel;
class LogSink;
class Preferences;
class TallyStore;

struct Backends {
  std::shared_ptr<Clock> clock;  // default: system clock honouring TALLYRUN_NOW
  std::shared_ptr<LogSink> log;  // default: syslog (mirrored to stderr on request)
  // False models a device without the analytics library (weakly linked).
  bool analytics_available = true;
  // False models a device without the purgeable-space service (weakly linked).
  bool purgewell_available = true;
};

class Context {
 public:
  // The root and backends from the environment: TALLYRUN_ROOT (default
  // /var/lib/tallyrun), TALLYRUN_NOW, TALLYRUN_LOG_STDERR, TALLYRUN_LOG_DEBUG.
  static Context& Current();

  Context(std::string root, Backends backends);
  ~Context();
  Context(const Context&) = delete;
  Context& operator=(const Context&) = delete;

  const std::string& root() const { return root_; }
  // Unique for the life of the process, for caches that belong to one context.
  uint64_t id() const { return id_; }
  // Resolves a device path such as "/var/run/x.sock" under the root.
  std::string Path(std::string_view device_path) const;

  Clock& clock() { return *backends_.clock; }
  LogSink& log() { return *backends_.log; }
  Preferences& preferences() { return PreferencesAt("/Library/Preferences"); }
  // A preference store of one file per domain in a device directory (the
  // diagnostics configuration, other users' preferences).
  Preferences& PreferencesAt(const std::string& device_dir);
  void SynchronizeAllPreferences();
  bool analytics_available() const { return backends_.analytics_available; }
  bool purgewell_available() const { return backends_.purgewell_available; }
  // The store client's connection, opened on first use; null (with a reason
  // in *error) when the store cannot be opened.
  TallyStore* store(std::string* error = nullptr);
  // The device registry and its open handles, made on first use.
  DeviceModel& device();

 private:
  friend class ContextScope;
  std::string root_;
  uint64_t id_;
  Backends backends_;
  std::map<std::string, std::unique_ptr<Preferences>> preference_stores_;
  std::unique_ptr<TallyStore> store_;
  std::unique_ptr<DeviceModel> device_;
  std::string store_error_;
  bool store_tried_ = false;
};

// Installs a context for the life of the scope and restores the previous one.
// Pending preference changes of the scoped context are discarded unless
// synchronized, as at a crash.
class ContextScope {
 public:
  explicit ContextScope(std::string root, Backends backends = {});
  ~ContextScope();
  ContextScope(const ContextScope&) = delete;
  ContextScope& operator=(const ContextScope&) = delete;
  Context& context() { return *context_; }

 private:
  std::unique_ptr<Context> context_;
  Context* previous_;
};

// Guards what the platform services share within the process: the store
// client's connection (and its last error), the preference stores, and the
// parts of the context made on first use. The system runs on the main
// thread; the one other thread that calls the services is the usage
// service's reply (platform/usage.h). The store client and preference calls
// take this lock themselves; it is recursive, so that a caller may hold it
// across several calls that another thread must not come between.
std::recursive_mutex& SharedStateMutex();

// Environment lookup with a default, shared by the backends.
std::string EnvOr(const char* name, const char* fallback);

}  // namespace platform
