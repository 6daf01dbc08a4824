#pragma once

#include <filesystem>
#include <memory>

#include "platform/MemoryPressure.h"
#include "platform/Process.h"
#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// Where the host tells of memory pressure.
struct MemoryPressurePaths {
  /// Pressure stall information: a trigger there fires when for a tenth of two seconds nothing could
  /// run for want of memory (two seconds is the shortest window that an unprivileged process gets).
  std::filesystem::path stalls = "/proc/pressure/memory";
  /// Counters of a cgroup (memory.events), where there is no trigger; empty: this process's cgroup.
  std::filesystem::path events;
  /// A file whose every change is critical pressure as well; empty: none.
  std::filesystem::path file;
};

class HostMemoryPressure final : public MemoryPressure {
 public:
  explicit HostMemoryPressure(Reactor& reactor, MemoryPressurePaths paths = {});
  ~HostMemoryPressure() override;

  [[nodiscard]] std::unique_ptr<Source> onCritical(std::shared_ptr<SerialQueue> queue,
                                                   std::function<void()> handler) override;

  Availability availability() const;

 private:
  class Listeners;
  class Sensors;
  class ListeningSource;
  const std::shared_ptr<Listeners> listeners_;
};

}  // namespace sable::platform::host
