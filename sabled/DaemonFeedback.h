#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/HTTPSession.h"
#include "sabled/FeedbackMessage.h"
#include "sabled/SableAnswer.h"

/// What the daemon reports of itself. Every maker takes the time of the event, on the daemon's
/// monotonic clock, and never fails: bytes of a text that are no UTF-8 are replaced. Any thread.
namespace sable::feedback {

using Message = std::unique_ptr<FeedbackMessage>;

// Values of the tables in FeedbackTables.h that the daemon itself records: never renumber.
enum class SkipSearchTrigger : std::uint32_t {
  lessThanMinimumQueryLength = 1,
  bagDisabled = 2,
  bagFetchFailed = 3,
  cacheHit = 4,
};
enum class Endpoint : std::uint32_t { sableSearch = 6, sableBag = 10, sableWarm = 12 };
inline constexpr std::int64_t kBagTrigger = 16, kWarmTrigger = 19;
enum class SessionEndReason : std::uint32_t {
  noPreviousSession = 0,
  externalRequest = 1,
  sessionIdle = 2,
  maxSessionTimePassed = 3,
  guidChanged = 4,
  criticalMemory = 5,
  engagementReceived = 6,
};
/// The words of a reason, as in the upload's envelope; empty for a number that is none.
std::string_view triggerEventEnumToString(std::uint32_t sessionEndReason);

/// A search that was answered without the service, or not at all.
Message skipSearch(platform::MonotonicTime time, SkipSearchTrigger trigger, std::string_view input);
/// `uuid` is that of the search whose answer was used.
Message cacheHit(platform::MonotonicTime time, std::string_view input, std::string_view uuid);

/// A request that leaves for the service. Texts are the caller's.
struct NetworkSearch {
  std::int64_t triggerEvent = 0;  ///< the client's, or kBagTrigger, kWarmTrigger
  Endpoint endpoint = Endpoint::sableSearch;
  std::string_view input;
  const platform::HTTPRequest& request;
  std::string_view uuid;  ///< new for every request; its end names it again
};
Message startNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search);
Message startLookupNetworkSearch(platform::MonotonicTime time, const NetworkSearch& search,
                                 std::int64_t lookupSelectionType);

/// How such a request ended.
struct NetworkSearchEnd {
  std::string_view uuid;  ///< of its start
  std::int64_t responseSize = 0;
  int statusCode = 0;  ///< 0: no response
  platform::HTTPTaskTiming timing;
};
NetworkSearchEnd endOf(const platform::HTTPResult& result, std::string_view uuid);
/// The end of a bag or warm-up request.
Message endNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end);
/// The end of a search, zero-keyword or lookup request.
Message endSableNetworkSearch(platform::MonotonicTime time, const NetworkSearchEnd& end,
                              const SableAnswer& answer);

Message error(platform::MonotonicTime time, const Error& error, const Error* underlying = nullptr);
Message sessionEnd(platform::MonotonicTime time, SessionEndReason reason);
Message connectionInvalidated(platform::MonotonicTime time);

/// What was shown in a session and never used, as SessionProcessingHelper remembers it.
Message sessionMissingResults(platform::MonotonicTime time, const std::vector<std::string>& results);
Message sessionMissingSuggestions(platform::MonotonicTime time, const std::vector<std::string>& suggestions);

}  // namespace sable::feedback
