#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/URL.h"

/// The records with which clients ask. A class's name on the wire is its name here.
namespace sable {

/// What every request carries.
struct SBLRequest {
  std::uint64_t queryId = 0;  ///< chosen by the client, ascending from one search to the next
  std::uint64_t clientQueryId = 0;
  std::int64_t triggerEvent = 0;  ///< what made the client ask
  double scale = 0;               ///< pixels per point of the client's screen; 0: not given
  std::optional<std::string> keyboardInputMode;
  bool verboseReply = false;                       ///< the reply tells the HTTP request and response
  std::vector<platform::URLQueryItem> queryItems;  ///< forced on the request to the service
};

struct SBLSearchRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLSearchRequest";
  std::string queryString;
  std::optional<std::string> topics;  ///< JSON text
};

struct SBLMoreResultsRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLMoreResultsRequest";
  std::string moreResultsURL;
};

struct SBLCardRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLCardRequest";
  std::string cardURL;
};

struct SBLZeroKeywordRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLZeroKeywordRequest";
};

struct SBLLookupRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLLookupRequest";
  std::string queryString;
  std::string appBundleId;
  std::string domain;
  std::int64_t lookupSelectionType = 0;
  std::optional<std::string> queryContext;  ///< the text around the looked-up words
};

struct SBLFlightLookupRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLFlightLookupRequest";
  std::string queryString;
};

struct SBLFlightSearchRequest : SBLRequest {
  static constexpr std::string_view kClassName = "SBLFlightSearchRequest";
  std::string queryString;
};

/// Any of them, in the order in which the daemon tells them apart.
using SBLAnyRequest =
    std::variant<SBLSearchRequest, SBLMoreResultsRequest, SBLCardRequest, SBLZeroKeywordRequest,
                 SBLLookupRequest, SBLFlightLookupRequest, SBLFlightSearchRequest>;

}  // namespace sable
