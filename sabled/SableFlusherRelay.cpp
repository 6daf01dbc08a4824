#include "sabled/SableFlusherRelay.h"

#include <utility>

#include "SableKit/SBLRelayInterfaces.h"
#include "sabled/Assembly.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientConnection.h"
#include "sabled/FlusherTool.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

using platform::RelayConnection;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryFlusher);
}

void setStopFlushing(Assembly& assembly, bool stop) {
  if (assembly.backgroundFlusher) assembly.backgroundFlusher->setStopFlushing(stop);
}

}  // namespace

SableFlusherRelay::SableFlusherRelay(Assembly& assembly, GetClientConnections getClientConnections)
    : assembly_(assembly),
      getClientConnections_(std::move(getClientConnections)),
      flusherrelayQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.flusherRelayQueue")),
      listener_(assembly.platform.relay().anonymousListener()) {
  listener_->setAcceptHandler(
      [this](const std::shared_ptr<RelayConnection>& connection) { return acceptConnection(connection); });
  if (const auto resumed = listener_->resume(); !resumed) {
    log().error("cannot open the flusher's endpoint: {}", resumed.error().description());
    return;
  }
  log().standard("started accepting connections :{}", listener_->endpoint());
}

SableFlusherRelay::~SableFlusherRelay() {
  log().standard("stopped listening for SBLFlusherListener connections");
}

platform::RelayEndpoint SableFlusherRelay::endpoint() const {
  return listener_->endpoint();
}

bool SableFlusherRelay::acceptConnection(const std::shared_ptr<RelayConnection>& connection) {
  const auto tool = std::make_shared<FlusherTool>(connection, flusherrelayQueue_);
  const std::weak_ptr<FlusherTool> weak = tool;
  connection->exportObject(kSBLFlusherListener, [this, weak](platform::RelayCall call) {
    if (const Tool caller = weak.lock())
      initiateConnectionWithIntent(std::get<std::uint64_t>(call.arguments[0]), caller, std::move(call.reply));
  });
  connection->setInvalidationHandler([this, weak] {
    log().standard("listener invalidated");
    if (const Tool gone = weak.lock()) flusherrelayQueue_->async([this, gone] { _removeDelegate(gone); });
  });
  flusherrelayQueue_->sync([&] {
    tools_.push_back(tool);
    remoteObject_ = tool;
  });
  connection->resume();
  return true;
}

void SableFlusherRelay::initiateConnectionWithIntent(std::uint64_t intent, const Tool& tool,
                                                     platform::RelayReply reply) {
  // Of several tools the one that speaks is meant, not one that has connected in between.
  flusherrelayQueue_->sync([&] { remoteObject_ = tool; });
  switch (static_cast<SBLFlusherIntent>(intent)) {
    case SBLFlusherIntent::watchSessions:
      flusherrelayQueue_->sync([&] { listenToSessions(tool); });
      break;
    case SBLFlusherIntent::watchFeedback:
      flusherrelayQueue_->sync([&] { listenToFeedback(tool); });
      break;
    case SBLFlusherIntent::stop:
      stop(tool);
      break;
    case SBLFlusherIntent::dump:
      dump(tool);
      break;
    default:
      log().standard("Unsupported command yet: {}", intent);
      return reply.fail("org.freedesktop.DBus.Error.NotSupported", "no such intent");
  }
  reply.send({});
}

void SableFlusherRelay::listenToSessions(const Tool& tool) {
  sendingStreamListener_ = tool;
  sending_ = true;
  log().standard("new listener for flusher client sessions, delegate: process {}", tool->peer().pid);
}

void SableFlusherRelay::listenToFeedback(const Tool& tool) {
  receivingStreamListener_ = tool;
  receiving_ = true;
  log().standard("new listener for client feedbacks, delegate: process {}", tool->peer().pid);
}

void SableFlusherRelay::stop(const Tool& tool) {
  log().standard("flushing stopped; dump command will start flushing again");
  setStopFlushing(assembly_, true);
  tellWorkDone(tool);
}

void SableFlusherRelay::dump(const Tool& tool) {
  flusherrelayQueue_->sync([&] {
    if (sendingStreamListener_) return;
    log().standard("no listener for sending stream setting this client as remote");
    listenToSessions(tool);
  });
  flushSessions([this, tool] {
    setStopFlushing(assembly_, false);
    tellWorkDone(tool);
  });
}

/// Ends the session of every client; `completion` runs when all have ended.
void SableFlusherRelay::flushSessions(const std::function<void()>& completion) {
  const auto connections =
      getClientConnections_ ? getClientConnections_() : std::vector<std::shared_ptr<ClientConnection>>();
  if (connections.empty()) return completion();
  const auto open = std::make_shared<std::atomic<std::size_t>>(connections.size());
  for (const auto& connection : connections) {
    connection->flushSession([this, open, completion](const std::optional<std::string>& agent) {
      if (agent) {
        log().standard("session flushed because of dump command {}", *agent);
        if (assembly_.backgroundFlusher) assembly_.backgroundFlusher->insertFlushActivity(0);
      }
      if (--*open == 0) completion();
    });
  }
}

void SableFlusherRelay::tellWorkDone(const Tool& tool) {
  flusherrelayQueue_->async([tool] { tool->workDone(); });
}

void SableFlusherRelay::sendDataToReceivingStreamListener(std::shared_ptr<const SableFeedback> feedback) {
  if (!receiving_.load(std::memory_order_relaxed)) return;
  if (onTheirWay_.fetch_add(1) >= kFlusherWaitingCalls) {
    --onTheirWay_;
    ++missed_;
    return;
  }
  flusherrelayQueue_->async([this, feedback = std::move(feedback)] {
    --onTheirWay_;
    forward(*feedback);
  });
}

void SableFlusherRelay::forward(const SableFeedback& feedback) {
  const std::uint64_t missed = missed_.exchange(0);
  if (!receivingStreamListener_) return;
  if (receivingStreamListener_->isFull()) return receivingStreamListener_->leaveOut(missed + 1);
  if (missed > 0) receivingStreamListener_->leaveOut(missed);
  receivingStreamListener_->receiveFeedback(feedback.description());
}

void SableFlusherRelay::sendDataToSendingStreamListener(std::vector<std::string> envelopes) {
  if (!hasSendingStreamListener()) return;
  flusherrelayQueue_->async([this, envelopes = std::move(envelopes)]() mutable {
    if (sendingStreamListener_) sendingStreamListener_->receiveSessions(std::move(envelopes));
  });
}

void SableFlusherRelay::_removeDelegate(const Tool& tool) {
  flusherrelayQueue_->assertIsCurrent();
  if (receivingStreamListener_ == tool) {
    receivingStreamListener_ = nullptr;
    receiving_ = false;
    log().standard("Removed receiving stream listener");
  }
  if (sendingStreamListener_ == tool) {
    sendingStreamListener_ = nullptr;
    sending_ = false;
    log().standard("Removed sending stream listener");
  }
  if (remoteObject_ == tool) {
    remoteObject_ = nullptr;
    log().standard("Removed remote listener");
  }
  std::erase(tools_, tool);
}

}  // namespace sable
