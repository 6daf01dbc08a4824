#pragma once

#include <cstdint>
#include <optional>
#include <utility>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLReply.h"
#include "platform/Relay.h"

namespace sable {

/// Answers a Request call: query id, reply, error.
inline void sendRequestReply(platform::RelayReply& relayReply, std::uint64_t queryId,
                             const std::optional<SBLReply>& reply, const std::optional<Error>& error) {
  relayReply(queryId, encodeReply(reply), encodeError(error));
}

/// The handler that answers a Request call with what a query ends with.
inline SBLReplyHandler replyHandler(platform::RelayReply relayReply) {
  return [relayReply = std::move(relayReply)](std::uint64_t queryId, const std::optional<SBLReply>& reply,
                                              const std::optional<Error>& error) mutable {
    sendRequestReply(relayReply, queryId, reply, error);
  };
}

}  // namespace sable
