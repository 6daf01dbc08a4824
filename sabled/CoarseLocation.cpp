#include "sabled/CoarseLocation.h"

#include <fmt/core.h>

#include <algorithm>
#include <cmath>
#include <numbers>

namespace sable {
namespace {

constexpr double kRowsPerDegree = 20;
constexpr int kColumnsAtEquator = 7200;

/// How many cells stand side by side around the Earth: as many as leave none narrower than high,
/// of halvings of the equator's, so that neighbouring rows mostly share their columns.
int columnsAt(double latitude) {
  const double room = kColumnsAtEquator * std::cos(latitude * std::numbers::pi / 180);
  int columns = kColumnsAtEquator;
  while (columns > 1 && columns > room) columns /= 2;
  return columns;
}

}  // namespace

std::string CoarseLocation::text() const {
  return fmt::format("{:f},{:f}", latitude, longitude);
}

double distance(const CoarseLocation& from, const CoarseLocation& to) {
  constexpr double kEarthRadius = 6'371'000;
  constexpr double kRadian = std::numbers::pi / 180;
  // The haversine formula, which is exact enough for short ways, too.
  const double north = std::sin((to.latitude - from.latitude) * kRadian / 2);
  const double east = std::sin((to.longitude - from.longitude) * kRadian / 2);
  const double chord =
      north * north + std::cos(from.latitude * kRadian) * std::cos(to.latitude * kRadian) * east * east;
  return 2 * kEarthRadius * std::asin(std::sqrt(std::min(1.0, chord)));
}

std::optional<CoarseLocation> coarseLocation(double latitude, double longitude) {
  if (!(std::abs(latitude) <= 90 && std::abs(longitude) <= 180)) return std::nullopt;
  const double row = std::round(latitude * kRowsPerDegree) / kRowsPerDegree + 0.0;  // makes -0 a 0
  const int columns = columnsAt(row);
  const double column = std::floor(longitude * columns / 360 + 0.5) * 360 / columns;
  return CoarseLocation{row, columns == 1 ? 0 : column < 180 ? column : column - 360};
}

}  // namespace sable
