#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <deque>
#include <list>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>

#include "platform/host/HostTimers.h"
#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// The process's threads: a one-shot epoll set on which a few of them wait, with a timer descriptor
/// and an event descriptor for posted work. Idle, none of them makes a system call.
///
/// A thread that is woken serves one event, then posted work, then waits again. Work that a pool
/// thread posts is run by that thread once its handler returns, without waking another one, unless it
/// piles up; should the handler take longer than two milliseconds, a waiting thread takes the work.
class HostReactor final : public Reactor {
 public:
  /// Starts `threads` threads, or one per processor (two at least) for 0. They take no signals.
  explicit HostReactor(unsigned threads = 0);
  /// Waits for the handlers that run, drops posted work that has not started.
  ~HostReactor() override;

  [[nodiscard]] std::unique_ptr<Watch> watch(int descriptor, std::function<void(Events)> handler) override;

  /// Runs `work` on a pool thread, after posted work of higher quality. Any thread.
  void post(QualityOfService quality, Function<void()> work);

  HostTimers& timers() { return timers_; }

  /// Said by a thread that is about to wait for another, as long as it lives: the pool adds a
  /// thread when too few are left to run. Costs nothing on other than pool threads.
  class Blocking {
   public:
    explicit Blocking(HostReactor& reactor);
    ~Blocking();
    Blocking(const Blocking&) = delete;
    Blocking& operator=(const Blocking&) = delete;

   private:
    HostReactor* reactor_;
  };

 private:
  class Descriptor;
  class WatchHandle;
  using Threads = std::list<std::thread>;
  enum class Next { wait, look, end };

  void add(int descriptor, std::uint64_t id, std::uint32_t events);
  void dispatch(std::uint64_t id, Events events);
  void forget(std::uint64_t id);

  void serve(Threads::iterator self);
  void runPosted();
  Function<void()> takePosted();
  Next prepareToWait(Threads::iterator self);
  void noteWoken(Next waited, std::uint64_t id);

  void startThread();
  void wakeOne(std::unique_lock<std::mutex>& lock);
  void leaveToThisThread(std::unique_lock<std::mutex>& lock);
  bool onPoolThread() const;

  const int epoll_;
  const int wakeDescriptor_;
  const unsigned wantedThreads_;
  std::atomic<bool> stopping_ = false;
  HostTimers timers_;

  std::mutex descriptorsMutex_;
  std::unordered_map<std::uint64_t, std::shared_ptr<Descriptor>> descriptors_;
  std::uint64_t lastId_;

  std::mutex mutex_;  // guards what follows
  std::array<std::deque<Function<void()>>, 3> posted_;
  std::size_t postedCount_ = 0;
  Threads threads_;
  unsigned blockedThreads_ = 0;
  unsigned waitingThreads_ = 0;
  bool wakeOnItsWay_ = false;
  bool backstopSet_ = false;
};

}  // namespace sable::platform::host
