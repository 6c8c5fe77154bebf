#include "tools/line_chart.h"

#include <algorithm>
#include <cmath>
#include <cstdio>

#include "tools/output.h"

namespace tools {

namespace {

constexpr double kWidth = 880, kHeight = 440;
constexpr double kLeft = 96, kRight = 32, kTop = 64, kBottom = 56;
constexpr double kPlotWidth = kWidth - kLeft - kRight, kPlotHeight = kHeight - kTop - kBottom;
constexpr int kMaxDayTicks = 7;
constexpr int kValueTicks = 5;

std::string Escape(const std::string& text) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      case '"': out += "&quot;"; break;
      case '\'': out += "&apos;"; break;
      default: out += c;
    }
  }
  return out;
}

std::string Coordinate(double v) {
  char buf[32];
  std::snprintf(buf, sizeof buf, "%.1f", v);
  return buf;
}

std::string WithSeparators(long long n) {
  std::string digits = std::to_string(n < 0 ? -static_cast<unsigned long long>(n) : static_cast<unsigned long long>(n));
  std::string out;
  for (size_t i = 0; i < digits.size(); ++i) {
    if (i > 0 && (digits.size() - i) % 3 == 0) out += ',';
    out += digits[i];
  }
  return n < 0 ? "-" + out : out;
}

// 1, 2 or 5 times a power of ten, at least raw; integers never need a finer step.
double NiceStep(double raw) {
  if (!(raw > 0)) return 1;
  const double magnitude = std::pow(10.0, std::floor(std::log10(raw)));
  const double norm = raw / magnitude;
  const double nice = norm <= 1 ? 1 : norm <= 2 ? 2 : norm <= 5 ? 5 : 10;
  return std::max(1.0, nice * magnitude);
}

}  // namespace

std::string TickLabel(double value, double step) {
  if (value == 0) return "0";
  static constexpr struct {
    double scale;
    const char* suffix;
  } kUnits[] = {{1e18, "E"}, {1e15, "P"}, {1e12, "T"}, {1e9, "G"}, {1e6, "M"}};
  double scale = 1;
  const char* suffix = "";
  for (const auto& unit : kUnits) {
    if (std::fabs(value) >= unit.scale) {
      scale = unit.scale;
      suffix = unit.suffix;
      break;
    }
  }
  const double relative = step / scale;
  const int decimals = relative >= 1 ? 0 : std::min(6, static_cast<int>(std::ceil(-std::log10(relative) - 1e-9)));
  if (scale == 1 && decimals == 0) return WithSeparators(std::llround(value));
  char buf[64];
  std::snprintf(buf, sizeof buf, "%.*f%s", decimals, value / scale, suffix);
  return buf;
}

std::string LineChartSVG(const std::string& title, const std::vector<DayValue>& points) {
  // The day axis spans the days with values; a lone day gets one either side.
  int64_t first_day = points.front().day, last_day = points.back().day;
  if (first_day == last_day) {
    --first_day;
    ++last_day;
  }
  const auto [min_it, max_it] = std::minmax_element(
      points.begin(), points.end(), [](const DayValue& a, const DayValue& b) { return a.value < b.value; });
  double low = static_cast<double>(min_it->value), high = static_cast<double>(max_it->value);
  if (low == high) {
    const double pad = std::max(1.0, std::fabs(low) * 0.05);
    low -= pad;
    high += pad;
  }
  const double step = NiceStep((high - low) / kValueTicks);
  const double axis_low = std::floor(low / step) * step, axis_high = std::ceil(high / step) * step;

  auto x_of = [&](int64_t day) {
    return kLeft + static_cast<double>(day - first_day) / static_cast<double>(last_day - first_day) * kPlotWidth;
  };
  auto y_of = [&](double v) { return kTop + (axis_high - v) / (axis_high - axis_low) * kPlotHeight; };

  const std::string name = Escape(title);
  std::string svg;
  svg += "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
  const std::string width = std::to_string(static_cast<int>(kWidth)), height = std::to_string(static_cast<int>(kHeight));
  svg += "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"" + width + "\" height=\"" + height + "\" viewBox=\"0 0 " +
         width + " " + height + "\" font-family=\"sans-serif\" font-size=\"12\">\n";
  svg += "<title>" + name + "</title>\n";
  svg += "<rect width=\"100%\" height=\"100%\" fill=\"#ffffff\"/>\n";
  svg += "<text class=\"title\" x=\"" + Coordinate(kWidth / 2) +
         "\" y=\"26\" text-anchor=\"middle\" font-size=\"16\" font-weight=\"bold\">" + name + "</text>\n";
  svg += "<text class=\"subtitle\" x=\"" + Coordinate(kWidth / 2) + "\" y=\"46\" text-anchor=\"middle\" fill=\"#555555\">" +
         IsoDate(points.front().day) + " to " + IsoDate(points.back().day) + ", " + std::to_string(points.size()) +
         (points.size() == 1 ? " day" : " days") + " with a value</text>\n";

  // Value axis: grid lines and labels.
  svg += "<g class=\"value-ticks\" text-anchor=\"end\" fill=\"#333333\">\n";
  const int value_ticks = static_cast<int>(std::lround((axis_high - axis_low) / step));
  for (int i = 0; i <= value_ticks; ++i) {
    const double v = axis_low + i * step;
    const std::string y = Coordinate(y_of(v));
    svg += "<line x1=\"" + Coordinate(kLeft) + "\" y1=\"" + y + "\" x2=\"" + Coordinate(kLeft + kPlotWidth) + "\" y2=\"" +
           y + "\" stroke=\"#e4e4e4\"/>";
    svg += "<text x=\"" + Coordinate(kLeft - 8) + "\" y=\"" + y + "\" dy=\"4\">" + TickLabel(v, step) + "</text>\n";
  }
  svg += "</g>\n";

  // Day axis: dates at whole-day steps, at most kMaxDayTicks + 1 of them.
  svg += "<g class=\"day-ticks\" text-anchor=\"middle\" fill=\"#333333\">\n";
  const int64_t span = last_day - first_day;
  const int64_t day_step = std::max<int64_t>(1, (span + kMaxDayTicks - 1) / kMaxDayTicks);
  for (int64_t day = first_day; day <= last_day; day += day_step) {
    const std::string x = Coordinate(x_of(day));
    svg += "<line x1=\"" + x + "\" y1=\"" + Coordinate(kTop + kPlotHeight) + "\" x2=\"" + x + "\" y2=\"" +
           Coordinate(kTop + kPlotHeight + 5) + "\" stroke=\"#333333\"/>";
    svg += "<text x=\"" + x + "\" y=\"" + Coordinate(kTop + kPlotHeight + 20) + "\" data-day=\"" + std::to_string(day) +
           "\">" + IsoDate(day) + "</text>\n";
  }
  svg += "</g>\n";

  svg += "<g class=\"axes\" stroke=\"#333333\" fill=\"none\">\n";
  svg += "<polyline points=\"" + Coordinate(kLeft) + "," + Coordinate(kTop) + " " + Coordinate(kLeft) + "," +
         Coordinate(kTop + kPlotHeight) + " " + Coordinate(kLeft + kPlotWidth) + "," + Coordinate(kTop + kPlotHeight) +
         "\"/>\n";
  svg += "</g>\n";

  // One polyline per run of consecutive days.
  svg += "<g class=\"series\" fill=\"none\" stroke=\"#2a6fdb\" stroke-width=\"2\" stroke-linejoin=\"round\">\n";
  for (size_t start = 0; start < points.size();) {
    size_t end = start + 1;
    while (end < points.size() && points[end].day == points[end - 1].day + 1) ++end;
    svg += "<polyline points=\"";
    for (size_t i = start; i < end; ++i) {
      if (i > start) svg += ' ';
      svg += Coordinate(x_of(points[i].day)) + "," + Coordinate(y_of(static_cast<double>(points[i].value)));
    }
    svg += "\"/>\n";
    start = end;
  }
  svg += "</g>\n";

  svg += "<g class=\"points\" fill=\"#2a6fdb\">\n";
  for (const DayValue& p : points) {
    const std::string value = std::to_string(p.value);
    svg += "<circle cx=\"" + Coordinate(x_of(p.day)) + "\" cy=\"" + Coordinate(y_of(static_cast<double>(p.value))) +
           "\" r=\"3.5\" data-day=\"" + std::to_string(p.day) + "\" data-date=\"" + IsoDate(p.day) +
           "\" data-value=\"" + value + "\"><title>" + IsoDate(p.day) + ": " + WithSeparators(p.value) +
           "</title></circle>\n";
  }
  svg += "</g>\n</svg>\n";
  return svg;
}

}  // namespace tools
