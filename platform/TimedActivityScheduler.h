#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>

#include "platform/ActivityScheduler.h"

namespace sable::platform {

class NotificationCenter;

/// Posted when the device goes onto battery or off it.
inline constexpr std::string_view kPowerSourceDidChangeNotification = "PowerSourceDidChange";

/// How long a run waits after it was deferred, and how often a run that waits for external power
/// looks for it where the host does not tell.
inline constexpr Duration kActivityRetryPause = std::chrono::minutes(5);

/// Times of an activity, as they are kept.
struct ActivityTimes {
  std::optional<WallTime> lastRun;  ///< when its last run that was not deferred began
  std::optional<WallTime> nextRun;  ///< absent: nobody has registered it
  bool operator==(const ActivityTimes&) const = default;
};
using ActivityRecord = std::map<std::string, ActivityTimes, std::less<>>;

/// How long after its registration an activity first runs: not before its delay has passed, nor
/// within an interval of its last run, and then `jitter` (0 to 1) of its grace period later, so that
/// devices which start together do not run together. A last run in the future was noted by a clock
/// that has been set back since, and counts as none.
Duration firstRunAfter(const ActivityCriteria& criteria, WallTime now, std::optional<WallTime> lastRun,
                       double jitter);

/// What the scheduler needs of its host. Called on the scheduler's queue, or from a run.
class ActivityHost {
 public:
  virtual ~ActivityHost() = default;
  virtual bool onBattery() = 0;
  /// Once, before the first activity. May block on the disk, as may save().
  virtual ActivityRecord load() = 0;
  virtual void save(const ActivityRecord& record) = 0;
};

/// The scheduler over a runtime's timers, the same on every host. Each activity that waits has one
/// timer. After its first run a repeating activity begins its runs an interval apart, or when the run
/// before has ended; a run that is due without external power it needs begins when there is some. A
/// run is noted before it begins: one that the process is killed in counts as done.
class TimedActivityScheduler final : public ActivityScheduler {
 public:
  /// `center` posts kPowerSourceDidChangeNotification. All three outlive the scheduler and its runs.
  TimedActivityScheduler(Runtime& runtime, NotificationCenter& center, ActivityHost& host);
  ~TimedActivityScheduler() override;

  /// Returns at once. A repeating activity has an interval.
  void registerActivity(std::string identifier, const ActivityCriteria& criteria, Handler handler) override;
  /// Waits for what the scheduler is doing, but for no handler.
  void unregister(std::string_view identifier) override;

 private:
  class Run;
  class Schedule;
  const std::shared_ptr<Schedule> schedule_;  ///< held weakly by its timers and runs
};

}  // namespace sable::platform
