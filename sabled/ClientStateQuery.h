#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "platform/HTTPSession.h"
#include "platform/Runtime.h"
#include "sabled/ClientState.h"
#include "sabled/SableLogging.h"

// What the sources of ClientState share about a query.
namespace sable {

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
  bool hasMinimumLength = false;
  const char* fetchFailed = nullptr;  ///< {0} HTTP status, {1} error
  bool expectsObject = false;
  bool isRecorded = false;  ///< in the client's session
};

/// A query under way.
struct ClientState::Query {
  Query(const QueryKind& queryKind, const SBLRequest& request, std::string text, std::string agent,
        SBLReplyHandler handler)
      : kind(queryKind),
        queryId(request.queryId),
        clientQueryId(request.clientQueryId),
        triggerEvent(request.triggerEvent),
        scale(request.scale),
        verboseReply(request.verboseReply),
        input(std::move(text)),
        userAgent(std::move(agent)),
        reply(std::move(handler)) {}

  const platform::LogHandle& log() const { return SableLogForCategory(kind.category); }
  /// The input as feedback tells it. What somebody selected to look it up stays on the device.
  std::string_view recordedInput() const { return kind.hasMinimumLength ? input : std::string_view(); }

  const QueryKind& kind;
  const std::uint64_t queryId;
  const std::uint64_t clientQueryId;
  const std::int64_t triggerEvent;
  const double scale;
  const bool verboseReply;
  const std::string input;
  const std::string userAgent;
  SBLReplyHandler reply;

  std::shared_ptr<const SBLBag> bag;
  unsigned fieldMask = 0;
  std::optional<platform::WallTime> expire;
  std::optional<std::int64_t> lookupSelectionType;  ///< of lookups
  platform::HTTPRequest httpRequest;
  std::uint64_t cacheGeneration = 0;  ///< when it was asked
  UUID uuid;                          ///< of the request, in its feedback and in what is cached of its answer
};

}  // namespace sable
