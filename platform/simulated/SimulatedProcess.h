#pragma once

#include <memory>
#include <optional>
#include <set>
#include <vector>

#include "platform/Process.h"
#include "platform/simulated/SimulatedRuntime.h"

namespace sable::platform::simulated {

/// A process that tests send signals to. exit() is recorded and ends the main loop; whoever called
/// it goes on, for there is no process to end.
class SimulatedProcess final : public Process {
 public:
  explicit SimulatedProcess(SimulatedRuntime& runtime) : runtime_(runtime) {}

  [[nodiscard]] std::unique_ptr<SignalSource> signalSource(TerminationSignal signal, Queue& queue,
                                                           std::function<void()> handler) override;
  void ignoreSignal(TerminationSignal signal) override { ignored_.insert(signal); }
  /// Runs the runtime until stop() or exit(), or until nothing is left to happen.
  void runMainLoop() override;
  void exit(int status) override;

  /// Sends a signal: its resumed sources hear of it; without ignoreSignal() it ends the process
  /// (exit status 128 + signal, as a shell has it).
  void raise(TerminationSignal signal);
  void stop() { stopping_ = true; }
  /// What exit() was called with first.
  std::optional<int> exitStatus() const { return exitStatus_; }

 private:
  struct Listener;
  class Source;

  SimulatedRuntime& runtime_;
  std::set<TerminationSignal> ignored_;
  std::vector<std::weak_ptr<Listener>> listeners_;
  bool stopping_ = false;
  std::optional<int> exitStatus_;
};

}  // namespace sable::platform::simulated
