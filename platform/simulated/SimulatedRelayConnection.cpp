#include "platform/simulated/SimulatedRelayConnection.h"

#include <fmt/format.h>

#include <algorithm>

#include "platform/RelaySupport.h"

namespace sable::platform::simulated {

namespace {

RelayValue throughTheWire(const RelayValue& value);

RelayRecord throughTheWire(const RelayRecord& record) {
  RelayRecord copied;
  for (const RelayMember& member : record.members()) {
    if (!isAbsent(member.value)) copied.add(member.name, throughTheWire(member.value));
  }
  return copied;
}

Data throughTheWire(const Data& data) {
  return makeData(data ? *data : std::string());
}

struct ThroughTheWire {
  template <class Plain>
  RelayValue operator()(const Plain& plain) const {
    return plain;
  }
  RelayValue operator()(const Data& data) const { return throughTheWire(data); }
  RelayValue operator()(const RelayRecord& record) const { return throughTheWire(record); }
  RelayValue operator()(const RelayRecords& records) const {
    RelayRecords copied;
    for (const RelayRecord& record : records) copied.push_back(throughTheWire(record));
    return copied;
  }
  RelayValue operator()(const RelayDataMap& map) const {
    RelayDataMap copied;
    for (const auto& [name, data] : map.entries) copied.entries.emplace_back(name, throughTheWire(data));
    return copied;
  }
};

RelayValue throughTheWire(const RelayValue& value) {
  return std::visit(ThroughTheWire{}, value);
}

RelayArguments throughTheWire(const RelayArguments& arguments) {
  RelayArguments copied;
  for (const RelayValue& argument : arguments) copied.push_back(throughTheWire(argument));
  return copied;
}

}  // namespace

class SimulatedRelayConnection::Reply final : public RelayReply::Implementation {
 public:
  Reply(std::weak_ptr<SimulatedRelayConnection> callee, std::weak_ptr<SimulatedRelayConnection> caller,
        std::uint64_t cookie, const RelayMethod& method)
      : callee_(std::move(callee)), caller_(std::move(caller)), cookie_(cookie), method_(method) {}

  void send(RelayArguments arguments) override {
    requireRelaySignature(arguments, method_.out, method_.name);
    finish(throughTheWire(arguments));
  }
  void fail(std::string_view name, std::string_view message) override {
    finish(relayError(RelayErrorCode::remoteError, fmt::format("{} {}", name, message)));
  }
  void forget() override {}

 private:
  void finish(Expected<RelayArguments> result) {
    const auto callee = callee_.lock();
    const auto caller = caller_.lock();
    if (cookie_ == 0 || !callee || callee->hasEnded() || !caller) return;
    caller->receive([cookie = cookie_, result = std::move(result)](SimulatedRelayConnection& self) mutable {
      self.complete(cookie, std::move(result));
    });
  }

  const std::weak_ptr<SimulatedRelayConnection> callee_;
  const std::weak_ptr<SimulatedRelayConnection> caller_;
  const std::uint64_t cookie_;  // 0 when nobody waits for the answer
  const RelayMethod& method_;
};

SimulatedRelayConnection::Ends SimulatedRelayConnection::makePair(Runtime& runtime, RelayPeer first,
                                                                  RelayPeer second) {
  Ends ends{std::make_shared<SimulatedRelayConnection>(runtime, second),
            std::make_shared<SimulatedRelayConnection>(runtime, first)};
  ends.first->other_ = ends.second;
  ends.second->other_ = ends.first;
  return ends;
}

SimulatedRelayConnection::SimulatedRelayConnection(Runtime& runtime, RelayPeer peer)
    : peer_(peer), queue_(runtime.serialQueue(fmt::format("relay.{}", peer.pid))) {}

SimulatedRelayConnection::~SimulatedRelayConnection() {
  invalidate();
}

void SimulatedRelayConnection::exportObject(const RelayInterface& interface, CallHandler handler) {
  handlers_->exported.emplace_back(&interface, std::move(handler));
}

void SimulatedRelayConnection::setInvalidationHandler(Function<void()> handler) {
  handlers_->invalidation = std::move(handler);
}

void SimulatedRelayConnection::resume() {
  const std::lock_guard lock(mutex_);
  resumed_ = true;
  for (Message& message : std::exchange(waiting_, {})) enqueue(std::move(message));
}

void SimulatedRelayConnection::invalidate() {
  std::vector<Message> undelivered;
  {
    const std::lock_guard lock(mutex_);
    if (std::exchange(ended_, true)) return;
    undelivered = std::exchange(waiting_, {});
    queue_->async([handlers = handlers_, pending = std::exchange(pending_, {})]() mutable {
      for (auto& [cookie, call] : pending) call.handler(relayDisconnected());
      if (handlers->invalidation) std::exchange(handlers->invalidation, nullptr)();
      handlers->exported.clear();
    });
  }
  if (const auto other = other_.lock()) {
    other->receive([](SimulatedRelayConnection& self) { self.invalidate(); });
  }
}

void SimulatedRelayConnection::send(const RelayInterface& interface, std::size_t method,
                                    RelayArguments arguments) {
  post(0, interface, interface.methods[method], arguments);
}

void SimulatedRelayConnection::call(const RelayInterface& interface, std::size_t method,
                                    RelayArguments arguments, Duration timeout, ReplyHandler handler) {
  const RelayMethod& description = interface.methods[method];
  std::uint64_t cookie = 0;
  {
    const std::lock_guard lock(mutex_);
    if (ended_) {
      queue_->async([handler = std::move(handler)]() mutable { handler(relayDisconnected()); });
      return;
    }
    cookie = ++lastCookie_;
    Timer timer = queue_->after(timeout, [weak = weak_from_this(), cookie] {
      if (const auto self = weak.lock()) self->complete(cookie, relayTimedOut());
    });
    pending_.emplace(cookie, PendingCall{&description, std::move(handler), std::move(timer)});
  }
  post(cookie, interface, description, arguments);
}

void SimulatedRelayConnection::post(std::uint64_t cookie, const RelayInterface& interface,
                                    const RelayMethod& method, const RelayArguments& arguments) {
  requireRelaySignature(arguments, method.in, method.name);
  const auto other = other_.lock();
  if (!other || hasEnded()) return;
  RelayReply reply(std::make_unique<Reply>(other_, weak_from_this(), cookie, method));
  other->receive([&interface, name = method.name, received = throughTheWire(arguments),
                  reply = std::move(reply)](SimulatedRelayConnection& self) mutable {
    self.dispatch(interface, name, std::move(received), std::move(reply));
  });
}

void SimulatedRelayConnection::receive(Message message) {
  const std::unique_lock lock(mutex_);
  if (ended_) return;
  if (resumed_) {
    enqueue(std::move(message));
  } else {
    waiting_.push_back(std::move(message));
  }
}

void SimulatedRelayConnection::enqueue(Message message) {
  queue_->async([weak = weak_from_this(), message = std::move(message)]() mutable {
    if (const auto self = weak.lock(); self && !self->hasEnded()) message(*self);
  });
}

void SimulatedRelayConnection::dispatch(const RelayInterface& interface, std::string_view method,
                                        RelayArguments arguments, RelayReply reply) {
  for (auto& [exported, handler] : handlers_->exported) {
    if (exported->name != interface.name || exported->path != interface.path) continue;
    const auto found = std::ranges::find(exported->methods, method, &RelayMethod::name);
    if (found == exported->methods.end()) break;
    if (!relayArgumentsMatch(arguments, found->in)) {
      return reply.fail(
          "org.freedesktop.DBus.Error.InvalidArgs",
          fmt::format("{} takes \"{}\", not \"{}\"", method, found->in, relaySignature(arguments)));
    }
    return handler({static_cast<std::size_t>(found - exported->methods.begin()), std::move(arguments),
                    std::move(reply)});
  }
  reply.fail("org.freedesktop.DBus.Error.UnknownMethod",
             fmt::format("{} has no method {}", interface.path, method));
}

void SimulatedRelayConnection::complete(std::uint64_t cookie, Expected<RelayArguments> result) {
  PendingCall call;
  {
    const std::lock_guard lock(mutex_);
    const auto found = pending_.find(cookie);
    if (found == pending_.end()) return;
    call = std::move(found->second);
    pending_.erase(found);
  }
  call.handler(std::move(result));
}

bool SimulatedRelayConnection::hasEnded() {
  const std::lock_guard lock(mutex_);
  return ended_;
}

}  // namespace sable::platform::simulated
