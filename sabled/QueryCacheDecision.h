#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Runtime.h"

namespace sable {

class CachedResultSet;

/// What a search asks of the query cache.
struct QueryCacheQuestion {
  std::string key;         ///< what is typed, in lower case
  std::size_t length = 0;  ///< its length in UTF-16 code units
  float scale = 0;         ///< of the client's screen; 0: any will do
  platform::WallTime now{};
};

/// What became of an entry whose query begins with what is typed: the rules in their order.
enum class QueryCacheOutcome {
  expired,
  otherScale,
  inputLonger,       ///< made for a longer input than what is typed now
  longerCompletion,  ///< than the best one's
  noHigherScore,     ///< than that of one with a completion as long
  chosen,
};

/// "other scale", "chosen", ...
std::string_view queryCacheOutcomeText(QueryCacheOutcome outcome);

/// What becomes of `candidate` when it is met after `best`, the choice among those before it (null:
/// there is none): `chosen` when it takes the place of `best`. A function of its arguments alone.
QueryCacheOutcome judgeCandidate(const CachedResultSet& candidate, const CachedResultSet* best,
                                 const QueryCacheQuestion& question);

/// How a lookup came to its result, for whoever wants to see it.
struct QueryCacheDecision {
  struct Row {
    std::shared_ptr<const CachedResultSet> candidate;
    QueryCacheOutcome outcome;
  };

  QueryCacheQuestion question;
  std::vector<Row> rows;  ///< one for each candidate, in the order of their queries' bytes

  /// Adds a candidate, whose outcome is not known before all are there.
  void add(std::shared_ptr<const CachedResultSet> candidate);
  /// Gives every row its outcome, now that the choice (null: none) is made.
  void settle(const CachedResultSet* choice);
};

}  // namespace sable
