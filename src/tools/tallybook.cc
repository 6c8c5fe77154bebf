// tallybook: read and write the statistics store of the device root
// (TALLYRUN_ROOT) by hand.

#include <charconv>
#include <cmath>
#include <cstdio>
#include <algorithm>
#include <filesystem>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tools/cli.h"
#include "tools/line_chart.h"
#include "tools/output.h"
#include "tools/status.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/history.h"
#include "platform/store.h"

namespace {

constexpr int kBadInput = 2;
constexpr int kStoreError = 1;
constexpr int64_t kDefaultDays = 30;
constexpr int64_t kMaxDays = 100000;  // beyond any store's age

bool ParseInteger(const std::string& text, int64_t* out) {
  const char* end = text.data() + text.size();
  auto [ptr, ec] = std::from_chars(text.data(), end, *out);
  return ec == std::errc() && ptr == end && !text.empty();
}

bool ParseReal(const std::string& text, double* out) {
  if (text.empty()) return false;
  char* end = nullptr;
  *out = std::strtod(text.c_str(), &end);
  return end == text.c_str() + text.size() && std::isfinite(*out);
}

int BadInput(const std::string& message) {
  std::fprintf(stderr, "tallybook: %s\n", message.c_str());
  return kBadInput;
}

platform::TallyStore* OpenStore() {
  std::string error;
  platform::TallyStore* store = platform::Context::Current().store(&error);
  if (!store) std::fprintf(stderr, "tallybook: %s\n", error.c_str());
  return store;
}


std::unique_ptr<platform::TBHistory> OpenHistory() {
  std::string error;
  auto history = platform::TBHistory::initWithDefaultPath(&error);
  if (!history) std::fprintf(stderr, "tallybook: %s\n", error.c_str());
  else history->setBadRowHandler([](const std::string& sentence) {
    std::fprintf(stderr, "tallybook: warning: %s\n", sentence.c_str());
  });
  return history;
}

// The fields every JSON line of a key and day starts with.
std::string JSONHead(int32_t day, const std::string& key) {
  return "{\"day\":" + std::to_string(day) + ",\"date\":\"" + tools::IsoDate(day) + "\",\"key\":" +
         tools::JSONString(key);
}


int Dump(bool one_day, int64_t day, const std::string& prefix, bool json) {
  auto history = OpenHistory();
  if (!history) return kStoreError;
  // The history's range excludes its minimum.
  const int32_t lo = one_day ? static_cast<int32_t>(std::max<int64_t>(day - 1, std::numeric_limits<int32_t>::min()))
                             : std::numeric_limits<int32_t>::min();
  const int32_t hi = one_day ? static_cast<int32_t>(day) : std::numeric_limits<int32_t>::max();
  bool ok = history->scalarsForKeyPrefix(prefix, lo, hi, [json](const std::string& key, int32_t d, int64_t v, bool*) {
    if (json)
      std::printf("%s,\"value\":%lld}\n", JSONHead(d, key).c_str(), static_cast<long long>(v));
    else
      std::printf("%d %s %lld\n", d, key.c_str(), static_cast<long long>(v));
  });
  ok = ok && history->distributionsForKeyPrefix(
                 prefix, lo, hi,
                 [json](const std::string& key, int32_t d, platform::TBHistoryDistributionEnumerator& e, bool*) {
                   double v = 0, mn = 0, mx = 0, mean = 0;
                   int32_t offset = 0;
                   uint64_t n = 0;
                   while (e.getNextValue(&v, &offset)) {
                     ++n;
                     if (n == 1 || v < mn) mn = v;
                     if (n == 1 || v > mx) mx = v;
                     mean += (v - mean) / static_cast<double>(n);
                   }
                   if (json)
                     std::printf("%s,\"count\":%llu,\"min\":%s,\"max\":%s,\"mean\":%s}\n", JSONHead(d, key).c_str(),
                                 static_cast<unsigned long long>(n), tools::JSONReal(mn).c_str(),
                                 tools::JSONReal(mx).c_str(), tools::JSONReal(mean).c_str());
                   else
                     std::printf("%d %s %llu %s %s %s\n", d, key.c_str(), static_cast<unsigned long long>(n),
                                 tools::RealText(mn).c_str(), tools::RealText(mx).c_str(),
                                 tools::RealText(mean).c_str());
                 });
  if (!ok) {
    std::fprintf(stderr, "tallybook: the store could not be read\n");
    return kStoreError;
  }
  return 0;
}

// The values of one scalar key in the last `days` days up to today, by day.
// Nothing, after a message, when the key has none there (exit 2) or the
// store cannot be read (exit 1); the status goes to *status.
std::optional<std::vector<tools::DayValue>> ScalarHistory(const std::string& key, int64_t days, int* status) {
  auto history = OpenHistory();
  *status = kStoreError;
  if (!history) return std::nullopt;
  const int32_t today = TBDaysSince1970();
  const int32_t after = static_cast<int32_t>(today - days);
  std::vector<tools::DayValue> points;
  bool ok = history->scalarsForKeyPrefix(key, after, today, [&](const std::string& k, int32_t d, int64_t v, bool*) {
    if (k == key) points.push_back({d, v});
  });
  if (ok && !points.empty()) return points;
  bool distribution = false;
  ok = ok && history->distributionsForKeyPrefix(
                 key, std::numeric_limits<int32_t>::min(), std::numeric_limits<int32_t>::max(),
                 [&](const std::string& k, int32_t, platform::TBHistoryDistributionEnumerator&, bool* stop) {
                   if (k == key) distribution = *stop = true;
                 });
  if (!ok) {
    std::fprintf(stderr, "tallybook: the store could not be read\n");
    return std::nullopt;
  }
  *status = kBadInput;
  if (distribution)
    BadInput(key + " is a distribution key; history and plot show scalar keys (see dump for its samples)");
  else
    BadInput("no values of the scalar key " + key + " in the last " + std::to_string(days) +
             (days == 1 ? " day" : " days") + " (" + tools::IsoDate(after + 1) + " to " + tools::IsoDate(today) + ")");
  return std::nullopt;
}

int History(const std::string& key, int64_t days, bool json) {
  int status = 0;
  const auto points = ScalarHistory(key, days, &status);
  if (!points) return status;
  for (const tools::DayValue& p : *points) {
    if (json)
      std::printf("%s,\"value\":%lld}\n", JSONHead(p.day, key).c_str(), static_cast<long long>(p.value));
    else
      std::printf("%d %s %lld\n", p.day, tools::IsoDate(p.day).c_str(), static_cast<long long>(p.value));
  }
  return 0;
}

int Plot(const std::string& key, int64_t days, const std::string& out) {
  int status = 0;
  const auto points = ScalarHistory(key, days, &status);
  if (!points) return status;
  std::string error;
  // Absolute, so that a chart written below the device root gets the same
  // refusal of links as everything else there.
  const std::string path = std::filesystem::absolute(out).lexically_normal().string();
  if (!platform::WriteFileAtomically(path, tools::LineChartSVG(key, *points), &error)) {
    std::fprintf(stderr, "tallybook: %s\n", error.c_str());
    return kStoreError;
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Read and write the Tallybook statistics store of TALLYRUN_ROOT"};
  app.require_subcommand(1);

  std::string key, value_text, prefix;
  int64_t offset = 0, day = 0;

  std::string day_text, write_day_text;
  auto* set = app.add_subcommand("set", "Set a day's value of a scalar key (today unless --day)");
  set->add_option("KEY", key)->required();
  set->add_option("VALUE", value_text, "signed 64-bit integer")->required();
  auto* add = app.add_subcommand("add", "Add to a day's value of a scalar key (today unless --day)");
  add->add_option("KEY", key)->required();
  add->add_option("VALUE", value_text, "signed 64-bit integer")->required();
  auto* push = app.add_subcommand("push", "Push a sample of a distribution key into a day (today unless --day)");
  push->add_option("KEY", key)->required();
  push->add_option("VALUE", value_text, "real number")->required();
  auto* offset_opt = push->add_option("--offset", offset, "seconds within the day (default: the time of day now)");
  for (CLI::App* writer : {set, add, push})
    writer->add_option("--day", write_day_text, "the day to record into: a day number or an ISO date (YYYY-MM-DD)");
  auto* dump = app.add_subcommand("dump", "Print scalars as 'day key value', distributions as "
                                          "'day key count min max mean'");
  auto* day_opt = dump->add_option("--day", day_text, "only this day: a day number or an ISO date (YYYY-MM-DD)");
  dump->add_option("--prefix", prefix, "only keys starting with this");
  bool json = false;
  dump->add_flag("--json", json, "one JSON object per line, with the day's date");
  int64_t days = kDefaultDays;
  std::string out;
  auto* history = app.add_subcommand("history", "Print a scalar key's values over the last days as 'day date value'");
  history->add_option("KEY", key)->required();
  history->add_option("--days", days, "how many days up to today (default 30)");
  history->add_flag("--json", json, "one JSON object per line");
  auto* plot = app.add_subcommand("plot", "Draw a scalar key's values over the last days as an SVG line chart");
  plot->add_option("KEY", key)->required();
  plot->add_option("--days", days, "how many days up to today (default 30)");
  plot->add_option("--out", out, "the SVG file to write")->required();
  auto* today = app.add_subcommand("today", "Print today's day number");
  double max_age_hours = 26;
  auto* status_cmd = app.add_subcommand(
      "status", "Say how the last run of tallyrun went; exit 0 (fine and recent), 1 (failed) or 3 (none, too old, "
                "or held back by the gate)");
  status_cmd->add_flag("--json", json, "as one JSON object");
  status_cmd->add_option("--max-age", max_age_hours, "hours a run stays recent (default 26)")
      ->check(CLI::Range(0.0, 24.0 * 366));

  if (const auto status = ParseCommandLine(app, argc, argv)) return *status;

  if (today->parsed()) {
    std::printf("%d\n", TBDaysSince1970());
    return 0;
  }
  if (const auto bad_root = CheckDeviceRoot("tallybook")) return *bad_root;
  if (status_cmd->parsed()) return tools::PrintRunStatus(json, max_age_hours * 3600);
  if (dump->parsed()) {
    if (day_opt->count()) {
      std::string error;
      const auto parsed = ParseDay(day_text, &error);
      if (!parsed) return BadInput(error);
      day = *parsed;
    }
    if (day_opt->count() && (day < std::numeric_limits<int32_t>::min() || day > std::numeric_limits<int32_t>::max()))
      return BadInput("day number out of range: " + std::to_string(day));
    return Dump(day_opt->count() > 0, day, prefix, json);
  }
  if (history->parsed() || plot->parsed()) {
    if (key.empty()) return BadInput("key must not be empty");
    if (days < 1 || days > kMaxDays)
      return BadInput("--days must be a whole number of days from 1 to " + std::to_string(kMaxDays) + ": " +
                      std::to_string(days));
    if (history->parsed()) return History(key, days, json);
    // The key is the chart's title: the file must be able to carry it.
    if (std::string why; !cf::IsPropertyListString(key, &why)) return BadInput("key cannot be a chart's title: " + why);
    if (out.empty() || out.back() == '/') return BadInput("--out must name a file: \"" + out + "\"");
    return Plot(key, days, out);
  }

  // Writes: every argument is checked before the store is opened, so bad
  // input never touches it.
  if (key.empty()) return BadInput("key must not be empty");
  if (std::string why; !cf::IsPropertyListString(key, &why))
    return BadInput("key cannot be stored, a property list cannot carry it: " + why);
  const int32_t today_number = TBDaysSince1970();
  int32_t write_day = today_number;
  if (!write_day_text.empty()) {
    std::string error;
    const auto parsed = ParseDay(write_day_text, &error);
    if (!parsed) return BadInput(error);
    if (*parsed < 0 || *parsed > std::numeric_limits<int32_t>::max())
      return BadInput("day number out of range: " + write_day_text);
    write_day = static_cast<int32_t>(*parsed);
  }
  if (push->parsed()) {
    double value = 0;
    if (!ParseReal(value_text, &value)) return BadInput("value is not a finite real number: \"" + value_text + "\"");
    if (offset_opt->count() == 0)
      offset = static_cast<int64_t>(platform::Now() - platform::StartOfDay(today_number));
    if (offset < 0 || offset > 90000)
      return BadInput("offset must be seconds within the day (0 to 90000): " + std::to_string(offset));
    platform::TallyStore* store = OpenStore();
    if (!store) return kStoreError;
    if (!store->PushSample(write_day, key, value, static_cast<int32_t>(offset))) {
      std::fprintf(stderr, "tallybook: %s\n", store->last_error().c_str());
      return kStoreError;
    }
    return 0;
  }
  int64_t value = 0;
  if (!ParseInteger(value_text, &value))
    return BadInput("value is not a signed 64-bit integer: \"" + value_text + "\"");
  platform::TallyStore* store = OpenStore();
  if (!store) return kStoreError;
  const bool ok = set->parsed() ? store->SetScalar(write_day, key, value) : store->AddScalar(write_day, key, value);
  if (!ok) {
    std::fprintf(stderr, "tallybook: %s\n", store->last_error().c_str());
    return store->last_error_is_bad_input() ? kBadInput : kStoreError;
  }
  (void)add;
  return 0;
}
