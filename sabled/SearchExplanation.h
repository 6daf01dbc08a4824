#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/HTTPSession.h"
#include "sabled/QueryCacheDecision.h"
#include "sabled/RequestTrace.h"

namespace sable {

/// What a search would do and why, filled by the code that decides it as it goes along.
struct SearchExplanation {
  struct Gate {
    std::string name;
    std::string found;
    std::string wanted;
    bool passes;
  };
  enum class Outcome {
    nothing,  ///< answered with neither reply nor error
    error,    ///< answered with the error of a missing bag
    cache,
    network,
  };
  /// Why the cache did or did not answer.
  enum class CacheUse { notAsked, off, noCandidate, forcedItems, hit };

  std::vector<Gate> gates;  ///< as far as the search came
  CacheUse cacheUse = CacheUse::notAsked;
  QueryCacheDecision cache;
  RequestTrace trace;
  std::optional<platform::HTTPRequest> request;  ///< what would be sent
  bool throughProxy = false;
  Outcome outcome = Outcome::nothing;

  /// Notes a gate; answers whether it lets the search pass.
  bool gate(std::string_view name, std::string found, std::string wanted, bool passes);
  /// The JSON text that diagnostics show; docs/relay.md describes it.
  std::string json() const;
};

}  // namespace sable
