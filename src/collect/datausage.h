// Network data usage: the usage service's per-process byte counters become
// kilobyte keys of the day, as growth since the counters of the last reply,
// which are kept as a baseline in the preferences.
//
// Threads: the reply is handled on the usage service's thread while the main
// thread goes on with the daily run and writes the store, the preferences
// and the log itself. The handler reaches the store client and the
// preferences only through their client calls, which take the platform's
// shared-state lock (platform/context.h); it holds that lock for its whole
// run, so its reading and replacing of the baseline and its keys form one
// unit that no write of the main thread comes between. The log sinks are
// safe to share (syslog; the capture sink locks), files made meanwhile get
// distinct temporary names, and the handler touches neither analytics nor
// the parsers' last-error message. With the main thread it shares only the
// semaphore. Whoever calls in must therefore not hold that lock while
// waiting for the reply.
#pragma once

#include <cstdint>
#include <semaphore>
#include <string_view>

#include "cf/value.h"

inline constexpr const char* kDataUsageBaselineKey = "netUsageBaseline";
inline constexpr const char* kDataUsageBaselineDomain = "com.velmora.diagvault.tallyrun";

// Writes the growth of every record's counters since the baseline, replaces
// the baseline with these records and signals done as its last act. Records
// without a usable name, start date or counter cannot join the baseline and
// are skipped.
void ProcessDataUsageReply(const cf::Array& records, std::counting_semaphore<>& done);

// Adds bytes / 1024 (truncated) to "datausage.<field before "Bytes">KB.<prefix><name>";
// nothing when that is 0 or the field has no "Bytes".
void AddDataUsageKB(std::string_view field, std::string_view prefix, std::string_view name, int64_t bytes);
