#include "platform/simulated/SimulatedProcess.h"

namespace sable::platform::simulated {

struct SimulatedProcess::Listener {
  TerminationSignal signal;
  Queue& queue;
  std::function<void()> handler;
  bool resumed = false;
};

class SimulatedProcess::Source final : public SignalSource {
 public:
  explicit Source(std::shared_ptr<Listener> listener) : listener_(std::move(listener)) {}
  void resume() override { listener_->resumed = true; }

 private:
  const std::shared_ptr<Listener> listener_;
};

std::unique_ptr<Process::SignalSource> SimulatedProcess::signalSource(TerminationSignal signal, Queue& queue,
                                                                      std::function<void()> handler) {
  auto listener = std::make_shared<Listener>(Listener{signal, queue, std::move(handler)});
  listeners_.push_back(listener);
  return std::make_unique<Source>(std::move(listener));
}

void SimulatedProcess::raise(TerminationSignal signal) {
  if (!ignored_.contains(signal)) return exit(128 + static_cast<int>(signal));
  for (const auto& weak : listeners_) {
    const auto listener = weak.lock();
    if (listener == nullptr || listener->signal != signal || !listener->resumed) continue;
    listener->queue.async([weak] {
      if (const auto alive = weak.lock()) alive->handler();
    });
  }
}

void SimulatedProcess::runMainLoop() {
  (void)runtime_.runUntil([this] { return stopping_ || exitStatus_; }, Duration::max());
}

void SimulatedProcess::exit(int status) {
  if (!exitStatus_) exitStatus_ = status;
}

}  // namespace sable::platform::simulated
