#pragma once

#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <string>

#include "platform/QueueTurn.h"
#include "platform/host/HostReactor.h"

namespace sable::platform::host {

/// The serial queue of HostRuntime.
///
///     idle --async--> scheduled --a pool thread starts--> running --> idle, or scheduled anew
///     idle or scheduled --sync--> running, on the caller's thread --> the same, or the next sync caller
///
/// A sync caller that finds the queue running waits, and is handed the queue by whoever leaves it.
class HostQueue final : public SerialQueue, public std::enable_shared_from_this<HostQueue> {
 public:
  HostQueue(HostReactor& reactor, std::string label, QualityOfService quality);

  const std::string& label() const override { return label_; }
  void async(Function<void()> work) override;
  [[nodiscard]] Timer after(Duration delay, Function<void()> work) override;
  bool isCurrent() const override;

  /// Runs `work` on the calling thread when the queue is idle; otherwise leaves it untouched and
  /// answers false. For the thread that read a message, which saves the way through the pool.
  [[nodiscard]] bool tryRunInline(Function<void()>& work);

 protected:
  void runSync(Function<void()> work) override;

 private:
  friend QueueTurn<HostQueue>;
  enum class State { idle, scheduled, running };
  struct Waiter {
    std::condition_variable handedOver;
    bool hasQueue = false;
  };
  struct Item {
    Function<void()> work;
    Waiter* waiter;  // of a sync call, which brings its work itself
  };
  using Lock = std::unique_lock<std::mutex>;

  int runSome(Lock& lock);
  void drain();
  void release(Lock& lock);
  void schedule(Lock& lock);
  void discard();

  HostReactor& reactor_;
  const std::string label_;
  const QualityOfService quality_;

  std::mutex mutex_;  // guards what follows
  State state_ = State::idle;
  bool drainPosted_ = false;
  std::deque<Item> items_;
  std::deque<Waiter*> waiters_;  // those in items_ that do not have the queue
};

}  // namespace sable::platform::host
