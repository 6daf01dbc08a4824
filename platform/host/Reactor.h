#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/Runtime.h"

namespace sable::platform::host {

/// What a descriptor waits for and what came; values of EPOLLIN and the like.
using Events = std::uint32_t;

/// One set of descriptors that a few threads wait on. The thread that the kernel wakes does the
/// work itself: no hop to another thread lies between a message's arrival and its handler. Any
/// thread.
class Reactor {
 public:
  virtual ~Reactor() = default;

  /// A descriptor's place in the set. Its handler gets one event per arm(), on a pool thread, and
  /// arms again when it wants the next: while it runs, no other thread serves that descriptor.
  /// Destroying the watch takes the descriptor out; a handler that runs at that moment on another
  /// thread may still finish, so handlers hold their owner weakly. The descriptor stays the
  /// caller's and must outlive the watch.
  class Watch {
   public:
    virtual ~Watch() = default;
    /// Asks for the next event among `events` (0 takes the question back). One-shot.
    virtual void arm(Events events) = 0;
  };

  [[nodiscard]] virtual std::unique_ptr<Watch> watch(int descriptor, std::function<void(Events)> handler) = 0;
};

}  // namespace sable::platform::host
