#pragma once

#include <condition_variable>
#include <memory>
#include <mutex>

#include "platform/Process.h"
#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// The process, with its signals through signalfd(2) on the reactor.
///
/// A signal reaches its sources only when no thread takes it first, so ignoreSignal() blocks it in
/// the calling thread: call it on the main thread before that starts any thread of its own (a
/// reactor's threads take no signals anyway). An ignored signal that arrives before its source is
/// resumed waits for it.
class HostProcess final : public Process {
 public:
  explicit HostProcess(Reactor& reactor);
  ~HostProcess() override;

  [[nodiscard]] std::unique_ptr<SignalSource> signalSource(TerminationSignal signal, Queue& queue,
                                                           std::function<void()> handler) override;
  void ignoreSignal(TerminationSignal signal) override;
  void runMainLoop() override;
  [[noreturn]] void exit(int status) override;

  /// Makes runMainLoop() return. Any thread.
  void stop();

 private:
  class Signal;
  class Source;
  std::shared_ptr<Signal> signalFor(TerminationSignal signal);

  Reactor& reactor_;

  std::mutex mutex_;  // guards what follows
  std::shared_ptr<Signal> interrupt_;
  std::shared_ptr<Signal> terminate_;
  std::condition_variable stopped_;
  bool stopping_ = false;
};

}  // namespace sable::platform::host
