#include "platform/simulated/SimulatedScheduler.h"

#include <algorithm>

namespace sable::platform::simulated {

void SimulatedScheduler::dropWork() {
  timers_.clear();
  // What is dropped may post in turn as it goes.
  while (!ready_.empty()) {
    const auto dropped = std::move(ready_.back());
    ready_.pop_back();
  }
}

Timer SimulatedScheduler::addTimer(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work) {
  return timers_.add(now_, later(now_, delay), std::move(queue), std::move(work));
}

bool SimulatedScheduler::runOne() {
  if (ready_.empty()) return false;
  auto& picked = ready_[chance_() % ready_.size()];
  Function<void()> work = std::exchange(picked, nullptr);
  if (&picked != &ready_.back()) picked = std::move(ready_.back());
  ready_.pop_back();
  work();
  return true;
}

bool SimulatedScheduler::reachNextTimer(MonotonicTime deadline) {
  const auto next = timers_.next();
  if (!next || *next > deadline) return false;
  now_ = std::max(now_, *next);
  timers_.fire(now_);
  return true;
}

bool SimulatedScheduler::runUntil(const std::function<bool()>& done, MonotonicTime deadline) {
  const Running otherThread(*this, nullptr);
  while (!done()) {
    if (runOne() || reachNextTimer(deadline)) continue;
    if (deadline != MonotonicTime::max()) now_ = std::max(now_, deadline);
    return done();
  }
  return true;
}

void SimulatedScheduler::runReady() {
  const Running otherThread(*this, nullptr);
  while (runOne()) continue;
}

bool SimulatedScheduler::isCurrent(const void* queue) const {
  const auto begin = std::find(running_.rbegin(), running_.rend(), nullptr);
  return std::find(running_.rbegin(), begin, queue) != begin;
}

}  // namespace sable::platform::simulated
