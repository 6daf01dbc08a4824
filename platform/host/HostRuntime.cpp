#include "platform/host/HostRuntime.h"

#include <sys/random.h>

#include <cerrno>
#include <chrono>

#include "platform/ProgrammingError.h"
#include "platform/host/HostConcurrentQueue.h"
#include "platform/host/HostGlobalQueue.h"
#include "platform/host/HostQueue.h"
#include "platform/host/HostWaiting.h"

namespace sable::platform::host {

HostRuntime::HostRuntime(unsigned threads) : reactor_(threads) {
  for (std::size_t i = 0; i < globalQueues_.size(); ++i) {
    globalQueues_[i] = std::make_shared<HostGlobalQueue>(reactor_, static_cast<QualityOfService>(i));
  }
}

WallTime HostRuntime::now() const {
  return std::chrono::system_clock::now();
}

MonotonicTime HostRuntime::ticks() const {
  return monotonicNow();
}

void HostRuntime::randomBytes(std::span<std::byte> bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::getrandom(bytes.data(), bytes.size(), 0);
    if (count >= 0) {
      bytes = bytes.subspan(static_cast<std::size_t>(count));
    } else if (errno != EINTR) {
      programmingError("the kernel gives no random bytes");
    }
  }
}

std::shared_ptr<SerialQueue> HostRuntime::serialQueue(std::string label, QualityOfService quality) {
  return std::make_shared<HostQueue>(reactor_, std::move(label), quality);
}

std::shared_ptr<ConcurrentQueue> HostRuntime::concurrentQueue(std::string label) {
  return std::make_shared<HostConcurrentQueue>(reactor_, std::move(label));
}

Queue& HostRuntime::globalQueue(QualityOfService quality) {
  return *globalQueues_[static_cast<std::size_t>(quality)];
}

std::unique_ptr<Semaphore> HostRuntime::semaphore(unsigned initialCount) {
  return std::make_unique<HostSemaphore>(reactor_, initialCount);
}

std::unique_ptr<WaitGroup> HostRuntime::waitGroup() {
  return std::make_unique<HostWaitGroup>(reactor_);
}

}  // namespace sable::platform::host
