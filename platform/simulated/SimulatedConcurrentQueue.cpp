#include "platform/simulated/SimulatedConcurrentQueue.h"

#include <fmt/core.h>

#include "platform/ProgrammingError.h"

namespace sable::platform::simulated {

void SimulatedConcurrentQueue::runRead(Function<void()> read) {
  if (scheduler_.isCurrent(this)) return read();
  if (writing_) programmingError(fmt::format("read on queue {}, whose barrier waits for it to end", label_));
  runBarriers();
  ++readers_;
  {
    const SimulatedScheduler::Running current(scheduler_, this);
    read();
  }
  --readers_;
  scheduleIfNeeded();
}

void SimulatedConcurrentQueue::barrierSync(Function<void()> write) {
  if (writing_ || readers_ > 0) {
    programmingError(fmt::format("barrier on queue {}, whose own work waits for it to end", label_));
  }
  runBarriers();
  runAlone(std::move(write));
  scheduleIfNeeded();
}

void SimulatedConcurrentQueue::barrierAsync(Function<void()> write) {
  barriers_.push_back(std::move(write));
  scheduleIfNeeded();
}

void SimulatedConcurrentQueue::runBarriers() {
  for (std::size_t before = barriers_.size(); before > 0 && readers_ == 0; --before) {
    Function<void()> write = std::move(barriers_.front());
    barriers_.pop_front();
    runAlone(std::move(write));
  }
}

void SimulatedConcurrentQueue::runAlone(Function<void()> write) {
  const SimulatedScheduler::Running current(scheduler_, this);
  writing_ = true;
  write();
  write = nullptr;
  writing_ = false;
}

void SimulatedConcurrentQueue::drain() {
  turnPosted_ = false;
  if (writing_) return;
  runBarriers();
  scheduleIfNeeded();
}

void SimulatedConcurrentQueue::discard() {
  turnPosted_ = false;
  const auto dropped = std::exchange(barriers_, {});
}

void SimulatedConcurrentQueue::scheduleIfNeeded() {
  if (writing_ || readers_ > 0 || barriers_.empty() || std::exchange(turnPosted_, true)) return;
  scheduler_.post(QueueTurn(shared_from_this()));
}

}  // namespace sable::platform::simulated
