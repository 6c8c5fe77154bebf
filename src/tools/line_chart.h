// An SVG line chart of one scalar key over days, for people to look at and
// for programs to read back: every point is a <circle> carrying data-day,
// data-date and data-value, and each run of consecutive days is one
// <polyline>, so a day without a value breaks the line.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tools {

struct DayValue {
  int32_t day;
  int64_t value;
};

// points: ordered by day, at most one per day, not empty.
std::string LineChartSVG(const std::string& title, const std::vector<DayValue>& points);

// A tick label of an axis whose ticks are step apart: plain digits with
// thousands separators below a million, else a multiple of k, M, G, T, P or E
// with just enough decimals to tell neighbouring ticks apart.
std::string TickLabel(double value, double step);

}  // namespace tools
