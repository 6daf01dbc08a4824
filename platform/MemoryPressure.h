#pragma once

#include <functional>
#include <memory>

#include "platform/Runtime.h"

namespace sable::platform {

/// Tells when memory runs critically short.
class MemoryPressure {
 public:
  virtual ~MemoryPressure() = default;

  class Source {
   public:
    virtual ~Source() = default;
  };

  /// Calls `handler` on `queue` at critical pressure, as long as the source lives. Costs nothing
  /// while nobody holds a source. A host that cannot tell never calls.
  [[nodiscard]] virtual std::unique_ptr<Source> onCritical(std::shared_ptr<SerialQueue> queue,
                                                           std::function<void()> handler) = 0;
};

}  // namespace sable::platform
