#include "platform/host/RelayBus.h"

#include <sys/ioctl.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>
#include <unistd.h>

#include <cerrno>

#include "platform/RelaySupport.h"

namespace sable::platform::host {

RelayBus::~RelayBus() {
  if (bus_ != nullptr) sd_bus_close_unref(bus_);
}

int RelayBus::start(int socket) {
  int error = sd_bus_new(&bus_);
  if (error >= 0) error = sd_bus_set_fd(bus_, socket, socket);
  if (error < 0) {
    ::close(socket);
    return error;
  }
  if (side_ == Side::server) {
    sd_id128_t id;
    error = sd_id128_randomize(&id);
    if (error >= 0) error = sd_bus_set_server(bus_, 1, id);
  }
  if (error >= 0) error = sd_bus_negotiate_fds(bus_, 1);
  if (error >= 0) error = sd_bus_start(bus_);
  return error;
}

int RelayBus::process(RelayMessage& message) {
  if (midMessage_ && messageGrowsTooLarge()) return -EMSGSIZE;
  sd_bus_message* received = nullptr;
  const int result = sd_bus_process(bus_, &received);
  message.reset(received);
  if (result < 0) return result;
  // The end of the connection arrives as a message of sd-bus's own.
  if (sd_bus_is_open(bus_) <= 0) return -ECONNRESET;
  if (!ready_) ready_ = sd_bus_is_ready(bus_) > 0;
  if (result == 0) {
    midMessage_ = !sawMessage_;
    sawMessage_ = false;
  } else {
    sawMessage_ = true;
    midMessage_ = false;
    midMessageBytes_ = 0;
  }
  if (const int error = drain(); error < 0) return error;
  return result;
}

/// sd-bus would let a message grow to 128 MiB before anybody sees it. What came in its first wake-up
/// is not counted; the whole is, once it is read.
bool RelayBus::messageGrowsTooLarge() {
  int readable = 0;
  if (::ioctl(sd_bus_get_fd(bus_), FIONREAD, &readable) == 0) {
    midMessageBytes_ += static_cast<std::size_t>(readable);
  }
  return midMessageBytes_ > quotas_.messageBytes;
}

int RelayBus::send(RelayOutgoing outgoing) {
  if (ready_ && outbox_.empty() && !sdBusHoldsMessages()) return transmit(outgoing);
  const std::size_t size = relayWireSize(outgoing.arguments);
  if (handedBytes_ + outboxBytes_ + size > quotas_.queuedBytes) return -EDQUOT;
  outboxBytes_ += size;
  outbox_.push_back(std::move(outgoing));
  return 0;
}

int RelayBus::drain() {
  if (outbox_.empty() || !ready_) return 0;
  int error = 0;
  while (error >= 0 && !outbox_.empty() && !sdBusHoldsMessages()) {
    const RelayOutgoing next = std::move(outbox_.front());
    outbox_.pop_front();
    outboxBytes_ -= relayWireSize(next.arguments);
    error = transmit(next);
  }
  return error;
}

int RelayBus::transmit(const RelayOutgoing& outgoing) {
  RelayMessage message;
  int error = makeMessage(bus_, outgoing, message);
  if (error < 0 && outgoing.kind == RelayOutgoing::Kind::reply) {
    RelayOutgoing refusal;
    refusal.kind = RelayOutgoing::Kind::error;
    refusal.cookie = outgoing.cookie;
    refusal.errorName = "org.freedesktop.DBus.Error.NotSupported";
    refusal.errorText = "The reply cannot be sent over this connection";
    error = makeMessage(bus_, refusal, message);
  }
  if (error < 0) return error;
  error = sd_bus_send(bus_, message.get(), nullptr);
  handedBytes_ = sdBusHoldsMessages() ? relayWireSize(outgoing.arguments) : 0;
  return error;
}

bool RelayBus::sdBusHoldsMessages() const {
  std::uint64_t held = 0;
  return sd_bus_get_n_queued_write(bus_, &held) >= 0 && held > 0;
}

bool RelayBus::wantsToWrite() const {
  return ready_ && (sdBusHoldsMessages() || !outbox_.empty());
}

Events RelayBus::awaited() const {
  const int events = sd_bus_get_events(bus_);
  return events < 0 ? 0 : static_cast<Events>(events);
}

}  // namespace sable::platform::host
