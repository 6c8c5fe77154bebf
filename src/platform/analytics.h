// Event analytics: an event is used when $ROOT/var/eventlens/enabled-events.plist
// (an array of names, or "*") lists it; accepted events are appended as JSON
// lines to $ROOT/var/eventlens/events.jsonl: {"time", "event", "payload"},
// with "day" when the run works on a day, and for a gated run an "id" that
// makes each event go out once for its day.
#pragma once

#include <functional>
#include <string_view>

#include "cf/value.h"

namespace platform {
// False where the analytics library is absent (it is weakly linked): callers
// then neither ask nor send.
bool AnalyticsAvailable();
}  // namespace platform

bool AnalyticsIsEventUsed(std::string_view event);
// Calls the block and records its payload only when the event is used;
// returns whether it was sent.
bool AnalyticsSendEventLazy(std::string_view event, const std::function<cf::Value()>& payload);
