#pragma once

#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <string>

#include "platform/QueueTurn.h"
#include "platform/host/HostReactor.h"

namespace sable::platform::host {

/// The concurrent queue of HostRuntime. Reads and synchronous barriers run on their caller's
/// thread; an asynchronous barrier on a pool thread, or on that of a caller who has to wait for it.
class HostConcurrentQueue final : public ConcurrentQueue,
                                  public std::enable_shared_from_this<HostConcurrentQueue> {
 public:
  HostConcurrentQueue(HostReactor& reactor, std::string label);

  void barrierSync(Function<void()> write) override;
  void barrierAsync(Function<void()> write) override;

 protected:
  /// A read from within this queue's own read or barrier runs at once.
  void runRead(Function<void()> read) override;

 private:
  friend QueueTurn<HostConcurrentQueue>;
  struct Waiter {
    bool writes;
    bool admitted = false;
    std::condition_variable changed;
  };
  struct Item {
    Function<void()> write;
    Waiter* waiter;  // of a synchronous call, which brings its work itself
  };
  using Lock = std::unique_lock<std::mutex>;

  void enter(Lock& lock, bool writes);
  void admit(bool writes);
  void proceed(Lock& lock);
  void admitWaiters();
  bool barrierIsNext() const;
  void runNextBarrier(Lock& lock);
  void drain();
  void discard();

  HostReactor& reactor_;
  const std::string label_;

  std::mutex mutex_;  // guards what follows
  unsigned readers_ = 0;
  bool writing_ = false;
  bool drainPosted_ = false;
  std::deque<Item> items_;
};

}  // namespace sable::platform::host
