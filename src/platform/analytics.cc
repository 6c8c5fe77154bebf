#include "platform/analytics.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <string>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"
#include "platform/run_record.h"
#include "platform/diagnostics.h"

bool platform::AnalyticsAvailable() { return Context::Current().analytics_available(); }

bool AnalyticsIsEventUsed(std::string_view event) {
  if (!platform::AnalyticsAvailable()) return false;
  const cf::Value enabled = platform::ReadProfileValue("/var/eventlens/enabled-events.plist");
  if (const cf::String* s = enabled.AsString()) return *s == "*";
  if (const cf::Array* names = enabled.AsArray())
    for (const cf::Value& name : *names)
      if (const cf::String* n = name.AsString(); n && (*n == "*" || *n == event)) return true;
  return false;
}

bool AnalyticsSendEventLazy(std::string_view event, const std::function<cf::Value()>& payload) {
  if (!AnalyticsIsEventUsed(event)) return false;
  cf::Dictionary record;
  record.Set("time", cf::ISO8601(cf::Date{platform::Now()}));
  record.Set("event", std::string(event));
  record.Set("payload", payload());
  // What a gated run sends is sent once for its day: a run repeated after a
  // crash sends its events in the same order, finds each (the n-th of its
  // name for that day) among the last ones and does not send it again.
  std::string mark;
  if (const std::optional<int32_t> day = platform::RunDay()) {
    record.Set("day", cf::Value::SInt32(*day));
    if (platform::RunIsGated()) {
      static std::mutex mu;
      static std::map<std::string, int, std::less<>> sent;
      int nth;
      {
        std::lock_guard<std::mutex> lock(mu);
        nth = ++sent[std::string(event)];
      }
      const std::string id = platform::LineId(std::string(event) + " #" + std::to_string(nth) + " of gated day " +
                                              std::to_string(*day));
      record.Set("id", id);
      mark = "\"id\":\"" + id + "\"";
    }
  }
  std::string line, error;
  if (!cf::WriteJSON(record, line, &error)) {
    platform::LogError("Cannot record event %s: %s", std::string(event), error);
    return false;
  }
  line += '\n';
  // A run's events are a few hundred KiB at most: the repeated run's
  // predecessor wrote its own among the last 2 MiB.
  platform::AppendOnce once{mark, int64_t{2} << 20};
  const bool ok =
      platform::AppendToFile(platform::Context::Current().Path("/var/eventlens/events.jsonl"), line, &error, &once);
  if (!ok) platform::LogError("Cannot record event %s: %s", std::string(event), error);
  if (once.present) platform::LogInfo("Event %s went out already for day %@", std::string(event), record.Get("day"));
  return ok;
}
