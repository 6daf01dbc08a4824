#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/Runtime.h"

namespace sable::platform {

/// Whether this program may know where the device is. Only `always` and `whenInUse` allow it; a
/// number that is not listed does not.
enum class LocationAuthorization : int {
  notDetermined = 0,  ///< nobody has been asked yet
  restricted = 1,
  denied = 2,
  always = 3,
  whenInUse = 4,
};

constexpr bool isAuthorized(LocationAuthorization status) {
  return status == LocationAuthorization::always || status == LocationAuthorization::whenInUse;
}

/// Where the device is (WGS 84), as the host tells it: exact, so it is neither logged nor sent.
struct LocationFix {
  double latitude = 0;   ///< degrees, positive to the north
  double longitude = 0;  ///< degrees, positive to the east
  int type = 0;          ///< how it was found: 1, 2, 3, 9 satellites; 6, 7, 8 cells; 4, 5 Wi-Fi
  WallTime timestamp;    ///< when the device was there
};

/// What a manager tells, each on the queue that it was given.
struct LocationEvents {
  std::function<void(LocationAuthorization)> authorizationChanged;
  std::function<void(const LocationFix&)> fixArrived;
  std::function<void(const std::string& reason)> failed;  ///< the search for a fix, which has ended
};

/// Asks for the device's location. Until it is started it costs nothing. Its last reference may be
/// dropped anywhere; events that are under way then still arrive.
class LocationManager {
 public:
  virtual ~LocationManager() = default;

  /// Any thread.
  virtual LocationAuthorization authorizationStatus() const = 0;

  // On the queue of the events; neither blocks.

  /// Looks for a fix until stopped or failed; without effect while it looks already, and where the
  /// program is known not to be authorised.
  virtual void startUpdatingLocation() = 0;
  virtual void stopUpdatingLocation() = 0;
};

/// The device's location.
class LocationService {
 public:
  virtual ~LocationService() = default;

  /// Whether the device can tell its location to anybody. Any thread.
  virtual bool locationServicesEnabled() const = 0;

  /// A manager whose fixes need to be no better than `desiredAccuracy` metres; null when the host
  /// cannot make one.
  virtual std::shared_ptr<LocationManager> makeManager(std::shared_ptr<SerialQueue> queue,
                                                       double desiredAccuracy, LocationEvents events) = 0;
};

}  // namespace sable::platform
