#include "SableKit/SBLClient.h"

#include <utility>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"

namespace sable {

using platform::RelayArguments;
using platform::RelayConnection;
using platform::RelayRecord;

namespace {

Error disconnectedError() {
  return {std::string(platform::kRelayErrorDomain),
          static_cast<std::int64_t>(platform::RelayErrorCode::disconnected), "not connected to the daemon"};
}

Error badReplyError() {
  return {std::string(platform::kRelayErrorDomain),
          static_cast<std::int64_t>(platform::RelayErrorCode::badReply),
          "the daemon's reply has another form"};
}

}  // namespace

std::shared_ptr<SBLClient> SBLClient::create(platform::Runtime& runtime, platform::Relay& relay,
                                             platform::RelayEndpoint daemon,
                                             SBLSessionConfiguration configuration) {
  return std::make_shared<SBLClient>(Key{}, runtime, relay, std::move(daemon), std::move(configuration));
}

SBLClient::SBLClient(Key, platform::Runtime& runtime, platform::Relay& relay, platform::RelayEndpoint daemon,
                     SBLSessionConfiguration configuration)
    : relay_(relay),
      daemon_(std::move(daemon)),
      configuration_(std::move(configuration)),
      queue_(runtime.serialQueue("com.kestrel.sable.client")) {}

void SBLClient::setBagHandler(BagHandler handler) {
  queue_->sync([&] { bagHandler_ = std::move(handler); });
}

Expected<std::shared_ptr<RelayConnection>> SBLClient::ensureConnection() {
  queue_->assertIsCurrent();
  if (connection_ != nullptr) return connection_;
  auto connected = relay_.connect(daemon_);
  if (!connected) return connected;
  connection_ = std::move(*connected);
  endpoint_.reset();

  const std::weak_ptr<SBLClient> weak = weak_from_this();
  connection_->exportObject(kSBLClientRelay, [weak](platform::RelayCall call) {
    if (const auto self = weak.lock()) self->handleCall(std::move(call));
  });
  connection_->setInvalidationHandler([weak, connection = connection_.get()] {
    if (const auto self = weak.lock()) self->connectionLost(connection);
  });
  connection_->resume();
  // Calls are delivered in order, so whatever follows finds the connection configured.
  connection_->call(kSBLDaemonRelay, SBLDaemonRelay::configure, {encodeConfiguration(configuration_)},
                    timeout_, [weak](Expected<RelayArguments> result) {
                      if (const auto self = weak.lock()) self->configured(std::move(result));
                    });
  return connection_;
}

void SBLClient::configured(Expected<RelayArguments> result) {
  queue_->async([self = shared_from_this(), result = std::move(result)] {
    self->endpoint_ = result.map([](const RelayArguments& arguments) {
      const auto* address = arguments.empty() ? nullptr : std::get_if<std::string>(&arguments[0]);
      return address == nullptr ? platform::RelayEndpoint() : *address;
    });
    for (auto& handler : std::exchange(self->awaitingEndpoint_, {})) handler(*self->endpoint_);
  });
}

void SBLClient::connectionLost(const RelayConnection* connection) {
  queue_->async([self = shared_from_this(), connection] {
    if (self->connection_.get() != connection) return;
    self->connection_.reset();
    for (auto& handler : std::exchange(self->awaitingEndpoint_, {}))
      handler(tl::unexpected(disconnectedError()));
  });
}

void SBLClient::handleCall(platform::RelayCall call) {
  if (call.method == SBLClientRelay::bagDidLoad) {
    BagHandler handler = queue_->sync([this] { return bagHandler_; });
    if (handler) {
      handler(std::get<std::string>(call.arguments[0]), std::get<std::string>(call.arguments[1]),
              decodeError(std::get<RelayRecord>(call.arguments[2])));
    }
  }
  call.reply.send({});
}

void SBLClient::connect(platform::Function<void(Expected<platform::RelayEndpoint>)> handler) {
  queue_->async([self = shared_from_this(), handler = std::move(handler)]() mutable {
    const auto connection = self->ensureConnection();
    if (!connection) return handler(tl::unexpected(connection.error()));
    if (self->endpoint_) return handler(*self->endpoint_);
    self->awaitingEndpoint_.push_back(std::move(handler));
  });
}

void SBLClient::call(std::size_t method, RelayArguments arguments, ResultHandler handler) {
  const auto connection = queue_->sync([this] { return ensureConnection(); });
  if (!connection) return handler(tl::unexpected(connection.error()));
  (*connection)->call(kSBLDaemonRelay, method, std::move(arguments), timeout_, std::move(handler));
}

void SBLClient::request(SBLAnyRequest request, SBLReplyHandler handler) {
  const std::uint64_t queryId = std::visit([](const auto& one) { return one.queryId; }, request);
  call(SBLDaemonRelay::request, {std::string(requestClassName(request)), encodeRequest(request)},
       [queryId, handler = std::move(handler)](Expected<RelayArguments> result) mutable {
         if (!result) return handler(queryId, std::nullopt, result.error());
         if (result->size() != 3) return handler(queryId, std::nullopt, badReplyError());
         handler(std::get<std::uint64_t>((*result)[0]), decodeReply(std::get<RelayRecord>((*result)[1])),
                 decodeError(std::get<RelayRecord>((*result)[2])));
       });
}

void SBLClient::bag(platform::Function<void(std::string, std::string, std::optional<Error>)> handler) {
  call(SBLDaemonRelay::bag, {}, [handler = std::move(handler)](Expected<RelayArguments> result) mutable {
    if (!result) return handler({}, {}, result.error());
    if (result->size() != 3) return handler({}, {}, badReplyError());
    handler(std::get<std::string>((*result)[0]), std::get<std::string>((*result)[1]),
            decodeError(std::get<RelayRecord>((*result)[2])));
  });
}

void SBLClient::disconnect() {
  queue_->async([self = shared_from_this()] {
    if (self->connection_ != nullptr) std::exchange(self->connection_, nullptr)->invalidate();
  });
}

}  // namespace sable
