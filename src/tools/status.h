// `tallybook status`: how the root's last run went, for a person or a
// scheduler.
#pragma once

namespace tools {

// Exit statuses, as a service manager's post-start check reads them.
inline constexpr int kStatusOk = 0;       // the last run did not fail and is recent enough
inline constexpr int kStatusFailed = 1;   // it failed, stopped half way, or its record is unreadable
inline constexpr int kStatusStale = 3;    // none, too old, or the gate holds every day back

// Prints the last run (JSON when json is set) and returns the exit status.
// max_age_seconds: how old a run may be and still count as recent.
int PrintRunStatus(bool json, double max_age_seconds);

}  // namespace tools
