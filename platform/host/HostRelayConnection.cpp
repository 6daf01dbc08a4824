#include "platform/host/HostRelayConnection.h"

#include <fmt/format.h>
#include <sys/epoll.h>
#include <systemd/sd-bus.h>

#include <cerrno>

#include "platform/Log.h"
#include "platform/RelaySupport.h"

namespace sable::platform::host {

namespace {

/// Messages that a thread reads before others that are ready get their chance.
constexpr int kMessagesPerWake = 64;

std::string_view orEmpty(const char* text) {
  return text == nullptr ? std::string_view() : text;
}

bool isHangup(int error) {
  return error == -ECONNRESET || error == -EPIPE || error == -ENOTCONN;
}

/// What a failure of the bus is to the log; a peer that just leaves is not worth a line.
std::string reasonFor(int error) {
  if (isHangup(error)) return {};
  if (error == -EDQUOT) return "it does not read what it asked for";
  if (error == -EMSGSIZE || error == -ENOBUFS) return "its message is too large";
  if (error == -EBADMSG) return "it sent what is no D-Bus message";
  if (error == -EOPNOTSUPP) return "it sent descriptors, which no call here takes";
  return std::generic_category().message(-error);
}

std::uint64_t nextConnectionNumber() {
  static std::atomic<std::uint64_t> last = 0;
  return ++last;
}

}  // namespace

class HostRelayConnection::Reply final : public RelayReply::Implementation {
 public:
  Reply(std::weak_ptr<HostRelayConnection> connection, std::uint64_t cookie, const RelayMethod& method)
      : connection_(std::move(connection)), cookie_(cookie), method_(method) {}

  void send(RelayArguments arguments) override {
    requireRelaySignature(arguments, method_.out, method_.name);
    RelayOutgoing outgoing;
    outgoing.arguments = std::move(arguments);
    finish(std::move(outgoing));
  }
  void fail(std::string_view name, std::string_view message) override {
    RelayOutgoing outgoing;
    outgoing.kind = RelayOutgoing::Kind::error;
    outgoing.errorName = name;
    outgoing.errorText = message;
    finish(std::move(outgoing));
  }
  void forget() override {
    cookie_ = 0;
    finish({});
  }

 private:
  void finish(RelayOutgoing outgoing) {
    outgoing.cookie = cookie_;
    if (const auto connection = connection_.lock()) connection->answer(std::move(outgoing));
  }

  const std::weak_ptr<HostRelayConnection> connection_;
  std::uint64_t cookie_;  // 0 when nobody waits for the answer
  const RelayMethod& method_;
};

HostRelayConnection::HostRelayConnection(HostRuntime& runtime, Descriptor socket, RelayPeer peer,
                                         RelayBus::Side side, const RelayQuotas& quotas)
    : HostRelayConnection(runtime, std::move(socket), peer, side, quotas, nextConnectionNumber()) {}

HostRelayConnection::HostRelayConnection(HostRuntime& runtime, Descriptor socket, RelayPeer peer,
                                         RelayBus::Side side, const RelayQuotas& quotas, std::uint64_t number)
    : runtime_(runtime),
      peer_(peer),
      quotas_(quotas),
      queue_(std::static_pointer_cast<HostQueue>(runtime.serialQueue(fmt::format("relay.{}", number)))),
      objects_(fmt::format(":1.{}", number)),
      socket_(std::move(socket)),
      bus_(std::make_unique<RelayBus>(side, quotas)) {}

HostRelayConnection::~HostRelayConnection() {
  invalidate();
}

void HostRelayConnection::exportObject(const RelayInterface& interface, CallHandler handler) {
  objects_.add(interface);
  handlers_->calls.push_back(std::move(handler));
}

void HostRelayConnection::setInvalidationHandler(Function<void()> handler) {
  handlers_->invalidation = std::move(handler);
}

void HostRelayConnection::resume() {
  const Turn turn(turn_);
  if (!bus_ || watch_) return;
  if (const int error = bus_->start(socket_.number()); error < 0) return end(reasonFor(error));
  watch_ = runtime_.reactor().watch(socket_.number(), [weak = weak_from_this()](Events) {
    if (const auto self = weak.lock()) self->wake();
  });
  handshake_ = queue_->after(quotas_.handshake, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->checkHandshake();
  });
  // Starting may have read all that the peer has sent so far: look at once, not at the next byte.
  watch_->arm(EPOLLIN | EPOLLOUT);
}

void HostRelayConnection::invalidate() {
  const Turn turn(turn_);
  end({});
}

void HostRelayConnection::send(const RelayInterface& interface, std::size_t method,
                               RelayArguments arguments) {
  const RelayMethod& description = interface.methods[method];
  requireRelaySignature(arguments, description.in, description.name);
  const Turn turn(turn_);
  if (!bus_) return;
  RelayOutgoing outgoing;
  outgoing.kind = RelayOutgoing::Kind::oneWay;
  outgoing.cookie = nextCookie();
  outgoing.interface = &interface;
  outgoing.method = &description;
  outgoing.arguments = std::move(arguments);
  transmit(std::move(outgoing));
}

void HostRelayConnection::call(const RelayInterface& interface, std::size_t method, RelayArguments arguments,
                               Duration timeout, ReplyHandler handler) {
  const RelayMethod& description = interface.methods[method];
  requireRelaySignature(arguments, description.in, description.name);
  const Turn turn(turn_);
  if (!bus_) {
    queue_->async([handler = std::move(handler)]() mutable { handler(relayDisconnected()); });
    return;
  }
  RelayOutgoing outgoing;
  outgoing.kind = RelayOutgoing::Kind::call;
  const std::uint64_t cookie = outgoing.cookie = nextCookie();
  outgoing.interface = &interface;
  outgoing.method = &description;
  outgoing.arguments = std::move(arguments);
  Timer timer = queue_->after(timeout, [weak = weak_from_this(), cookie] {
    if (const auto self = weak.lock()) self->expire(cookie);
  });
  pending_.emplace(cookie, PendingCall{&description, std::move(handler), std::move(timer)});
  transmit(std::move(outgoing));
}

void HostRelayConnection::wake() {
  {
    const Turn turn(turn_);
    // A reply from elsewhere may have asked for an event in the moment in which this one came.
    if (!bus_ || reading_) return;
    reading_ = true;
  }
  read();
}

void HostRelayConnection::read() {
  int budget = kMessagesPerWake;
  while (Function<void()> delivery = nextDelivery(budget)) {
    if (queue_->tryRunInline(delivery)) continue;
    queue_->async([self = shared_from_this(), delivery = std::move(delivery)]() mutable {
      delivery();
      delivery = nullptr;
      self->stopReading();
    });
    return;
  }
}

/// The next thing to run on the queue. Empty: there is none, and the reader is released.
Function<void()> HostRelayConnection::nextDelivery(int& budget) {
  const Turn turn(turn_);
  while (bus_) {
    if (budget-- == 0) {
      reading_ = false;
      watch_->arm(EPOLLIN | EPOLLOUT);
      break;
    }
    RelayMessage message;
    const int result = bus_->process(message);
    if (result < 0) {
      end(reasonFor(result));
    } else if (message) {
      if (Function<void()> delivery = take(message.get())) return delivery;
    } else if (result == 0) {
      reading_ = false;
      arm();
      break;
    }
  }
  return {};
}

void HostRelayConnection::stopReading() {
  const Turn turn(turn_);
  if (!bus_) return;
  reading_ = false;
  watch_->arm(EPOLLIN | EPOLLOUT);
}

Function<void()> HostRelayConnection::take(sd_bus_message* message) {
  std::uint8_t type = 0;
  sd_bus_message_get_type(message, &type);
  if (type == SD_BUS_MESSAGE_METHOD_CALL) return takeCall(message);
  if (type == SD_BUS_MESSAGE_METHOD_RETURN || type == SD_BUS_MESSAGE_METHOD_ERROR) return takeReply(message);
  return {};
}

Function<void()> HostRelayConnection::takeCall(sd_bus_message* call) {
  RelayObjects::Header header{.path = orEmpty(sd_bus_message_get_path(call)),
                              .interface = orEmpty(sd_bus_message_get_interface(call)),
                              .member = orEmpty(sd_bus_message_get_member(call)),
                              .signature = orEmpty(sd_bus_message_get_signature(call, 1)),
                              .argument = {}};
  if (header.interface == "org.freedesktop.DBus.Properties" && header.signature.starts_with('s')) {
    const char* argument = nullptr;
    if (sd_bus_message_read_basic(call, 's', &argument) >= 0) header.argument = orEmpty(argument);
  }
  RelayObjects::Resolution resolution = objects_.resolve(header);
  const bool wantsReply = sd_bus_message_get_expect_reply(call) > 0;
  if (const auto* target = std::get_if<RelayObjects::Target>(&resolution)) {
    return deliverCall(call, *target, wantsReply);
  }
  if (!wantsReply) return {};
  RelayOutgoing outgoing;
  sd_bus_message_get_cookie(call, &outgoing.cookie);
  if (auto* refusal = std::get_if<RelayObjects::Refusal>(&resolution)) {
    outgoing.kind = RelayOutgoing::Kind::error;
    outgoing.errorName = std::move(refusal->name);
    outgoing.errorText = std::move(refusal->text);
  } else {
    outgoing.arguments = std::move(std::get<RelayArguments>(resolution));
  }
  transmit(std::move(outgoing));
  return {};
}

Function<void()> HostRelayConnection::deliverCall(sd_bus_message* call, const RelayObjects::Target& target,
                                                  bool wantsReply) {
  RelayArguments arguments;
  const int error = readArguments(call, target.description->in, quotas_.messageBytes, arguments);
  if (error < 0) {
    end(reasonFor(error));
    return {};
  }
  if (callsInFlight_ >= quotas_.callsInFlight) {
    end("it has too many calls in flight");
    return {};
  }
  ++callsInFlight_;
  std::uint64_t cookie = 0;
  if (wantsReply) sd_bus_message_get_cookie(call, &cookie);
  RelayReply reply(std::make_unique<Reply>(weak_from_this(), cookie, *target.description));
  return [handlers = handlers_, exported = target.exported,
          received = RelayCall{target.method, std::move(arguments), std::move(reply)}]() mutable {
    if (!handlers->ended) handlers->calls[exported](std::move(received));
  };
}

Function<void()> HostRelayConnection::takeReply(sd_bus_message* reply) {
  std::uint64_t cookie = 0;
  sd_bus_message_get_reply_cookie(reply, &cookie);
  const auto found = pending_.find(cookie);
  if (found == pending_.end()) return {};
  PendingCall pending = std::move(found->second);
  pending_.erase(found);

  Expected<RelayArguments> result;
  if (const sd_bus_error* error = sd_bus_message_get_error(reply)) {
    result = relayError(RelayErrorCode::remoteError,
                        fmt::format("{} {}", orEmpty(error->name), orEmpty(error->message)));
  } else if (orEmpty(sd_bus_message_get_signature(reply, 1)) != pending.method->out) {
    result = relayError(RelayErrorCode::badReply,
                        fmt::format("{} answered with \"{}\" in place of \"{}\"", pending.method->name,
                                    orEmpty(sd_bus_message_get_signature(reply, 1)), pending.method->out));
  } else if (const int code = readArguments(reply, pending.method->out, quotas_.messageBytes, *result);
             code < 0) {
    result =
        relayError(RelayErrorCode::badReply, fmt::format("{}: {}", pending.method->name, reasonFor(code)));
  }
  return [handler = std::move(pending.handler), result = std::move(result)]() mutable {
    handler(std::move(result));
  };
}

void HostRelayConnection::answer(RelayOutgoing outgoing) {
  const Turn turn(turn_);
  --callsInFlight_;
  if (bus_ && outgoing.cookie != 0) transmit(std::move(outgoing));
}

void HostRelayConnection::transmit(RelayOutgoing outgoing) {
  if (const int error = bus_->send(std::move(outgoing)); error < 0) return end(reasonFor(error));
  if (!reading_ && bus_->wantsToWrite()) arm();
}

/// 0 is no cookie (D-Bus specification, "Message Format").
std::uint32_t HostRelayConnection::nextCookie() {
  if (++lastCookie_ == 0) ++lastCookie_;
  return lastCookie_;
}

void HostRelayConnection::arm() {
  if (bus_->isReady()) handshake_.cancel();
  watch_->arm(bus_->awaited());
}

void HostRelayConnection::expire(std::uint64_t cookie) {
  ReplyHandler handler;
  {
    const Turn turn(turn_);
    const auto found = pending_.find(cookie);
    if (found == pending_.end()) return;
    handler = std::move(found->second.handler);
    pending_.erase(found);
  }
  handler(relayTimedOut());
}

void HostRelayConnection::checkHandshake() {
  const Turn turn(turn_);
  if (bus_ && !bus_->isReady()) end("it did not authenticate in time");
}

/// Under the turn. Without a reason nothing is logged: the peer left, or its owner let go of it.
void HostRelayConnection::end(std::string_view reason) {
  if (!bus_) return;
  if (!reason.empty()) platformLog().error("Relay connection of process {} closed: {}", peer_.pid, reason);
  watch_.reset();
  bus_.reset();
  socket_ = Descriptor();
  handshake_.cancel();
  handlers_->ended = true;
  queue_->async([handlers = handlers_, pending = std::exchange(pending_, {})]() mutable {
    for (auto& [cookie, call] : pending) call.handler(relayDisconnected());
    if (handlers->invalidation) std::exchange(handlers->invalidation, nullptr)();
    handlers->calls.clear();
  });
}

}  // namespace sable::platform::host
