#include "report/report.h"

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/diagnostics.h"
#include "platform/history.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "platform/store.h"

using platform::LogError;
using platform::LogInfo;

namespace {

// A key the log could not carry would cost the whole day's log; writers
// refuse such keys, but a store may hold older ones.
bool Carried(const std::string& key) {
  std::string why;
  if (cf::IsPropertyListString(key, &why)) return true;
  LogError("Skipping a store key that a property list cannot carry: %s", why);
  return false;
}

}  // namespace

TBReport::TBReport() : _config(TBConfig::init()) {}

void TBReport::writeLogForYesterday(int32_t day, const cf::Value& appInfo) {
  LogInfo("writing aggregated log. yesterday=%d", day);
  {
    std::string error;
    std::unique_ptr<platform::TBHistory> history = platform::TBHistory::initWithDefaultPath(&error);
    if (!history) {
      LogError("Could not open the store's history: %s", error);
    } else {
      // The row's day is not looked at: a key returned twice keeps the later row.
      const bool complete =
          history->scalarsForKeyPrefix("", day - 1, day,
                                       [&](const std::string& key, int32_t, int64_t value, bool*) {
                                         if (!_config) return;
                                         const auto options = _config->configOptionsForScalarKey(key);
                                         if (options && Carried(key)) addScalar(value, key, *options);
                                       }) &&
          history->distributionsForKeyPrefix(
              "", day - 1, day,
              [&](const std::string& key, int32_t, platform::TBHistoryDistributionEnumerator& samples, bool*) {
                if (!_config) return;
                const auto options = _config->configOptionsForDistributionKey(key);
                if (options && Carried(key)) computeAndAddDistribution(samples, key, *options);
              });
      // Part of a day submitted as the whole of it would be wrong data; the
      // history has said why, and counted a corruption.
      if (!complete) {
        LogError("Not writing the aggregated log for day %d: the store could not be read completely", day);
        return;
      }
    }
  }
  serializeWithDate(day, appInfo);
}

int64_t TBReport::addScalar(int64_t value, const std::string& key, const cf::Dictionary& options) {
  const int64_t shaped = options.empty() ? value : ShapeScalarValue(value, options);
  _scalarsOutput.Set(key, cf::Value::SInt64(shaped));
  return shaped;
}

void TBReport::addScalarForKey(const std::string& key, const std::function<int64_t()>& block) {
  if (!_config) return;
  const auto options = _config->configOptionsForScalarKey(key);
  if (!options) return;
  addScalar(block(), key, *options);
}

void TBReport::serializeWithDate(int32_t day, const cf::Value& appInfo) {
  if (_scalarsOutput.empty() && _distributionsOutput.empty() && _histogramsOutput.empty()) return;

  addInstalledAppInfo();
  addMetadataKeys();
  reportDatabaseSize();
  reportCPUUptime();
  reportVMStats();

  const std::string digest = _config ? _config->configFileDigest() : std::string();
  _config.reset();  // nothing can be added from here on

  const cf::Value task_id = DGVPreferencesGetValue("TaskingID", kTallyrunDomain);
  const cf::Value task_digest = DGVPreferencesGetValue("TaskingDigest", kTallyrunDomain);
  const cf::Value payload = DGVPreferencesGetValue("TaskingPayload", kTallyrunDomain);

  cf::Dictionary root;
  root.Set("TBCrashLogVersion", cf::Value::SInt32(1));
  root.Set("TBStartDate", dateForDaysSince1970(day));
  root.Set("TBLogCreationDate", cf::Date{platform::Now()});
  root.Set("TBMetadata", _metadataOutput);
  root.Set("TBScalars", _scalarsOutput);
  root.Set("TBDistributions", _distributionsOutput);
  root.Set("TBDistributionsHistogram", _histogramsOutput);
  root.Set("TBTasking", payload.AsArray() ? payload : cf::Value(cf::Array()));
  root.Set("TBTaskID", task_id.AsString() ? task_id : cf::Value("(no tasking id)"));
  root.Set("TBTaskDigest", task_digest.AsString() ? task_digest : cf::Value("(no tasking digest)"));
  root.Set("TBWhitelistDigest", digest);
  if (!appInfo.IsNull()) root.Set("TBActivatedAppInfo", appInfo);

  std::string bytes, error;
  if (!cf::WriteXMLPropertyList(root, bytes, &error)) {
    LogError("Could not create aggregated plist: %@", cf::Value(error));
    return;
  }

  // The OS version moves on before the submission, so a failed write does
  // not bring "previous_os_version" back the next day.
  cf::Dictionary options;
  const cf::Value last = DGVPreferencesGetValue("LastOSVersion", kTallyrunDomain);
  const std::string current = DGVOSVersion();
  if (!last.AsString() || *last.AsString() != current) {
    DGVPreferencesSetValue("LastOSVersion", current, kTallyrunDomain);
    DGVPreferencesSynchronize(kTallyrunDomain);
    options.Set("previous_os_version", last.AsString() ? last : cf::Value("<unknown>"));
  }
  const bool ok = DGVWriteLogForSubmission("193", "log-aggregated", options.empty() ? cf::Value() : cf::Value(options),
                                           cf::Value(), [&](platform::LogOutput& out) { out.Write(bytes); });
  if (!ok) LogError("Failed to write aggregated log");
}
