#include "platform/simulated/SimulatedRuntime.h"

#include <chrono>

#include "platform/simulated/SimulatedConcurrentQueue.h"
#include "platform/simulated/SimulatedQueue.h"
#include "platform/simulated/SimulatedWaiting.h"

namespace sable::platform::simulated {

namespace {

/// Work side by side: every piece is ready by itself.
class SimulatedGlobalQueue final : public Queue, public std::enable_shared_from_this<SimulatedGlobalQueue> {
 public:
  explicit SimulatedGlobalQueue(SimulatedScheduler& scheduler) : scheduler_(scheduler) {}

  void async(Function<void()> work) override { scheduler_.post(std::move(work)); }
  [[nodiscard]] Timer after(Duration delay, Function<void()> work) override {
    return scheduler_.addTimer(delay, shared_from_this(), std::move(work));
  }

 private:
  SimulatedScheduler& scheduler_;
};

constexpr WallTime kStart = std::chrono::sys_days(std::chrono::year(2026) / 1 / 1);

}  // namespace

SimulatedRuntime::SimulatedRuntime(std::uint64_t seed) : randomBytes_(~seed), scheduler_(seed) {
  setWallClock(kStart);
  for (auto& queue : globalQueues_) queue = std::make_shared<SimulatedGlobalQueue>(scheduler_);
}

void SimulatedRuntime::advance(Duration duration) {
  scheduler_.runUntil([] { return false; }, later(scheduler_.now(), duration));
}

bool SimulatedRuntime::runUntil(const std::function<bool()>& predicate, Duration limit) {
  return scheduler_.runUntil(predicate, later(scheduler_.now(), limit));
}

void SimulatedRuntime::randomBytes(std::span<std::byte> bytes) {
  for (std::byte& byte : bytes) byte = static_cast<std::byte>(randomBytes_() >> 56);
}

std::shared_ptr<SerialQueue> SimulatedRuntime::serialQueue(std::string label, QualityOfService) {
  return std::make_shared<SimulatedQueue>(scheduler_, std::move(label));
}

std::shared_ptr<ConcurrentQueue> SimulatedRuntime::concurrentQueue(std::string label) {
  return std::make_shared<SimulatedConcurrentQueue>(scheduler_, std::move(label));
}

Queue& SimulatedRuntime::globalQueue(QualityOfService quality) {
  return *globalQueues_[static_cast<std::size_t>(quality)];
}

std::unique_ptr<Semaphore> SimulatedRuntime::semaphore(unsigned initialCount) {
  return std::make_unique<SimulatedSemaphore>(scheduler_, initialCount);
}

std::unique_ptr<WaitGroup> SimulatedRuntime::waitGroup() {
  return std::make_unique<SimulatedWaitGroup>(scheduler_);
}

}  // namespace sable::platform::simulated
