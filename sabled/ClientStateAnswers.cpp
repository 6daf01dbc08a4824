#include <fmt/core.h>

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLError.h"
#include "platform/Dictionary.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientStateManager.h"
#include "sabled/ClientStateQuery.h"
#include "sabled/QueryCache.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SearchExplanation.h"
#include "sabled/SearchResponse.h"

// The road back: what the service answered, or what it answered earlier.
namespace sable {

using platform::HTTPRequest;
using platform::HTTPResult;

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
    query.reply(query.queryId, std::nullopt, result.error);
    return failSearchFeedback(query, result);
  }
  if (!result.response) {
    log.error("not http response? {}", "(null)");
    query.reply(query.queryId, std::nullopt,
                makeSBLError(SBLErrorCode::daemonSide, "invalid response class"));
    return failSearchFeedback(query, result);
  }

  std::optional<Error> parseError = processAnswer(query, result);
  SBLReply reply = replyWith(query, std::move(result.data));
  if (query.verboseReply) {
    reply.httpRequest = query.httpRequest;
    reply.httpResponse = std::move(result.response);
  }
  query.reply(query.queryId, std::move(reply), std::move(parseError));
  if (&query.kind == &kSearch) forceFetch(query.httpRequest);
}

/// Takes from an answer what concerns the daemon; says why it is no JSON, if it is none.
std::optional<Error> ClientState::processAnswer(const Query& query, const HTTPResult& result) {
  const auto response = SearchResponse::parse(*result.data);
  std::optional<Error> parseError = response ? std::nullopt : std::optional(response.error());
  if (response) {
    assembly_.clientStateManager->processImagesFromResponse(*response, *query.bag);
    if (&query.kind == &kSearch) _cacheResponse(*response, query, result.data, query.uuid);
  }
  if (query.kind.expectsObject && (!response || !response->isObject)) {
    // The missing word after "for" is part of the line that log readers match.
    query.log().error(
        "Failed to deserialize card details for into a dictionary. Error: {}. Response data: \"{}\"",
        parseError ? parseError->description() : "(null)", *result.data);
  }
  endNetworkFeedback(query, result, response ? response->account : SableAnswer{});
  return parseError;
}

std::shared_ptr<const CachedResultSet> ClientState::cachedAnswer(const SBLSearchRequest& request,
                                                                 SearchExplanation* why) const {
  using Use = SearchExplanation::CacheUse;
  const auto noted = [why](Use use) {
    if (why != nullptr) why->cacheUse = use;
  };
  if (queryCache_ == nullptr) {
    noted(Use::off);
    return nullptr;
  }
  auto hit = queryCache_->getRequest(request, why == nullptr ? nullptr : &why->cache);
  // Whoever forces query items wants to know what the service makes of them.
  if (hit != nullptr && !request.queryItems.empty()) {
    noted(Use::forcedItems);
    return nullptr;
  }
  noted(hit == nullptr ? Use::noCandidate : Use::hit);
  return hit;
}

void ClientState::answerFromCache(Query& query, const CachedResultSet& hit) {
  query.reply(query.queryId, replyWith(query, hit.data), std::nullopt);
  count("ondevicecachehits");
  cacheHitFeedback(query, hit);
}

void ClientState::_cacheResponse(const SearchResponse& response, const Query& query, const Data& data,
                                 const UUID& uuid) {
  if (queryCache_ == nullptr) return;
  // What has changed meanwhile has emptied the cache of answers like this one.
  if (queryCache_->generation() != query.cacheGeneration || userAgent() != query.userAgent) return;
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
