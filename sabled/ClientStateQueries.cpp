#include <fmt/core.h>

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "platform/Dictionary.h"
#include "platform/NetworkServiceProxy.h"
#include "platform/Tally.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientState.h"
#include "sabled/ClientStateManager.h"
#include "sabled/QueryCache.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SBLRetryableNetworkRequest.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/SearchResponse.h"
#include "sabled/UTF16Length.h"

// The road of a query: the gates that may refuse it, the request to the service, the answer.
namespace sable {

using platform::HTTPDataTask;
using platform::HTTPRequest;
using platform::HTTPResult;

/// What tells one kind of query from another. Messages may name {0} the client identifier, {1} the
/// query id, {2} the input and {3} the reply.
struct ClientState::QueryKind {
  SableLoggingCategory category;
  const char* performing;
  const char* bagFetchFailed;
  const char* bagDisabled;
  const char* dispatching;
  const char* gotResponse;
  bool mayUseProxy;
  unsigned retries;
  bool delayOnFail;
  const char* fetchFailed = nullptr;  ///< {0} HTTP status, {1} error
  bool expectsObject = false;
};

/// A query under way.
struct ClientState::Query {
  Query(const QueryKind& queryKind, const SBLRequest& request, std::string text, SBLReplyHandler handler)
      : kind(queryKind),
        queryId(request.queryId),
        scale(request.scale),
        verboseReply(request.verboseReply),
        input(std::move(text)),
        reply(std::move(handler)) {}

  const platform::LogHandle& log() const { return SableLogForCategory(kind.category); }

  const QueryKind& kind;
  const std::uint64_t queryId;
  const double scale;
  const bool verboseReply;
  const std::string input;
  SBLReplyHandler reply;

  std::shared_ptr<const SBLBag> bag;
  unsigned fieldMask = 0;
  std::optional<platform::WallTime> expire;
  HTTPRequest httpRequest;
};

const ClientState::QueryKind ClientState::kSearch{
    .category = SableLoggingCategorySearch,
    .performing = "session {0} performing query[{1}] {2}, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached query {2}.",
    .bagDisabled = "no search, bag disabled",
    .dispatching = "Dispatching network request for (id, query): ({1}, {2})",
    .gotResponse = "Got network response for (id, query): ({1}, {2})",
    .mayUseProxy = true,
    .retries = 0,
    .delayOnFail = false,
};

const ClientState::QueryKind ClientState::kZeroKeyword{
    .category = SableLoggingCategoryZeroKeyword,
    .performing = "session {0} performing zkw query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached zkw query.",
    .bagDisabled = "no zkw, bag disabled",
    .dispatching = "Dispatching network request for zkw query",
    .gotResponse = "Got network response for zkw query",
    .mayUseProxy = false,
    .retries = 0,
    .delayOnFail = false,
};

const ClientState::QueryKind ClientState::kLookup{
    .category = SableLoggingCategoryLookUp,
    .performing = "session {0} performing lookup query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached lookup query.",
    .bagDisabled = "no lookup, bag disabled",
    .dispatching = "Dispatching network request for lookup query",
    .gotResponse = "Got network response for lookup query",
    .mayUseProxy = true,
    .retries = 2,  // within the time a rendered page waits for them
    .delayOnFail = false,
};

const ClientState::QueryKind ClientState::kMoreResults{
    .category = SableLoggingCategoryMoreResults,
    .performing = "session {0} performing more results query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached more results query.",
    .bagDisabled = "no more results, bag disabled",
    .dispatching = "Dispatching network request for more results query",
    .gotResponse = "Got network response for more results query",
    .mayUseProxy = true,
    .retries = 2,  // a person waits: two more tries, a moment apart
    .delayOnFail = true,
    .fetchFailed = "More results fetch failed with HTTP status code {} error {}",
    .expectsObject = true,
};

const ClientState::QueryKind ClientState::kCard{
    .category = SableLoggingCategoryCard,
    .performing = "session {0} performing card query, reply {3}",
    .bagFetchFailed = "Bag fetch failed, can't complete non-cached card query.",
    .bagDisabled = "no card, bag disabled",
    .dispatching = "Dispatching network request for card query",
    .gotResponse = "Got network response for card query",
    .mayUseProxy = true,
    .retries = 2,
    .delayOnFail = true,
    .fetchFailed = "Card fetch failed with HTTP status code {} error {}",
    .expectsObject = true,
};

std::shared_ptr<ClientState::Query> ClientState::begin(const QueryKind& kind, const SBLRequest& request,
                                                       const std::string& input, SBLReplyHandler reply) {
  auto query = std::make_shared<Query>(kind, request, input, std::move(reply));
  query->log().standard(fmt::runtime(kind.performing), identifier_, query->queryId, input, "(reply)");
  const std::string agent = lowercasedASCII(userAgent().value_or(""));
  if (agent.find("messages") != std::string::npos) query->fieldMask = kSBLFieldMaskNoLocation;
  return query;
}

bool ClientState::passesGates(Query& query) {
  if (!_ensureBag()) {
    query.log().error(fmt::runtime(query.kind.bagFetchFailed), identifier_, query.queryId, query.input, "");
    query.reply(query.queryId, std::nullopt, makeSBLError(SBLErrorCode::bagMissing, "timeout"));
    return false;
  }
  query.bag = heldBag();
  if (!query.bag->isEnabled()) {
    query.log().info(fmt::runtime(query.kind.bagDisabled), identifier_, query.queryId, query.input, "");
    query.reply(query.queryId, std::nullopt, std::nullopt);
    return false;
  }
  return true;
}

void ClientState::search(const SBLSearchRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kSearch, request, request.queryString, std::move(reply));
  count("keystrokes");
  if (!passesGates(*query)) return;
  const std::uint64_t minimum = query->bag->minimumQueryLength();
  if (lengthInUTF16(query->input) < minimum) {
    query->log().info("query[{}] input '{}' less than {}", query->queryId, query->input, minimum);
    query->reply(query->queryId, std::nullopt, std::nullopt);
    return;
  }
  if (answerFromCache(*query, request)) return;
  dispatch(query, assembly_.requestFactory->searchRequest(
                      request, *query->bag, guidController_->currentUserGUID(), query->fieldMask));
  assembly_.tally.add(kSBLSearchCounterKey, 1);
}

void ClientState::zeroKeyword(const SBLZeroKeywordRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kZeroKeyword, request, "", std::move(reply));
  if (!passesGates(*query)) return;
  dispatch(query, assembly_.requestFactory->zeroKeywordRequest(
                      request, *query->bag, guidController_->currentUserGUID(), query->fieldMask));
}

void ClientState::lookup(const SBLLookupRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kLookup, request, request.queryString, std::move(reply));
  if (!passesGates(*query)) return;
  query->expire = assembly_.runtime.now() + platform::fromSeconds(query->bag->searchRenderTimeout());
  dispatch(query,
           assembly_.requestFactory->lookupRequest(request, *query->bag, guidController_->currentUserGUID()));
}

void ClientState::moreResults(const SBLMoreResultsRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kMoreResults, request, "", std::move(reply));
  if (!passesGates(*query)) return;
  dispatch(query, assembly_.requestFactory->moreResultsRequest(
                      request, *query->bag, guidController_->currentUserGUID(), query->fieldMask));
}

void ClientState::card(const SBLCardRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kCard, request, "", std::move(reply));
  if (!passesGates(*query)) return;
  dispatch(query,
           assembly_.requestFactory->cardRequest(request, *query->bag, guidController_->currentUserGUID()));
}

void ClientState::flightSearch(const SBLFlightSearchRequest& request, SBLReplyHandler reply) {
  reply(request.queryId, std::nullopt, std::nullopt);
}

void ClientState::flightLookup(const SBLFlightLookupRequest& request, SBLReplyHandler reply) {
  reply(request.queryId, std::nullopt, std::nullopt);
}

void ClientState::dispatch(const std::shared_ptr<Query>& query, std::optional<HTTPRequest> request) {
  const QueryKind& kind = query->kind;
  // A bag without a search URL makes a request that no session can send; its error says so.
  query->httpRequest = std::move(request).value_or(HTTPRequest{});
  query->log().info(fmt::runtime(kind.dispatching), identifier_, query->queryId, query->input, "");
  query->log().info("request: {} header: {}", query->httpRequest.url,
                    query->httpRequest.headers.description());

  auto retryable = std::make_shared<SBLRetryableNetworkRequest>(
      SBLRetryableNetworkRequest{query->httpRequest, query->expire, kind.delayOnFail});
  const auto prepare = [this, query](HTTPDataTask& task) {
    if (routesThroughProxy(*query)) enableProxy(task);
  };
  const auto task = dataTaskWithRetryableRequest(
      assembly_.runtime, assembly_.urlSession(), std::move(retryable), 1, kind.retries,
      [self = shared_from_this(), query](HTTPResult result) { self->didComplete(*query, std::move(result)); },
      prepare);
  task->resume();
  _markNetworkRequest();
}

bool ClientState::routesThroughProxy(const Query& query) const {
  return query.kind.mayUseProxy && (query.fieldMask & kSBLFieldMaskNoLocation) == 0 &&
         assembly_.useBramble() && assembly_.platform.networkServiceProxy().isEnabled();
}

void ClientState::didComplete(Query& query, HTTPResult result) {
  const auto& log = query.log();
  const int status = result.response ? result.response->status : 0;
  if (result.response) recordSearchResult(status);
  log.standard(fmt::runtime(query.kind.gotResponse), identifier_, query.queryId, query.input, "");
  log.info("resp: {}", result.response ? result.response->description() : "(null)");
  if (query.kind.fetchFailed != nullptr && (result.error || status != 200)) {
    log.error(fmt::runtime(query.kind.fetchFailed), status,
              result.error ? result.error->description() : "(null)");
  }
  if (result.error || result.data == nullptr) {
    log.error("error with request {}", result.error ? result.error->description() : "(null)");
    return query.reply(query.queryId, std::nullopt, result.error);
  }
  if (!result.response) {
    log.error("not http response? {}", "(null)");
    return query.reply(query.queryId, std::nullopt,
                       makeSBLError(SBLErrorCode::daemonSide, "invalid response class"));
  }

  std::optional<Error> parseError = processAnswer(query, result.data);
  SBLReply reply = replyWith(query, std::move(result.data));
  if (query.verboseReply) {
    reply.httpRequest = query.httpRequest;
    reply.httpResponse = std::move(result.response);
  }
  query.reply(query.queryId, std::move(reply), std::move(parseError));
  if (&query.kind == &kSearch) forceFetch(query.httpRequest);
}

/// Takes from an answer what concerns the daemon; says why it is no JSON, if it is none.
std::optional<Error> ClientState::processAnswer(const Query& query, const Data& data) {
  const auto response = SearchResponse::parse(*data);
  std::optional<Error> parseError = response ? std::nullopt : std::optional(response.error());
  if (response) {
    assembly_.clientStateManager->processImagesFromResponse(*response, *query.bag);
    if (&query.kind == &kSearch) _cacheResponse(*response, query, data, assembly_.runtime.uuid());
  }
  if (query.kind.expectsObject && (!response || !response->isObject)) {
    // The missing word after "for" is part of the line that log readers match.
    query.log().error(
        "Failed to deserialize card details for into a dictionary. Error: {}. Response data: \"{}\"",
        parseError ? parseError->description() : "(null)", *data);
  }
  return parseError;
}

/// Answers a search from what the service said to an earlier one, if it can.
bool ClientState::answerFromCache(Query& query, const SBLSearchRequest& request) {
  if (queryCache_ == nullptr) return false;
  const auto hit = queryCache_->getRequest(request);
  // Whoever forces query items wants to know what the service makes of them.
  if (hit == nullptr || !request.queryItems.empty()) return false;
  query.reply(query.queryId, replyWith(query, hit->data), std::nullopt);
  count("ondevicecachehits");
  return true;
}

void ClientState::_cacheResponse(const SearchResponse& response, const Query& query, const Data& data,
                                 const UUID& uuid) {
  if (queryCache_ == nullptr) return;
  const platform::WallTime now = assembly_.runtime.now();
  for (const SearchResponse::ResultSet& set : response.resultSets) {
    if (set.status == "ERROR") continue;
    queryCache_->set(
        std::make_shared<const CachedResultSet>(query.input, query.httpRequest, set, uuid, data, now));
  }
}

SBLReply ClientState::replyWith(const Query& query, Data data) const {
  SBLReply reply;
  reply.scale = query.scale;
  reply.data = std::move(data);
  if (const auto entity = assembly_.requestFactory->getMapsUserSessionEntityAndReset(false)) {
    reply.geoSessionEntityString = entity->entityString;
  }
  return reply;
}

void ClientState::recordSearchResult(int status) {
  if (userAgent()) count(fmt::format("fedapicall.serverstatus.{}", status));
}

void ClientState::forceFetch(const HTTPRequest& request) {
  // Read from the request that was sent, not from the response: deployments set it there, as a
  // debugging aid, and count on it.
  const std::string* header = request.headers.find("X-Kestrel-ForceFetch");
  if (header == nullptr || header->empty()) return;
  constexpr std::size_t kMaximumBytes = 64u << 10;
  const auto announcement = parseJSON(*header, kMaximumBytes);
  if (!announcement || !announcement->is_object()) {
    SableLogForCategory(SableLoggingCategorySearch)
        .error("Failed to deserialize X-Kestrel-ForceFetch header data into a dictionary: {}",
               announcement ? "(null)" : announcement.error().description());
    return;
  }
  if (userAgent()) assembly_.bagController->forceFetchBag(*announcement);
}

}  // namespace sable
