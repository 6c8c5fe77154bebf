#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "../../tests/temp_dir.h"
#include "platform/context.h"
#include "platform/history.h"
#include "platform/log.h"
#include "platform/store.h"
#include "report/report.h"

namespace {

cf::Dictionary Opts(std::initializer_list<std::pair<const char*, cf::Value>> entries) {
  return cf::Dictionary::Of(entries);
}

cf::Array Bounds(std::initializer_list<cf::Value> bounds) { return cf::Array(std::vector<cf::Value>(bounds)); }

TEST(ShapeScalarTest, BucketThenSignificantDigits) {
  const auto sig = [](int64_t v, int64_t s) { return ShapeScalarValue(v, Opts({{"sig_fig", cf::Value::SInt64(s)}})); };
  const auto bucket = [](int64_t v, int64_t i) {
    return ShapeScalarValue(v, Opts({{"bucket_interval", cf::Value::SInt64(i)}}));
  };
  EXPECT_EQ(sig(12345, 2), 12000);
  EXPECT_EQ(sig(12500, 2), 13000);  // ties away from zero
  EXPECT_EQ(sig(-12345, 2), -12000);
  EXPECT_EQ(sig(-12500, 2), -13000);
  EXPECT_EQ(sig(999, 2), 1000);
  EXPECT_EQ(sig(87, 2), 87);
  EXPECT_EQ(sig(100, 2), 100);
  EXPECT_EQ(sig(101, 1), 100);
  EXPECT_EQ(sig(0, 1), 0);
  EXPECT_EQ(sig(5, 0), 10);  // no digit kept: the leading power of ten
  EXPECT_EQ(sig(123456, 10), 123456);  // more digits asked than there are
  EXPECT_EQ(sig(std::numeric_limits<int64_t>::max(), 1), 9000000000000000000);
  EXPECT_EQ(sig(std::numeric_limits<int64_t>::min(), 2), -9200000000000000000);

  EXPECT_EQ(bucket(14, 10), 10);
  EXPECT_EQ(bucket(15, 10), 20);
  EXPECT_EQ(bucket(0, 10), 0);
  EXPECT_EQ(bucket(123, 0), 0);
  EXPECT_EQ(bucket(7, 1), 7);
  // Negative values go through the unsigned bits with wrap-around.
  EXPECT_EQ(bucket(-5, 10), 0);
  EXPECT_EQ(bucket(-6, 10), -6);
  EXPECT_EQ(bucket(-14, 10), -16);

  // Bucket first, then significant digits on its result: 1449 -> 1400 -> 1000.
  EXPECT_EQ(ShapeScalarValue(1449, Opts({{"sig_fig", cf::Value::SInt64(1)}, {"bucket_interval", cf::Value::SInt64(100)}})),
            1000);
  // Options of the other kind, and option values that are not numbers, do nothing.
  EXPECT_EQ(ShapeScalarValue(1449, Opts({{"intervals", Bounds({cf::Value::SInt64(1)})}})), 1449);
  EXPECT_EQ(ShapeScalarValue(1449, Opts({{"sig_fig", cf::Value("2")}})), 1449);
}

TEST(HistogramTest, BucketsAndLabels) {
  const cf::Array b = Bounds({cf::Value::SInt64(10), cf::Value::SInt64(100)});
  EXPECT_EQ(TBReport::determineHistBucketForValue(5, b), 0u);
  EXPECT_EQ(TBReport::determineHistBucketForValue(10, b), 0u);  // a bound closes its bucket
  EXPECT_EQ(TBReport::determineHistBucketForValue(10.0001, b), 1u);
  EXPECT_EQ(TBReport::determineHistBucketForValue(100, b), 1u);
  EXPECT_EQ(TBReport::determineHistBucketForValue(1e9, b), 2u);
  EXPECT_EQ(TBReport::determineHistBucketForValue(-INFINITY, b), 0u);
  EXPECT_EQ(TBReport::determineHistBucketForValue(NAN, b), 2u);  // NaN is above nothing
  EXPECT_EQ(TBReport::determineHistBucketForValue(3, cf::Array()), 0u);

  cf::Value h = TBReport::histogramDictForIntervals(b, {2, 0, 1});
  ASSERT_NE(h.AsDictionary(), nullptr);
  ASSERT_EQ(h.AsDictionary()->size(), 2u);
  EXPECT_EQ(*h.AsDictionary()->entries()[0].first.AsString(), "(-inf, 10]");
  EXPECT_EQ(h.AsDictionary()->Get("(-inf, 10]"), cf::Value::UInt64(2));
  EXPECT_TRUE(h.AsDictionary()->Get("(-inf, 10]").AsNumber()->IsUnsigned());
  EXPECT_EQ(h.AsDictionary()->Get("(100, inf)"), cf::Value::UInt64(1));
  EXPECT_TRUE(TBReport::histogramDictForIntervals(b, {0, 0, 0}).IsNull());
  h = TBReport::histogramDictForIntervals(cf::Array(), {4});
  EXPECT_EQ(h.AsDictionary()->Get("(-inf, inf)"), cf::Value::UInt64(4));
  h = TBReport::histogramDictForIntervals(Bounds({cf::Value::Float64(2.5), cf::Value::Float64(1e21)}), {0, 1, 1});
  EXPECT_EQ(h.AsDictionary()->Get("(2.5, 1e+21]"), cf::Value::UInt64(1));
  EXPECT_EQ(h.AsDictionary()->Get("(1e+21, inf)"), cf::Value::UInt64(1));
}

// Summaries read their samples through the store's history, as in the report.
class SummaryTest : public ::testing::Test {
 protected:
  TempDir root;
  std::shared_ptr<platform::CaptureLog> log = std::make_shared<platform::CaptureLog>();
  platform::ContextScope scope{root.path(), platform::Backends{nullptr, log}};

  void Summarize(TBReport& report, const std::vector<double>& samples, const cf::Dictionary& options) {
    const std::string path = scope.context().Path(platform::kStoreDevicePath);
    auto store = platform::TallyStore::Open(path, platform::TallyStore::Mode::kCreate, nullptr);
    std::vector<std::pair<double, int32_t>> values;
    for (double s : samples) values.emplace_back(s, 0);
    const std::string key = "k" + std::to_string(++n_);
    ASSERT_TRUE(store->PushSamples(1, key, values));
    auto history = platform::TBHistory::initWithPath(path);
    history->distributionsForKeyPrefix(key, 0, 1, [&](const std::string& k, int32_t, platform::TBHistoryDistributionEnumerator& e, bool*) {
      if (k == key) report.computeAndAddDistribution(e, "out", options);
    });
  }
  int n_ = 0;
};

cf::Value Five(double mn, double mx, double mean, double m2, int32_t n) {
  return cf::Array({cf::Value::Float64(mn), cf::Value::Float64(mx), cf::Value::Float64(mean), cf::Value::Float64(m2),
                    cf::Value::SInt32(n)});
}

TEST_F(SummaryTest, WelfordSummariesAndHistograms) {
  TBReport report;  // no whitelist: fine, we feed it directly
  Summarize(report, {1, 2, 3, 4}, {});
  EXPECT_EQ(report.distributionsOutput().Get("out"), Five(1, 4, 2.5, 5, 4));
  EXPECT_TRUE(report.histogramsOutput().empty());

  Summarize(report, {}, {});
  EXPECT_EQ(report.distributionsOutput().Get("out"), Five(0, 0, 0, 0, 0));

  Summarize(report, {7.5}, {});
  EXPECT_EQ(report.distributionsOutput().Get("out"), Five(7.5, 7.5, 7.5, 0, 1));

  Summarize(report, {5, 10, 11, 1000}, Opts({{"intervals", Bounds({cf::Value::SInt64(10), cf::Value::SInt64(100)})}}));
  EXPECT_EQ(report.distributionsOutput().Get("out").AsArray()->at(4), cf::Value::SInt32(4));
  const cf::Dictionary& h = *report.histogramsOutput().Get("out").AsDictionary();
  EXPECT_EQ(h.Get("(-inf, 10]"), cf::Value::UInt64(2));
  EXPECT_EQ(h.Get("(10, 100]"), cf::Value::UInt64(1));
  EXPECT_EQ(h.Get("(100, inf)"), cf::Value::UInt64(1));
  EXPECT_EQ(log->Count("Treating key out as a histogram"), 1u);

  // The minimum found first is not rechecked as a maximum: 3, 1, 2 gives max 3.
  Summarize(report, {3, 1, 2}, {});
  EXPECT_EQ(report.distributionsOutput().Get("out"), Five(1, 3, 2, 2, 3));
  // Types: reals for the four statistics, a 32-bit integer for the count.
  const cf::Array& five = *report.distributionsOutput().Get("out").AsArray();
  EXPECT_TRUE(five[0].AsNumber()->IsFloat());
  EXPECT_EQ(five[4].AsNumber()->type(), cf::NumberType::kSInt32);

  // Bounds that are not an array of numbers: summary only, one error line.
  TBReport other;
  Summarize(other, {1}, Opts({{"intervals", cf::Value("10,100")}}));
  Summarize(other, {1}, Opts({{"intervals", Bounds({cf::Value("x")})}}));
  EXPECT_TRUE(other.histogramsOutput().empty());
  EXPECT_EQ(log->CountContaining("\"intervals\" of key out"), 2u);
}

}  // namespace
