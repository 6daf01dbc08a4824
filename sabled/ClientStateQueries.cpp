#include <fmt/core.h>

#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "platform/NetworkServiceProxy.h"
#include "platform/Tally.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientStateQuery.h"
#include "sabled/QueryCache.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SBLRetryableNetworkRequest.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/SearchExplanation.h"
#include "sabled/UTF16Length.h"

// The road of a query to the service: the gates that may refuse it, the cache that may answer it, the
// request.
namespace sable {

using platform::HTTPDataTask;
using platform::HTTPRequest;
using platform::HTTPResult;

ClientState::Query ClientState::makeQuery(const QueryKind& kind, const SBLRequest& request,
                                          const std::string& input, SBLReplyHandler reply) const {
  Query query(kind, request, input, userAgent().value_or(""), std::move(reply));
  if (lowercasedASCII(query.userAgent).find("messages") != std::string::npos) {
    query.fieldMask = kSBLFieldMaskNoLocation;
  }
  return query;
}

std::shared_ptr<ClientState::Query> ClientState::begin(const QueryKind& kind, const SBLRequest& request,
                                                       const std::string& input, SBLReplyHandler reply) {
  auto query = std::make_shared<Query>(makeQuery(kind, request, input, std::move(reply)));
  query->log().standard(fmt::runtime(kind.performing), identifier_, query->queryId, input, "(reply)");
  return query;
}

ClientState::Verdict ClientState::judge(Query& query, SearchExplanation* why) {
  const bool hasBag = _ensureBag();
  if (hasBag) query.bag = heldBag();
  const auto gate = [why](std::string_view name, auto found, auto wanted, bool passes) {
    return why == nullptr ? passes : why->gate(name, fmt::format("{}", found), wanted(), passes);
  };
  if (!gate(
          "bag", hasBag ? "version " + query.bag->version() : "none", [] { return "one within a second"; },
          hasBag)) {
    return Verdict::bagMissing;
  }
  const bool enabled = query.bag->isEnabled();
  if (!gate(
          "enabled in the bag", enabled, [] { return "true"; }, enabled))
    return Verdict::bagDisabled;
  if (!query.kind.hasMinimumLength) return Verdict::passes;
  const std::size_t length = lengthInUTF16(query.input);
  const std::uint64_t minimum = query.bag->minimumQueryLength();
  const bool longEnough = gate(
      "length of the input", length, [&] { return fmt::format("at least {}", minimum); }, length >= minimum);
  return longEnough ? Verdict::passes : Verdict::inputTooShort;
}

bool ClientState::refuses(Query& query) {
  std::optional<Error> error;
  const Verdict verdict = judge(query, nullptr);
  switch (verdict) {
    case Verdict::passes:
      return false;
    case Verdict::bagMissing:
      query.log().error(fmt::runtime(query.kind.bagFetchFailed), identifier_, query.queryId, query.input, "");
      error = makeSBLError(SBLErrorCode::bagMissing, "timeout");
      break;
    case Verdict::bagDisabled:
      query.log().info(fmt::runtime(query.kind.bagDisabled), identifier_, query.queryId, query.input, "");
      break;
    case Verdict::inputTooShort:
      query.log().info("query[{}] input '{}' less than {}", query.queryId, query.input,
                       query.bag->minimumQueryLength());
      break;
  }
  query.reply(query.queryId, std::nullopt, std::move(error));
  skipSearchFeedback(query, verdict);
  return true;
}

void ClientState::search(const SBLSearchRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kSearch, request, request.queryString, std::move(reply));
  count("keystrokes");
  if (refuses(*query)) return;
  if (const auto hit = cachedAnswer(request, nullptr)) return answerFromCache(*query, *hit);
  if (queryCache_ != nullptr) query->cacheGeneration = queryCache_->generation();
  dispatch(query, searchRequest(*query, request, nullptr));
  assembly_.tally.add(kSBLSearchCounterKey, 1);
  assembly_.requestFactory->setPerformedSearch();
}

std::optional<HTTPRequest> ClientState::searchRequest(const Query& query, const SBLSearchRequest& request,
                                                      RequestTrace* trace) const {
  return assembly_.requestFactory->searchRequest(request, *query.bag, guidController_->currentUserGUID(),
                                                 query.fieldMask, trace);
}

void ClientState::explain(const SBLSearchRequest& request, SearchExplanation& why) {
  using Outcome = SearchExplanation::Outcome;
  Query query = makeQuery(kSearch, request, request.queryString, {});
  const Verdict verdict = judge(query, &why);
  if (verdict != Verdict::passes) {
    why.outcome = verdict == Verdict::bagMissing ? Outcome::error : Outcome::nothing;
  } else if (cachedAnswer(request, &why) != nullptr) {
    why.outcome = Outcome::cache;
  } else {
    why.request = searchRequest(query, request, &why.trace);
    why.throughProxy = routesThroughProxy(query);
    why.outcome = why.request ? Outcome::network : Outcome::error;
  }
}

void ClientState::zeroKeyword(const SBLZeroKeywordRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kZeroKeyword, request, "", std::move(reply));
  if (refuses(*query)) return;
  dispatch(query, assembly_.requestFactory->zeroKeywordRequest(
                      request, *query->bag, guidController_->currentUserGUID(), query->fieldMask));
}

void ClientState::lookup(const SBLLookupRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kLookup, request, request.queryString, std::move(reply));
  if (refuses(*query)) return;
  query->expire = assembly_.runtime.now() + platform::fromSeconds(query->bag->searchRenderTimeout());
  query->lookupSelectionType = request.lookupSelectionType;
  dispatch(query,
           assembly_.requestFactory->lookupRequest(request, *query->bag, guidController_->currentUserGUID()));
}

void ClientState::moreResults(const SBLMoreResultsRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kMoreResults, request, "", std::move(reply));
  if (refuses(*query)) return;
  dispatch(query, assembly_.requestFactory->moreResultsRequest(
                      request, *query->bag, guidController_->currentUserGUID(), query->fieldMask));
}

void ClientState::card(const SBLCardRequest& request, SBLReplyHandler reply) {
  const auto query = begin(kCard, request, "", std::move(reply));
  if (refuses(*query)) return;
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
  query->uuid = assembly_.runtime.uuid();
  startNetworkFeedback(*query);

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

}  // namespace sable
