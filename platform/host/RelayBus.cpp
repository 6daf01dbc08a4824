#include "platform/host/RelayBus.h"

#include <fcntl.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>
#include <unistd.h>

#include <cerrno>

#include "platform/RelaySupport.h"

namespace sable::platform::host {

namespace {

int countMessage(sd_bus_message*, void* expected, sd_bus_error*) {
  auto& count = *static_cast<std::size_t*>(expected);
  if (count > 0) --count;
  return 0;
}

}  // namespace

RelayBus::~RelayBus() {
  if (bus_ != nullptr) sd_bus_close_unref(bus_);
}

int RelayBus::start(int socket) {
  // sd-bus closes its descriptors when it likes.
  Descriptor output(::fcntl(socket, F_DUPFD_CLOEXEC, 3));
  if (!output) return -errno;
  int input = output.number();
  if (side_ == Side::server) {
    inlet_.emplace(socket, quotas_.messageBytes);
    input = inlet_->start();
    if (input < 0) return input;
  }
  int error = sd_bus_new(&bus_);
  if (error >= 0) error = sd_bus_set_fd(bus_, input, output.number());
  if (error < 0) {
    if (inlet_) ::close(input);
    return error;
  }
  output.release();
  if (side_ == Side::server) {
    sd_id128_t id;
    error = sd_id128_randomize(&id);
    if (error >= 0) error = sd_bus_set_server(bus_, 1, id);
  }
  if (error >= 0 && inlet_) error = sd_bus_add_filter(bus_, nullptr, countMessage, &expected_);
  if (error >= 0) error = sd_bus_negotiate_fds(bus_, 1);
  if (error >= 0) error = sd_bus_start(bus_);
  return error;
}

int RelayBus::process(RelayMessage& message) {
  if (const int admitted = admit(); admitted <= 0) return admitted;
  sd_bus_message* received = nullptr;
  const int result = sd_bus_process(bus_, &received);
  message.reset(received);
  if (result < 0) return result;
  // The end of the connection arrives as a message of sd-bus's own.
  if (sd_bus_is_open(bus_) <= 0) return -ECONNRESET;
  if (!ready_) ready_ = sd_bus_is_ready(bus_) > 0;
  if (result == 0) {
    reading_ = false;
    if (expected_ > 0 || (inlet_ && inlet_->hasBegun() && !ready_)) return -EBADMSG;
  }
  if (const int error = drain(); error < 0) return error;
  return result;
}

/// Whether sd-bus may go on: 0 when there is nothing for it to do, below 0 an errno value.
int RelayBus::admit() {
  if (!inlet_ || expected_ > 0 || (reading_ && !inlet_->isAttached())) return 1;
  const int admitted = inlet_->admit(expected_);
  if (admitted < 0) return admitted;
  reading_ = admitted > 0;
  if (reading_) return 1;
  if (ready_ && !sdBusHoldsMessages()) return 0;
  const int error = inlet_->detach();
  return error < 0 ? error : 1;
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
