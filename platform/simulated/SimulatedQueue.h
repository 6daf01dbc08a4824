#pragma once

#include <deque>
#include <memory>
#include <string>

#include "platform/QueueTurn.h"
#include "platform/simulated/SimulatedScheduler.h"

namespace sable::platform::simulated {

/// The serial queue of SimulatedRuntime. It runs one piece of work a turn, so that the seed may let
/// any other queue run in between.
class SimulatedQueue final : public SerialQueue, public std::enable_shared_from_this<SimulatedQueue> {
 public:
  SimulatedQueue(SimulatedScheduler& scheduler, std::string label)
      : scheduler_(scheduler), label_(std::move(label)) {}

  const std::string& label() const override { return label_; }
  void async(Function<void()> work) override;
  [[nodiscard]] Timer after(Duration delay, Function<void()> work) override;
  bool isCurrent() const override { return scheduler_.isCurrent(this); }

 protected:
  /// Runs what is queued, then `work`. With a queue whose own work waits further down the stack
  /// that is impossible, as it is on a queue's own work: the process stops with a message.
  void runSync(Function<void()> work) override;

 private:
  friend QueueTurn<SimulatedQueue>;

  void drain();
  void discard();
  void runFirst();
  void run(Function<void()> work);
  void scheduleIfNeeded();

  SimulatedScheduler& scheduler_;
  const std::string label_;
  std::deque<Function<void()>> items_;
  bool running_ = false;
  bool turnPosted_ = false;
};

}  // namespace sable::platform::simulated
