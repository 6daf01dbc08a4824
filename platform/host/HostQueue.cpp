#include "platform/host/HostQueue.h"

#include <fmt/core.h>

#include <array>
#include <thread>

#include "platform/ProgrammingError.h"
#include "platform/host/RunningQueue.h"

namespace sable::platform::host {

namespace {

constexpr int kItemsInARow = 32;  // then other queues have a turn
constexpr std::size_t kItemsAtOnce = 8;
constexpr int kLooksBeforeSleep = 20;

}  // namespace

HostQueue::HostQueue(HostReactor& reactor, std::string label, QualityOfService quality)
    : reactor_(reactor), label_(std::move(label)), quality_(quality) {}

bool HostQueue::isCurrent() const {
  return RunningQueue::onThisThread(this);
}

void HostQueue::async(Function<void()> work) {
  Lock lock(mutex_);
  items_.push_back({std::move(work), nullptr});
  if (state_ == State::idle) schedule(lock);
}

Timer HostQueue::after(Duration delay, Function<void()> work) {
  return reactor_.timers().add(delay, shared_from_this(), std::move(work));
}

bool HostQueue::tryRunInline(Function<void()>& work) {
  Lock lock(mutex_);
  if (state_ != State::idle) return false;
  state_ = State::running;
  lock.unlock();
  {
    const RunningQueue running(this);
    work();
    work = nullptr;
  }
  lock.lock();
  release(lock);
  return true;
}

void HostQueue::runSync(Function<void()> work) {
  if (isCurrent()) programmingError(fmt::format("sync onto queue {} from its own work", label_));
  Lock lock(mutex_);
  // Most work is over sooner than this thread could fall asleep and be woken.
  for (int i = 0; i < kLooksBeforeSleep && state_ == State::running && items_.empty(); ++i) {
    lock.unlock();
    std::this_thread::yield();
    lock.lock();
  }
  const RunningQueue running(this);
  if (state_ == State::running || !items_.empty()) {
    Waiter waiter;
    items_.push_back({nullptr, &waiter});
    if (state_ == State::running) {
      waiters_.push_back(&waiter);
      lock.unlock();
      const HostReactor::Blocking blocking(reactor_);
      lock.lock();
      waiter.handedOver.wait(lock, [&] { return waiter.hasQueue; });
    }
    state_ = State::running;
    while (items_.front().waiter != &waiter) runSome(lock);
    items_.pop_front();
  }
  state_ = State::running;
  lock.unlock();
  work();
  lock.lock();
  release(lock);
}

/// Runs the first few items, up to a waiter, and says how many. One lock for all of them, because
/// taking it costs as much as many an item.
int HostQueue::runSome(Lock& lock) {
  std::array<Function<void()>, kItemsAtOnce> taken;
  std::size_t count = 0;
  while (count < taken.size() && !items_.empty() && items_.front().waiter == nullptr) {
    taken[count++] = std::move(items_.front().work);
    items_.pop_front();
  }
  lock.unlock();
  for (std::size_t i = 0; i < count; ++i) {
    taken[i]();
    taken[i] = nullptr;
  }
  lock.lock();
  return static_cast<int>(count);
}

void HostQueue::drain() {
  Lock lock(mutex_);
  drainPosted_ = false;
  if (state_ != State::scheduled) return;  // a sync caller was faster
  state_ = State::running;
  {
    const RunningQueue running(this);
    for (int count = 0; count < kItemsInARow && !items_.empty() && items_.front().waiter == nullptr;)
      count += runSome(lock);
  }
  release(lock);
}

void HostQueue::release(Lock& lock) {
  if (items_.empty()) {
    state_ = State::idle;
  } else if (waiters_.empty()) {
    schedule(lock);
  } else {
    // The first waiter runs what stands before it, so that it needs no pool thread. Told under the
    // lock, for it may be gone right after.
    waiters_.front()->hasQueue = true;
    waiters_.front()->handedOver.notify_one();
    waiters_.pop_front();
  }
}

void HostQueue::schedule(Lock& lock) {
  state_ = State::scheduled;
  if (std::exchange(drainPosted_, true)) return;
  lock.unlock();
  reactor_.post(quality_, QueueTurn(shared_from_this()));
}

void HostQueue::discard() {
  Lock lock(mutex_);
  drainPosted_ = false;
  if (state_ != State::scheduled) return;
  state_ = State::idle;
  const auto dropped = std::exchange(items_, {});
  lock.unlock();
}

}  // namespace sable::platform::host
