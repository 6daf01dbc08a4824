#pragma once

#include <array>
#include <functional>
#include <memory>
#include <random>
#include <string>

#include "platform/simulated/SimulatedScheduler.h"

namespace sable::platform::simulated {

/// A runtime in virtual time, all on the calling thread. The seed decides which of the ready queues
/// runs next, so one seed is one run and other seeds are other interleavings. Work takes no time;
/// the clock jumps from timer to timer. A blocking wait runs other work, on top of the waiting one,
/// until it is signalled or its virtual deadline passes; a wait without end that nothing can end
/// stops the process with a message.
class SimulatedRuntime final : public Runtime {
 public:
  explicit SimulatedRuntime(std::uint64_t seed = 1);

  /// Runs everything that is ready, and what that makes ready. Time stands still.
  void run() { scheduler_.runReady(); }
  /// Runs everything up to `duration` from now, in order of time.
  void advance(Duration duration);
  /// Runs until `predicate` holds, for `limit` at most; says whether it holds.
  bool runUntil(const std::function<bool()>& predicate, Duration limit);

  /// As when the process is killed: what is queued, or timed, never runs. From outside all work.
  void dropWork() { scheduler_.dropWork(); }

  /// Sets the time of day; monotonic time and timers do not notice.
  void setWallClock(WallTime time) { wallAtZero_ = time - scheduler_.now().time_since_epoch(); }
  void jumpWallClock(Duration distance) { wallAtZero_ += distance; }

  WallTime now() const override { return wallAtZero_ + scheduler_.now().time_since_epoch(); }
  MonotonicTime ticks() const override { return scheduler_.now(); }
  void randomBytes(std::span<std::byte> bytes) override;

  std::shared_ptr<SerialQueue> serialQueue(std::string label,
                                           QualityOfService quality = QualityOfService::standard) override;
  std::shared_ptr<ConcurrentQueue> concurrentQueue(std::string label) override;
  Queue& globalQueue(QualityOfService quality) override;

  std::unique_ptr<Semaphore> semaphore(unsigned initialCount) override;
  std::unique_ptr<WaitGroup> waitGroup() override;

 private:
  WallTime wallAtZero_;
  std::mt19937_64 randomBytes_;
  SimulatedScheduler scheduler_;
  std::array<std::shared_ptr<Queue>, 3> globalQueues_;
};

}  // namespace sable::platform::simulated
