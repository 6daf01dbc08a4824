#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Relay.h"

namespace sable::platform::simulated {

/// Relay within the process. Works on any Runtime; on a simulated one the seed decides how calls
/// of different connections interleave. Peers are who the test says they are.
class SimulatedRelay final : public Relay {
 public:
  /// The process that connect() speaks for, and the one behind every listener.
  static constexpr RelayPeer kSelf{.pid = 1, .uid = 1000};

  explicit SimulatedRelay(Runtime& runtime);
  ~SimulatedRelay() override;

  std::unique_ptr<RelayListener> namedListener(std::string_view name) override;
  std::unique_ptr<RelayListener> anonymousListener() override;
  Expected<std::shared_ptr<RelayConnection>> connect(const RelayEndpoint& endpoint) override;
  Expected<std::string> executablePath(pid_t pid) override;
  void setEventStreamHandler(std::string_view stream, std::shared_ptr<SerialQueue> queue,
                             std::function<void(std::optional<std::string>)> handler) override;

  /// Connects as some other process. As on a host, users other than kSelf's and root are refused:
  /// their connection ends before it has begun.
  Expected<std::shared_ptr<RelayConnection>> connectAs(const RelayEndpoint& endpoint, RelayPeer peer);
  void setExecutablePath(pid_t pid, std::string path);
  /// Delivers an event; it waits for a handler where there is none yet.
  void raiseEvent(std::string_view stream, std::optional<std::string> name);

 private:
  class Listener;
  struct State;
  std::unique_ptr<RelayListener> listener(RelayEndpoint endpoint);

  Runtime& runtime_;
  const std::shared_ptr<State> state_;
};

}  // namespace sable::platform::simulated
