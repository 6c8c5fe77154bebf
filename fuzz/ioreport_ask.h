// What the reporting-channel fuzz targets ask of every channel and sample
// they make: each accessor, at indexes inside and outside the element count.
#pragma once

#include "ioreport/ioreport.h"
#include "ioreport/samples.h"

namespace fuzz {

inline void AskChannel(const cf::Dictionary& c) {
  (void)IOReportChannelGetFormat(c);
  (void)IOReportChannelGetCategories(c);
  (void)IOReportChannelGetChannelName(c);
  (void)IOReportChannelGetUnitLabel(c);
  (void)IOReportChannelCopyDescription(c, {}, "> ");
  (void)IOReportStateGetCount(c);
  int64_t lower, upper;
  for (int i = -1; i < 3; ++i) (void)IOReportHistogramGetBucketBounds(c, i, &lower, &upper);
}

inline void AskSample(const cf::Dictionary& s) {
  int64_t unit = 0;
  (void)IOReportChannelGetFormat(s);
  (void)IOReportChannelGetCategories(s);
  (void)IOReportChannelGetChannelID(s);
  (void)IOReportChannelGetDriverID(s);
  (void)IOReportChannelGetChannelName(s);
  (void)IOReportChannelGetUnitLabel(s);
  (void)IOReportChannelCopyDescription(s, {}, "> ");
  (void)IOReportSimpleGetIntegerValue(s, &unit);
  (void)IOReportStateGetCount(s);
  (void)IOReportHistogramGetBucketCount(s);
  for (int i = -1; i < 9; ++i) {
    int64_t lower, upper;
    (void)IOReportArrayGetValueAtIndex(s, i);
    (void)IOReportStateGetIDForIndex(s, i);
    (void)IOReportStateGetInTransitions(s, i);
    (void)IOReportStateGetResidency(s, i);
    (void)IOReportStateGetNameForIndex(s, i);
    (void)IOReportStateGetDutyCycle(s, i);
    (void)IOReportHistogramGetBucketHits(s, i);
    (void)IOReportHistogramGetBucketMinValue(s, i);
    (void)IOReportHistogramGetBucketMaxValue(s, i);
    (void)IOReportHistogramGetBucketSum(s, i);
    (void)IOReportHistogramGetBucketBounds(s, i, &lower, &upper);
  }
  (void)IOReportStateGetIndexForID(s, 0);
  (void)IOReportStateGetIndexForID(s, 0x4F4E);
  (void)IOReportStateGetCurrent(s);
  (void)IOReportHistogramGetMinValue(s);
  (void)IOReportHistogramGetMaxValue(s);
  (void)IOReportSampleCreateDelta(s, s, nullptr);
  (void)IOReportSampleCopyDescription(s, {}, "  ");
}

}  // namespace fuzz
