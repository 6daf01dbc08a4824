#pragma once

#include <memory>
#include <string>
#include <utility>

#include "platform/LocationService.h"

namespace sable::platform::simulated {

/// The location of a virtual device: a test says what is allowed, and when a fix or a failure
/// comes. Every manager hears of each.
class SimulatedLocationService final : public LocationService {
 public:
  bool enabled = true;
  bool canMakeManager = true;

  explicit SimulatedLocationService(LocationAuthorization status = LocationAuthorization::notDetermined)
      : status_(std::make_shared<LocationAuthorization>(status)) {}

  /// Before a manager is made this only sets what it will find.
  void authorize(LocationAuthorization status) {
    *status_ = status;
    tell([status](const LocationEvents& events) { events.authorizationChanged(status); });
  }
  void deliver(const LocationFix& fix) {
    tell([fix](const LocationEvents& events) { events.fixArrived(fix); });
  }
  void fail(std::string reason = "no signal") {
    tell([reason = std::move(reason)](const LocationEvents& events) { events.failed(reason); });
  }

  bool isUpdating() const {
    const auto manager = manager_.lock();
    return manager && manager->updating;
  }
  /// How often the manager was started when it stood still.
  int starts() const {
    const auto manager = manager_.lock();
    return manager ? manager->starts : 0;
  }

  bool locationServicesEnabled() const override { return enabled; }

  std::shared_ptr<LocationManager> makeManager(std::shared_ptr<SerialQueue> queue, double,
                                               LocationEvents events) override {
    if (!canMakeManager) return nullptr;
    auto manager = std::make_shared<Manager>(std::move(queue), std::move(events), status_);
    manager_ = manager;
    return manager;
  }

 private:
  struct Manager final : LocationManager {
    Manager(std::shared_ptr<SerialQueue> onQueue, LocationEvents toTell,
            std::shared_ptr<const LocationAuthorization> itsStatus)
        : queue(std::move(onQueue)), events(std::move(toTell)), status(std::move(itsStatus)) {}

    LocationAuthorization authorizationStatus() const override { return *status; }
    void startUpdatingLocation() override {
      queue->assertIsCurrent();
      if (!std::exchange(updating, true)) ++starts;
    }
    void stopUpdatingLocation() override {
      queue->assertIsCurrent();
      updating = false;
    }

    const std::shared_ptr<SerialQueue> queue;
    const LocationEvents events;
    const std::shared_ptr<const LocationAuthorization> status;
    bool updating = false;
    int starts = 0;
  };

  template <class Event>
  void tell(Event event) {
    const auto manager = manager_.lock();
    if (!manager) return;
    manager->queue->async([weak = manager_, event] {
      if (const auto told = weak.lock()) event(told->events);
    });
  }

  const std::shared_ptr<LocationAuthorization> status_;
  std::weak_ptr<Manager> manager_;  ///< of the daemon of the moment; one that is gone hears nothing
};

}  // namespace sable::platform::simulated
