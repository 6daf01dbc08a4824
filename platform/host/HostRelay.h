#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Relay.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/RelayBus.h"

namespace sable::platform::host {

struct HostRelayConfiguration {
  /// Where sockets stand; made when a listener opens the first, mode 0700. Empty: beside the named one.
  std::string runtimeFolder;
  /// The named listener's socket; empty is `relay.sock` in the runtime folder.
  std::string socketPath;
  RelayQuotas quotas;
  /// Which users may connect; by default this process's own and root.
  std::function<bool(uid_t)> admits;
};

/// D-Bus spoken peer to peer over Unix stream sockets.
class HostRelay final : public Relay {
 public:
  HostRelay(HostRuntime& runtime, HostRelayConfiguration configuration);

  /// The name is not on the wire: a process has one named listener, found by its path.
  std::unique_ptr<RelayListener> namedListener(std::string_view name) override;
  std::unique_ptr<RelayListener> anonymousListener() override;
  Expected<std::shared_ptr<RelayConnection>> connect(const RelayEndpoint& endpoint) override;
  Expected<std::string> executablePath(pid_t pid) override;
  void setEventStreamHandler(std::string_view stream, std::shared_ptr<SerialQueue> queue,
                             std::function<void(std::optional<std::string>)> handler) override;

  /// Delivers an event; it waits for a handler where there is none yet. Any thread.
  void raiseEvent(std::string_view stream, std::optional<std::string> name);

 private:
  struct EventStream {
    std::shared_ptr<SerialQueue> queue;
    std::function<void(std::optional<std::string>)> handler;
    std::vector<std::optional<std::string>> waiting;
  };
  static void deliver(const EventStream& stream, std::optional<std::string> name);

  HostRuntime& runtime_;
  const HostRelayConfiguration configuration_;

  std::mutex mutex_;
  std::map<std::string, EventStream, std::less<>> eventStreams_;
};

}  // namespace sable::platform::host
