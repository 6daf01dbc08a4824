#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "SableKit/SBLImageDescription.h"
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

/// Hosts that answers may vouch for in the life of a process.
inline constexpr std::size_t kMaximumImageHosts = 4096;
/// Images that a client may ask for in one call; more are not looked at.
inline constexpr std::size_t kMaximumImagesPerCall = 256;

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
  /// Makes the states of those sessions. Once, before the first client.
  void loadState();

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

  using Images = std::map<std::string, Data>;
  /// Loads images, each under its description's URL or else its identifier; blocks until all have
  /// come or failed, or until `deadline` (nanoseconds of the runtime's monotonic time, 0: not at
  /// all). What is missing then is absent; it goes on to the fetcher's memory. The bag's request
  /// time-out bounds every fetch, and with it a deadline that is far away. `completion` is called
  /// within the call.
  void loadImages(std::vector<SBLImageDescription> descriptions, std::uint64_t deadline,
                  platform::Function<void(Images)> completion);

  /// Adds the hosts of an answer's images to those from which images may be loaded.
  void processImagesFromResponse(const SearchResponse& response, const SBLBag& bag);
  std::set<std::string> validImageHosts() const;

 private:
  bool acceptEndpointConnection(const std::shared_ptr<platform::RelayConnection>& connection);
  void handleEndpointCall(platform::RelayCall call);
  std::vector<Session> sessionsOnQueue() const;
  void addImageHosts(const std::set<std::string>& hosts);

  Assembly& assembly_;
  const std::unique_ptr<platform::Semaphore> connectSemaphore_;
  const bool persistSessions_;
  const std::shared_ptr<platform::SerialQueue> stateCacheQueue_;
  const std::shared_ptr<platform::ConcurrentQueue> imageHostsQueue_;
  const std::shared_ptr<platform::SerialQueue> connectionsQueue_;
  const std::unique_ptr<platform::RelayListener> listener_;

  std::map<std::string, std::shared_ptr<ClientState>> stateCache_;            ///< on stateCacheQueue_
  std::set<std::string> validImageHosts_;                                     ///< on imageHostsQueue_
  bool tooManyImageHosts_ = false;                                            ///< on imageHostsQueue_
  std::set<std::shared_ptr<platform::RelayConnection>> endpointConnections_;  ///< on connectionsQueue_
};

}  // namespace sable
