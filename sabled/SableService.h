#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Relay.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class ClientConnection;

/// Accepts every client connection and keeps the list of live ones. Making it also makes the
/// services that belong to clients as a whole. Any thread.
class SableService {
 public:
  explicit SableService(Assembly& assembly);
  ~SableService();

  /// The listener's delegate: on the listener's queue.
  bool acceptConnection(const std::shared_ptr<platform::RelayConnection>& connection);

  /// A copy of the list.
  std::vector<std::shared_ptr<ClientConnection>> getClientConnections() const;

 private:
  std::optional<std::string> clientIDForConnection(const platform::RelayConnection& connection) const;
  void addConnection(std::shared_ptr<ClientConnection> connection, pid_t pid);
  void connectionInvalidated(const std::shared_ptr<ClientConnection>& connection, const std::string& clientID,
                             pid_t pid);
  void removeConnection(const std::shared_ptr<ClientConnection>& connection);

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;

  std::vector<std::shared_ptr<ClientConnection>> connections_;  ///< on queue_
};

}  // namespace sable
