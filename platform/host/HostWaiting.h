#pragma once

#include <condition_variable>
#include <cstddef>
#include <mutex>

#include "platform/host/HostReactor.h"

namespace sable::platform::host {

class HostSemaphore final : public Semaphore {
 public:
  HostSemaphore(HostReactor& reactor, unsigned initialCount) : reactor_(reactor), count_(initialCount) {}

  void signal() override;
  [[nodiscard]] bool wait(MonotonicTime deadline) override;

 private:
  HostReactor& reactor_;
  std::mutex mutex_;
  std::condition_variable signalled_;
  std::size_t count_;
};

class HostWaitGroup final : public WaitGroup {
 public:
  explicit HostWaitGroup(HostReactor& reactor) : reactor_(reactor) {}

  void enter() override;
  /// Leaving more often than entering is a programming error.
  void leave() override;
  [[nodiscard]] bool wait(MonotonicTime deadline) override;

 private:
  HostReactor& reactor_;
  std::mutex mutex_;
  std::condition_variable empty_;
  std::size_t count_ = 0;
};

}  // namespace sable::platform::host
