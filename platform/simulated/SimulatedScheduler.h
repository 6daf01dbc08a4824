#pragma once

#include <chrono>
#include <functional>
#include <random>
#include <vector>

#include "platform/TimerSet.h"

namespace sable::platform::simulated {

/// One thread's worth of virtual time: what is ready to run, picked by the seed, and a clock that
/// moves only when nothing is ready, to the next timer.
class SimulatedScheduler {
 public:
  explicit SimulatedScheduler(std::uint64_t seed) : chance_(seed) {}
  ~SimulatedScheduler() { dropWork(); }
  SimulatedScheduler(const SimulatedScheduler&) = delete;
  SimulatedScheduler& operator=(const SimulatedScheduler&) = delete;

  MonotonicTime now() const { return now_; }
  Timer addTimer(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work);

  /// Makes `work` ready: it runs when the seed picks it among all that is ready.
  void post(Function<void()> work) { ready_.push_back(std::move(work)); }

  /// Runs ready work and due timers in order of time until `done` says so or `deadline` has come;
  /// the clock stands at `deadline` then. Work runs on top of what is running, as if on a thread
  /// of its own. Says whether `done`.
  bool runUntil(const std::function<bool()>& done, MonotonicTime deadline);
  /// Runs what is ready, and what that makes ready, without moving the clock.
  void runReady();

  /// Destroys all that is ready or timed without running it.
  void dropWork();

  /// Marks, as long as it lives, that work of a queue runs.
  class Running {
   public:
    Running(SimulatedScheduler& scheduler, const void* queue) : scheduler_(scheduler) {
      scheduler_.running_.push_back(queue);
    }
    ~Running() { scheduler_.running_.pop_back(); }
    Running(const Running&) = delete;
    Running& operator=(const Running&) = delete;

   private:
    SimulatedScheduler& scheduler_;
  };
  /// Whether the work on top runs on `queue`, itself or through the sync calls it stands in; what
  /// waits further down is another thread's.
  bool isCurrent(const void* queue) const;

 private:
  bool runOne();
  bool reachNextTimer(MonotonicTime deadline);

  std::mt19937_64 chance_;
  MonotonicTime now_{std::chrono::hours(1)};
  TimerSet timers_;
  std::vector<Function<void()>> ready_;
  std::vector<const void*> running_;  // null where another thread begins
};

}  // namespace sable::platform::simulated
