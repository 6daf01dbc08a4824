#include "platform/simulated/SimulatedWaiting.h"

#include <functional>

#include "platform/ProgrammingError.h"

namespace sable::platform::simulated {

namespace {

bool waitUntil(SimulatedScheduler& scheduler, const std::function<bool()>& done, MonotonicTime deadline) {
  if (done()) return true;
  if (deadline <= scheduler.now()) return false;
  const bool reached = scheduler.runUntil(done, deadline);
  if (!reached && deadline == MonotonicTime::max()) {
    programmingError("a wait without end that nothing is left to end");
  }
  return reached;
}

}  // namespace

bool SimulatedSemaphore::wait(MonotonicTime deadline) {
  if (!waitUntil(
          scheduler_, [this] { return count_ > 0; }, deadline))
    return false;
  --count_;
  return true;
}

void SimulatedWaitGroup::leave() {
  if (count_ == 0) programmingError("a wait group was left more often than entered");
  --count_;
}

bool SimulatedWaitGroup::wait(MonotonicTime deadline) {
  return waitUntil(
      scheduler_, [this] { return count_ == 0; }, deadline);
}

}  // namespace sable::platform::simulated
