#include "collect/datausage.h"

#include <cmath>
#include <limits>
#include <mutex>
#include <optional>
#include <string>

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/store.h"
#include "platform/usage.h"

namespace {

// The baseline keeps them in this order too.
constexpr const char* kCounterFields[] = {"wifiInBytes", "wifiOutBytes", "wwanInBytes", "wwanOutBytes"};
constexpr size_t kCounters = std::size(kCounterFields);

// Dates the preferences can keep (years 1 to 9999); they keep them to the
// second, so start dates are compared at that precision.
constexpr double kFirstDate = -62135596800.0, kLastDate = 253402300799.0;

bool SameSecond(const cf::Date& a, const cf::Date& b) { return std::floor(a.seconds) == std::floor(b.seconds); }

struct UsageRecord {
  std::string name;
  const char* prefix;
  cf::Date since;
  cf::Value counters[kCounters];
};

// Nothing when the record lacks a name, start date or counter of the right
// type, or has a name no store key or preference can carry.
std::optional<UsageRecord> ReadRecord(const cf::Value& value) {
  const cf::Dictionary* d = value.AsDictionary();
  if (!d) return std::nullopt;
  UsageRecord r;
  if (const cf::String* bundle = d->Get("bundleName").AsString()) {
    r.name = *bundle;
    r.prefix = "";
  } else if (const cf::String* proc = d->Get("procName").AsString()) {
    r.name = *proc;
    r.prefix = "com.velmora.";
  } else {
    return std::nullopt;
  }
  if (r.name.empty() || !cf::IsPropertyListString(r.name)) return std::nullopt;
  const cf::Date* since = d->Get(kUsageSinceTime).AsDate();
  if (!since || !(since->seconds >= kFirstDate && since->seconds <= kLastDate)) return std::nullopt;
  r.since = *since;
  for (size_t i = 0; i < kCounters; ++i) {
    r.counters[i] = d->Get(kCounterFields[i]);
    if (!r.counters[i].AsNumber()) return std::nullopt;
  }
  return r;
}

// The old entry's counters when it is the record's baseline: same start
// date, and whole (it comes from a file, so it is checked like one).
const cf::Array* MatchingEntry(const cf::Dictionary& baseline, const UsageRecord& r) {
  const cf::Array* entry = baseline.Get(r.name).AsArray();
  if (!entry || entry->size() != kCounters + 1) return nullptr;
  const cf::Date* since = entry->at(0).AsDate();
  if (!since || !SameSecond(*since, r.since)) return nullptr;
  for (size_t i = 1; i <= kCounters; ++i)
    if (!entry->at(i).AsNumber()) return nullptr;
  return entry;
}

int64_t Difference(int64_t now, int64_t before) {
  int64_t delta = 0;
  if (__builtin_sub_overflow(now, before, &delta))
    delta = now < before ? std::numeric_limits<int64_t>::min() : std::numeric_limits<int64_t>::max();
  return delta;
}

}  // namespace

void AddDataUsageKB(std::string_view field, std::string_view prefix, std::string_view name, int64_t bytes) {
  const size_t bytes_at = field.find("Bytes");
  const int64_t kb = bytes / 1024;
  if (kb == 0 || bytes_at == std::string_view::npos) return;
  TBClientAddValueForScalarKey(
      "datausage." + std::string(field.substr(0, bytes_at)) + "KB." + std::string(prefix) + std::string(name), kb);
}

void ProcessDataUsageReply(const cf::Array& records, std::counting_semaphore<>& done) {
  {
    std::lock_guard<std::recursive_mutex> lock(platform::SharedStateMutex());
    const int32_t today = TBDaysSince1970();
    const int32_t cutoff = today - 1;
    const cf::Value stored = DGVPreferencesGetValue(kDataUsageBaselineKey, kDataUsageBaselineDomain);
    const cf::Dictionary old_baseline = stored.AsDictionary() ? *stored.AsDictionary() : cf::Dictionary();
    cf::Dictionary baseline;
    size_t skipped = 0;
    for (const cf::Value& value : records) {
      const std::optional<UsageRecord> r = ReadRecord(value);
      if (!r) {
        ++skipped;
        continue;
      }
      cf::Array entry;
      entry.Append(r->since);
      if (const cf::Array* old = MatchingEntry(old_baseline, *r)) {
        for (size_t i = 0; i < kCounters; ++i) {
          entry.Append(r->counters[i]);
          const int64_t delta =
              Difference(r->counters[i].AsNumber()->AsSInt64(), old->at(i + 1).AsNumber()->AsSInt64());
          if (delta >= 1) AddDataUsageKB(kCounterFields[i], r->prefix, r->name, delta);
          else if (delta < 0) TBClientAddValueForScalarKey("datausage.baddata." + (r->prefix + r->name), 1);
        }
      } else {
        const int32_t start_day = platform::DaysSince1970At(r->since.seconds);
        for (size_t i = 0; i < kCounters; ++i) {
          entry.Append(r->counters[i]);
          if (start_day >= cutoff) AddDataUsageKB(kCounterFields[i], r->prefix, r->name, r->counters[i].AsNumber()->AsSInt64());
        }
        if (start_day < cutoff) TBClientAddValueForScalarKey("datausage.olddata." + (r->prefix + r->name), 1);
      }
      baseline.Set(r->name, entry);
    }
    if (skipped > 0)
      platform::LogError("Skipped %zu data usage records without a usable name, start date or counter", skipped);
    DGVPreferencesSetValue(kDataUsageBaselineKey, baseline, kDataUsageBaselineDomain);
    DGVPreferencesSynchronize(kDataUsageBaselineDomain);
  }
  done.release();
}
