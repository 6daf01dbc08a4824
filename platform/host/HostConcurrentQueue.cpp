#include "platform/host/HostConcurrentQueue.h"

#include <fmt/core.h>

#include "platform/ProgrammingError.h"
#include "platform/host/RunningQueue.h"

namespace sable::platform::host {

HostConcurrentQueue::HostConcurrentQueue(HostReactor& reactor, std::string label)
    : reactor_(reactor), label_(std::move(label)) {}

void HostConcurrentQueue::runRead(Function<void()> read) {
  if (RunningQueue::onThisThread(this)) return read();
  Lock lock(mutex_);
  enter(lock, false);
  lock.unlock();
  {
    const RunningQueue running(this);
    read();
  }
  lock.lock();
  --readers_;
  proceed(lock);
}

void HostConcurrentQueue::barrierSync(Function<void()> write) {
  if (RunningQueue::onThisThread(this)) {
    programmingError(fmt::format("barrier on queue {} from its own work", label_));
  }
  Lock lock(mutex_);
  enter(lock, true);
  lock.unlock();
  {
    const RunningQueue running(this);
    write();
  }
  lock.lock();
  writing_ = false;
  proceed(lock);
}

void HostConcurrentQueue::barrierAsync(Function<void()> write) {
  Lock lock(mutex_);
  items_.push_back({std::move(write), nullptr});
  proceed(lock);
}

void HostConcurrentQueue::enter(Lock& lock, bool writes) {
  if (items_.empty() && !writing_ && !(writes && readers_ > 0)) {
    admit(writes);
    return;
  }
  Waiter waiter{.writes = writes, .changed = {}};
  items_.push_back({nullptr, &waiter});
  // Barriers that only wait for a pool thread are run here, so that this call needs none.
  while (barrierIsNext()) runNextBarrier(lock);
  admitWaiters();
  if (waiter.admitted) return;
  lock.unlock();
  const HostReactor::Blocking blocking(reactor_);
  lock.lock();
  waiter.changed.wait(lock, [&] { return waiter.admitted; });
}

void HostConcurrentQueue::admit(bool writes) {
  if (writes) {
    writing_ = true;
  } else {
    ++readers_;
  }
}

void HostConcurrentQueue::proceed(Lock& lock) {
  admitWaiters();
  if (!barrierIsNext() || std::exchange(drainPosted_, true)) return;
  lock.unlock();
  reactor_.post(QualityOfService::standard, QueueTurn(shared_from_this()));
}

void HostConcurrentQueue::admitWaiters() {
  while (!items_.empty() && items_.front().waiter != nullptr && !writing_) {
    Waiter& waiter = *items_.front().waiter;
    if (waiter.writes && readers_ > 0) return;
    admit(waiter.writes);
    items_.pop_front();
    waiter.admitted = true;
    waiter.changed.notify_one();
  }
}

bool HostConcurrentQueue::barrierIsNext() const {
  return !items_.empty() && items_.front().waiter == nullptr && !writing_ && readers_ == 0;
}

void HostConcurrentQueue::runNextBarrier(Lock& lock) {
  Function<void()> write = std::move(items_.front().write);
  items_.pop_front();
  writing_ = true;
  lock.unlock();
  {
    const RunningQueue running(this);
    write();
    write = nullptr;
  }
  lock.lock();
  writing_ = false;
}

void HostConcurrentQueue::drain() {
  Lock lock(mutex_);
  drainPosted_ = false;
  if (barrierIsNext()) runNextBarrier(lock);
  proceed(lock);
}

void HostConcurrentQueue::discard() {
  Lock lock(mutex_);
  drainPosted_ = false;
  if (!barrierIsNext()) return;
  const auto dropped = std::exchange(items_, {});
  lock.unlock();
}

}  // namespace sable::platform::host
