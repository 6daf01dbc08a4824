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
  platform::HTTPRequest httpRequest;
};

}  // namespace sable
