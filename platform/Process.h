#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/Runtime.h"

namespace sable::platform {

enum class TerminationSignal { interrupt = 2, terminate = 15 };

/// The process the daemon lives in.
class Process {
 public:
  virtual ~Process() = default;

  class SignalSource {
   public:
    virtual ~SignalSource() = default;
    virtual void resume() = 0;
  };

  /// Calls `handler` on `queue` for each signal, once resumed and as long as the source lives.
  [[nodiscard]] virtual std::unique_ptr<SignalSource> signalSource(TerminationSignal signal, Queue& queue,
                                                                   std::function<void()> handler) = 0;
  /// Takes the signal's default action away, so that only sources see it.
  virtual void ignoreSignal(TerminationSignal signal) = 0;

  /// Runs the main run loop; returns only if the process is asked to end in an orderly way.
  virtual void runMainLoop() = 0;
  /// Ends the process at once: nothing is flushed or destroyed.
  virtual void exit(int status) = 0;
};

/// A facility of the host and whether it is there, for one line at start and `sablectl status`.
struct Availability {
  std::string facility;
  bool available;
  std::string detail;
};

}  // namespace sable::platform
