#pragma once

#include <string>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "platform/Data.h"
#include "platform/Error.h"
#include "sabled/SableAnswer.h"

namespace sable {

/// What the daemon itself reads in an answer of the service. Clients get the raw bytes.
struct SearchResponse {
  struct ResultSet {
    std::string query;  ///< the completed query
    double completionScore = 0;
    double maxAge = 0;  ///< seconds; 0: does not expire by time
    std::string status;
  };

  bool isObject = false;
  std::vector<ResultSet> resultSets;  ///< the objects of an answer that is an array
  /// Found under "image" and "images" at up to 64 levels.
  std::vector<SBLImageDescription> images;

  /// Of an answer that is an array each member stands in the first of its objects that has it.
  SableAnswer account;

  /// Reads RFC 8259 text nested at most kMaximumJSONDepth deep; the error's reason is the parser's.
  static Expected<SearchResponse> parse(const std::string& text);
};

}  // namespace sable
