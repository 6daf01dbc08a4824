#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <utility>

#include "platform/Runtime.h"

namespace sable::platform::host {

/// The clock of timers: CLOCK_MONOTONIC.
MonotonicTime monotonicNow();
/// `delay` from now, at the end of time when that is past it.
MonotonicTime deadlineAfter(Duration delay);

/// Every pending timer of a runtime, behind one timer descriptor. The descriptor is set only when
/// a deadline comes before the one it is set to; a cancelled timer costs no system call, at most
/// one wake-up for nothing. Any thread.
class HostTimers {
 public:
  HostTimers();
  ~HostTimers();
  HostTimers(const HostTimers&) = delete;
  HostTimers& operator=(const HostTimers&) = delete;

  /// Readable once for each setting that has come due.
  int descriptor() const { return descriptor_; }

  /// Appends `work` to `queue` after `delay`.
  Timer add(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work);

  /// Makes the descriptor readable at `time` at the latest.
  void wakeBy(MonotonicTime time);

  /// Appends the work of every due timer to its queue, in order of deadline.
  void fire();

  /// Drops every pending timer.
  void clear();

 private:
  class Entry;
  using Key = std::pair<MonotonicTime, std::uint64_t>;
  struct Pending {
    std::shared_ptr<Queue> queue;
    std::shared_ptr<Entry> entry;
  };

  void remove(const Key& key);
  void setDescriptor(MonotonicTime time);
  std::map<Key, Pending> takeDue();

  const int descriptor_;

  std::mutex mutex_;
  std::map<Key, Pending> pending_;
  std::uint64_t lastSequence_ = 0;
  MonotonicTime setFor_ = MonotonicTime::max();
  bool firing_ = false;
  bool fireAgain_ = false;
};

}  // namespace sable::platform::host
