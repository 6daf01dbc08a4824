#pragma once

#include <optional>

#include "platform/HTTPSession.h"

/// When a background transfer that came to nothing is tried again.
namespace sable::platform {

/// Before the second attempt; doubles with every further one.
inline constexpr Duration kFirstRetryPause = std::chrono::seconds(5);
inline constexpr Duration kLongestRetryPause = std::chrono::hours(1);

/// The pause after `attempts` attempts (1 or more): between half and the whole of what it has doubled
/// to, as `chance` (0 up to 1) decides. Devices that lost the service together come apart by that, and
/// do not return together.
Duration retryPause(int attempts, double chance);

/// The pause after a response that asked for `asked`: never shorter than that, longer by chance, up to
/// half as much again and at least by the ordinary pause.
Duration retryPauseAsked(Duration asked, int attempts, double chance);

/// What is left of a pause that has passed while no process ran: any part of it, as `chance` decides.
Duration spreadPause(Duration pause, double chance);

/// What a 503 or 429 asks for by Retry-After (RFC 9110 section 10.2.3), in seconds or as a date, which
/// is taken by the service's clock where it tells its Date. Nothing for another response, and for a
/// field that is neither.
std::optional<Duration> retryAfter(const HTTPResponse& response, WallTime now);

/// Whether another attempt may end better than with this error of kHTTPErrorDomain.
bool isWorthRetrying(const Error& error);

}  // namespace sable::platform
