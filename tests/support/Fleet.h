#pragma once

#include <string>
#include <vector>

#include "platform/Runtime.h"

namespace sable::test {

/// What a fleet goes through, from the moment all its devices start at once.
struct FleetPlan {
  int devices = 1000;
  platform::Duration goodTimes = std::chrono::hours(1);  ///< until the service is lost
  platform::Duration outage = std::chrono::hours(6);
  platform::Duration afterwards = std::chrono::hours(2);
  platform::Duration
      powerCut{};  ///< how long before the service's return all devices were off; they return with it
};

/// How many requests the devices sent in each minute, those that came to nothing included. Each device is
/// a background session and the schedule of the flusher, which brings it an upload every ten minutes.
std::vector<int> requestsPerMinute(const FleetPlan& plan);

/// The requests of one hour.
struct FleetHour {
  int peak = 0;  ///< in one minute
  double mean = 0;
};
FleetHour hourFrom(const std::vector<int>& minutes, platform::Duration begin);

}  // namespace sable::test
