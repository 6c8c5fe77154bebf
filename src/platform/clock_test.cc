#include "platform/clock.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

#include "platform/context.h"
#include "platform/store.h"

namespace platform {
namespace {

class TimeZone {
 public:
  explicit TimeZone(const char* tz) {
    const char* old = std::getenv("TZ");
    had_ = old != nullptr;
    if (had_) old_ = old;
    setenv("TZ", tz, 1);
    tzset();
  }
  ~TimeZone() {
    if (had_) setenv("TZ", old_.c_str(), 1);
    else unsetenv("TZ");
    tzset();
  }

 private:
  bool had_ = false;
  std::string old_;
};

// POSIX zone rules, so the tests need no time-zone database.
constexpr const char* kPacific = "PST8PDT,M3.2.0,M11.1.0";
constexpr const char* kTokyo = "JST-9";

TEST(ClockTest, ParseInstantAcceptsEpochAndIso8601Only) {
  TimeZone utc("UTC0");
  EXPECT_EQ(ParseInstant("1700000000"), 1700000000.0);
  EXPECT_EQ(ParseInstant("-86400"), -86400.0);
  EXPECT_EQ(ParseInstant("2026-11-22T10:00:00Z"), 1795341600.0);
  EXPECT_EQ(ParseInstant("2026-11-22T12:00:00+02:00"), 1795341600.0);
  EXPECT_EQ(ParseInstant("2026-11-22T05:30:00-0430"), 1795341600.0);
  EXPECT_EQ(ParseInstant("2026-11-22 10:00"), 1795341600.0);  // local, and local is UTC here
  EXPECT_EQ(ParseInstant("2026-11-22"), 1795305600.0);
  EXPECT_EQ(ParseInstant("2024-02-29T00:00:00.5Z"), 1709164800.5);
  for (const char* bad : {"", "now", "2026-13-01", "2026-11-22T25:00", "2026-11-22T10:00:00+2",
                          "2026-11-22T10:00:00Zjunk", "1e9", "0x10", "nan", "inf", "2026/11/22",
                          "99999999999999999999999", "-99999999999999"})
    EXPECT_FALSE(ParseInstant(bad).has_value()) << bad;
}

TEST(ClockTest, DayNumbersFollowTheLocalZone) {
  const double instant = *ParseInstant("2026-11-22T07:30:00Z");
  const int32_t utc_day = 20779;  // 2026-11-22
  {
    TimeZone tz("UTC0");
    EXPECT_EQ(DaysSince1970At(instant), utc_day);
    EXPECT_EQ(DaysSince1970At(0), 0);
    EXPECT_EQ(DaysSince1970At(-1), -1);
    EXPECT_EQ(StartOfDay(utc_day), 1795305600.0);
  }
  {
    TimeZone tz(kPacific);  // 23:30 the evening before
    EXPECT_EQ(DaysSince1970At(instant), utc_day - 1);
    EXPECT_EQ(DaysSince1970At(*ParseInstant("2026-11-22T07:59:59Z")), utc_day - 1);
    EXPECT_EQ(DaysSince1970At(*ParseInstant("2026-11-22T08:00:00Z")), utc_day);
    EXPECT_EQ(StartOfDay(utc_day), *ParseInstant("2026-11-22T08:00:00Z"));
    // The spring-forward day still starts at local midnight (08:00Z, PST);
    // the next day starts an hour earlier in UTC (PDT).
    const int32_t spring = static_cast<int32_t>(DaysFromCivil(2026, 3, 8));
    EXPECT_EQ(StartOfDay(spring), *ParseInstant("2026-03-08T08:00:00Z"));
    EXPECT_EQ(StartOfDay(spring + 1), *ParseInstant("2026-03-09T07:00:00Z"));
    EXPECT_EQ(DaysSince1970At(StartOfDay(spring + 1) - 1), spring);
  }
  {
    TimeZone tz(kTokyo);  // already 16:30
    EXPECT_EQ(DaysSince1970At(instant), utc_day);
    EXPECT_EQ(DaysSince1970At(*ParseInstant("2026-11-22T15:00:00Z")), utc_day + 1);
    EXPECT_EQ(StartOfDay(utc_day + 1), *ParseInstant("2026-11-22T15:00:00Z"));
  }
}

TEST(ClockTest, StoreClientUsesTheContextClock) {
  TimeZone tz(kTokyo);
  auto clock = std::make_shared<FixedClock>(*ParseInstant("2026-11-22T14:59:59Z"));
  ContextScope scope("/nonexistent-root", Backends{clock, nullptr});
  EXPECT_EQ(TBDaysSince1970(), 20779);
  clock->Set(*ParseInstant("2026-11-22T15:00:00Z"));
  EXPECT_EQ(TBDaysSince1970(), 20780);
  EXPECT_EQ(dateForDaysSince1970(20780).seconds, *ParseInstant("2026-11-22T15:00:00Z"));
  int64_t y;
  unsigned m, d;
  CivilFromDays(-719468, &y, &m, &d);
  EXPECT_EQ(y, 0);
  EXPECT_EQ(m, 3u);
  EXPECT_EQ(d, 1u);
  EXPECT_EQ(scope.context().Path("/var/run/x.sock"), "/nonexistent-root/var/run/x.sock");
}

}  // namespace
}  // namespace platform
