#include "sabled/FeedbackTranslation.h"

#include "SableKit/SBLError.h"

namespace sable::feedback {

void ObjectBuilder::set(const std::string& key, Dictionary value) {
  Dictionary::object_t::Container& members = object_.get_ref<Dictionary::object_t&>();
  const auto [place, isNew] = places_.try_emplace(key, members.size());
  if (isNew) {
    members.emplace_back(key, std::move(value));
  } else {
    members[place->second].second = std::move(value);
  }
}

Dictionary firstURL(const messages::SBLPunchout& punchout) {
  return punchout.urls_size() > 0 ? Dictionary(punchout.urls(0)) : Dictionary();
}

Dictionary localFeatures(const google::protobuf::RepeatedPtrField<messages::SBLLocalFeature>& features) {
  ObjectBuilder builder;
  for (const auto& feature : features) {
    builder.set(feature.key(), feature.has_string_value() ? Dictionary(feature.string_value())
                                                          : Dictionary(feature.double_value()));
  }
  return builder.take();
}

Dictionary headerFields(const google::protobuf::RepeatedPtrField<messages::SBLHeaderField>& fields) {
  if (fields.empty()) return nullptr;
  ObjectBuilder builder;
  for (const auto& field : fields) builder.set(field.name(), field.value());
  return builder.take();
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
