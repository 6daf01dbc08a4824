#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "SableKit/SBLSessionConfiguration.h"
#include "platform/FileManager.h"
#include "platform/NotificationCenter.h"
#include "platform/Relay.h"
#include "platform/Runtime.h"
#include "platform/Transaction.h"

namespace sable {

class Assembly;
class ClientSession;
class ClientState;
class FeedbackMessage;
class SBLBag;
struct ResultEngagement;

/// How long a connection may be silent before the daemon closes it.
inline constexpr platform::Duration kClientIdleTimeout = std::chrono::seconds(60);

/// What a client calls: SBLDaemonRelay on one connection.
///
///     accepted --configure--> bound to its client's state --+
///        |                                                  |-- 60 s without a call, or the
///        +-- configure that names no identifier or agent ---+   client's end --> invalidated
///
/// Calls arrive on the connection's queue, one at a time. Kept alive by the service's list and by
/// whatever the client still waits for.
class ClientConnection : public std::enable_shared_from_this<ClientConnection> {
 public:
  ClientConnection(Assembly& assembly, std::shared_ptr<platform::RelayConnection> connection);
  ~ClientConnection();

  /// Begins to serve. Once, after construction.
  void start();

  const platform::RelayConnection& connection() const { return *connection_; }
  const std::shared_ptr<ClientState>& state() const { return state_; }

  /// Ends the session that the client's feedback goes into, also where others share it; calls back, later
  /// and on any queue, with the client's user agent, or with nothing where no sessions are kept for it.
  void flushSession(platform::Function<void(const std::optional<std::string>&)> callback);

  /// Ends the client's session, where it has one of its own; tells whether it did, on any queue.
  /// Called when the connection has ended.
  void flushSessionInvalidation(platform::Function<void(bool)> callback);

 private:
  void handleInvocation(platform::RelayCall call);
  void idleTimerFired();
  void armIdleTimer(platform::Duration delay);

  bool _ensureState();
  bool _ensureState(const std::string& userAgent);
  void configure(SBLSessionConfiguration configuration, platform::RelayReply reply);
  void failConfiguration();
  void startServing(std::shared_ptr<const SBLBag> bag, std::optional<Error> error);
  void bag(platform::RelayReply reply);
  void bagChangeNotification(const platform::Notification& notification);
  void pushBag(const SBLBag* bag, const std::optional<Error>& error);
  void pushAnswered(const Expected<platform::RelayArguments>& result);

  void request(platform::RelayCall& call);
  void diagnose(platform::RelayCall call);
  void explain(platform::RelayCall& call);
  void describePrivacy(platform::RelayReply reply);
  void describeResources(platform::RelayReply reply);
  void fillDefaults(SBLRequest& request) const;
  void search(const SBLSearchRequest& request, SBLReplyHandler reply);
  // Feedback. The sender of what is none loses its connection.
  void reportEvent(platform::RelayCall& call);
  void reportPayload(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId);
  void reportLost(std::string reason, const char* logLine);
  void inSessionOfItsOwn(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId,
                         void (*complete)(Assembly&, ClientSession&));
  void handleCustomFeedback(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId);
  void noteEngagement(const ResultEngagement& engagement);
  void feedback(platform::RelayReply reply);
  void listSessions(platform::RelayReply reply);
  void fileHandleAndAttributesForResource(const std::string& identifier, platform::RelayReply reply);
  Expected<std::shared_ptr<const int>> openResource(const std::string& identifier,
                                                    platform::FileAttributes& attributes);

  Assembly& assembly_;
  const std::shared_ptr<platform::RelayConnection> connection_;
  const std::shared_ptr<platform::Transaction> transaction_;

  std::atomic<std::uint64_t> currentQueryId_{0};  ///< of the newest search; only grows
  std::atomic<platform::MonotonicTime> lastCall_;

  // On the connection's queue.
  std::optional<SBLSessionConfiguration> configuration_;
  std::string userAgent_;
  std::shared_ptr<ClientState> state_;
  platform::NotificationCenter::Token bagObservation_;
  bool awaitsPush_ = false;  ///< a pushed bag is unanswered

  platform::Timer timer_;  ///< on the background queue
};

}  // namespace sable
