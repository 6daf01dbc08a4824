#include "sabled/QueryCacheDecision.h"

#include <utility>

#include "sabled/CachedResultSet.h"

namespace sable {

std::string_view queryCacheOutcomeText(QueryCacheOutcome outcome) {
  switch (outcome) {
    case QueryCacheOutcome::expired:
      return "expired";
    case QueryCacheOutcome::otherScale:
      return "other scale";
    case QueryCacheOutcome::inputLonger:
      return "input longer";
    case QueryCacheOutcome::longerCompletion:
      return "longer completion";
    case QueryCacheOutcome::noHigherScore:
      return "no higher score";
    case QueryCacheOutcome::chosen:
      return "chosen";
  }
  return "";
}

QueryCacheOutcome judgeCandidate(const CachedResultSet& candidate, const CachedResultSet* best,
                                 const QueryCacheQuestion& question) {
  if (candidate.expireTime && *candidate.expireTime <= question.now) return QueryCacheOutcome::expired;
  if (question.scale > 0 && candidate.uiScale != question.scale) return QueryCacheOutcome::otherScale;
  if (candidate.inputLength > question.length) return QueryCacheOutcome::inputLonger;
  if (best == nullptr || candidate.queryLength < best->queryLength) return QueryCacheOutcome::chosen;
  if (candidate.queryLength > best->queryLength) return QueryCacheOutcome::longerCompletion;
  const bool better = candidate.completionScore > 0 && candidate.completionScore > best->completionScore;
  return better ? QueryCacheOutcome::chosen : QueryCacheOutcome::noHigherScore;
}

void QueryCacheDecision::add(std::shared_ptr<const CachedResultSet> candidate) {
  rows.push_back({std::move(candidate), QueryCacheOutcome::chosen});
}

void QueryCacheDecision::settle(const CachedResultSet* choice) {
  for (Row& row : rows) {
    if (row.candidate.get() != choice) row.outcome = judgeCandidate(*row.candidate, choice, question);
  }
}

}  // namespace sable
