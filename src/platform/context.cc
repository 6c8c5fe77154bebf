#include "platform/context.h"

#include <cstdlib>

#include "platform/clock.h"
#include "platform/device_model.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/run_record.h"
#include "platform/store.h"

namespace platform {

namespace {

Context* g_current = nullptr;

uint64_t NextId() {
  static uint64_t next = 0;
  return ++next;
}

Context& DefaultContext() {
  // Built once from the environment and never destroyed, so services stay
  // usable from exit handlers.
  static Context* context = [] {
    auto* c = new Context(EnvOr("TALLYRUN_ROOT", "/var/lib/tallyrun"), Backends{});
    std::atexit([] {
      if (g_current == nullptr) DefaultContext().SynchronizeAllPreferences();
    });
    return c;
  }();
  return *context;
}

}  // namespace

std::recursive_mutex& SharedStateMutex() {
  // Never destroyed: exit handlers and late replies still take it.
  static auto* const mutex = new std::recursive_mutex;
  return *mutex;
}

std::string EnvOr(const char* name, const char* fallback) {
  const char* v = std::getenv(name);
  return v && *v ? std::string(v) : std::string(fallback);
}

Context& Context::Current() { return g_current ? *g_current : DefaultContext(); }

Context::Context(std::string root, Backends backends)
    : root_(std::move(root)), id_(NextId()), backends_(std::move(backends)) {
  while (root_.size() > 1 && root_.back() == '/') root_.pop_back();
  if (!backends_.clock) backends_.clock = std::make_shared<SystemClock>();
  if (!backends_.log) backends_.log = std::make_shared<SyslogSink>();
}

Preferences& Context::PreferencesAt(const std::string& device_dir) {
  std::lock_guard<std::recursive_mutex> lock(SharedStateMutex());
  auto& slot = preference_stores_[device_dir];
  if (!slot) slot = std::make_unique<Preferences>(Path(device_dir));
  return *slot;
}

void Context::SynchronizeAllPreferences() {
  std::lock_guard<std::recursive_mutex> lock(SharedStateMutex());
  for (auto& [dir, prefs] : preference_stores_) prefs->SynchronizeAll();
}

Context::~Context() = default;

DeviceModel& Context::device() {
  if (!device_) device_ = std::make_unique<DeviceModel>();
  return *device_;
}

std::string Context::Path(std::string_view device_path) const {
  std::string out = root_ == "/" ? std::string() : root_;
  if (device_path.empty() || device_path.front() != '/') out += '/';
  out += device_path;
  return out;
}

TallyStore* Context::store(std::string* error) {
  std::lock_guard<std::recursive_mutex> lock(SharedStateMutex());
  if (!store_ && !store_tried_) {
    store_tried_ = true;
    store_ = TallyStore::Open(Path(kStoreDevicePath), TallyStore::Mode::kCreate, &store_error_);
    if (!store_) {
      LogError("Tallybook store unavailable: %s", store_error_);
      NoteRunFailure("the store could not be opened: " + store_error_);
    }
  }
  if (!store_ && error) *error = store_error_;
  return store_.get();
}

ContextScope::ContextScope(std::string root, Backends backends)
    : context_(std::make_unique<Context>(std::move(root), std::move(backends))), previous_(g_current) {
  g_current = context_.get();
}

ContextScope::~ContextScope() { g_current = previous_; }

}  // namespace platform
