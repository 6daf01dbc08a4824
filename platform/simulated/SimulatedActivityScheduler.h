#pragma once

#include <string>
#include <utility>

#include "platform/NotificationCenter.h"
#include "platform/TimedActivityScheduler.h"

namespace sable::platform::simulated {

/// Activities in virtual time. When they last ran is kept as long as the device: a daemon that is
/// made anew on it finds what an earlier one has run.
class SimulatedActivityScheduler final : public ActivityScheduler {
 public:
  SimulatedActivityScheduler(Runtime& runtime, NotificationCenter& center)
      : center_(center), scheduler_(runtime, center, host_) {}

  /// The power cord is pulled, or plugged in.
  void setOnBattery(bool onBattery) {
    host_.battery = onBattery;
    center_.post({kPowerSourceDidChangeNotification, this, {}});
  }
  /// What is on the device's disk.
  const ActivityRecord& record() const { return host_.record; }

  void registerActivity(std::string identifier, const ActivityCriteria& criteria, Handler handler) override {
    scheduler_.registerActivity(std::move(identifier), criteria, std::move(handler));
  }
  void unregister(std::string_view identifier) override { scheduler_.unregister(identifier); }

 private:
  struct Host final : ActivityHost {
    bool onBattery() override { return battery; }
    ActivityRecord load() override { return record; }
    void save(const ActivityRecord& saved) override { record = saved; }

    bool battery = false;
    ActivityRecord record;
  };

  NotificationCenter& center_;
  Host host_;
  TimedActivityScheduler scheduler_;
};

}  // namespace sable::platform::simulated
