#pragma once

#include <memory>
#include <mutex>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/Relay.h"

namespace sable::platform::simulated {

/// One end of a connection within the process. What it sends is checked and copied as if it had
/// been encoded and decoded, and arrives on the other end's queue, in order.
class SimulatedRelayConnection final : public RelayConnection,
                                       public std::enable_shared_from_this<SimulatedRelayConnection> {
 public:
  using Ends =
      std::pair<std::shared_ptr<SimulatedRelayConnection>, std::shared_ptr<SimulatedRelayConnection>>;
  /// Two ends; each has the other as its peer.
  static Ends makePair(Runtime& runtime, RelayPeer first, RelayPeer second);

  SimulatedRelayConnection(Runtime& runtime, RelayPeer peer);
  ~SimulatedRelayConnection() override;

  void exportObject(const RelayInterface& interface, CallHandler handler) override;
  void setInvalidationHandler(Function<void()> handler) override;
  void resume() override;
  void invalidate() override;
  void send(const RelayInterface& interface, std::size_t method, RelayArguments arguments) override;
  void call(const RelayInterface& interface, std::size_t method, RelayArguments arguments, Duration timeout,
            ReplyHandler handler) override;
  RelayPeer peer() const override { return peer_; }
  SerialQueue& queue() override { return *queue_; }

 private:
  class Reply;
  using Message = Function<void(SimulatedRelayConnection&)>;

  struct Handlers {
    std::vector<std::pair<const RelayInterface*, CallHandler>> exported;
    Function<void()> invalidation;
  };
  struct PendingCall {
    const RelayMethod* method;
    ReplyHandler handler;
    Timer timeout;
  };

  void post(std::uint64_t cookie, const RelayInterface& interface, const RelayMethod& method,
            const RelayArguments& arguments);
  void receive(Message message);
  void enqueue(Message message);
  void dispatch(const RelayInterface& interface, std::string_view method, RelayArguments arguments,
                RelayReply reply);
  void complete(std::uint64_t cookie, Expected<RelayArguments> result);
  bool hasEnded();

  const RelayPeer peer_;
  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<Handlers> handlers_ = std::make_shared<Handlers>();  // used on queue_ once resumed
  std::weak_ptr<SimulatedRelayConnection> other_;

  std::mutex mutex_;  // guards what follows
  bool resumed_ = false;
  bool ended_ = false;
  std::vector<Message> waiting_;  // for resume()
  std::uint64_t lastCookie_ = 0;
  std::unordered_map<std::uint64_t, PendingCall> pending_;
};

}  // namespace sable::platform::simulated
