#include "platform/simulated/SimulatedRelay.h"

#include <fmt/format.h>

#include <cerrno>
#include <mutex>

#include "platform/simulated/SimulatedRelayConnection.h"

namespace sable::platform::simulated {

/// Where somebody listens; kept by the listener, so that connections under way outlive it.
struct SimulatedRelay::State {
  struct Accepting {
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<RelayListener::AcceptHandler> handler;
  };
  struct EventStream {
    std::shared_ptr<SerialQueue> queue;
    std::function<void(std::optional<std::string>)> handler;
    std::vector<std::optional<std::string>> waiting;
  };

  std::mutex mutex;
  std::map<RelayEndpoint, Accepting> listeners;
  std::map<std::string, EventStream, std::less<>> eventStreams;
  std::map<pid_t, std::string> executables;
};

class SimulatedRelay::Listener final : public RelayListener {
 public:
  Listener(std::shared_ptr<State> state, std::shared_ptr<SerialQueue> queue, RelayEndpoint endpoint)
      : state_(std::move(state)), queue_(std::move(queue)), endpoint_(std::move(endpoint)) {}
  ~Listener() override {
    {
      const std::lock_guard lock(state_->mutex);
      if (listening_) state_->listeners.erase(endpoint_);
    }
    if (!handler_ || queue_->isCurrent()) return;
    queue_->sync([this] { *handler_ = nullptr; });
  }

  void setAcceptHandler(AcceptHandler handler) override {
    handler_ = std::make_shared<AcceptHandler>(std::move(handler));
  }
  Expected<void> resume() override {
    const std::lock_guard lock(state_->mutex);
    listening_ = state_->listeners.try_emplace(endpoint_, State::Accepting{queue_, handler_}).second;
    if (listening_) return {};
    return tl::unexpected(
        Error{std::string(kPOSIXErrorDomain), EADDRINUSE, fmt::format("another daemon holds {}", endpoint_)});
  }
  RelayEndpoint endpoint() const override { return endpoint_; }

 private:
  const std::shared_ptr<State> state_;
  const std::shared_ptr<SerialQueue> queue_;
  const RelayEndpoint endpoint_;
  std::shared_ptr<AcceptHandler> handler_;
  bool listening_ = false;
};

SimulatedRelay::SimulatedRelay(Runtime& runtime) : runtime_(runtime), state_(std::make_shared<State>()) {}
SimulatedRelay::~SimulatedRelay() = default;

std::unique_ptr<RelayListener> SimulatedRelay::listener(RelayEndpoint endpoint) {
  return std::make_unique<Listener>(state_, runtime_.serialQueue("relay.accept"), std::move(endpoint));
}

std::unique_ptr<RelayListener> SimulatedRelay::namedListener(std::string_view name) {
  return listener(fmt::format("unix:path=/simulated/{}", name));
}

std::unique_ptr<RelayListener> SimulatedRelay::anonymousListener() {
  return listener(fmt::format("unix:path=/simulated/{}", runtime_.uuid().string()));
}

Expected<std::shared_ptr<RelayConnection>> SimulatedRelay::connect(const RelayEndpoint& endpoint) {
  return connectAs(endpoint, kSelf);
}

Expected<std::shared_ptr<RelayConnection>> SimulatedRelay::connectAs(const RelayEndpoint& endpoint,
                                                                     RelayPeer peer) {
  const std::lock_guard lock(state_->mutex);
  const auto found = state_->listeners.find(endpoint);
  if (found == state_->listeners.end())
    return tl::unexpected(posixError(ECONNREFUSED, "connect " + endpoint));
  auto [client, server] = SimulatedRelayConnection::makePair(runtime_, peer, kSelf);
  if (peer.uid == kSelf.uid || peer.uid == 0) {
    found->second.queue->async([handler = found->second.handler, accepted = std::move(server)]() mutable {
      if (handler && *handler) (*handler)(std::move(accepted));
    });
  }
  return client;
}

Expected<std::string> SimulatedRelay::executablePath(pid_t pid) {
  const std::lock_guard lock(state_->mutex);
  const auto found = state_->executables.find(pid);
  if (found == state_->executables.end())
    return tl::unexpected(posixError(ENOENT, fmt::format("process {}", pid)));
  return found->second;
}

void SimulatedRelay::setExecutablePath(pid_t pid, std::string path) {
  const std::lock_guard lock(state_->mutex);
  state_->executables[pid] = std::move(path);
}

void SimulatedRelay::setEventStreamHandler(std::string_view stream, std::shared_ptr<SerialQueue> queue,
                                           std::function<void(std::optional<std::string>)> handler) {
  std::vector<std::optional<std::string>> waiting;
  {
    const std::lock_guard lock(state_->mutex);
    State::EventStream& entry = state_->eventStreams[std::string(stream)];
    entry.queue = std::move(queue);
    entry.handler = std::move(handler);
    waiting = std::exchange(entry.waiting, {});
  }
  for (auto& name : waiting) raiseEvent(stream, std::move(name));
}

void SimulatedRelay::raiseEvent(std::string_view stream, std::optional<std::string> name) {
  const std::lock_guard lock(state_->mutex);
  State::EventStream& entry = state_->eventStreams[std::string(stream)];
  if (!entry.handler) {
    entry.waiting.push_back(std::move(name));
    return;
  }
  entry.queue->async(
      [handler = entry.handler, name = std::move(name)]() mutable { handler(std::move(name)); });
}

}  // namespace sable::platform::simulated
