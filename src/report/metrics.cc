// Report-side system metrics, added at serialization time: installed apps,
// UI language and region, the store's size and corruption count, CPU uptime
// and the memory freezer's counters.
#include <cmath>
#include <limits>

#include "cf/plist.h"
#include "platform/analytics.h"
#include "platform/context.h"
#include "platform/faultkeep.h"
#include "platform/files.h"
#include "platform/loader.h"
#include "platform/log.h"
#include "platform/store.h"
#include "platform/system.h"
#include "report/report.h"

using platform::LogError;

namespace {

constexpr const char* kAppInstallsEvent = "com.velmora.homedeck.appInstalls";
constexpr const char* kNumAllInstalledApps = "com.velmora.homedeck.numAllInstalledApps";
constexpr const char* kNumThirdPartyApps = "com.velmora.homedeck.numThirdPartyApps";
constexpr const char* kDatabaseSize = "com.velmora.diagvault.tbkd.database.size";
constexpr const char* kDatabaseCorruptions = "com.velmora.diagvault.tbkd.database.corruptions";
constexpr const char* kCPUUptime = "com.velmora.usage.cur_boot_session_cpu_uptime";
// The store file under the fixed home directory "/var/mobile".
constexpr const char* kDatabaseFile = "/var/mobile/Library/Tallybook/TBDataStore.sqlitedb";

constexpr uint64_t kFailedRead = std::numeric_limits<uint64_t>::max();

// Ratio to integer: truncation toward zero, the nearest limit beyond the
// range, and 0 for an undefined quotient.
int64_t RatioToInt64(double d) { return std::isnan(d) ? 0 : cf::Number::Float64(d).AsSInt64(); }

bool ReadU64(const char* name, uint64_t* out) {
  size_t size = sizeof *out;
  return platform::Sysctl(name, out, &size) == 0;
}

bool ReadU32(const char* name, uint32_t* out) {
  size_t size = sizeof *out;
  return platform::Sysctl(name, out, &size) == 0;
}

uint64_t ReadU64OrAllOnes(const char* name) {
  uint64_t v = 0;
  return ReadU64(name, &v) ? v : kFailedRead;
}

int64_t ReadU64OrMinusOne(const char* name) {
  uint64_t v = 0;
  return ReadU64(name, &v) ? static_cast<int64_t>(v) : -1;
}

int64_t ReadU32OrAllOnes(const char* name) {
  uint32_t v = 0;
  return ReadU32(name, &v) ? v : int64_t{4294967295};
}

// The two preference functions of the support library, resolved by name
// once per process (per device root) while both are found.
struct SupportFunctions {
  uint64_t context = 0;
  DGVPreferencesGetIntegerValueFn get = nullptr;
  DGVPreferencesSetValueFn set = nullptr;
};

bool ResolveSupportFunctions(SupportFunctions& f) {
  const uint64_t context = platform::Context::Current().id();
  if (f.context != context) f = SupportFunctions{context, nullptr, nullptr};
  if (f.get && f.set) return true;
  void* library = platform::LoadLibrary(kFaultkeepSupportPath);
  if (!library) LogError("Failed to dynamically load the FaultkeepSupport framework");
  if (!f.get) {
    f.get = reinterpret_cast<DGVPreferencesGetIntegerValueFn>(platform::FindSymbol(library, "DGVPreferencesGetIntegerValue"));
    if (!f.get) LogError("Failed to dyanmically link DGVPreferencesGetIntegerValue");
  }
  if (!f.set) {
    f.set = reinterpret_cast<DGVPreferencesSetValueFn>(platform::FindSymbol(library, "DGVPreferencesSetValue"));
    if (!f.set) LogError("Failed to dynamically link DGVPreferencesSetValue");
  }
  return f.get && f.set;
}

// Reads "DatabaseCorruptionCount" of "com.velmora.tallybookd" and sets it back to 0.
int64_t ReadAndResetCorruptionCount() {
  static SupportFunctions functions;
  if (!ResolveSupportFunctions(functions)) return 0;
  const int64_t count = functions.get(platform::kStoreCorruptionKey, platform::kStoreCorruptionDomain, nullptr);
  const cf::Value zero = cf::Value::SInt64(0);
  functions.set(platform::kStoreCorruptionKey, &zero, platform::kStoreCorruptionDomain);
  return count;
}

}  // namespace

void TBReport::addInstalledAppInfo() {
  const auto all_options = _config ? _config->configOptionsForScalarKey(kNumAllInstalledApps) : std::nullopt;
  const auto third_options = _config ? _config->configOptionsForScalarKey(kNumThirdPartyApps) : std::nullopt;
  const bool analytics = platform::AnalyticsAvailable();
  if (!all_options && !third_options && !(analytics && AnalyticsIsEventUsed(kAppInstallsEvent))) return;
  int64_t all = 0, third_party = 0;
  LSApplicationWorkspace::defaultWorkspace().enumerateBundlesOfType(1, [&](const LSBundleProxy& bundle) {
    ++all;
    if (bundle.bundleType == LSUserApplicationType) ++third_party;
  });
  if (all_options) addScalar(all, kNumAllInstalledApps, *all_options);
  if (third_options) addScalar(third_party, kNumThirdPartyApps, *third_options);
  if (analytics) {
    AnalyticsSendEventLazy(kAppInstallsEvent, [&] {
      cf::Dictionary fields;
      fields.Set("numThirdPartyApps", cf::Value::SInt64(third_party));
      fields.Set("numAllApps", cf::Value::SInt64(all));
      return cf::Value(fields);
    });
  }
}

void TBReport::addMetadataKeys() {
  // The languages and region come from the environment and the device files:
  // text the log cannot carry counts as unknown rather than costing the log.
  auto carried = [](const cf::Value& v) { return v.AsString() && cf::IsPropertyListString(*v.AsString()); };
  const cf::Array preferred = preferredLanguages();
  const cf::Array best = preferredLocalizationsFromArray(systemLanguages(), preferred);
  _metadataOutput.Set("TBUserInterfaceLanguage", !best.empty() && carried(best[0]) ? best[0] : cf::Value("<unknown>"));
  _metadataOutput.Set("TBPreferredUserInterfaceLanguage",
                      !preferred.empty() && carried(preferred[0]) ? preferred[0] : cf::Value("<unknown>"));
  const cf::Value country = CurrentLocaleCountryCode();
  if (carried(country)) _metadataOutput.Set("TBUserSetRegionFormat", country);
}

void TBReport::reportDatabaseSize() {
  if (!_config) return;
  if (const auto options = _config->configOptionsForScalarKey(kDatabaseSize)) {
    const auto size = platform::FileSize(platform::Context::Current().Path(kDatabaseFile));
    addScalar(size ? *size / 1048576 : -1, kDatabaseSize, *options);
  }
  if (const auto options = _config->configOptionsForScalarKey(kDatabaseCorruptions))
    addScalar(ReadAndResetCorruptionCount(), kDatabaseCorruptions, *options);
}

void TBReport::reportCPUUptime() {
  addScalarForKey(kCPUUptime, [] {
    const uint64_t t = mach_absolute_time();
    mach_timebase_info_data_t info{};
    if (mach_timebase_info(&info) != 0 || info.denom == 0) {
      LogError("Couldn't retrieve mach_timebase_info");
      return int64_t{-1};
    }
    return RatioToInt64(info.numer * 1e-9 / info.denom / 60.0 * static_cast<double>(t));
  });
}

void TBReport::reportVMStats() {
  addScalarForKey("com.velmora.kernel.memorystatus_freeze_count",
                  [] { return ReadU32OrAllOnes("kern.memorystatus_freeze_count"); });

  uint64_t pageouts = 0;
  if (ReadU64("kern.memorystatus_freeze_pageouts", &pageouts)) {
    addScalarForKey("com.velmora.kernel.memorystatus_freeze_pageouts", [&] { return static_cast<int64_t>(pageouts); });
    const double frozen_gib = static_cast<double>(pageouts) * static_cast<double>(platform::PageSize()) / 1073741824.0;
    if (frozen_gib >= 1.0)
      addScalarForKey("com.velmora.memorystatus_freezer_thaws_per_gb", [&] {
        return RatioToInt64(static_cast<double>(ReadU64OrAllOnes("kern.memorystatus_thaw_count_since_boot")) / frozen_gib);
      });
  }

  addScalarForKey("com.velmora.kernel.memorystatus_freeze_budget_pages_remaining",
                  [] { return ReadU64OrMinusOne("kern.memorystatus_freeze_budget_pages_remaining"); });
  addScalarForKey("com.velmora.kernel.memorystatus_thaw_count",
                  [] { return ReadU32OrAllOnes("kern.memorystatus_thaw_count"); });
  addScalarForKey("com.velmora.kernel.swapusage", [] {
    uint64_t record[4] = {};
    size_t size = sizeof record;
    return platform::Sysctl("vm.swapusage", record, &size) == 0 ? static_cast<int64_t>(record[0]) : int64_t{-1};
  });

  // Percentages of a gate count; the quotient is in double precision.
  auto percentage = [&](const char* key, const char* numerator, uint64_t gate) {
    addScalarForKey(key, [&] {
      return RatioToInt64(static_cast<double>(ReadU64OrAllOnes(numerator)) / static_cast<double>(gate) * 100);
    });
  };
  uint64_t considered = 0;
  if (ReadU64("kern.memorystatus_freezer_process_considered_count", &considered)) {
    percentage("com.velmora.memorystatus_freezer_error_no_compressor_space_count",
               "kern.memorystatus_freezer_error_no_compressor_space_count", considered);
    percentage("com.velmora.memorystatus_freezer_error_no_swap_space_count",
               "kern.memorystatus_freezer_error_no_swap_space_count", considered);
    percentage("com.velmora.memorystatus_freezer_error_below_min_pages_count",
               "kern.memorystatus_freezer_error_below_min_pages_count", considered);
    percentage("com.velmora.memorystatus_freezer_error_low_probability_of_use_count",
               "kern.memorystatus_freezer_error_low_probability_of_use_count", considered);
    percentage("com.velmora.memorystatus_freezer_error_other_count", "kern.memorystatus_freezer_error_other_count",
               considered);
    addScalarForKey("com.velmora.memorystatus_freezer_process_considered_count",
                    [&] { return static_cast<int64_t>(considered); });
  }
  uint64_t below_threshold = 0;
  if (ReadU64("kern.memorystatus_freezer_below_threshold_count", &below_threshold))
    percentage("com.velmora.memorystatus_freezer_skipped_full_count", "kern.memorystatus_freezer_skipped_full_count",
               below_threshold);
  addScalarForKey("com.velmora.memorystatus_freezer_thaw_percentage",
                  [] { return ReadU64OrMinusOne("kern.memorystatus_freezer_thaw_percentage"); });
  uint64_t refreezes = 0;
  if (ReadU64("kern.memorystatus_freezer_refreeze_count", &refreezes) && refreezes >= 10)
    addScalarForKey("com.velmora.memorystatus_freezer_refreeze_average", [&] {
      return static_cast<int64_t>(ReadU64OrAllOnes("kern.memorystatus_freezer_bytes_refrozen") / refreezes);
    });
}
