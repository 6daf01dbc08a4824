#pragma once

#include <array>
#include <memory>
#include <string>

#include "platform/host/HostReactor.h"

namespace sable::platform::host {

/// The runtime of real time and real threads. Its destructor waits for the work that runs and
/// drops what has not started.
class HostRuntime final : public Runtime {
 public:
  /// Runs on `threads` threads, or one per processor (two at least) for 0.
  explicit HostRuntime(unsigned threads = 0);

  /// Where the facilities of the host watch their descriptors.
  HostReactor& reactor() { return reactor_; }

  WallTime now() const override;
  MonotonicTime ticks() const override;
  void randomBytes(std::span<std::byte> bytes) override;

  /// A HostQueue.
  std::shared_ptr<SerialQueue> serialQueue(std::string label,
                                           QualityOfService quality = QualityOfService::standard) override;
  std::shared_ptr<ConcurrentQueue> concurrentQueue(std::string label) override;
  Queue& globalQueue(QualityOfService quality) override;

  std::unique_ptr<Semaphore> semaphore(unsigned initialCount) override;
  std::unique_ptr<WaitGroup> waitGroup() override;

 private:
  HostReactor reactor_;
  std::array<std::shared_ptr<Queue>, 3> globalQueues_;
};

}  // namespace sable::platform::host
