// TBReport: builds one day's aggregated log from the store's history and the
// whitelist, and submits it as log type "193", name "log-aggregated".
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "cf/value.h"
#include "platform/run_record.h"
#include "report/config.h"

namespace platform {
class TBHistoryDistributionEnumerator;
}

using platform::kTallyrunDomain;

class TBReport {
 public:
  TBReport();  // init: loads the whitelist (null config when it cannot be loaded)

  // Builds and submits the log for day D; appInfo is an array of app entries or null.
  void writeLogForYesterday(int32_t day, const cf::Value& appInfo);

  // Shapes value with the scalar options (only when there are any), stores
  // it under key, and returns what was stored.
  int64_t addScalar(int64_t value, const std::string& key, const cf::Dictionary& options);
  // One pass over the day's samples: the five-number summary, and a
  // histogram when the options carry "intervals".
  void computeAndAddDistribution(platform::TBHistoryDistributionEnumerator& samples, const std::string& key,
                                 const cf::Dictionary& options);
  // Runs the measurement only when the whitelist lists the key.
  void addScalarForKey(const std::string& key, const std::function<int64_t()>& block);

  // Index of the first bound >= value, or the overflow bucket (bounds.size()).
  static uint32_t determineHistBucketForValue(double value, const cf::Array& intervals);
  // Label -> count for the non-empty buckets; null when all are empty.
  static cf::Value histogramDictForIntervals(const cf::Array& intervals, const std::vector<uint64_t>& counts);

  // Report-side system metrics, gathered at serialization.
  void addInstalledAppInfo();
  void addMetadataKeys();
  void reportDatabaseSize();
  void reportVMStats();
  void reportCPUUptime();

  const cf::Dictionary& scalarsOutput() const { return _scalarsOutput; }
  const cf::Dictionary& distributionsOutput() const { return _distributionsOutput; }
  const cf::Dictionary& histogramsOutput() const { return _histogramsOutput; }
  const cf::Dictionary& metadataOutput() const { return _metadataOutput; }

 private:
  void serializeWithDate(int32_t day, const cf::Value& appInfo);

  std::unique_ptr<TBConfig> _config;
  cf::Dictionary _scalarsOutput;
  cf::Dictionary _distributionsOutput;
  cf::Dictionary _histogramsOutput;
  cf::Dictionary _metadataOutput;
};

// The scalar shaping of "bucket_interval" then "sig_fig".
int64_t ShapeScalarValue(int64_t value, const cf::Dictionary& options);
