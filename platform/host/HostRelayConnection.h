#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <unordered_map>

#include "platform/Relay.h"
#include "platform/host/Descriptor.h"
#include "platform/host/HostQueue.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/RelayBus.h"
#include "platform/host/RelayObjects.h"

namespace sable::platform::host {

/// A connection over a Unix stream socket.
///
/// The socket waits in the reactor, one event at a time. The thread that wakes is the reader until
/// it asks for the next event: it reads a message, runs its handler on the spot when the queue is
/// idle, and reads on. When the queue is busy the handler is queued, and reading goes on once it
/// has run: at most one call waits in the process, the others in the socket.
///
/// The bus is touched under the turn, which nobody holds while a handler runs: a reply from any
/// thread is written by that thread.
class HostRelayConnection final : public RelayConnection,
                                  public std::enable_shared_from_this<HostRelayConnection> {
 public:
  HostRelayConnection(HostRuntime& runtime, Descriptor socket, RelayPeer peer, RelayBus::Side side,
                      const RelayQuotas& quotas);
  ~HostRelayConnection() override;

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
  HostRelayConnection(HostRuntime& runtime, Descriptor socket, RelayPeer peer, RelayBus::Side side,
                      const RelayQuotas& quotas, std::uint64_t number);

  class Reply;
  using Turn = std::unique_lock<std::mutex>;

  /// What runs on the queue; it outlives the connection when work is still queued.
  struct Handlers {
    std::vector<CallHandler> calls;
    Function<void()> invalidation;
    std::atomic<bool> ended = false;
  };
  struct PendingCall {
    const RelayMethod* method;
    ReplyHandler handler;
    Timer timeout;
  };
  using PendingCalls = std::unordered_map<std::uint64_t, PendingCall>;

  void wake();
  void read();
  Function<void()> nextDelivery(int& budget);
  Function<void()> take(sd_bus_message* message);
  Function<void()> takeCall(sd_bus_message* call);
  Function<void()> takeReply(sd_bus_message* reply);
  Function<void()> deliverCall(sd_bus_message* call, const RelayObjects::Target& target, bool wantsReply);
  void stopReading();

  void answer(RelayOutgoing outgoing);
  void transmit(RelayOutgoing outgoing);
  std::uint32_t nextCookie();
  void arm();
  void expire(std::uint64_t cookie);
  void checkHandshake();
  void end(std::string_view reason);

  HostRuntime& runtime_;
  const RelayPeer peer_;
  const RelayQuotas quotas_;
  const std::shared_ptr<HostQueue> queue_;
  const std::shared_ptr<Handlers> handlers_ = std::make_shared<Handlers>();
  RelayObjects objects_;  // constant once resumed

  std::mutex turn_;  // guards what follows
  Descriptor socket_;
  std::unique_ptr<RelayBus> bus_;  // null once the connection has ended
  std::unique_ptr<Reactor::Watch> watch_;
  Timer handshake_;
  bool reading_ = false;
  std::size_t callsInFlight_ = 0;
  std::uint32_t lastCookie_ = 0;
  PendingCalls pending_;
};

}  // namespace sable::platform::host
