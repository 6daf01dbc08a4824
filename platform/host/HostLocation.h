#pragma once

#include "platform/LocationService.h"
#include "platform/NotificationCenter.h"
#include "platform/Process.h"
#include "platform/host/HostFacts.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

/// The location that the facts tell, else GeoClue's.
///
/// Facts (table "location"): without `authorization` the program is authorised, without
/// coordinates there is no fix yet, one coordinate alone is a search that failed, without
/// `timestamp` the device is there now. A change is told at once, also while nobody looks.
///
/// GeoClue is not spoken to before somebody looks, and its connection ends with the search: when a
/// fix has come, or after a minute without one. Until it was asked nothing is determined; whether it
/// starts decides on the authorisation. After a search that failed or was refused it is left alone
/// for a minute, whoever looks.
class HostLocationService final : public LocationService {
 public:
  HostLocationService(HostRuntime& runtime, const HostFacts& facts, NotificationCenter& notificationCenter)
      : runtime_(runtime), facts_(facts), notificationCenter_(notificationCenter) {}

  /// Whether there are facts, or a system bus on which GeoClue may be.
  bool locationServicesEnabled() const override;
  /// Never null.
  std::shared_ptr<LocationManager> makeManager(std::shared_ptr<SerialQueue> queue, double desiredAccuracy,
                                               LocationEvents events) override;

  Availability availability() const;

 private:
  HostRuntime& runtime_;
  const HostFacts& facts_;
  NotificationCenter& notificationCenter_;
};

}  // namespace sable::platform::host
