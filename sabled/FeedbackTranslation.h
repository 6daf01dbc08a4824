#pragma once

#include <nlohmann/json.hpp>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "SableKit/messages/Shared.pb.h"
#include "platform/Dictionary.h"
#include "sabled/FeedbackTables.h"

/// The parts that several kinds of feedback have in common, as JSON. A template takes the message of
/// either family.
namespace sable::feedback {

inline Dictionary orNull(bool present, const std::string& text) {
  return present ? Dictionary(text) : Dictionary();
}

/// A number without a word is null.
inline Dictionary word(std::span<const std::string_view> table, std::uint32_t index) {
  const std::string_view text = wordOf(table, index);
  return text.empty() ? Dictionary() : Dictionary(text);
}

/// An array of translated members; null for an empty list, which on the wire is no list.
template <class List, class Translate>
Dictionary listOrNull(const List& list, Translate translate) {
  Dictionary array;
  for (const auto& member : list) array.push_back(translate(member));
  return array;
}

/// An object whose members a stranger counts: setting one takes the same time whatever their number.
class ObjectBuilder {
 public:
  /// Of members with one name the last value counts, in the first one's place.
  void set(const std::string& key, Dictionary value);
  Dictionary take() { return std::move(object_); }

 private:
  Dictionary object_ = Dictionary::object();
  std::unordered_map<std::string, std::size_t> places_;
};

/// The first URL, or null.
Dictionary firstURL(const messages::SBLPunchout& punchout);
Dictionary localFeatures(const google::protobuf::RepeatedPtrField<messages::SBLLocalFeature>& features);
Dictionary headerFields(const google::protobuf::RepeatedPtrField<messages::SBLHeaderField>& fields);
Dictionary errorRecord(const messages::SBLErrorRecord& error);
Dictionary searchSuggestion(const messages::RKSearchSuggestion& suggestion);

inline constexpr std::uint32_t kSableResult = 1;
inline constexpr std::uint32_t kUserActivityResult = 4;
inline constexpr std::uint32_t kFirstWebEngineResult = 9, kLastWebEngineResult = 14;

/// What stands for every application of the device, whose own identifiers never leave it.
inline constexpr std::string_view kAnyApplication = "com.kestrel.application";

template <class Result>
Dictionary resultBundleIdentifier(const Result& result) {
  if (!result.has_result_bundle_id() && !result.has_application_bundle_identifier()) return nullptr;
  if (result.is_local_application_result()) return kAnyApplication;
  return result.has_result_bundle_id() ? result.result_bundle_id() : result.application_bundle_identifier();
}

template <class Result>
Dictionary searchResult(const Result& result) {
  Dictionary d;
  d["id"] = orNull(result.has_identifier(), result.identifier());
  d["score"] = result.ranking_score();
  d["result_type"] = word(kResultTypes, result.type());
  if (result.type() == kUserActivityResult) d["publicly_indexable"] = result.publicly_indexable();
  d["top_hit"] = word(kTopHits, result.top_hit());
  d["section_bundle_id"] = orNull(result.has_section_bundle_id(), result.section_bundle_id());
  d["bundle_id"] = resultBundleIdentifier(result);
  d["fbr"] = orNull(result.has_fbr(), result.fbr());
  if (result.local_features_size() > 0) d["local_features"] = localFeatures(result.local_features());
  if (result.has_corrected_query()) d["corrected_query"] = result.corrected_query();
  d["static_correction"] = result.static_correction();
  return d;
}

template <class List>
Dictionary searchResults(const List& results) {
  return listOrNull(results, [](const auto& result) { return searchResult(result); });
}

template <class Section>
Dictionary resultSection(const Section& section) {
  Dictionary d;
  d["id"] = orNull(section.has_identifier(), section.identifier());
  d["score"] = section.score();
  d["bundle_id"] = orNull(section.has_bundle_id(), section.bundle_id());
  d["results"] = searchResults(section.results());
  return d;
}

/// What the ranker did with a result, behind the result's own keys.
template <class Ranking>
Dictionary resultRanking(const Ranking& ranking) {
  Dictionary d = ranking.has_result() ? searchResult(ranking.result()) : Dictionary();
  d["local_result_position"] = ranking.local_result_position();
  d["hidden_results"] = Dictionary::array();
  for (const auto& hidden : ranking.hidden_results()) d["hidden_results"].push_back(searchResult(hidden));
  d["duplicate_results"] = Dictionary::array();
  for (const auto& duplicate : ranking.duplicate_results()) {
    d["duplicate_results"].push_back(searchResult(duplicate));
  }
  return d;
}

/// What the ranker did with a section; its "results" are ranked ones, in the place of the section's.
template <class Ranking>
Dictionary sectionRanking(const Ranking& ranking) {
  Dictionary d = ranking.has_section() ? resultSection(ranking.section()) : Dictionary();
  d["local_section_position"] = ranking.local_section_position();
  d["results"] = listOrNull(ranking.results(), [](const auto& result) { return resultRanking(result); });
  return d;
}

/// The "result" of an engagement: who it was, and where the user went.
template <class Engagement>
Dictionary engagedResult(const Engagement& engagement) {
  const auto& result = engagement.result();
  Dictionary d;
  d["id"] = orNull(result.has_identifier(), result.identifier());
  if (result.type() >= kFirstWebEngineResult && result.type() <= kLastWebEngineResult &&
      engagement.result_had_title()) {
    d["third_party_suggestion"] = orNull(engagement.has_title_text_for_result_engagement(),
                                         engagement.title_text_for_result_engagement());
  }
  if (result.type() != kSableResult) {
    d["action_destination"] = "non_sable_result";
  } else if (engagement.action_engaged() && result.action().punchout().urls_size() > 0) {
    d["action_destination"] = firstURL(result.action().punchout());
  } else {
    d["action_destination"] = firstURL(result.punchout());
  }
  return d;
}

}  // namespace sable::feedback
