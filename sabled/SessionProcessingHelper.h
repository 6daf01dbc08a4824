#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace sable {

/// Keeps a client's identifiers out of one upload: each becomes a number that means nothing outside
/// it, and of those that were shown but never used the results and suggestions are remembered. One
/// per upload; one thread at a time.
class SessionProcessingHelper {
 public:
  /// "1", "2", ... in the order of first use; the same for the same identifier.
  std::string replacementForIdentifier(const std::string& identifier);

  /// `result` was shown: its serialised `_SKSearchResultForFeedback` or `RKSearchResult`. Of several
  /// with one identifier the first counts.
  void identifierReferencedForResult(const std::string& identifier, std::string result);
  /// The same for a serialised `RKSearchSuggestion`.
  void identifierReferencedForSuggestion(const std::string& identifier, std::string suggestion);
  /// The result or suggestion was used: it is not missing, now or later.
  void identifierExpanded(const std::string& identifier);

  /// Serialised, in the order of reference: referenced and never expanded.
  std::vector<std::string> missingResults() const { return values(idResultMap_); }
  std::vector<std::string> missingSuggestions() const { return values(idSuggestionMap_); }

 private:
  /// A map in the order of insertion; what is erased leaves an empty place.
  struct OrderedMap {
    std::vector<std::optional<std::string>> places;
    std::unordered_map<std::string, std::size_t> index;
  };

  void reference(OrderedMap& map, const std::string& identifier, std::string value);
  static bool erase(OrderedMap& map, const std::string& identifier);
  static std::vector<std::string> values(const OrderedMap& map);

  std::unordered_map<std::string, std::string> privateIdMapping_;
  std::int32_t nextMappedId_ = 1;
  OrderedMap idResultMap_, idSuggestionMap_;
  std::unordered_set<std::string> expandedIdSet_;
};

}  // namespace sable
