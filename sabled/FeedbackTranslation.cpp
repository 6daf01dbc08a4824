#include "sabled/FeedbackTranslation.h"

#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"

namespace sable::feedback {

std::optional<std::string_view> firstURL(const messages::SBLPunchout& punchout) {
  return punchout.urls_size() > 0 ? std::optional<std::string_view>(punchout.urls(0)) : std::nullopt;
}

void localFeatures(JSONPlace place,
                   const google::protobuf::RepeatedPtrField<messages::SBLLocalFeature>& features) {
  JSONObject d(place);
  for (const auto* feature :
       withoutRepeated(features, [](const auto& each) -> std::string_view { return each.key(); })) {
    if (feature->has_string_value()) {
      d[feature->key()] = feature->string_value();
    } else {
      d[feature->key()] = feature->double_value();
    }
  }
}

void headerFields(JSONPlace place,
                  const google::protobuf::RepeatedPtrField<messages::SBLHeaderField>& fields) {
  if (fields.empty()) return place = nullptr;
  JSONObject d(place);
  for (const auto* field :
       withoutRepeated(fields, [](const auto& each) -> std::string_view { return each.name(); }))
    d[field->name()] = field->value();
}

void errorRecord(JSONPlace place, const messages::SBLErrorRecord& error) {
  place = encodeErrorForJSON({error.domain(), error.code(), error.reason()});
}

void searchSuggestion(JSONPlace place, const messages::RKSearchSuggestion& suggestion) {
  JSONObject d(place);
  d["id"] = orNull(suggestion.has_identifier(), suggestion.identifier());
  d["suggestion"] = orNull(suggestion.has_suggestion(), suggestion.suggestion());
  d["score"] = suggestion.score();
  d["suggestion_type"] = word(kSuggestionTypes, suggestion.suggestion_type());
  if (suggestion.has_sable()) d["fbr"] = orNull(suggestion.sable().has_fbr(), suggestion.sable().fbr());
}

}  // namespace sable::feedback
