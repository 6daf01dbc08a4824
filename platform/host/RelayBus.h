#pragma once

#include <cstddef>
#include <deque>
#include <optional>

#include "platform/host/Reactor.h"
#include "platform/host/RelayInlet.h"
#include "platform/host/RelayOutgoing.h"

namespace sable::platform::host {

/// What one peer may cost; past it the peer loses its connection.
struct RelayQuotas {
  std::size_t callsInFlight = 256;
  std::size_t queuedBytes = std::size_t{32} << 20;   ///< that the peer has not read yet
  std::size_t messageBytes = std::size_t{16} << 20;  ///< of one message that it sends
  Duration handshake = std::chrono::seconds(5);      ///< to authenticate in
};

/// One connection's sd-bus object and the messages that wait for it. sd-bus is not thread-safe:
/// everything happens under the turn of the connection that owns this. Never blocks.
///
/// The server side trusts its peer with nothing (RelayInlet), descriptors included; the client side
/// trusts the daemon that it chose.
class RelayBus {
 public:
  enum class Side { client, server };

  RelayBus(Side side, const RelayQuotas& quotas) : side_(side), quotas_(quotas) {}
  RelayBus(const RelayBus&) = delete;
  RelayBus& operator=(const RelayBus&) = delete;
  ~RelayBus();

  // Results: below 0, an errno value and the connection is of no more use.

  /// Begins the handshake on a socket that stays the caller's.
  [[nodiscard]] int start(int socket);
  /// Whether the handshake is over.
  bool isReady() const { return ready_; }

  /// One step of reading and writing. 0: nothing more to do until an awaited event; 1: there may be
  /// more, and `message`, where set, has been received.
  [[nodiscard]] int process(RelayMessage& message);

  /// Sends, or keeps until the peer has read what was sent before. -EDQUOT: past the quota.
  [[nodiscard]] int send(RelayOutgoing outgoing);

  /// What to wait for on the socket.
  Events awaited() const;
  bool wantsToWrite() const;

 private:
  int admit();
  int transmit(const RelayOutgoing& outgoing);
  int drain();
  bool sdBusHoldsMessages() const;

  const Side side_;
  const RelayQuotas quotas_;

  sd_bus* bus_ = nullptr;
  bool ready_ = false;

  // sd-bus is given a message only when it has written the one before: what waits, waits here,
  // where it is counted.
  std::deque<RelayOutgoing> outbox_;
  std::size_t outboxBytes_ = 0;
  std::size_t handedBytes_ = 0;  // of the message that sd-bus has not written whole

  std::optional<RelayInlet> inlet_;  // on the side that strangers connect to
  bool reading_ = false;             // sd-bus has not read all that it was let
  std::size_t expected_ = 0;         // messages that it must find there
};

}  // namespace sable::platform::host
