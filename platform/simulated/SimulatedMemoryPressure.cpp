#include "platform/simulated/SimulatedMemoryPressure.h"

#include <algorithm>
#include <utility>

namespace sable::platform::simulated {

struct SimulatedMemoryPressure::Listener {
  std::shared_ptr<SerialQueue> queue;
  std::function<void()> handler;
};

class SimulatedMemoryPressure::ListeningSource final : public Source {
 public:
  explicit ListeningSource(std::shared_ptr<Listener> listener) : listener_(std::move(listener)) {}

 private:
  const std::shared_ptr<Listener> listener_;
};

std::unique_ptr<MemoryPressure::Source> SimulatedMemoryPressure::onCritical(
    std::shared_ptr<SerialQueue> queue, std::function<void()> handler) {
  auto listener = std::make_shared<Listener>(Listener{std::move(queue), std::move(handler)});
  listeners_.push_back(listener);
  return std::make_unique<ListeningSource>(std::move(listener));
}

std::size_t SimulatedMemoryPressure::sources() const {
  return static_cast<std::size_t>(
      std::ranges::count_if(listeners_, [](const auto& weak) { return !weak.expired(); }));
}

void SimulatedMemoryPressure::fireCritical() {
  for (const auto& weak : listeners_) {
    const auto listener = weak.lock();
    if (listener == nullptr) continue;
    listener->queue->async([weak] {
      if (const auto alive = weak.lock()) alive->handler();
    });
  }
}

}  // namespace sable::platform::simulated
