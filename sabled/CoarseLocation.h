#pragma once

#include <optional>
#include <string>

namespace sable {

/// A cell of the grid on which a location leaves the device, by the latitude and longitude of its
/// middle, in degrees.
///
/// The grid serves weather and shops, not addresses. Cells are 0.05 degrees high (5.6 km) and, as
/// meridians converge, the wider in degrees the nearer they lie to a pole: never narrower than high,
/// and at most about twice as wide (5.6 to 11.7 km). Each place has one cell and each cell one name:
/// the antimeridian is -180, a pole has longitude 0 and no zero is negative.
struct CoarseLocation {
  double latitude = 0;
  double longitude = 0;

  /// "%f,%f", as requests carry it.
  std::string text() const;

  bool operator==(const CoarseLocation&) const = default;
};

/// nullopt for what is no place on Earth: a latitude beyond 90, a longitude beyond 180, not a number.
std::optional<CoarseLocation> coarseLocation(double latitude, double longitude);

/// Metres between the middles of two cells, along a great circle of a round Earth.
double distance(const CoarseLocation& from, const CoarseLocation& to);

}  // namespace sable
