#include "platform/HTTPSession.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientStateQuery.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/SableFeedback.h"
#include "sabled/UserAgent.h"

// What the road of a query leaves in the client's session.
namespace sable {

using feedback::SkipSearchTrigger;
using platform::HTTPErrorCode;
using platform::HTTPResult;

namespace {

/// What the service knows an end by that never reached it.
constexpr const char* kNoConnection = "noconnection";

/// Whether there was no connection to the service, or it broke: the network's fault. A time-out, a
/// certificate or an answer that is none may be the service's.
bool meansNoConnection(const Error& error) {
  if (error.domain != platform::kHTTPErrorDomain) return false;
  switch (static_cast<HTTPErrorCode>(error.code)) {
    case HTTPErrorCode::cannotFindHost:
    case HTTPErrorCode::cannotConnect:
    case HTTPErrorCode::connectionLost:
    case HTTPErrorCode::proxyFailed:
      return true;
    default:
      return false;
  }
}

}  // namespace

void ClientState::record(const Query& query, std::unique_ptr<FeedbackMessage> message) const {
  sessionManager_->addSableFeedback(
      std::make_shared<SableFeedback>(std::move(message), static_cast<std::int64_t>(query.queryId),
                                      std::nullopt, query.userAgent, query.clientQueryId));
}

bool ClientState::isRecorded(const Query& query) const {
  return sessionManager_ != nullptr && query.kind.isRecorded;
}

void ClientState::skipSearchFeedback(const Query& query, Verdict verdict) const {
  if (!isRecorded(query)) return;
  const SkipSearchTrigger trigger = verdict == Verdict::bagMissing ? SkipSearchTrigger::bagFetchFailed
                                    : verdict == Verdict::bagDisabled
                                        ? SkipSearchTrigger::bagDisabled
                                        : SkipSearchTrigger::lessThanMinimumQueryLength;
  record(query, feedback::skipSearch(assembly_.runtime.ticks(), trigger, query.recordedInput()));
}

void ClientState::cacheHitFeedback(const Query& query, const CachedResultSet& hit) const {
  if (!isRecorded(query)) return;
  record(query, feedback::cacheHit(assembly_.runtime.ticks(), query.recordedInput(), hit.uuid.string()));
}

void ClientState::startNetworkFeedback(const Query& query) const {
  if (!isRecorded(query)) return;
  const auto now = assembly_.runtime.ticks();
  const std::string uuid = query.uuid.string();
  const feedback::NetworkSearch search{.triggerEvent = query.triggerEvent,
                                       .endpoint = feedback::Endpoint::sableSearch,
                                       .input = query.recordedInput(),
                                       .request = query.httpRequest,
                                       .uuid = uuid};
  record(query, query.lookupSelectionType
                    ? feedback::startLookupNetworkSearch(now, search, *query.lookupSelectionType)
                    : feedback::startNetworkSearch(now, search));
}

void ClientState::endNetworkFeedback(const Query& query, const HTTPResult& result,
                                     const SableAnswer& answer) const {
  if (!isRecorded(query)) return;
  record(query, feedback::endSableNetworkSearch(assembly_.runtime.ticks(),
                                                feedback::endOf(result, query.uuid.string()), answer));
}

void ClientState::failSearchFeedback(const Query& query, const HTTPResult& result) const {
  SableAnswer answer;
  if (result.error && meansNoConnection(*result.error)) answer.status = kNoConnection;
  endNetworkFeedback(query, result, answer);
}

std::string ClientState::startWarmFeedback(const platform::HTTPRequest& request) const {
  std::string uuid = assembly_.runtime.uuid().string();
  recordOfDaemon(
      feedback::startNetworkSearch(assembly_.runtime.ticks(), {.triggerEvent = feedback::kWarmTrigger,
                                                               .endpoint = feedback::Endpoint::sableWarm,
                                                               .input = "",
                                                               .request = request,
                                                               .uuid = uuid}));
  return uuid;
}

void ClientState::endWarmFeedback(const HTTPResult& result, const std::string& uuid) const {
  recordOfDaemon(feedback::endNetworkSearch(assembly_.runtime.ticks(), feedback::endOf(result, uuid)));
}

void ClientState::recordOfDaemon(std::unique_ptr<FeedbackMessage> message) const {
  if (assembly_.clientSessionManager == nullptr) return;
  assembly_.clientSessionManager->addSableFeedback(std::make_shared<SableFeedback>(
      std::move(message), 0, std::nullopt, sabledUserAgent(assembly_.platform.deviceInfo())));
}

}  // namespace sable
