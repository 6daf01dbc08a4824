#include "platform/host/HostTimers.h"

#include <sys/timerfd.h>
#include <unistd.h>

#include <chrono>

#include "platform/ProgrammingError.h"

namespace sable::platform::host {

MonotonicTime monotonicNow() {
  return MonotonicTime(std::chrono::steady_clock::now().time_since_epoch());
}

HostTimers::HostTimers() : descriptor_(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC)) {
  if (descriptor_ < 0) programmingError("no timer descriptor");
}

HostTimers::~HostTimers() {
  ::close(descriptor_);
}

Timer HostTimers::add(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work) {
  const MonotonicTime now = monotonicNow();
  const MonotonicTime deadline = later(now, delay);
  Timer timer = timers_.add(now, deadline, std::move(queue), std::move(work));
  if (deadline > now) wakeBy(deadline);
  return timer;
}

void HostTimers::wakeBy(MonotonicTime time) {
  const std::lock_guard lock(mutex_);
  if (time >= setFor_) return;
  setFor_ = time;
  const auto sinceBoot = time.time_since_epoch();
  const auto seconds = std::chrono::floor<std::chrono::seconds>(sinceBoot);
  itimerspec setting{};
  setting.it_value.tv_sec = seconds.count();
  setting.it_value.tv_nsec = (sinceBoot - seconds).count();
  ::timerfd_settime(descriptor_, TFD_TIMER_ABSTIME, &setting, nullptr);
}

void HostTimers::fire() {
  std::unique_lock lock(mutex_);
  setFor_ = MonotonicTime::max();
  fireAgain_ = true;
  if (firing_) return;  // the thread that fires looks again
  firing_ = true;
  while (std::exchange(fireAgain_, false)) {
    lock.unlock();
    timers_.fire(monotonicNow());
    if (const auto next = timers_.next()) wakeBy(*next);
    lock.lock();
  }
  firing_ = false;
}

}  // namespace sable::platform::host
