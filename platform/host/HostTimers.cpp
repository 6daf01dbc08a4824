#include "platform/host/HostTimers.h"

#include <sys/timerfd.h>
#include <unistd.h>

#include <atomic>
#include <chrono>

#include "platform/ProgrammingError.h"

namespace sable::platform::host {

MonotonicTime monotonicNow() {
  return MonotonicTime(std::chrono::steady_clock::now().time_since_epoch());
}

MonotonicTime deadlineAfter(Duration delay) {
  const MonotonicTime now = monotonicNow();
  return delay > MonotonicTime::max() - now ? MonotonicTime::max() : now + delay;
}

class HostTimers::Entry final : public Timer::Implementation {
 public:
  Entry(HostTimers& timers, Key key, Function<void()> work)
      : timers_(timers), key_(key), work_(std::move(work)) {}

  void run() {
    if (taken_.exchange(true)) return;
    work_();
    work_ = nullptr;
  }

  void cancel() override {
    if (taken_.exchange(true)) return;
    work_ = nullptr;
    timers_.remove(key_);
  }

 private:
  HostTimers& timers_;
  const Key key_;
  std::atomic<bool> taken_ = false;
  Function<void()> work_;  // belongs to whoever sets taken_
};

HostTimers::HostTimers() : descriptor_(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC)) {
  if (descriptor_ < 0) programmingError("no timer descriptor");
}

HostTimers::~HostTimers() {
  ::close(descriptor_);
}

Timer HostTimers::add(Duration delay, std::shared_ptr<Queue> queue, Function<void()> work) {
  std::unique_lock lock(mutex_);
  const Key key(deadlineAfter(delay), ++lastSequence_);
  auto entry = std::make_shared<Entry>(*this, key, std::move(work));
  if (delay > Duration::zero()) {
    pending_.emplace(key, Pending{std::move(queue), entry});
    if (key.first < setFor_) setDescriptor(key.first);
  } else {
    lock.unlock();
    queue->async([entry] { entry->run(); });
  }
  return Timer(std::move(entry));
}

void HostTimers::remove(const Key& key) {
  std::unique_lock lock(mutex_);
  const auto node = pending_.extract(key);
  lock.unlock();  // the node goes unlocked: it may be the last to hold its queue
}

void HostTimers::clear() {
  std::unique_lock lock(mutex_);
  const auto dropped = std::exchange(pending_, {});
  lock.unlock();
}

void HostTimers::wakeBy(MonotonicTime time) {
  const std::lock_guard lock(mutex_);
  if (time < setFor_) setDescriptor(time);
}

void HostTimers::setDescriptor(MonotonicTime time) {
  setFor_ = time;
  const auto sinceBoot = time.time_since_epoch();
  const auto seconds = std::chrono::floor<std::chrono::seconds>(sinceBoot);
  itimerspec setting{};
  setting.it_value.tv_sec = seconds.count();
  setting.it_value.tv_nsec = (sinceBoot - seconds).count();
  ::timerfd_settime(descriptor_, TFD_TIMER_ABSTIME, &setting, nullptr);
}

std::map<HostTimers::Key, HostTimers::Pending> HostTimers::takeDue() {
  std::map<Key, Pending> due;
  const MonotonicTime now = monotonicNow();
  while (!pending_.empty() && pending_.begin()->first.first <= now) {
    due.insert(due.end(), pending_.extract(pending_.begin()));
  }
  return due;
}

void HostTimers::fire() {
  std::unique_lock lock(mutex_);
  // Two threads that append at once could swap timers of one queue: the second leaves it to the first.
  if (firing_) {
    fireAgain_ = true;
    return;
  }
  firing_ = true;
  do {
    fireAgain_ = false;
    setFor_ = MonotonicTime::max();
    auto due = takeDue();
    if (!pending_.empty()) setDescriptor(pending_.begin()->first.first);
    lock.unlock();
    for (auto& [key, pending] : due) {
      pending.queue->async([entry = std::move(pending.entry)] { entry->run(); });
    }
    due.clear();
    lock.lock();
  } while (fireAgain_);
  firing_ = false;
}

}  // namespace sable::platform::host
