#include "platform/TimerSet.h"

#include <atomic>

namespace sable::platform {

MonotonicTime later(MonotonicTime time, Duration delay) {
  if (delay <= Duration::zero()) return time;
  return delay > MonotonicTime::max() - time ? MonotonicTime::max() : time + delay;
}

class TimerSet::Entry final : public Timer::Implementation {
 public:
  Entry(TimerSet& set, Key key, Function<void()> work) : set_(set), key_(key), work_(std::move(work)) {}

  void run() {
    if (taken_.exchange(true)) return;
    work_();
    work_ = nullptr;
  }

  void cancel() override {
    if (taken_.exchange(true)) return;
    work_ = nullptr;
    set_.remove(key_);
  }

 private:
  TimerSet& set_;
  const Key key_;
  std::atomic<bool> taken_ = false;
  Function<void()> work_;  // belongs to whoever sets taken_
};

Timer TimerSet::add(MonotonicTime now, MonotonicTime deadline, std::shared_ptr<Queue> queue,
                    Function<void()> work) {
  std::unique_lock lock(mutex_);
  const Key key(deadline, ++lastSequence_);
  auto entry = std::make_shared<Entry>(*this, key, std::move(work));
  if (deadline > now) {
    pending_.emplace(key, Pending{std::move(queue), entry});
  } else {
    lock.unlock();
    queue->async([entry] { entry->run(); });
  }
  return Timer(std::move(entry));
}

std::optional<MonotonicTime> TimerSet::next() const {
  const std::lock_guard lock(mutex_);
  if (pending_.empty()) return std::nullopt;
  return pending_.begin()->first.first;
}

void TimerSet::fire(MonotonicTime now) {
  std::map<Key, Pending> due;
  {
    const std::lock_guard lock(mutex_);
    while (!pending_.empty() && pending_.begin()->first.first <= now) {
      due.insert(due.end(), pending_.extract(pending_.begin()));
    }
  }
  for (auto& [key, pending] : due) {
    pending.queue->async([entry = std::move(pending.entry)] { entry->run(); });
  }
}

void TimerSet::remove(const Key& key) {
  std::unique_lock lock(mutex_);
  const auto node = pending_.extract(key);
  lock.unlock();  // first, for the node may be the last to hold its queue
}

void TimerSet::clear() {
  std::unique_lock lock(mutex_);
  const auto dropped = std::exchange(pending_, {});
  lock.unlock();
}

}  // namespace sable::platform
