#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <vector>

#include "platform/MemoryPressure.h"

namespace sable::platform::simulated {

/// Memory pressure that tests raise.
class SimulatedMemoryPressure final : public MemoryPressure {
 public:
  [[nodiscard]] std::unique_ptr<Source> onCritical(std::shared_ptr<SerialQueue> queue,
                                                   std::function<void()> handler) override;

  void fireCritical();
  /// Sources that somebody holds.
  std::size_t sources() const;

 private:
  struct Listener;
  class ListeningSource;

  std::vector<std::weak_ptr<Listener>> listeners_;
};

}  // namespace sable::platform::simulated
