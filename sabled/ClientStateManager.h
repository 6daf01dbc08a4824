#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "SableKit/SBLSessionConfiguration.h"
#include "platform/Relay.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class ClientState;
class SBLBag;
struct SearchResponse;

/// Of an identifier or a user agent; both are kept for good.
inline constexpr std::size_t kMaximumNameBytes = 4096;

/// Keeps one ClientState per client session identifier, for the life of the process; serves the
/// anonymous endpoint on which clients ask follow-up requests; and remembers the hosts that answers
/// of the service have vouched for as sources of images. Any thread.
class ClientStateManager {
 public:
  explicit ClientStateManager(Assembly& assembly);
  ~ClientStateManager();

  /// The state of an identifier, made when it is new; null for one that is empty or longer than
  /// kMaximumNameBytes.
  std::shared_ptr<ClientState> stateForClientIdentifier(const std::string& identifier);

  /// Writes the known sessions to the settings, where the user asked for that.
  void saveState();

  struct Session {
    std::string identifier;
    std::string agent;
  };
  /// The states that have a user agent.
  std::vector<Session> sessions() const;

  /// Where clients reach SBLEndpointRelay.
  platform::RelayEndpoint endpoint() const;

  /// Follow-up requests: more results and cards. Any other request is dropped: its caller's call
  /// never completes.
  void request(const SBLAnyRequest& request, const SBLSessionConfiguration& configuration,
               platform::RelayReply reply);

  /// Adds the hosts of an answer's images to those from which images may be loaded.
  void processImagesFromResponse(const SearchResponse& response, const SBLBag& bag);
  std::set<std::string> validImageHosts() const;

 private:
  void loadState();
  bool acceptEndpointConnection(const std::shared_ptr<platform::RelayConnection>& connection);
  void handleEndpointCall(platform::RelayCall call);
  std::vector<Session> sessionsOnQueue() const;

  Assembly& assembly_;
  const std::unique_ptr<platform::Semaphore> connectSemaphore_;
  const bool persistSessions_;
  const std::shared_ptr<platform::SerialQueue> stateCacheQueue_;
  const std::shared_ptr<platform::ConcurrentQueue> imageHostsQueue_;
  const std::shared_ptr<platform::SerialQueue> connectionsQueue_;
  const std::unique_ptr<platform::RelayListener> listener_;

  std::map<std::string, std::shared_ptr<ClientState>> stateCache_;            ///< on stateCacheQueue_
  std::set<std::string> validImageHosts_;                                     ///< on imageHostsQueue_
  std::set<std::shared_ptr<platform::RelayConnection>> endpointConnections_;  ///< on connectionsQueue_
};

}  // namespace sable
