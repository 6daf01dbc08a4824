#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Data.h"
#include "platform/Runtime.h"
#include "platform/UUID.h"
#include "sabled/SearchResponse.h"

namespace sable::platform {
struct HTTPRequest;
}

namespace sable {

/// The nearest float; of numbers that no float reaches, the greatest or the least there is.
float nearestFloat(double number);

/// A result set of the service, kept to answer the inputs that its query completes. Immutable. Texts
/// are in lower case, and lengths are theirs, in UTF-16 code units.
class CachedResultSet {
 public:
  /// `input` is what was typed, `request` what was sent for it, `data` the whole answer, which all
  /// its result sets share, and `uuid` the answer's.
  CachedResultSet(std::string_view input, const platform::HTTPRequest& request,
                  SearchResponse::ResultSet resultSet, const UUID& uuid, Data data, platform::WallTime now);

  const std::string input;
  const std::string query;  ///< the completed query, the key in the cache
  const std::size_t inputLength, queryLength;
  const float completionScore;
  const std::optional<platform::WallTime> expireTime;  ///< none: time does not end it
  const float uiScale;                                 ///< that the request told; 0: it told none
  const UUID uuid;
  const SearchResponse::ResultSet resultSet;
  const Data data;

  std::size_t cost() const { return data == nullptr ? 0 : data->size(); }  ///< bytes
};

}  // namespace sable
