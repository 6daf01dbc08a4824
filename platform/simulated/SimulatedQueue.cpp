#include "platform/simulated/SimulatedQueue.h"

#include <fmt/core.h>

#include "platform/ProgrammingError.h"

namespace sable::platform::simulated {

void SimulatedQueue::async(Function<void()> work) {
  items_.push_back(std::move(work));
  scheduleIfNeeded();
}

Timer SimulatedQueue::after(Duration delay, Function<void()> work) {
  return scheduler_.addTimer(delay, shared_from_this(), std::move(work));
}

void SimulatedQueue::runSync(Function<void()> work) {
  if (isCurrent()) programmingError(fmt::format("sync onto queue {} from its own work", label_));
  if (running_) {
    programmingError(fmt::format("sync onto queue {}, whose work waits for the caller's to end", label_));
  }
  for (std::size_t before = items_.size(); before > 0; --before) runFirst();
  run(std::move(work));
  scheduleIfNeeded();
}

void SimulatedQueue::drain() {
  turnPosted_ = false;
  if (running_) return;
  if (!items_.empty()) runFirst();
  scheduleIfNeeded();
}

void SimulatedQueue::discard() {
  turnPosted_ = false;
  const auto dropped = std::exchange(items_, {});
}

void SimulatedQueue::runFirst() {
  Function<void()> work = std::move(items_.front());
  items_.pop_front();
  run(std::move(work));
}

void SimulatedQueue::run(Function<void()> work) {
  const SimulatedScheduler::Running current(scheduler_, this);
  running_ = true;
  work();
  work = nullptr;
  running_ = false;
}

void SimulatedQueue::scheduleIfNeeded() {
  if (running_ || items_.empty() || std::exchange(turnPosted_, true)) return;
  scheduler_.post(QueueTurn(shared_from_this()));
}

}  // namespace sable::platform::simulated
