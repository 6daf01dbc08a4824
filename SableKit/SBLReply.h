#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/Data.h"
#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/HTTPSession.h"

namespace sable {

/// What the service answered, as it reaches the client.
struct SBLReply {
  double scale = 0;  ///< the request's
  Data data;         ///< the raw bytes of the answer
  std::optional<std::string> geoSessionEntityString;
  // Only in verbose replies; an answer from the cache has neither.
  std::optional<platform::HTTPRequest> httpRequest;
  std::optional<platform::HTTPResponse> httpResponse;
};

/// Called exactly once per query, on any queue: query id, reply or none, error or none.
using SBLReplyHandler =
    platform::Function<void(std::uint64_t, std::optional<SBLReply>, std::optional<Error>)>;

}  // namespace sable
