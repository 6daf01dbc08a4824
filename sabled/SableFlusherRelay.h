#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/Relay.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class ClientConnection;
class FlusherTool;
class SableFeedback;

/// The flusher control channel: an anonymous endpoint over which a diagnostic tool watches and steers
/// the feedback pipeline. Each stream has one listener, the tool that last asked for it. Any thread;
/// nothing here waits for a tool.
class SableFlusherRelay {
 public:
  using GetClientConnections = std::function<std::vector<std::shared_ptr<ClientConnection>>()>;

  /// Begins to listen. `getClientConnections` may be null: then a dump ends no session.
  SableFlusherRelay(Assembly& assembly, GetClientConnections getClientConnections);
  ~SableFlusherRelay();

  /// Where tools connect.
  platform::RelayEndpoint endpoint() const;

  /// Forwards a feedback, which does not change from here on, to who watches; costs next to nothing
  /// when nobody does.
  void sendDataToReceivingStreamListener(std::shared_ptr<const SableFeedback> feedback);

  /// Whether anybody watches uploads: whoever uploads need not keep envelopes for nobody.
  bool hasSendingStreamListener() const { return sending_.load(std::memory_order_relaxed); }
  /// Forwards the envelopes of one upload batch, as JSON texts.
  void sendDataToSendingStreamListener(std::vector<std::string> envelopes);

 private:
  using Tool = std::shared_ptr<FlusherTool>;

  bool acceptConnection(const std::shared_ptr<platform::RelayConnection>& connection);
  void initiateConnectionWithIntent(std::uint64_t intent, const Tool& tool, platform::RelayReply reply);
  void listenToSessions(const Tool& tool);
  void listenToFeedback(const Tool& tool);
  void stop(const Tool& tool);
  void dump(const Tool& tool);
  void flushSessions(const std::function<void()>& completion);
  void tellWorkDone(const Tool& tool);
  void forward(const SableFeedback& feedback);
  void _removeDelegate(const Tool& tool);

  Assembly& assembly_;
  const GetClientConnections getClientConnections_;
  const std::shared_ptr<platform::SerialQueue> flusherrelayQueue_;
  const std::unique_ptr<platform::RelayListener> listener_;

  // Written on the queue, read anywhere.
  std::atomic<bool> receiving_ = false, sending_ = false;
  std::atomic<std::size_t> onTheirWay_ = 0;  ///< feedback that waits for the queue
  std::atomic<std::uint64_t> missed_ = 0;    ///< feedback that found no place there

  // On the queue.
  std::vector<Tool> tools_;  ///< keeps them alive while they are connected
  Tool remoteObject_;        ///< who connected, or asked for something, last
  Tool receivingStreamListener_, sendingStreamListener_;
};

}  // namespace sable
