#include "platform/clock.h"

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "platform/context.h"
#include "platform/log.h"

namespace platform {

namespace {

bool AllDigits(std::string_view s) {
  if (s.empty()) return false;
  for (char c : s)
    if (c < '0' || c > '9') return false;
  return true;
}

}  // namespace

int64_t DaysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const unsigned yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

void CivilFromDays(int64_t days, int64_t* year, unsigned* month, unsigned* day) {
  const int64_t z = days + 719468;
  const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  const unsigned doe = static_cast<unsigned>(z - era * 146097);
  const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const unsigned mp = (5 * doy + 2) / 153;
  *day = doy - (153 * mp + 2) / 5 + 1;
  *month = mp < 10 ? mp + 3 : mp - 9;
  *year = static_cast<int64_t>(yoe) + era * 400 + (*month <= 2);
}

std::string DayDate(int64_t day) {
  int64_t year = 0;
  unsigned month = 0, mday = 0;
  CivilFromDays(day, &year, &month, &mday);
  char buf[32];
  std::snprintf(buf, sizeof buf, "%04lld-%02u-%02u", static_cast<long long>(year), month, mday);
  return buf;
}

std::optional<double> ParseInstant(std::string_view text) {
  if (text.empty()) return std::nullopt;
  // Epoch seconds, possibly negative or fractional.
  {
    std::string s(text);
    char* end = nullptr;
    const double v = std::strtod(s.c_str(), &end);
    // Within years 1 to 9999, so every later conversion stays defined.
    if (end && *end == '\0' && (std::isdigit(static_cast<unsigned char>(s[0])) || s[0] == '-') &&
        s.find_first_of("eExXnN") == std::string::npos && v >= -62135596800.0 && v <= 253402300799.0)
      return v;
  }
  // YYYY-MM-DD[(T| )HH:MM[:SS[.fff]]][Z|(+|-)HH[:]MM]
  if (text.size() < 10 || text[4] != '-' || text[7] != '-') return std::nullopt;
  if (!AllDigits(text.substr(0, 4)) || !AllDigits(text.substr(5, 2)) || !AllDigits(text.substr(8, 2)))
    return std::nullopt;
  const int year = std::stoi(std::string(text.substr(0, 4)));
  const int month = std::stoi(std::string(text.substr(5, 2)));
  const int day = std::stoi(std::string(text.substr(8, 2)));
  if (month < 1 || month > 12 || day < 1 || day > 31) return std::nullopt;
  int hour = 0, minute = 0;
  double second = 0;
  size_t i = 10;
  if (i < text.size() && (text[i] == 'T' || text[i] == ' ')) {
    ++i;
    if (text.size() < i + 5 || text[i + 2] != ':' || !AllDigits(text.substr(i, 2)) ||
        !AllDigits(text.substr(i + 3, 2)))
      return std::nullopt;
    hour = std::stoi(std::string(text.substr(i, 2)));
    minute = std::stoi(std::string(text.substr(i + 3, 2)));
    i += 5;
    if (i < text.size() && text[i] == ':') {
      size_t j = i + 1;
      while (j < text.size() && (std::isdigit(static_cast<unsigned char>(text[j])) || text[j] == '.')) ++j;
      if (j == i + 1) return std::nullopt;
      second = std::strtod(std::string(text.substr(i + 1, j - i - 1)).c_str(), nullptr);
      i = j;
    }
    if (hour > 23 || minute > 59 || second >= 61) return std::nullopt;
  }
  const double local_seconds = static_cast<double>(DaysFromCivil(year, month, day)) * 86400 + hour * 3600 +
                               minute * 60 + second;
  if (i == text.size()) {
    // No zone: local time in TZ.
    struct tm tm = {};
    tm.tm_year = year - 1900;
    tm.tm_mon = month - 1;
    tm.tm_mday = day;
    tm.tm_hour = hour;
    tm.tm_min = minute;
    tm.tm_sec = 0;
    tm.tm_isdst = -1;
    const time_t t = mktime(&tm);
    if (t == static_cast<time_t>(-1) && !(year == 1969 && month == 12 && day == 31)) return std::nullopt;
    return static_cast<double>(t) + second;
  }
  if (text[i] == 'Z' && i + 1 == text.size()) return local_seconds;
  if (text[i] == '+' || text[i] == '-') {
    const int sign = text[i] == '+' ? 1 : -1;
    std::string_view zone = text.substr(i + 1);
    std::string digits;
    for (char c : zone)
      if (c != ':') digits += c;
    if (digits.size() != 4 || !AllDigits(digits)) return std::nullopt;
    const int offset = std::stoi(digits.substr(0, 2)) * 3600 + std::stoi(digits.substr(2, 2)) * 60;
    return local_seconds - sign * offset;
  }
  return std::nullopt;
}

std::optional<std::string> ClockOverrideError() {
  const char* env = std::getenv("TALLYRUN_NOW");
  if (!env || !*env || ParseInstant(env)) return std::nullopt;
  return std::string("TALLYRUN_NOW=\"") + env +
         "\" is not a moment: give epoch seconds (1795435200) or an ISO-8601 date or date-time "
         "(2026-11-22, 2026-11-22T10:00:00, 2026-11-22T10:00:00Z, 2026-11-22T10:00:00+02:00), or unset it";
}

// A TALLYRUN_NOW that does not parse leaves the real clock here; the
// programs refuse to run on it before they read the clock (ClockOverrideError).
SystemClock::SystemClock() {
  const char* env = std::getenv("TALLYRUN_NOW");
  if (env && *env) fixed_ = ParseInstant(env);
}

double SystemClock::Now() { return fixed_ ? *fixed_ : static_cast<double>(time(nullptr)); }

uint64_t SystemClock::MonotonicNanos() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<uint64_t>(ts.tv_sec) * 1000000000ULL + static_cast<uint64_t>(ts.tv_nsec);
}

double Now() { return Context::Current().clock().Now(); }
uint64_t MonotonicNanos() { return Context::Current().clock().MonotonicNanos(); }

std::string LocalStamp(double t, const char* format) {
  const time_t secs = static_cast<time_t>(std::floor(t));
  struct tm tm;
  localtime_r(&secs, &tm);
  char buf[128];
  return std::string(buf, std::strftime(buf, sizeof buf, format, &tm));
}

}  // namespace platform
