// Wall clock and monotonic clock.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class Clock {
 public:
  virtual ~Clock() = default;
  // Seconds since 1970-01-01T00:00:00Z.
  virtual double Now() = 0;
  // Nanoseconds of CLOCK_MONOTONIC (does not advance in suspend).
  virtual uint64_t MonotonicNanos() = 0;
  // How MonotonicNanos ticks relate to nanoseconds; false when unknown.
  virtual bool Timebase(uint32_t* numer, uint32_t* denom) {
    *numer = 1;
    *denom = 1;
    return true;
  }
};

// time(), or the fixed instant of TALLYRUN_NOW when it is set and valid.
class SystemClock : public Clock {
 public:
  SystemClock();
  double Now() override;
  uint64_t MonotonicNanos() override;

 private:
  std::optional<double> fixed_;
};

// A clock that tests set by hand.
class FixedClock : public Clock {
 public:
  explicit FixedClock(double now) : now_(now) {}
  double Now() override { return now_; }
  uint64_t MonotonicNanos() override { return mono_; }
  void Set(double now) { now_ = now; }
  void AdvanceMonotonic(uint64_t ns) { mono_ += ns; }
  bool Timebase(uint32_t* numer, uint32_t* denom) override {
    *numer = numer_;
    *denom = denom_;
    return timebase_ok_;
  }
  void SetTimebase(uint32_t numer, uint32_t denom, bool ok = true) {
    numer_ = numer;
    denom_ = denom;
    timebase_ok_ = ok;
  }

 private:
  double now_;
  uint64_t mono_ = 1'000'000'000;
  uint32_t numer_ = 1, denom_ = 1;
  bool timebase_ok_ = true;
};

// Epoch seconds ("1700000000", "-5.5") or an ISO-8601 date-time
// ("2026-11-22T10:00:00Z", "2026-11-22T10:00:00+02:00", "2026-11-22 10:00",
// "2026-11-22"); without a zone the time is local (TZ). Nothing for other text.
std::optional<double> ParseInstant(std::string_view text);

// Why TALLYRUN_NOW cannot be used (naming the variable and the forms it
// takes), or nothing when it is unset or valid. A mistyped moment is never
// replaced by the real clock: every program refuses to run on it.
std::optional<std::string> ClockOverrideError();

// Civil calendar arithmetic (proleptic Gregorian), days relative to 1970-01-01.
int64_t DaysFromCivil(int64_t year, unsigned month, unsigned day);
void CivilFromDays(int64_t days, int64_t* year, unsigned* month, unsigned* day);

// The calendar date (YYYY-MM-DD) of a day number. Day numbers already count
// local days, so no time zone enters here.
std::string DayDate(int64_t day);

// The local time of t (epoch seconds) as strftime writes it with format.
std::string LocalStamp(double t, const char* format);

// Shorthands over the current context's clock.
double Now();
uint64_t MonotonicNanos();

}  // namespace platform
