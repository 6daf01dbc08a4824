#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/SBLTracing.h"
#include "platform/Tally.h"
#include "platform/UserActivity.h"
#include "sabled/Assembly.h"
#include "sabled/ClientConnection.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientState.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableLogging.h"
#include "sabled/SablePersistentStorage.h"

// What a client reports, and its way into a session.
namespace sable {
namespace {

using platform::QualityOfService;
using platform::RelayRecord;

constexpr std::uint32_t kTraceFeedback = 0x2b000024;
constexpr std::uint32_t kSableResult = 1;  ///< a result of the service

// Values of RKCustomFeedback's `feedback_type`.
constexpr std::uint32_t kRoverAutofill = 1, kBeaconResultFeatures = 3;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryConnection);
}

/// Whether a search is likely to follow: the view has come up for one, on an unlocked device.
bool announcesSearch(const FeedbackMessage& message) {
  constexpr std::uint32_t kForSearch[] = {2, 5, 6, 9, 10, 11, 22, 23, 24};
  const auto appearance = message.searchViewAppearance();
  return appearance && !appearance->onLockScreen &&
         std::ranges::find(kForSearch, appearance->viewAppearEvent) != std::end(kForSearch);
}

Expected<std::unique_ptr<FeedbackMessage>> reportedMessage(const platform::RelayCall& call) {
  const auto bytes = [&](std::size_t argument) -> std::string_view {
    const auto& data = std::get<Data>(call.arguments[argument]);
    return data == nullptr ? std::string_view() : std::string_view(*data);
  };
  if (call.method == SBLDaemonRelay::reportEventData) return FeedbackMessage::parseReportedPayload(bytes(2));
  return FeedbackMessage::parseReported(std::get<std::string>(call.arguments[2]), bytes(3));
}

}  // namespace

void ClientConnection::reportEvent(platform::RelayCall& call) {
  auto message = reportedMessage(call);
  if (!message) {
    log().error("(pid:{}) feedback refused: {}", connection_->peer().pid, message.error().reason);
    call.reply.fail("org.freedesktop.DBus.Error.InvalidArgs", message.error().reason);
    return connection_->invalidate();
  }
  reportPayload(std::move(*message), std::get<std::int64_t>(call.arguments[1]));
  call.reply.send({});
}

void ClientConnection::reportPayload(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId) {
  if (state_ == nullptr) return reportLost("client state nil", "state must not be nil");
  if (message->customFeedbackType()) return handleCustomFeedback(std::move(message), queryId);
  if (announcesSearch(*message)) state_->warm();
  auto* sessionManager = state_->sessionManager();
  if (sessionManager == nullptr) return reportLost("session manager nil", "session manager nil");
  if (const auto engagement = message->resultEngagement()) noteEngagement(*engagement);
  const std::uint64_t clientQueryId = message->clientQueryId();
  sessionManager->addSableFeedback(std::make_shared<SableFeedback>(
      std::move(message), queryId, std::nullopt, state_->userAgent().value_or(""), clientQueryId));
}

/// A feedback that no session takes: a session of its own says so.
void ClientConnection::reportLost(std::string reason, const char* logLine) {
  // A session makes a file: not while the client waits.
  assembly_.runtime.globalQueue(QualityOfService::background)
      .async([&assembly = assembly_, error = makeSBLError(SBLErrorCode::daemonSide, std::move(reason))] {
        ClientSession::createFeedbackSessionFromError(error, assembly)->sessionComplete();
      });
  log().error("{}", logLine);
}

void ClientConnection::noteEngagement(const ResultEngagement& engagement) {
  const auto& client = state_->clientShortName();
  if (!client) return;
  if (engagement.topHit) assembly_.tally.add(createTallyKey(*client, "tophit.engagements"), 1);
  if (engagement.resultType == kSableResult) {
    assembly_.tally.add(createTallyKey(*client, "sable.engagements"), 1);
  }
  if (engagement.completedQuery.empty() || (*client != "rover" && *client != "beacon")) return;
  std::string domain = *client;
  domain.front() = static_cast<char>(domain.front() - 'a' + 'A');
  assembly_.platform.userActivity().donate(
      {std::move(domain), "Engagement", "input", engagement.completedQuery});
}

void ClientConnection::handleCustomFeedback(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId) {
  switch (*message->customFeedbackType()) {
    case kRoverAutofill:
    case kBeaconResultFeatures:
      inSessionOfItsOwn(std::move(message), queryId,
                        [](Assembly&, ClientSession& session) { session.sessionComplete(); });
      break;
    case kCrowdsourcingFeedback:
      assembly_.tally.add("com.kestrel.sabled.dp.submit", 1);
      inSessionOfItsOwn(std::move(message), queryId, [](Assembly& assembly, ClientSession& session) {
        if (!session.storageHandle()) return;
        assembly.persistentStorage->closeCrowdsourcingSessionWithFileContainer(session.storageHandle());
      });
      break;
    default:
      break;
  }
}

/// Later: a session makes a file.
void ClientConnection::inSessionOfItsOwn(std::unique_ptr<FeedbackMessage> message, std::int64_t queryId,
                                         void (*complete)(Assembly&, ClientSession&)) {
  auto feedback = std::make_shared<SableFeedback>(std::move(message), queryId, std::nullopt,
                                                  state_->userAgent().value_or(""));
  assembly_.runtime.globalQueue(QualityOfService::background)
      .async([&assembly = assembly_, feedback = std::move(feedback), complete] {
        ClientSession session(assembly, feedback);
        complete(assembly, session);
      });
}

void ClientConnection::feedback(platform::RelayReply reply) {
  SBLTracePoint(kTraceFeedback);
  _ensureState();
  platform::RelayStrings texts;
  const auto* sessionManager = state_ == nullptr ? nullptr : state_->sessionManager();
  if (const auto session = sessionManager == nullptr ? nullptr : sessionManager->session()) {
    for (const Dictionary& feedback : session->feedbacksWithRelativeTimestamp()) {
      texts.push_back(compactJSON(feedback));
    }
  }
  reply(std::move(texts), RelayRecord{});
}

}  // namespace sable
