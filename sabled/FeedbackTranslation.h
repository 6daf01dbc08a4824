#pragma once

#include <algorithm>
#include <iterator>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "SableKit/messages/Shared.pb.h"
#include "sabled/FeedbackTables.h"
#include "sabled/JSONWriter.h"

/// The parts that several kinds of feedback have in common, as JSON: each writes a value into its
/// place, or members into an object. A template takes the message of either family.
namespace sable::feedback {

/// Nothing is null. The text is the caller's.
inline std::optional<std::string_view> orNull(bool present, const std::string& text) {
  return present ? std::optional<std::string_view>(text) : std::nullopt;
}

/// A number without a word is null.
inline std::optional<std::string_view> word(std::span<const std::string_view> table, std::uint32_t index) {
  const std::string_view text = wordOf(table, index);
  return text.empty() ? std::nullopt : std::optional(text);
}

/// An array of translated members.
template <class List, class Translate>
void list(JSONPlace place, const List& members, Translate translate) {
  JSONArray array(place);
  for (const auto& member : members) translate(array.next(), member);
}

/// The same; null for an empty list, which on the wire is no list.
template <class List, class Translate>
void listOrNull(JSONPlace place, const List& members, Translate translate) {
  if (members.empty()) {
    place = nullptr;
  } else {
    list(place, members, translate);
  }
}

/// Of fields with one key the last one, in the first one's place; `keyOf` leaves a field out with nothing.
/// A stranger counts them: comparing each with each would be too slow.
template <class Field, class KeyOf>
std::vector<const Field*> withoutRepeated(const google::protobuf::RepeatedPtrField<Field>& fields,
                                          KeyOf keyOf) {
  std::vector<std::pair<std::string_view, int>> places;
  for (int i = 0; i < fields.size(); ++i) {
    const std::optional<std::string_view> key = keyOf(fields[i]);
    if (key) places.emplace_back(*key, i);
  }
  std::ranges::sort(places);
  std::vector<const Field*> kept(static_cast<std::size_t>(fields.size()));
  for (auto first = places.begin(); first != places.end();) {
    const auto next =
        std::find_if(first, places.end(), [&](const auto& each) { return each.first != first->first; });
    kept[static_cast<std::size_t>(first->second)] = &fields[std::prev(next)->second];
    first = next;
  }
  std::erase(kept, nullptr);
  return kept;
}

/// The first URL, or null.
std::optional<std::string_view> firstURL(const messages::SBLPunchout& punchout);
void localFeatures(JSONPlace place,
                   const google::protobuf::RepeatedPtrField<messages::SBLLocalFeature>& features);
void headerFields(JSONPlace place,
                  const google::protobuf::RepeatedPtrField<messages::SBLHeaderField>& fields);
void errorRecord(JSONPlace place, const messages::SBLErrorRecord& error);
void searchSuggestion(JSONPlace place, const messages::RKSearchSuggestion& suggestion);

inline constexpr std::uint32_t kSableResult = 1;
inline constexpr std::uint32_t kUserActivityResult = 4;
inline constexpr std::uint32_t kFirstWebEngineResult = 9, kLastWebEngineResult = 14;

/// What stands for every application of the device, whose own identifiers never leave it.
inline constexpr std::string_view kAnyApplication = "com.kestrel.application";

template <class Result>
std::optional<std::string_view> resultBundleIdentifier(const Result& result) {
  if (!result.has_result_bundle_id() && !result.has_application_bundle_identifier()) return std::nullopt;
  if (result.is_local_application_result()) return kAnyApplication;
  return result.has_result_bundle_id() ? result.result_bundle_id() : result.application_bundle_identifier();
}

template <class Result>
void writeSearchResult(const Result& result, JSONObject& d) {
  d["id"] = orNull(result.has_identifier(), result.identifier());
  d["score"] = result.ranking_score();
  d["result_type"] = word(kResultTypes, result.type());
  if (result.type() == kUserActivityResult) d["publicly_indexable"] = result.publicly_indexable();
  d["top_hit"] = word(kTopHits, result.top_hit());
  d["section_bundle_id"] = orNull(result.has_section_bundle_id(), result.section_bundle_id());
  d["bundle_id"] = resultBundleIdentifier(result);
  d["fbr"] = orNull(result.has_fbr(), result.fbr());
  if (result.local_features_size() > 0) localFeatures(d["local_features"], result.local_features());
  if (result.has_corrected_query()) d["corrected_query"] = result.corrected_query();
  d["static_correction"] = result.static_correction();
}

inline constexpr auto searchResult = [](JSONPlace place, const auto& result) {
  JSONObject d(place);
  writeSearchResult(result, d);
};

template <class Section>
void writeSectionWithoutResults(const Section& section, JSONObject& d) {
  d["id"] = orNull(section.has_identifier(), section.identifier());
  d["score"] = section.score();
  d["bundle_id"] = orNull(section.has_bundle_id(), section.bundle_id());
}

inline constexpr auto resultSection = [](JSONPlace place, const auto& section) {
  JSONObject d(place);
  writeSectionWithoutResults(section, d);
  listOrNull(d["results"], section.results(), searchResult);
};

/// What the ranker did with a result, behind the result's own keys.
inline constexpr auto resultRanking = [](JSONPlace place, const auto& ranking) {
  JSONObject d(place);
  if (ranking.has_result()) writeSearchResult(ranking.result(), d);
  d["local_result_position"] = ranking.local_result_position();
  list(d["hidden_results"], ranking.hidden_results(), searchResult);
  list(d["duplicate_results"], ranking.duplicate_results(), searchResult);
};

/// What the ranker did with a section; its "results" are ranked ones, in the place of the section's.
inline constexpr auto sectionRanking = [](JSONPlace place, const auto& ranking) {
  JSONObject d(place);
  if (ranking.has_section()) {
    writeSectionWithoutResults(ranking.section(), d);
    listOrNull(d["results"], ranking.results(), resultRanking);
    d["local_section_position"] = ranking.local_section_position();
  } else {
    d["local_section_position"] = ranking.local_section_position();
    listOrNull(d["results"], ranking.results(), resultRanking);
  }
};

/// The "result" of an engagement: who it was, and where the user went.
template <class Engagement>
void engagedResult(JSONPlace place, const Engagement& engagement) {
  const auto& result = engagement.result();
  JSONObject d(place);
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
}

}  // namespace sable::feedback
