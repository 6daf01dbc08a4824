#pragma once

#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/messages/RKFeedback.pb.h"
#include "SableKit/messages/SKFeedback.pb.h"
#include "sabled/FeedbackTranslation.h"
#include "sabled/NetworkTimingTranslation.h"

/// Every kind of feedback: its type index, whether its record names a query, what becomes of the
/// identifiers in it, and the keys it writes, in order. A message of either family is translated by
/// the same template. docs/feedback.md says the same for those who read the wire.
namespace sable::feedback {

enum class QueryId { none, required };
/// Whether a kind's results and suggestions get other identifiers, as shown or as used.
enum class Identifiers { kept, referenced, expanded };

template <unsigned Type, QueryId Query = QueryId::required, Identifiers Use = Identifiers::kept>
struct Kind {
  static constexpr Identifiers identifiers = Use;
  static unsigned type(const auto&) { return Type; }
  static bool requiresQueryId(const auto&) { return Query == QueryId::required; }
};

/// A kind that the daemon knows no more of. Of the generated family that is worth a line in the log.
struct Untranslated : Kind<kUnknownType> {
  static void write(const messages::RKFeedback&, JSONObject&) {}
  static void write(const messages::_SKFeedback& message, JSONObject&);
};

struct VisibleResults : Kind<0, QueryId::required, Identifiers::referenced> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kVisibleResultsTriggers, m.trigger_event());
    listOrNull(d["results"], m.results(), [](JSONPlace place, const auto& result) {
      place = orNull(result.has_identifier(), result.identifier());
    });
  }
};

struct StartSearch : Kind<14> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kStartSearchTriggers, m.trigger_event());
    writeSearch(m, d);
  }
  static void writeSearch(const auto& m, JSONObject& d) {
    d["input"] = orNull(m.has_input(), m.input());
    d["uuid"] = orNull(m.has_uuid(), m.uuid());
  }
};

struct StartNetworkSearch : Kind<1> {
  static void write(const auto& m, JSONObject& d) {
    StartSearch::write(m, d);
    writeRequest(m, d);
  }
  static void writeRequest(const auto& m, JSONObject& d) {
    headerFields(d["headers"], m.headers());
    d["url"] = orNull(m.has_url(), m.url());
    d["endpoint_type"] = word(kEndpoints, m.endpoint_type());
  }
};

/// The two families differ in where they write the trigger.
struct LookupStartNetworkSearch : Kind<1> {
  static void write(const auto& m, JSONObject& d) {
    constexpr bool generated = requires {
      static_cast<const messages::_SKLookupStartNetworkSearchFeedback&>(m);
    };
    if (!generated) writeTrigger(m, d);
    StartSearch::writeSearch(m, d);
    StartNetworkSearch::writeRequest(m, d);
    if (generated) writeTrigger(m, d);
  }
  static void writeTrigger(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kLookupSelections, m.lookup_selection_type());
  }
};

struct EndNetworkSearch : Kind<2, QueryId::none> {
  static void write(const auto& m, JSONObject& d) {
    d["response_size"] = m.response_size();
    d["status_code"] = m.status_code();
    if (m.has_network_timing()) {
      writeNetworkTiming(m.network_timing(), d);
    } else {
      d["network_timing_data"] = nullptr;
    }
    d["uuid"] = orNull(m.has_uuid(), m.uuid());
  }
};

struct EndSableNetworkSearch : EndNetworkSearch {
  static void write(const auto& m, JSONObject& d) {
    EndNetworkSearch::write(m, d);
    d["sable_status"] = orNull(m.has_sable_status(), m.sable_status());
    d["sable_duration"] = m.sable_duration();
    d["fbq"] = orNull(m.has_fbq(), m.fbq());
    d["sable_partial_client_ip"] = orNull(m.has_sable_partial_client_ip(), m.sable_partial_client_ip());
  }
};

struct StartLocalSearch : Kind<3> {
  static void write(const auto& m, JSONObject& d) {
    StartSearch::write(m, d);
    d["index_type"] = word(kLocalIndexes, m.index_type());
  }
};

template <class Base>
struct EndOfSearch : Base {
  static void write(const auto& m, JSONObject& d) { d["uuid"] = orNull(m.has_uuid(), m.uuid()); }
};
using EndLocalSearch = EndOfSearch<Kind<4, QueryId::none>>;
using EndSearch = EndOfSearch<Kind<15>>;

struct SearchViewAppear : Kind<5> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kSearchViewAppearTriggers, m.view_appear_event());
    d["on_lock_screen"] = m.on_lock_screen();
    d["is_over_app"] = m.is_over_app();
  }
};

struct SearchViewDisappear : Kind<6> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kSearchViewDisappearTriggers, m.view_disappear_event());
  }
};

struct Ranking : Kind<7, QueryId::required, Identifiers::referenced> {
  static void write(const auto& m, JSONObject& d) {
    d["blending_duration"] = m.blending_duration();
    listOrNull(d["sections"], m.sections(), sectionRanking);
  }
};

struct Ranker : Ranking {
  static void write(const auto& m, JSONObject& d) {
    Ranking::write(m, d);
    d["ranker_did_rank"] = true;
    d["ranker_timeout"] = m.did_time_out();
    d["ranker_results"] = m.results_ranked();
    d["ranker_duration"] = m.ranking_duration_milliseconds();
  }
};

struct ResultEngaged : Kind<8, QueryId::required, Identifiers::expanded> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kResultEngagementTriggers, m.trigger_event());
    d["destination"] = word(kDestinations, m.destination());
    if (!m.has_result()) {
      d["result"] = nullptr;
      return;
    }
    engagedResult(d["result"], m);
    if (m.action_engaged()) d["action_target"] = word(kResultActionTargets, m.action_target());
  }
};

struct CardSectionEngagement : Kind<10> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kCardSectionEngagementTriggers, m.trigger_event());
    d["card_type"] = word(kCardTypes, m.action_card_type());
    d["action_target"] = m.is_description_card_section()       ? "more"
                         : m.destination().has_action_target() ? m.destination().action_target()
                                                               : "unknown";
    d["action_destination"] = firstURL(m.destination());
  }
};

struct MapsCardSectionEngagement : Kind<10> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = "tap";
    d["card_type"] = "maps";
    d["action_target"] = word(kMapsActions, m.feedback_type());
  }
};

struct StoreCardSectionEngagement : Kind<10> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = "tap";
    d["card_type"] = "emporium_sheet";
    d["action_target"] = word(kStoreProductPageResults, m.product_page_result());
  }
};

struct ErrorFeedback : Kind<11> {
  static void write(const auto& m, JSONObject& d) {
    if (m.has_error()) {
      errorRecord(d["error"], m.error());
    } else {
      d["error"] = nullptr;
    }
    if (m.has_underlying_error()) errorRecord(d["underlying_error"], m.underlying_error());
  }
};

struct SuggestionEngagement : Kind<12, QueryId::required, Identifiers::expanded> {
  static void write(const auto& m, JSONObject& d) {
    d["id"] = orNull(m.suggestion().has_identifier(), m.suggestion().identifier());
  }
};

struct CardViewDisappear : Kind<13> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kCardViewDisappearTriggers, m.card_disappear_event());
  }
};

struct VisibleSuggestions : Kind<16, QueryId::required, Identifiers::referenced> {
  static void write(const auto& m, JSONObject& d) {
    listOrNull(d["suggestions"], m.suggestions(), searchSuggestion);
    if (m.suggestions_size() == 0) return;
    const auto& first = m.suggestions(0);
    d["suggestion_query"] = orNull(first.has_query(), first.query());
  }
};

/// The client's own JSON object; what is none was refused when the message was read.
struct Custom {
  static constexpr Identifiers identifiers = Identifiers::kept;
  static unsigned type(const auto& m) {
    constexpr unsigned kTypeByFeedbackType[] = {17, 19, 18, 20};  // crossed on purpose: the service counts so
    return m.feedback_type() < std::size(kTypeByFeedbackType) ? kTypeByFeedbackType[m.feedback_type()]
                                                              : kTypeByFeedbackType[0];
  }
  static bool requiresQueryId(const auto& m) { return type(m) != 20; }
  static Dictionary own(const auto& m) {
    auto json = parseJSON(m.json_feedback(), m.json_feedback().size());
    return json ? *std::move(json) : Dictionary::object();
  }
};

struct ResultsReceivedAfterTimeout : Kind<22, QueryId::required, Identifiers::expanded> {
  static void write(const auto& m, JSONObject& d) { listOrNull(d["results"], m.results(), searchResult); }
};

struct LateSectionsAppended : Kind<23, QueryId::required, Identifiers::referenced> {
  static void write(const auto& m, JSONObject& d) { listOrNull(d["sections"], m.sections(), resultSection); }
};

struct ClearInput : Kind<24> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kClearInputTriggers, m.trigger_event());
  }
};

struct SessionEnd : Kind<25, QueryId::none> {
  static void write(const auto& m, JSONObject& d) { d["reason"] = word(kSessionEndReasons, m.reason()); }
};

struct SkipSearch : Kind<26> {
  static void write(const auto& m, JSONObject& d) {
    d["trigger_event"] = word(kSkipSearchTriggers, m.trigger_event());
    d["input"] = orNull(m.has_input(), m.input());
  }
};

struct CacheHit : Kind<26> {
  static void write(const auto& m, JSONObject& d) {
    SkipSearch::write(m, d);
    d["uuid"] = orNull(m.has_uuid(), m.uuid());
  }
};

struct SectionEngagement : Kind<27> {
  static void write(const auto& m, JSONObject& d) {
    d["id"] = orNull(m.has_identifier(), m.identifier());
    d["trigger_event"] = word(kSectionEngagementTriggers, m.trigger_event());
  }
};

struct VisibleSectionHeader : Kind<28> {
  static void write(const auto& m, JSONObject& d) {
    d["section_id"] = orNull(m.has_section_id(), m.section_id());
    d["section_header_type"] = word(kSectionHeaderTypes, m.section_header_type());
  }
};

struct SessionMissingResults : Kind<29, QueryId::none> {
  static void write(const auto& m, JSONObject& d) { listOrNull(d["results"], m.results(), searchResult); }
};

struct SessionMissingSuggestions : Kind<30, QueryId::none> {
  static void write(const auto& m, JSONObject& d) {
    listOrNull(d["suggestions"], m.suggestions(), searchSuggestion);
  }
};

struct DidGoToSite : Kind<31> {
  static void write(const auto& m, JSONObject& d) { d["input"] = orNull(m.has_input(), m.input()); }
};

struct ConnectionInvalidated : Kind<32, QueryId::none> {
  static void write(const auto&, JSONObject&) {}
};

struct ResultGrading : Kind<33, QueryId::none, Identifiers::expanded> {
  static void write(const auto& m, JSONObject& d) {
    writeGrade(m.grade(), d);
    JSONObject{d["result"]}["id"] = orNull(m.result().has_identifier(), m.result().identifier());
    d["text_feedback"] = orNull(m.has_text_feedback(), m.text_feedback());
  }
  /// A grade that has no word is logged and left out.
  static void writeGrade(std::uint32_t grade, JSONObject& d);
};

struct DidGoToSearch : Kind<34> {
  static void write(const auto& m, JSONObject& d) {
    d["input"] = orNull(m.has_input(), m.input());
    d["endpoint_type"] = word(kEndpoints, m.endpoint_type());
  }
};

}  // namespace sable::feedback
