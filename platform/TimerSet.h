#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

#include "platform/Runtime.h"

namespace sable::platform {

/// `delay` after `time`: `time` itself when the delay is not positive, at most the end of time.
MonotonicTime later(MonotonicTime time, Duration delay);

/// The pending timers of a runtime in order of deadline; whoever owns it tells it the time. Any
/// thread. It outlives its timers.
class TimerSet {
 public:
  /// Appends `work` to `queue` when `deadline` has passed; at once when that is not after `now`.
  Timer add(MonotonicTime now, MonotonicTime deadline, std::shared_ptr<Queue> queue, Function<void()> work);

  /// The earliest deadline.
  std::optional<MonotonicTime> next() const;

  /// Appends the work of every timer due at `now` to its queue, in order of deadline. One caller at
  /// a time: two could swap the timers of a queue.
  void fire(MonotonicTime now);

  /// Drops all timers.
  void clear();

 private:
  class Entry;
  using Key = std::pair<MonotonicTime, std::uint64_t>;  // deadline, then order of arrival
  struct Pending {
    std::shared_ptr<Queue> queue;
    std::shared_ptr<Entry> entry;
  };

  void remove(const Key& key);

  mutable std::mutex mutex_;
  std::map<Key, Pending> pending_;
  std::uint64_t lastSequence_ = 0;
};

}  // namespace sable::platform
