#include "platform/usage.h"

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <optional>
#include <system_error>
#include <thread>

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/log.h"
#include "platform/profile.h"

namespace {

// Replies being delivered, so that exit can wait for them. Never destroyed:
// a client thread may still look at it while the process exits.
struct Deliveries {
  std::mutex mu;
  std::condition_variable idle;
  int running = 0;
  bool exiting = false;
};

Deliveries& State() {
  static Deliveries* const state = [] {
    // The first request comes after the context exists, so this runs before
    // the context's own exit handler: a reply's preferences are written
    // before the last synchronize.
    std::atexit([] {
      Deliveries& d = State();
      std::unique_lock<std::mutex> lock(d.mu);
      d.exiting = true;
      d.idle.wait(lock, [&] { return d.running == 0; });
    });
    return new Deliveries;
  }();
  return *state;
}

void Deliver(UsageFeed::Reply& reply, cf::Array& records) {
  Deliveries& d = State();
  {
    std::lock_guard<std::mutex> lock(d.mu);
    if (d.exiting) return;
    ++d.running;
  }
  reply(records);
  // What the reply holds goes while exit still waits.
  reply = nullptr;
  records = cf::Array();
  {
    std::lock_guard<std::mutex> lock(d.mu);
    --d.running;
  }
  d.idle.notify_all();
}

struct Answer {
  cf::Array records;
  double delay_seconds = 0;
  bool never_reply = false;
};

// The service's answer from the device file; nothing (after one error line)
// when the file is there but unusable.
std::optional<Answer> ReadAnswer() {
  Answer answer;
  std::string error;
  const auto bytes = platform::ReadDeviceBytes(kUsageDevicePath, &error);
  if (!bytes) {
    if (error.empty()) return answer;  // no file: nothing was used
    platform::LogError("The usage service cannot answer: %s", error);
    return std::nullopt;
  }
  const std::string path = platform::Context::Current().Path(kUsageDevicePath);
  auto refuse = [&](const std::string& why) -> std::optional<Answer> {
    platform::LogError("The usage service cannot answer: %s %s", path, why);
    return std::nullopt;
  };
  const cf::ParseResult parsed = cf::ParsePropertyList(*bytes);
  if (!parsed.ok()) return refuse("is not a property list (" + parsed.error + ")");
  const cf::Dictionary* file = parsed.value.AsDictionary();
  if (!file) return refuse("is " + cf::TypeNameWithArticle(parsed.value.type()) + ", not a dictionary");
  const cf::Value& records = file->Get("records");
  if (!records.IsNull() && !records.AsArray())
    return refuse("has \"records\" of " + cf::TypeNameWithArticle(records.type()) + ", not an array");
  const cf::Value& delay = file->Get("delaySeconds");
  if (!delay.IsNull()) {
    const double seconds = delay.AsNumber() ? delay.AsNumber()->AsFloat64() : -1;
    if (!(seconds >= 0 && seconds <= 3600)) return refuse("has \"delaySeconds\" that is not a number from 0 to 3600");
    answer.delay_seconds = seconds;
  }
  const cf::Value& never = file->Get("neverReply");
  if (!never.IsNull() && !never.AsBool()) return refuse("has \"neverReply\" that is not a boolean");
  answer.never_reply = never.AsBool() && *never.AsBool();
  if (records.AsArray()) answer.records = *records.AsArray();
  return answer;
}

}  // namespace

void UsageFeed::UsageToDateFor(const std::set<std::string>& names, UsageNameKind kind, Reply reply) {
  std::optional<Answer> answer = ReadAnswer();
  if (!answer || answer->never_reply) return;
  if (!names.empty()) {
    cf::Array named;
    for (const cf::Value& record : answer->records) {
      const cf::Dictionary* r = record.AsDictionary();
      const cf::String* name = r && kind == kUsageProcessProcName ? r->Get("procName").AsString() : nullptr;
      if (name && names.count(*name)) named.Append(record);
    }
    answer->records = named;
  }
  State();  // the exit handler is in place before any reply can start
  try {
    std::thread([answer = std::move(*answer), reply = std::move(reply)]() mutable {
      if (answer.delay_seconds > 0) std::this_thread::sleep_for(std::chrono::duration<double>(answer.delay_seconds));
      Deliver(reply, answer.records);
    }).detach();
  } catch (const std::system_error& e) {
    platform::LogError("The usage service cannot answer: no thread for the reply (%s)", e.what());
  }
}
