#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "platform/HTTPSession.h"
#include "platform/Runtime.h"

namespace sable {

/// A request that may be sent again after a transport error.
struct SBLRetryableNetworkRequest {
  platform::HTTPRequest httpRequest;
  std::optional<platform::WallTime> expire;  ///< no retry after this moment
  bool delayOnFail = false;                  ///< wait before each retry
};

/// How long a delayed retry waits.
inline constexpr platform::Duration kSBLRetryDelay = std::chrono::milliseconds(1500);

/// A task, not yet resumed, for the first attempt; later attempts start by themselves on a
/// high-priority global queue and cannot be cancelled through it. Only transport errors retry: an
/// HTTP status such as 500 is a completed task. `completion` (may be empty) hears of the final
/// outcome only, once, on the session's callback queue. `prepare` (may be empty) is called with
/// each task before it is resumed or returned, for routing.
std::shared_ptr<platform::HTTPDataTask> dataTaskWithRetryableRequest(
    platform::Runtime& runtime, platform::HTTPSession& session,
    const std::shared_ptr<const SBLRetryableNetworkRequest>& request, unsigned attempt,
    unsigned retriesRemaining, platform::HTTPSession::Completion completion,
    std::function<void(platform::HTTPDataTask&)> prepare = nullptr);

/// A count of monotonic ticks in whole milliseconds.
std::uint64_t mach_duration_to_milliseconds(std::uint64_t ticks);

}  // namespace sable
