#include "sabled/SessionProcessingHelper.h"

namespace sable {

std::string SessionProcessingHelper::replacementForIdentifier(const std::string& identifier) {
  const auto [entry, isNew] = privateIdMapping_.try_emplace(identifier);
  if (isNew) entry->second = std::to_string(nextMappedId_++);
  return entry->second;
}

void SessionProcessingHelper::identifierReferencedForResult(const std::string& identifier,
                                                            std::string result) {
  reference(idResultMap_, identifier, std::move(result));
}

void SessionProcessingHelper::identifierReferencedForSuggestion(const std::string& identifier,
                                                                std::string suggestion) {
  reference(idSuggestionMap_, identifier, std::move(suggestion));
}

void SessionProcessingHelper::identifierExpanded(const std::string& identifier) {
  expandedIdSet_.insert(identifier);
  if (!erase(idResultMap_, identifier)) erase(idSuggestionMap_, identifier);
}

void SessionProcessingHelper::reference(OrderedMap& map, const std::string& identifier, std::string value) {
  if (expandedIdSet_.contains(identifier)) return;
  if (!map.index.try_emplace(identifier, map.places.size()).second) return;
  map.places.emplace_back(std::move(value));
}

bool SessionProcessingHelper::erase(OrderedMap& map, const std::string& identifier) {
  const auto entry = map.index.find(identifier);
  if (entry == map.index.end()) return false;
  map.places[entry->second].reset();
  map.index.erase(entry);
  return true;
}

std::vector<std::string> SessionProcessingHelper::values(const OrderedMap& map) {
  std::vector<std::string> values;
  for (const auto& value : map.places) {
    if (value) values.push_back(*value);
  }
  return values;
}

}  // namespace sable
