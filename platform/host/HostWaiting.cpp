#include "platform/host/HostWaiting.h"

#include <chrono>

#include "platform/ProgrammingError.h"

namespace sable::platform::host {

namespace {

/// Waits until `done`, which `mutex` guards, and tells the pool only if it has to wait at all.
template <class Done>
bool waitUntil(HostReactor& reactor, std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
               MonotonicTime deadline, Done done) {
  if (done()) return true;
  if (deadline <= monotonicNow()) return false;
  lock.unlock();
  const HostReactor::Blocking blocking(reactor);
  lock.lock();
  return changed.wait_until(lock, std::chrono::steady_clock::time_point(deadline.time_since_epoch()), done);
}

}  // namespace

void HostSemaphore::signal() {
  const std::lock_guard lock(mutex_);
  ++count_;
  signalled_.notify_one();  // under the lock: who waits may destroy the semaphore when it has its count
}

bool HostSemaphore::wait(MonotonicTime deadline) {
  std::unique_lock lock(mutex_);
  if (!waitUntil(reactor_, lock, signalled_, deadline, [this] { return count_ > 0; })) return false;
  --count_;
  return true;
}

void HostWaitGroup::enter() {
  const std::lock_guard lock(mutex_);
  ++count_;
}

void HostWaitGroup::leave() {
  const std::lock_guard lock(mutex_);
  if (count_ == 0) programmingError("a wait group was left more often than entered");
  if (--count_ == 0) empty_.notify_all();
}

bool HostWaitGroup::wait(MonotonicTime deadline) {
  std::unique_lock lock(mutex_);
  return waitUntil(reactor_, lock, empty_, deadline, [this] { return count_ == 0; });
}

}  // namespace sable::platform::host
