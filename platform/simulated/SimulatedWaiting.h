#pragma once

#include <cstddef>

#include "platform/simulated/SimulatedScheduler.h"

namespace sable::platform::simulated {

class SimulatedSemaphore final : public Semaphore {
 public:
  SimulatedSemaphore(SimulatedScheduler& scheduler, unsigned initialCount)
      : scheduler_(scheduler), count_(initialCount) {}

  void signal() override { ++count_; }
  [[nodiscard]] bool wait(MonotonicTime deadline) override;

 private:
  SimulatedScheduler& scheduler_;
  std::size_t count_;
};

class SimulatedWaitGroup final : public WaitGroup {
 public:
  explicit SimulatedWaitGroup(SimulatedScheduler& scheduler) : scheduler_(scheduler) {}

  void enter() override { ++count_; }
  /// Leaving more often than entering is a programming error.
  void leave() override;
  [[nodiscard]] bool wait(MonotonicTime deadline) override;

 private:
  SimulatedScheduler& scheduler_;
  std::size_t count_ = 0;
};

}  // namespace sable::platform::simulated
