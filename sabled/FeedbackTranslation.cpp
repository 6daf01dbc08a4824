#include "sabled/FeedbackTranslation.h"

#include "SableKit/SBLError.h"

namespace sable::feedback {

Dictionary firstURL(const messages::SBLPunchout& punchout) {
  return punchout.urls_size() > 0 ? Dictionary(punchout.urls(0)) : Dictionary();
}

Dictionary localFeatures(const google::protobuf::RepeatedPtrField<messages::SBLLocalFeature>& features) {
  Dictionary d = Dictionary::object();
  for (const auto& feature : features) {
    Dictionary& value = d[feature.key()];
    if (feature.has_string_value()) {
      value = feature.string_value();
    } else {
      value = feature.double_value();
    }
  }
  return d;
}

Dictionary headerFields(const google::protobuf::RepeatedPtrField<messages::SBLHeaderField>& fields) {
  Dictionary d;
  for (const auto& field : fields) d[field.name()] = field.value();
  return d;
}

Dictionary errorRecord(const messages::SBLErrorRecord& error) {
  return encodeErrorForJSON({error.domain(), error.code(), error.reason()});
}

Dictionary searchSuggestion(const messages::RKSearchSuggestion& suggestion) {
  Dictionary d;
  d["id"] = orNull(suggestion.has_identifier(), suggestion.identifier());
  d["suggestion"] = orNull(suggestion.has_suggestion(), suggestion.suggestion());
  d["score"] = suggestion.score();
  d["suggestion_type"] = word(kSuggestionTypes, suggestion.suggestion_type());
  if (suggestion.has_sable()) d["fbr"] = orNull(suggestion.sable().has_fbr(), suggestion.sable().fbr());
  return d;
}

}  // namespace sable::feedback
