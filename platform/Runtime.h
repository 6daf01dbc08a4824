#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <type_traits>
#include <utility>

#include "platform/Function.h"
#include "platform/UUID.h"

/// Time, queues and waiting: everything in the daemon that happens "later" or "elsewhere" goes
/// through here, so that the same code runs on real threads (platform/host) and in virtual time
/// (platform/simulated), where a seed decides every interleaving.
namespace sable::platform {

using Duration = std::chrono::nanoseconds;

/// Tag of monotonic time points. It has no now(): time comes from a Runtime.
struct MonotonicClock {
  using duration = Duration;
  using rep = duration::rep;
  using period = duration::period;
  using time_point = std::chrono::time_point<MonotonicClock>;
  static constexpr bool is_steady = true;
};

/// Nanoseconds of the host's monotonic clock; comparable between processes of one boot.
using MonotonicTime = MonotonicClock::time_point;

/// Time of day; jumps when the user or the network sets the clock.
using WallTime = std::chrono::sys_time<Duration>;

/// Seconds since 1970 as a double, the form in which dates leave the process.
double secondsSince1970(WallTime time);
WallTime wallTimeFromSecondsSince1970(double seconds);
Duration fromSeconds(double seconds);
double toSeconds(Duration duration);

enum class QualityOfService { background, standard, high };

/// A scheduled piece of work. Destroying or cancelling it before it is due takes it back; once it
/// is due it may already be running. On a serial queue, cancelling from that queue is exact: the
/// work does not start afterwards.
class Timer {
 public:
  class Implementation {
   public:
    virtual ~Implementation() = default;
    virtual void cancel() = 0;
  };

  Timer() = default;
  explicit Timer(std::shared_ptr<Implementation> implementation)
      : implementation_(std::move(implementation)) {}
  Timer(Timer&&) noexcept = default;
  Timer& operator=(Timer&& other) noexcept;
  ~Timer() { cancel(); }

  void cancel();
  /// Lets the work run although nobody holds its timer.
  void detach() { implementation_.reset(); }

 private:
  std::shared_ptr<Implementation> implementation_;
};

/// Where work runs. Queues are shared: work that is still queued keeps its queue alive.
class Queue {
 public:
  virtual ~Queue() = default;

  /// Appends work and returns at once. Any thread.
  virtual void async(Function<void()> work) = 0;

  /// Appends work when `delay` has passed (at once when it is not positive). Any thread.
  [[nodiscard]] virtual Timer after(Duration delay, Function<void()> work) = 0;
};

/// Runs one piece of work at a time, first in, first out across async and sync.
class SerialQueue : public Queue {
 public:
  virtual const std::string& label() const = 0;

  /// Runs `work` in its turn and returns its result. The caller's thread drains the queue when
  /// nobody else does, so waiting never depends on a free pool thread. Calling it on the queue
  /// that one already runs on is a programming error: the process stops with a message.
  template <class F>
  std::invoke_result_t<F&> sync(F&& work) {
    using Result = std::invoke_result_t<F&>;
    if constexpr (std::is_void_v<Result>) {
      runSync([&work] { work(); });
    } else {
      std::optional<Result> result;
      runSync([&work, &result] { result.emplace(work()); });
      return std::move(*result);
    }
  }

  /// Whether the calling thread is running this queue's work.
  virtual bool isCurrent() const = 0;

  /// Stops the process when not on this queue: the head of private operations that need it.
  void assertIsCurrent() const;

 protected:
  virtual void runSync(Function<void()> work) = 0;
};

/// Readers side by side, writers ("barriers") alone, in order of arrival.
class ConcurrentQueue {
 public:
  virtual ~ConcurrentQueue() = default;

  /// Runs a read on the caller's thread as soon as no barrier runs or waits before it.
  template <class F>
  std::invoke_result_t<F&> sync(F&& read) {
    using Result = std::invoke_result_t<F&>;
    if constexpr (std::is_void_v<Result>) {
      runRead([&read] { read(); });
    } else {
      std::optional<Result> result;
      runRead([&read, &result] { result.emplace(read()); });
      return std::move(*result);
    }
  }
  /// Runs a write alone; waits for it.
  virtual void barrierSync(Function<void()> write) = 0;
  /// Runs a write alone, later.
  virtual void barrierAsync(Function<void()> write) = 0;

 protected:
  virtual void runRead(Function<void()> read) = 0;
};

/// Counting semaphore (Dijkstra). A thread that waits here tells the runtime, which keeps its
/// number of runnable threads: waiting never starves the work that would signal.
class Semaphore {
 public:
  virtual ~Semaphore() = default;
  virtual void signal() = 0;
  /// Takes one count, waiting until `deadline` for it; false when the deadline passed first.
  [[nodiscard]] virtual bool wait(MonotonicTime deadline) = 0;
};

/// Counts pieces of work in flight.
class WaitGroup {
 public:
  virtual ~WaitGroup() = default;
  virtual void enter() = 0;
  virtual void leave() = 0;
  /// Waits until as many have left as entered; false when `deadline` passed first. A deadline in
  /// the past only looks.
  [[nodiscard]] virtual bool wait(MonotonicTime deadline) = 0;
};

/// The source of time, chance and concurrency. One per process (host) or per device (simulated);
/// outlives everything that uses it. All operations: any thread.
class Runtime {
 public:
  virtual ~Runtime() = default;

  virtual WallTime now() const = 0;
  virtual MonotonicTime ticks() const = 0;

  /// Fills `bytes` from a cryptographic source (simulated: from the seed).
  virtual void randomBytes(std::span<std::byte> bytes) = 0;
  /// A new version 4 UUID (RFC 4122 section 4.4).
  UUID uuid();

  virtual std::shared_ptr<SerialQueue> serialQueue(std::string label,
                                                   QualityOfService quality = QualityOfService::standard) = 0;
  virtual std::shared_ptr<ConcurrentQueue> concurrentQueue(std::string label) = 0;
  /// The process-wide queue of a priority, on which work runs side by side.
  virtual Queue& globalQueue(QualityOfService quality) = 0;

  virtual std::unique_ptr<Semaphore> semaphore(unsigned initialCount) = 0;
  virtual std::unique_ptr<WaitGroup> waitGroup() = 0;
};

}  // namespace sable::platform
