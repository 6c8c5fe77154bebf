#include "platform/analytics.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"

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
  std::string line, error;
  if (!cf::WriteJSON(record, line, &error)) {
    platform::LogError("Cannot record event %s: %s", std::string(event), error);
    return false;
  }
  line += '\n';
  const bool ok = platform::AppendToFile(platform::Context::Current().Path("/var/eventlens/events.jsonl"), line, &error);
  if (!ok) platform::LogError("Cannot record event %s: %s", std::string(event), error);
  return ok;
}
