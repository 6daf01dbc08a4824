// A thousand devices lose the service for six hours, in virtual time: how much more than in the mean
// of an hour they ask in one minute of it when it returns, and when all start at once. With a path as
// the only argument it draws their requests there, as docs/fleet-return.svg has them.
#include "tests/support/Fleet.h"

#include <fmt/core.h>

#include <algorithm>
#include <fstream>
#include <string_view>

#include "bench/support/Bench.h"

namespace {

using namespace sable;
using test::FleetHour;
using test::FleetPlan;

constexpr int kWidth = 720, kHeight = 300, kLeft = 70, kRight = 20, kTop = 20, kBottom = 50;

/// Pixels of the plot for values from 0 to the largest.
struct Axes {
  double minutes, requests;
  double x(double minute) const { return kLeft + minute / minutes * (kWidth - kLeft - kRight); }
  double y(double value) const { return kHeight - kBottom - value / requests * (kHeight - kTop - kBottom); }
};

std::string text(double x, double y, std::string_view anchor, std::string_view words) {
  return fmt::format("<text x=\"{:.0f}\" y=\"{:.0f}\" text-anchor=\"{}\">{}</text>\n", x, y, anchor, words);
}

std::string ticks(const Axes& axes) {
  std::string svg;
  for (int hour = 0; hour * 60 <= axes.minutes; ++hour)
    svg += text(axes.x(hour * 60), kHeight - kBottom + 18, "middle", std::to_string(hour));
  for (int value = 0; value <= axes.requests; value += 500) {
    const double y = axes.y(value);
    svg += fmt::format("<path d=\"M{} {:.1f}H{}\" stroke=\"#ddd\"/>\n", kLeft, y, kWidth - kRight);
    svg += text(kLeft - 8, y + 4, "end", std::to_string(value));
  }
  svg += text(axes.x(axes.minutes / 2), kHeight - 10, "middle", "hours since the devices started");
  return svg + fmt::format(
                   "<text transform=\"translate(16 {}) rotate(-90)\" text-anchor=\"middle\">"
                   "requests a minute</text>\n",
                   (kTop + kHeight - kBottom) / 2);
}

std::string drawing(const FleetPlan& plan, const std::vector<int>& minutes) {
  const double largest = *std::max_element(minutes.begin(), minutes.end());
  const Axes axes{static_cast<double>(minutes.size()), largest * 1.1};
  const double lost = static_cast<double>(plan.goodTimes / std::chrono::minutes(1));
  const double back = lost + static_cast<double>(plan.outage / std::chrono::minutes(1));
  std::string svg = fmt::format(
      "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"{0}\" height=\"{1}\" "
      "viewBox=\"0 0 {0} {1}\" font-family=\"sans-serif\" font-size=\"12\">\n"
      "<rect width=\"{0}\" height=\"{1}\" fill=\"#fff\"/>\n",
      kWidth, kHeight);
  svg += fmt::format("<rect x=\"{:.1f}\" y=\"{}\" width=\"{:.1f}\" height=\"{}\" fill=\"#f6e3e0\"/>\n",
                     axes.x(lost), kTop, axes.x(back) - axes.x(lost), kHeight - kTop - kBottom);
  svg += ticks(axes) + text(axes.x((lost + back) / 2), kTop + 16, "middle", "no service");
  svg += "<path fill=\"none\" stroke=\"#1f5f99\" d=\"";
  for (std::size_t i = 0; i < minutes.size(); ++i) {
    svg += fmt::format("{}{:.1f} {:.1f}", i == 0 ? 'M' : 'L', axes.x(static_cast<double>(i) + 0.5),
                       axes.y(minutes[i]));
  }
  return svg + "\"/>\n</svg>\n";
}

void tell(std::string_view measure, const FleetHour& hour, int argc, char** argv) {
  bench::report({std::string(measure), "requests", static_cast<double>(hour.peak), hour.mean, 3.0}, argc,
                argv);
}

}  // namespace

int main(int argc, char** argv) {
  FleetPlan plan;
  const auto minutes = test::requestsPerMinute(plan);
  if (argc == 2 && argv[1][0] != '-') {
    std::ofstream(argv[1]) << drawing(plan, minutes);
    return 0;
  }
  plan.powerCut = std::chrono::hours(2);
  const auto afterPowerCut = test::requestsPerMinute(plan);
  tell("fleet_start", test::hourFrom(minutes, {}), argc, argv);
  tell("fleet_return", test::hourFrom(minutes, plan.goodTimes + plan.outage), argc, argv);
  tell("fleet_power_cut", test::hourFrom(afterPowerCut, plan.goodTimes + plan.outage), argc, argv);
}
