#pragma once

#include <deque>
#include <memory>
#include <string>

#include "platform/QueueTurn.h"
#include "platform/simulated/SimulatedScheduler.h"

namespace sable::platform::simulated {

/// The concurrent queue of SimulatedRuntime. Reads and synchronous barriers first run the barriers
/// queued before them.
class SimulatedConcurrentQueue final : public ConcurrentQueue,
                                       public std::enable_shared_from_this<SimulatedConcurrentQueue> {
 public:
  SimulatedConcurrentQueue(SimulatedScheduler& scheduler, std::string label)
      : scheduler_(scheduler), label_(std::move(label)) {}

  void barrierSync(Function<void()> write) override;
  void barrierAsync(Function<void()> write) override;

 protected:
  /// A read from within this queue's own read or barrier runs at once. One that would have to wait
  /// for a barrier further down the stack stops the process with a message.
  void runRead(Function<void()> read) override;

 private:
  friend QueueTurn<SimulatedConcurrentQueue>;

  void drain();
  void discard();
  void runBarriers();
  void runAlone(Function<void()> write);
  void scheduleIfNeeded();

  SimulatedScheduler& scheduler_;
  const std::string label_;
  std::deque<Function<void()>> barriers_;
  unsigned readers_ = 0;
  bool writing_ = false;
  bool turnPosted_ = false;
};

}  // namespace sable::platform::simulated
