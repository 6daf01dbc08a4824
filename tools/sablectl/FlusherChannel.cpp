#include "tools/sablectl/FlusherChannel.h"

#include <deque>
#include <utility>

namespace sable::sablectl {

using platform::RelayCall;
using Kind = FlusherEvent::Kind;

struct FlusherChannel::Inbox {
  std::shared_ptr<platform::SerialQueue> queue;
  std::unique_ptr<platform::Semaphore> arrived;
  std::deque<FlusherEvent> events;  ///< on queue

  void add(FlusherEvent event) {
    queue->sync([&] { events.push_back(std::move(event)); });
    arrived->signal();
  }
};

namespace {

FlusherEvent eventOf(RelayCall call) {
  FlusherEvent event;
  event.reply = std::move(call.reply);
  switch (call.method) {
    case SBLFlusherListenerRelay::workDone:
      event.kind = Kind::workDone;
      break;
    case SBLFlusherListenerRelay::receiveFeedback:
      event.kind = Kind::feedback;
      event.texts = {std::move(std::get<std::string>(call.arguments[0]))};
      break;
    case SBLFlusherListenerRelay::receiveSessions:
      event.kind = Kind::sessions;
      event.texts = std::move(std::get<platform::RelayStrings>(call.arguments[0]));
      break;
    default:
      event.kind = Kind::dropped;
      event.count = std::get<std::uint64_t>(call.arguments[0]);
      break;
  }
  return event;
}

}  // namespace

Expected<std::unique_ptr<FlusherChannel>> FlusherChannel::open(Host& host,
                                                               const platform::RelayEndpoint& endpoint) {
  auto connected = host.relay.connect(endpoint);
  if (!connected) return tl::unexpected(connected.error());
  const auto inbox = std::make_shared<Inbox>();
  inbox->queue = host.runtime.serialQueue("com.kestrel.sablectl.flusher");
  inbox->arrived = host.runtime.semaphore(0);
  (*connected)->exportObject(kSBLFlusherListenerRelay, [inbox](RelayCall call) {
    inbox->add(eventOf(std::move(call)));
  });
  (*connected)->setInvalidationHandler([inbox] { inbox->add({}); });
  (*connected)->resume();
  return std::unique_ptr<FlusherChannel>(new FlusherChannel(std::move(*connected), inbox));
}

FlusherChannel::FlusherChannel(std::shared_ptr<platform::RelayConnection> connection,
                               std::shared_ptr<Inbox> inbox)
    : connection_(std::move(connection)), inbox_(std::move(inbox)) {}

FlusherChannel::~FlusherChannel() {
  connection_->invalidate();
}

void FlusherChannel::ask(SBLFlusherIntent intent, platform::Duration timeout) {
  connection_->call(kSBLFlusherListener, SBLFlusherListener::initiateConnectionWithIntent,
                    {static_cast<std::uint64_t>(intent)}, timeout,
                    [weak = std::weak_ptr(connection_)](const Expected<platform::RelayArguments>& answer) {
                      const auto connection = weak.lock();
                      if (!answer && connection != nullptr) connection->invalidate();
                    });
}

std::optional<FlusherEvent> FlusherChannel::next(platform::MonotonicTime deadline) {
  if (!inbox_->arrived->wait(deadline)) return std::nullopt;
  return inbox_->queue->sync([this] {
    FlusherEvent event = std::move(inbox_->events.front());
    inbox_->events.pop_front();
    return event;
  });
}

}  // namespace sable::sablectl
