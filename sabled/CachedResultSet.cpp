#include "sabled/CachedResultSet.h"

#include <algorithm>
#include <charconv>
#include <limits>
#include <utility>

#include "platform/HTTPSession.h"
#include "platform/Lowercase.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/UTF16Length.h"

namespace sable {
namespace {

constexpr double kLongestAge = 3.2e9;  // seconds: a century, short of where times of day end

std::optional<platform::WallTime> expiry(double maxAge, platform::WallTime now) {
  if (maxAge == 0) return std::nullopt;
  return now + platform::fromSeconds(std::clamp(maxAge, -kLongestAge, kLongestAge));
}

float scaleOf(const platform::HTTPRequest& request) {
  float scale = 0;
  if (const std::string* text = request.headers.find(kUIScaleHeader)) {
    std::from_chars(text->data(), text->data() + text->size(), scale);
  }
  return scale;
}

}  // namespace

float nearestFloat(double number) {
  constexpr double kMost = std::numeric_limits<float>::max();
  return static_cast<float>(std::clamp(number, -kMost, kMost));
}

CachedResultSet::CachedResultSet(std::string_view typed, const platform::HTTPRequest& request,
                                 SearchResponse::ResultSet set, const UUID& answer, Data bytes,
                                 platform::WallTime now)
    : input(platform::lowercased(typed)),
      query(platform::lowercased(set.query)),
      inputLength(lengthInUTF16(input)),
      queryLength(lengthInUTF16(query)),
      completionScore(nearestFloat(set.completionScore)),
      expireTime(expiry(set.maxAge, now)),
      uiScale(scaleOf(request)),
      uuid(answer),
      resultSet(std::move(set)),
      data(std::move(bytes)) {}

}  // namespace sable
