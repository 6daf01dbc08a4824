#include "platform/TransferRetry.h"

#include <curl/curl.h>

#include <algorithm>
#include <charconv>

namespace sable::platform {
namespace {

using std::chrono::seconds;

// Longer than any task waits.
constexpr seconds kLongestAsked = std::chrono::hours(24 * 366);

Duration pauseBound(int attempts) {
  Duration bound = kFirstRetryPause;
  for (int i = 1; i < attempts && bound < kLongestRetryPause; ++i) bound *= 2;
  return std::min(bound, kLongestRetryPause);
}

Duration part(Duration whole, double share) {
  return std::chrono::duration_cast<Duration>(whole * share);
}

std::optional<WallTime> dateIn(const std::string* text) {
  if (text == nullptr || text->find(' ') == std::string::npos) return std::nullopt;
  const time_t time = curl_getdate(text->c_str(), nullptr);
  if (time < 0) return std::nullopt;
  return WallTime(seconds(time));
}

}  // namespace

Duration retryPause(int attempts, double chance) {
  return part(pauseBound(attempts), 0.5 + chance / 2);
}

Duration retryPauseAsked(Duration asked, int attempts, double chance) {
  return asked + part(std::max(asked / 2, pauseBound(attempts)), chance);
}

Duration spreadPause(Duration pause, double chance) {
  return part(pause, chance);
}

std::optional<Duration> retryAfter(const HTTPResponse& response, WallTime now) {
  if (response.status != 503 && response.status != 429) return std::nullopt;
  const std::string* text = response.headers.find("Retry-After");
  if (text == nullptr || text->empty()) return std::nullopt;
  if (text->find_first_not_of("0123456789") == std::string::npos) {
    seconds::rep count = 0;
    const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), count);
    if (error != std::errc()) return kLongestAsked;
    return seconds(std::min(count, kLongestAsked.count()));
  }
  const auto until = dateIn(text);
  if (!until) return std::nullopt;
  const auto from = dateIn(response.headers.find("Date")).value_or(now);
  return std::clamp(*until - from, Duration{}, Duration(kLongestAsked));
}

bool isWorthRetrying(const Error& error) {
  using enum HTTPErrorCode;
  if (error.domain != kHTTPErrorDomain) return false;
  switch (static_cast<HTTPErrorCode>(error.code)) {
    case badURL:
    case tooManyRedirects:
    case responseTooLarge:
    case cancelled:
    case notAllowed:
      return false;
    default:
      return true;
  }
}

}  // namespace sable::platform
