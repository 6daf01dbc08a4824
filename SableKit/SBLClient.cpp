#include "SableKit/SBLClient.h"

#include <algorithm>
#include <iterator>
#include <utility>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "platform/RelaySupport.h"

namespace sable {

using platform::RelayArguments;
using platform::RelayConnection;
using platform::RelayRecord;

/// What a call may wait for images, whatever deadline it is given.
constexpr platform::Duration kLongestWait = std::chrono::hours(24);

std::shared_ptr<SBLClient> SBLClient::create(platform::Runtime& runtime, platform::Relay& relay,
                                             platform::RelayEndpoint daemon,
                                             SBLSessionConfiguration configuration) {
  return std::make_shared<SBLClient>(Key{}, runtime, relay, std::move(daemon), std::move(configuration));
}

SBLClient::SBLClient(Key, platform::Runtime& runtime, platform::Relay& relay, platform::RelayEndpoint daemon,
                     SBLSessionConfiguration configuration)
    : runtime_(runtime),
      relay_(relay),
      daemon_(std::move(daemon)),
      configuration_(std::move(configuration)),
      queue_(runtime.serialQueue("com.kestrel.sable.client")),
      callbackQueue_(runtime.serialQueue("com.kestrel.sable.client.callbacks")) {}

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
  const std::weak_ptr<RelayConnection> connection = connection_;
  connection_->exportObject(kSBLClientRelay, [weak](platform::RelayCall call) {
    if (const auto self = weak.lock()) self->handleCall(std::move(call));
  });
  connection_->setInvalidationHandler([weak, connection] {
    if (const auto self = weak.lock()) self->connectionLost(connection);
  });
  connection_->resume();
  // Calls are delivered in order, so whatever follows finds the connection configured.
  connection_->call(kSBLDaemonRelay, SBLDaemonRelay::configure, {encodeConfiguration(configuration_)},
                    timeout_, [weak, connection](Expected<RelayArguments> result) {
                      if (const auto self = weak.lock()) self->configured(connection, std::move(result));
                    });
  return connection_;
}

void SBLClient::configured(const std::weak_ptr<RelayConnection>& weak, Expected<RelayArguments> result) {
  queue_->async([self = shared_from_this(), weak, result = std::move(result)] {
    const auto connection = weak.lock();
    if (connection == nullptr || connection != self->connection_) return;
    if (!result) {
      // Without a configuration the daemon answers nothing: the next call starts anew.
      connection->invalidate();
      return self->dropConnection(result.error());
    }
    self->endpoint_ = std::get<std::string>((*result)[0]);
    self->finishConnecting(*self->endpoint_);
  });
}

void SBLClient::connectionLost(const std::weak_ptr<RelayConnection>& weak) {
  queue_->async([self = shared_from_this(), weak] {
    if (const auto connection = weak.lock(); connection != nullptr && connection == self->connection_)
      self->dropConnection(platform::relayDisconnected().value());
  });
}

void SBLClient::dropConnection(const Error& reason) {
  queue_->assertIsCurrent();
  connection_.reset();
  endpoint_.reset();
  finishConnecting(tl::unexpected(reason));
}

void SBLClient::finishConnecting(const Expected<platform::RelayEndpoint>& result) {
  for (auto& handler : std::exchange(awaitingEndpoint_, {})) {
    callbackQueue_->async([handler = std::move(handler), result]() mutable { handler(result); });
  }
}

void SBLClient::handleCall(platform::RelayCall call) {
  const BagHandler handler = queue_->sync([this] { return bagHandler_; });
  if (handler) {
    handler(std::get<std::string>(call.arguments[0]), std::get<std::string>(call.arguments[1]),
            decodeError(std::get<RelayRecord>(call.arguments[2])));
  }
  call.reply.send({});
}

void SBLClient::connect(platform::Function<void(Expected<platform::RelayEndpoint>)> handler) {
  queue_->async([self = shared_from_this(), handler = std::move(handler)]() mutable {
    const auto connection = self->ensureConnection();
    self->awaitingEndpoint_.push_back(std::move(handler));
    if (!connection) return self->finishConnecting(tl::unexpected(connection.error()));
    if (self->endpoint_) self->finishConnecting(*self->endpoint_);
  });
}

void SBLClient::call(const platform::RelayInterface& interface, std::size_t method, RelayArguments arguments,
                     ResultHandler handler) {
  const auto connection = queue_->sync([this] { return ensureConnection(); });
  if (!connection) {
    return callbackQueue_->async([handler = std::move(handler), error = connection.error()]() mutable {
      handler(tl::unexpected(error));
    });
  }
  (*connection)->call(interface, method, std::move(arguments), timeout_, std::move(handler));
}

void SBLClient::request(const SBLAnyRequest& request, SBLReplyHandler handler) {
  this->request(std::string(requestClassName(request)), encodeRequest(request), std::move(handler));
}

void SBLClient::request(std::string className, RelayRecord record, SBLReplyHandler handler) {
  const std::uint64_t queryId = record.unsignedInteger("queryId").value_or(0);
  call(kSBLDaemonRelay, SBLDaemonRelay::request, {std::move(className), std::move(record)},
       [queryId, handler = std::move(handler)](Expected<RelayArguments> result) mutable {
         if (!result) return handler(queryId, std::nullopt, result.error());
         handler(std::get<std::uint64_t>((*result)[0]), decodeReply(std::get<RelayRecord>((*result)[1])),
                 decodeError(std::get<RelayRecord>((*result)[2])));
       });
}

void SBLClient::bag(platform::Function<void(std::string, std::string, std::optional<Error>)> handler) {
  call(kSBLDaemonRelay, SBLDaemonRelay::bag, {},
       [handler = std::move(handler)](Expected<RelayArguments> result) mutable {
         if (!result) return handler({}, {}, result.error());
         handler(std::get<std::string>((*result)[0]), std::get<std::string>((*result)[1]),
                 decodeError(std::get<RelayRecord>((*result)[2])));
       });
}

void SBLClient::loadImages(const std::vector<SBLImageDescription>& descriptions,
                           platform::MonotonicTime deadline,
                           platform::Function<void(Expected<Images>)> handler) {
  const platform::MonotonicTime now = runtime_.ticks();
  const auto nanoseconds =
      static_cast<std::uint64_t>(std::max<std::int64_t>(deadline.time_since_epoch().count(), 0));
  RelayArguments arguments{encodeImageDescriptions(descriptions), nanoseconds};
  const auto timeout = timeout_ + std::clamp(deadline - now, platform::Duration{}, kLongestWait);
  connect([self = shared_from_this(), arguments = std::move(arguments), timeout,
           handler = std::move(handler)](Expected<platform::RelayEndpoint> endpoint) mutable {
    if (!endpoint) return handler(tl::unexpected(endpoint.error()));
    const auto connected = self->relay_.connect(*endpoint);
    if (!connected) return handler(tl::unexpected(connected.error()));
    const std::shared_ptr<RelayConnection>& connection = *connected;
    connection->setInvalidationHandler([] {});
    connection->resume();
    connection->call(
        kSBLEndpointRelay, SBLEndpointRelay::loadImages, std::move(arguments), timeout,
        [connection, handler = std::move(handler)](Expected<RelayArguments> result) mutable {
          connection->invalidate();
          if (!result) return handler(tl::unexpected(result.error()));
          auto& entries = std::get<platform::RelayDataMap>((*result)[0]).entries;
          handler(Images(std::move_iterator(entries.begin()), std::move_iterator(entries.end())));
        });
  });
}

void SBLClient::disconnect() {
  queue_->async([self = shared_from_this()] {
    if (self->connection_ == nullptr) return;
    self->connection_->invalidate();
    self->dropConnection(platform::relayDisconnected().value());
  });
}

}  // namespace sable
