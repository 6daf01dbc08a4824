#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Runtime.h"

namespace sable::platform {

/// The numbers stand in log lines: never renumber.
enum class ActivityState : long {
  checkIn = 0,
  wait = 1,
  run = 2,
  defer = 3,
  continueRunning = 4,  ///< work goes on after the handler has returned
  done = 5,
};

/// When an activity may run.
struct ActivityCriteria {
  Duration delay{};        ///< before the first run
  Duration interval{};     ///< between the starts of two runs of a repeating activity
  Duration gracePeriod{};  ///< by how much a run may be late, so that runs can be put together
  bool repeating = false;
  bool allowBattery = false;  ///< run without external power
};

/// One run of an activity. Any thread.
class Activity {
 public:
  virtual ~Activity() = default;
  virtual const std::string& identifier() const = 0;
  virtual ActivityState state() const = 0;
  /// Whether the step was allowed: run to continueRunning, defer or done; continueRunning to defer or
  /// done. A handler that returns in state run has ended the run; after continueRunning the run ends
  /// with done or defer.
  virtual bool setState(ActivityState state) = 0;
  /// Whether the conditions have changed so that the work had better stop and defer.
  virtual bool shouldDefer() const = 0;
};

/// Runs work in the background when the device has time for it. The time of an activity's last run is
/// kept on disk, so that a restart neither skips nor doubles a run. Any thread.
class ActivityScheduler {
 public:
  virtual ~ActivityScheduler() = default;

  using Handler = std::function<void(const std::shared_ptr<Activity>& activity)>;

  /// Begins the activity, in place of one of the same identifier. The handler is called on a global
  /// queue of background priority, never twice at once.
  virtual void registerActivity(std::string identifier, const ActivityCriteria& criteria,
                                Handler handler) = 0;
  /// No handler is called from here on; one that is being called may still finish.
  virtual void unregister(std::string_view identifier) = 0;
};

}  // namespace sable::platform
