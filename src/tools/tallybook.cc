// tallybook: read and write the statistics store of the device root
// (TALLYRUN_ROOT) by hand.

#include <charconv>
#include <cmath>
#include <cstdio>
#include <algorithm>
#include <limits>
#include <string>

#include "tools/cli.h"
#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/history.h"
#include "platform/store.h"

namespace {

constexpr int kBadInput = 2;
constexpr int kStoreError = 1;

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

std::string Real(double d) {
  char buf[64];
  std::snprintf(buf, sizeof buf, "%0.16g", d);
  return buf;
}

int Dump(bool one_day, int64_t day, const std::string& prefix) {
  std::string error;
  auto history = platform::TBHistory::initWithDefaultPath(&error);
  if (!history) {
    std::fprintf(stderr, "tallybook: %s\n", error.c_str());
    return kStoreError;
  }
  // The history's range excludes its minimum.
  const int32_t lo = one_day ? static_cast<int32_t>(std::max<int64_t>(day - 1, std::numeric_limits<int32_t>::min()))
                             : std::numeric_limits<int32_t>::min();
  const int32_t hi = one_day ? static_cast<int32_t>(day) : std::numeric_limits<int32_t>::max();
  bool ok = history->scalarsForKeyPrefix(prefix, lo, hi, [](const std::string& key, int32_t d, int64_t v, bool*) {
    std::printf("%d %s %lld\n", d, key.c_str(), static_cast<long long>(v));
  });
  ok = ok && history->distributionsForKeyPrefix(
                 prefix, lo, hi,
                 [](const std::string& key, int32_t d, platform::TBHistoryDistributionEnumerator& e, bool*) {
                   double v = 0, mn = 0, mx = 0, mean = 0;
                   int32_t offset = 0;
                   uint64_t n = 0;
                   while (e.getNextValue(&v, &offset)) {
                     ++n;
                     if (n == 1 || v < mn) mn = v;
                     if (n == 1 || v > mx) mx = v;
                     mean += (v - mean) / static_cast<double>(n);
                   }
                   std::printf("%d %s %llu %s %s %s\n", d, key.c_str(), static_cast<unsigned long long>(n),
                               Real(mn).c_str(), Real(mx).c_str(), Real(mean).c_str());
                 });
  if (!ok) {
    std::fprintf(stderr, "tallybook: the store could not be read\n");
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

  auto* set = app.add_subcommand("set", "Set today's value of a scalar key");
  set->add_option("KEY", key)->required();
  set->add_option("VALUE", value_text, "signed 64-bit integer")->required();
  auto* add = app.add_subcommand("add", "Add to today's value of a scalar key");
  add->add_option("KEY", key)->required();
  add->add_option("VALUE", value_text, "signed 64-bit integer")->required();
  auto* push = app.add_subcommand("push", "Push a sample of a distribution key for today");
  push->add_option("KEY", key)->required();
  push->add_option("VALUE", value_text, "real number")->required();
  auto* offset_opt = push->add_option("--offset", offset, "seconds within the day (default: now)");
  auto* dump = app.add_subcommand("dump", "Print scalars as 'day key value', distributions as "
                                          "'day key count min max mean'");
  auto* day_opt = dump->add_option("--day", day, "only this day number");
  dump->add_option("--prefix", prefix, "only keys starting with this");
  auto* today = app.add_subcommand("today", "Print today's day number");

  if (const auto status = ParseCommandLine(app, argc, argv)) return *status;

  if (today->parsed()) {
    std::printf("%d\n", TBDaysSince1970());
    return 0;
  }
  if (const auto status = CheckDeviceRoot("tallybook")) return *status;
  if (dump->parsed()) {
    if (day_opt->count() && (day < std::numeric_limits<int32_t>::min() || day > std::numeric_limits<int32_t>::max()))
      return BadInput("day number out of range: " + std::to_string(day));
    return Dump(day_opt->count() > 0, day, prefix);
  }

  // Writes: every argument is checked before the store is opened, so bad
  // input never touches it.
  if (key.empty()) return BadInput("key must not be empty");
  if (std::string why; !cf::IsPropertyListString(key, &why))
    return BadInput("key cannot be stored, a property list cannot carry it: " + why);
  const int32_t today_number = TBDaysSince1970();
  if (push->parsed()) {
    double value = 0;
    if (!ParseReal(value_text, &value)) return BadInput("value is not a finite real number: \"" + value_text + "\"");
    if (offset_opt->count() == 0)
      offset = static_cast<int64_t>(platform::Now() - platform::StartOfDay(today_number));
    if (offset < 0 || offset > 90000)
      return BadInput("offset must be seconds within the day (0 to 90000): " + std::to_string(offset));
    platform::TallyStore* store = OpenStore();
    if (!store) return kStoreError;
    if (!store->PushSample(today_number, key, value, static_cast<int32_t>(offset))) {
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
  const bool ok = set->parsed() ? store->SetScalar(today_number, key, value) : store->AddScalar(today_number, key, value);
  if (!ok) {
    std::fprintf(stderr, "tallybook: %s\n", store->last_error().c_str());
    return store->last_error_is_bad_input() ? kBadInput : kStoreError;
  }
  (void)add;
  return 0;
}
