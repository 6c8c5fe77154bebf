// Shaping of the report's values: scalar rounding, distribution summaries
// and histograms.
#include <cmath>
#include <limits>
#include <new>

#include "cf/format.h"
#include "platform/history.h"
#include "platform/log.h"
#include "report/report.h"

using platform::LogDebug;
using platform::LogDefault;
using platform::LogError;

namespace {

// double -> int64 as a truncating conversion that cannot overflow.
int64_t TruncateToInt64(double d) { return cf::Number::Float64(d).AsSInt64(); }

}  // namespace

int64_t ShapeScalarValue(int64_t value, const cf::Dictionary& options) {
  if (const cf::Number* interval = options.Get("bucket_interval").AsNumber()) {
    // Computed on the unsigned bits with wrap-around: the nearest multiple,
    // halves up, for the non-negative counts the store holds.
    const uint64_t i = interval->AsUInt64();
    value = i == 0 ? 0 : static_cast<int64_t>((static_cast<uint64_t>(value) + i / 2) / i * i);
  }
  const cf::Value sig_fig = options.Get("sig_fig");
  if (sig_fig.AsNumber() && value != 0) {
    const uint64_t s = sig_fig.AsNumber()->AsUInt64();
    const double l = std::ceil(std::log10(std::fabs(static_cast<double>(value))));
    const uint64_t d = l < 0 ? 0 : static_cast<uint64_t>(l);
    const int64_t x = static_cast<int64_t>(d - s);
    if (x >= 1) {
      const double p = std::pow(10.0, static_cast<double>(x));
      value = TruncateToInt64(p * std::round(static_cast<double>(value) / p));
    }
  }
  return value;
}

uint32_t TBReport::determineHistBucketForValue(double value, const cf::Array& intervals) {
  uint32_t i = 0;
  for (const cf::Value& bound : intervals) {
    const cf::Number* n = bound.AsNumber();
    if (n && n->AsFloat64() >= value) return i;
    ++i;
  }
  return i;
}

cf::Value TBReport::histogramDictForIntervals(const cf::Array& intervals, const std::vector<uint64_t>& counts) {
  const size_t n = intervals.size();
  cf::Value result;  // stays null until the first non-empty bucket
  cf::Dictionary histogram;
  for (size_t i = 0; i <= n && i < counts.size(); ++i) {
    if (counts[i] == 0) continue;
    if (result.IsNull()) {
      histogram.Reserve(n + 1);
      result = histogram;
    }
    const cf::Value lower = i == 0 ? cf::Value::Float64(-INFINITY) : intervals[i - 1];
    const cf::Value upper = i == n ? cf::Value::Float64(INFINITY) : intervals[i];
    histogram.Set(cf::Format(i == n ? "(%@, %@)" : "(%@, %@]", lower, upper), cf::Value::UInt64(counts[i]));
  }
  return result;
}

void TBReport::computeAndAddDistribution(platform::TBHistoryDistributionEnumerator& samples, const std::string& key,
                                         const cf::Dictionary& options) {
  const cf::Value intervals_value = options.Get("intervals");
  const cf::Array* intervals = intervals_value.AsArray();
  if (!intervals_value.IsNull() && !intervals) {
    LogError("\"intervals\" of key %s is %s, not an array; no histogram", key,
             cf::TypeNameWithArticle(intervals_value.type()));
  } else if (intervals) {
    for (const cf::Value& bound : *intervals)
      if (!bound.AsNumber()) {
        LogError("\"intervals\" of key %s holds %s, not a number; no histogram", key,
                 cf::TypeNameWithArticle(bound.type()));
        intervals = nullptr;
        break;
      }
  }
  std::vector<uint64_t> counts;
  if (intervals) {
    LogDebug("Treating key %@ as a histogram", cf::Value(key));
    try {
      counts.assign(intervals->size() + 1, 0);
    } catch (const std::bad_alloc&) {
      LogDefault("Couldn't allocate histCounts for key %@. Will not calculate histogram values", cf::Value(key));
      intervals = nullptr;
    }
  }

  int32_t count = 0;
  double minimum = 0, maximum = 0, mean = 0, m2 = 0;
  double v = 0;
  int32_t offset = 0;
  while (samples.getNextValue(&v, &offset)) {
    if (count == 0) {
      minimum = maximum = mean = v;
      count = 1;
      m2 = 0;
    } else {
      if (v < minimum) minimum = v;
      else if (v > maximum) maximum = v;
      const double delta = v - mean;
      ++count;
      mean += delta / count;
      m2 += delta * (v - mean);
    }
    if (intervals) ++counts[determineHistBucketForValue(v, *intervals)];
  }

  if (intervals) {
    const cf::Value histogram = histogramDictForIntervals(*intervals, counts);
    if (!histogram.IsNull()) _histogramsOutput.Set(key, histogram);
  }
  cf::Array summary;
  summary.Append(cf::Value::Float64(minimum));
  summary.Append(cf::Value::Float64(maximum));
  summary.Append(cf::Value::Float64(mean));
  summary.Append(cf::Value::Float64(m2));
  summary.Append(cf::Value::SInt32(count));
  _distributionsOutput.Set(key, summary);
}
