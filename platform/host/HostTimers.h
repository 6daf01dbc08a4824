#pragma once

#include <memory>
#include <mutex>

#include "platform/TimerSet.h"

namespace sable::platform::host {

/// The clock of timers: CLOCK_MONOTONIC.
MonotonicTime monotonicNow();

/// Every timer of a runtime, behind one timer descriptor. The descriptor is set only when a
/// deadline comes before the one it is set to; a cancelled timer costs no system call, at most one
/// wake-up for nothing. Any thread.
class HostTimers {
 public:
  HostTimers();
  ~HostTimers();
  HostTimers(const HostTimers&) = delete;
  HostTimers& operator=(const HostTimers&) = delete;

  /// Becomes readable each time something has come due.
  int descriptor() const { return descriptor_; }

  /// Appends `work` to `queue` after `delay`.
  Timer add(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work);

  /// Makes the descriptor readable at `time` at the latest.
  void wakeBy(MonotonicTime time);

  /// Appends the work of every due timer to its queue.
  void fire();

  /// Drops all timers.
  void clear() { timers_.clear(); }

 private:
  const int descriptor_;
  TimerSet timers_;

  std::mutex mutex_;  // guards what follows
  MonotonicTime setFor_ = MonotonicTime::max();
  bool firing_ = false;
  bool fireAgain_ = false;
};

}  // namespace sable::platform::host
