#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "SableKit/SBLSessionConfiguration.h"
#include "platform/Relay.h"
#include "platform/Runtime.h"

namespace sable {

/// What an application links to search: one connection to the daemon, opened and configured at the
/// first call and again at the first call after it was lost (the daemon closes idle connections
/// after 60 s). A call that was under way when the connection broke fails; it is not sent again,
/// for a search of a moment ago may no longer be wanted.
///
/// All operations: any thread; they never wait for an answer. Handlers run exactly once each, on a
/// queue and never within the call, and may call the client.
class SBLClient : public std::enable_shared_from_this<SBLClient> {
 public:
  /// The raw bag, as JSON text, and the user agent it was read for; called whenever the daemon
  /// pushes one.
  using BagHandler = std::function<void(const std::string& rawBag, const std::string& userAgent,
                                        const std::optional<Error>& error)>;
  using ResultHandler = platform::Function<void(Expected<platform::RelayArguments>)>;

  static std::shared_ptr<SBLClient> create(platform::Runtime& runtime, platform::Relay& relay,
                                           platform::RelayEndpoint daemon,
                                           SBLSessionConfiguration configuration);

  void setBagHandler(BagHandler handler);
  /// How long a call may wait for its answer; 20 s unless set. Before the first call.
  void setTimeout(platform::Duration timeout) { timeout_ = timeout; }

  /// Opens and configures the connection, if there is none; the result is the endpoint's address.
  void connect(platform::Function<void(Expected<platform::RelayEndpoint>)> handler);
  void request(const SBLAnyRequest& request, SBLReplyHandler handler);
  /// A request as it travels. The daemon never answers a class it does not know.
  void request(std::string className, platform::RelayRecord record, SBLReplyHandler handler);
  void bag(platform::Function<void(std::string rawBag, std::string userAgent, std::optional<Error>)> handler);

  /// By the URL of their description, or by its id where there is none at the URL.
  using Images = std::map<std::string, Data>;
  /// Loads images whose hosts the service's answers have vouched for; what has not arrived at
  /// `deadline` (of the runtime's monotonic time; the past: no waiting at all) is left out. On a
  /// connection of its own, which ends with it: the daemon serves ten of them at one time.
  void loadImages(const std::vector<SBLImageDescription>& descriptions, platform::MonotonicTime deadline,
                  platform::Function<void(Expected<Images>)> handler);

  /// Any method that the daemon exports on a client's connection, with its arguments and results as
  /// they travel.
  void call(const platform::RelayInterface& interface, std::size_t method, platform::RelayArguments arguments,
            ResultHandler handler);

  /// Ends the connection.
  void disconnect();

 private:
  struct Key {};

 public:
  SBLClient(Key, platform::Runtime& runtime, platform::Relay& relay, platform::RelayEndpoint daemon,
            SBLSessionConfiguration configuration);

 private:
  Expected<std::shared_ptr<platform::RelayConnection>> ensureConnection();
  void handleCall(platform::RelayCall call);
  void configured(const std::weak_ptr<platform::RelayConnection>& connection,
                  Expected<platform::RelayArguments> result);
  void connectionLost(const std::weak_ptr<platform::RelayConnection>& connection);
  void dropConnection(const Error& reason);
  void finishConnecting(const Expected<platform::RelayEndpoint>& result);

  platform::Runtime& runtime_;
  platform::Relay& relay_;
  const platform::RelayEndpoint daemon_;
  const SBLSessionConfiguration configuration_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::shared_ptr<platform::SerialQueue> callbackQueue_;  ///< of what no connection calls
  platform::Duration timeout_ = std::chrono::seconds(20);

  // On queue_.
  std::shared_ptr<platform::RelayConnection> connection_;
  std::optional<platform::RelayEndpoint> endpoint_;  ///< once configured
  std::vector<platform::Function<void(Expected<platform::RelayEndpoint>)>> awaitingEndpoint_;
  BagHandler bagHandler_;
};

}  // namespace sable
