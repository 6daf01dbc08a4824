#include "sabled/FeedbackMessage.h"

#include <fmt/core.h>

#include <algorithm>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "sabled/FeedbackOfKind.h"
#include "sabled/ParsedMessage.h"
#include "sabled/SableLogging.h"

namespace sable {

namespace {

tl::unexpected<Error> refusal(std::string reason) {
  return tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, std::move(reason)));
}

}  // namespace

namespace feedback {

tl::unexpected<Error> noMessage(std::string_view className) {
  return refusal(fmt::format("the bytes are no {}", className));
}

Expected<void> checkOwnObject(std::string_view className, const std::string& text) {
  const auto json = parseJSON(text, text.size());
  if (!json) return refusal(fmt::format("JSON of {}: {}", className, json.error().reason));
  if (!json->is_object()) return refusal(fmt::format("JSON of {} is no object", className));
  return {};
}

void Untranslated::write(const messages::_SKFeedback&, JSONObject&) {
  SableLogForCategory(SableLoggingCategoryFeedbackErrors)
      .error("Feedback dictionary translation for {} fell back to default implementation.", "_SKFeedback");
}

void ResultGrading::writeGrade(std::uint32_t grade, JSONObject& d) {
  if (grade < std::size(kResultGrades)) {
    d["grade"] = kResultGrades[grade];
  } else {
    SableLogForCategory(SableLoggingCategoryFeedbackErrors)
        .error("No JSON string defined for result grade {}", grade);
  }
}

}  // namespace feedback

namespace {

std::optional<Error> tooLong(std::string_view bytes) {
  if (bytes.size() <= kMaximumFeedbackBytes) return std::nullopt;
  return makeSBLError(SBLErrorCode::daemonSide, fmt::format("{} bytes of feedback, more than the {} allowed",
                                                            bytes.size(), kMaximumFeedbackBytes));
}

struct FeedbackClass {
  std::string_view name;
  Expected<std::unique_ptr<FeedbackMessage>> (*parse)(std::string_view name, std::string_view bytes);
};

template <class Kind, class M>
Expected<std::unique_ptr<FeedbackMessage>> parseAs(std::string_view name, std::string_view bytes) {
  auto message = std::make_unique<feedback::FeedbackOfKind<Kind, M>>(name);
  if (auto assigned = message->assign(bytes); !assigned) return tl::unexpected(std::move(assigned.error()));
  return message;
}

#define FEEDBACK_CLASS(kind, name) \
  { #name, parseAs < feedback::kind, messages::name> }

constexpr FeedbackClass kClasses[] = {
    FEEDBACK_CLASS(VisibleResults, RKVisibleResultsFeedback),
    FEEDBACK_CLASS(VisibleResults, _SKVisibleResultsFeedback),
    FEEDBACK_CLASS(StartNetworkSearch, RKStartNetworkSearchFeedback),
    FEEDBACK_CLASS(StartNetworkSearch, _SKStartNetworkSearchFeedback),
    FEEDBACK_CLASS(LookupStartNetworkSearch, SBLLookupStartNetworkSearchFeedback),
    FEEDBACK_CLASS(LookupStartNetworkSearch, _SKLookupStartNetworkSearchFeedback),
    FEEDBACK_CLASS(EndNetworkSearch, RKEndNetworkSearchFeedback),
    FEEDBACK_CLASS(EndNetworkSearch, _SKEndNetworkSearchFeedback),
    FEEDBACK_CLASS(EndSableNetworkSearch, _SKSKEndNetworkSearchFeedback),
    FEEDBACK_CLASS(StartLocalSearch, RKStartLocalSearchFeedback),
    FEEDBACK_CLASS(StartLocalSearch, _SKStartLocalSearchFeedback),
    FEEDBACK_CLASS(EndLocalSearch, RKEndLocalSearchFeedback),
    FEEDBACK_CLASS(EndLocalSearch, _SKEndLocalSearchFeedback),
    FEEDBACK_CLASS(SearchViewAppear, RKSearchViewAppearFeedback),
    FEEDBACK_CLASS(SearchViewAppear, _SKSearchViewAppearFeedback),
    FEEDBACK_CLASS(SearchViewDisappear, _SKSearchViewDisappearFeedback),
    FEEDBACK_CLASS(Ranking, RKRankingFeedback),
    FEEDBACK_CLASS(Ranking, _SKRankingFeedback),
    FEEDBACK_CLASS(Ranker, SBLRankerFeedback),
    FEEDBACK_CLASS(Ranker, _SKSBLRankerFeedback),
    FEEDBACK_CLASS(ResultEngaged, RKResultEngagementFeedback),
    FEEDBACK_CLASS(ResultEngaged, _SKResultEngagementFeedback),
    FEEDBACK_CLASS(CardSectionEngagement, RKCardSectionEngagementFeedback),
    FEEDBACK_CLASS(CardSectionEngagement, _SKCardSectionEngagementFeedback),
    FEEDBACK_CLASS(MapsCardSectionEngagement, RKMapsCardSectionEngagementFeedback),
    FEEDBACK_CLASS(MapsCardSectionEngagement, _SKMapsCardSectionEngagementFeedback),
    FEEDBACK_CLASS(StoreCardSectionEngagement, RKStoreCardSectionEngagementFeedback),
    FEEDBACK_CLASS(StoreCardSectionEngagement, _SKStoreCardSectionEngagementFeedback),
    FEEDBACK_CLASS(ErrorFeedback, RKErrorFeedback),
    FEEDBACK_CLASS(SuggestionEngagement, RKSuggestionEngagementFeedback),
    FEEDBACK_CLASS(CardViewDisappear, RKCardViewDisappearFeedback),
    FEEDBACK_CLASS(StartSearch, RKStartSearchFeedback),
    FEEDBACK_CLASS(StartSearch, _SKStartSearchFeedback),
    FEEDBACK_CLASS(EndSearch, RKEndSearchFeedback),
    FEEDBACK_CLASS(EndSearch, _SKEndSearchFeedback),
    FEEDBACK_CLASS(VisibleSuggestions, RKVisibleSuggestionsFeedback),
    FEEDBACK_CLASS(Custom, RKCustomFeedback),
    FEEDBACK_CLASS(ResultsReceivedAfterTimeout, RKResultsReceivedAfterTimeoutFeedback),
    FEEDBACK_CLASS(ResultsReceivedAfterTimeout, _SKResultsReceivedAfterTimeoutFeedback),
    FEEDBACK_CLASS(LateSectionsAppended, RKLateSectionsAppendedFeedback),
    FEEDBACK_CLASS(LateSectionsAppended, _SKLateSectionsAppendedFeedback),
    FEEDBACK_CLASS(ClearInput, RKClearInputFeedback),
    FEEDBACK_CLASS(SessionEnd, SableSessionEndFeedback),
    FEEDBACK_CLASS(SessionEnd, _SKSessionEndFeedback),
    FEEDBACK_CLASS(SkipSearch, SBLSkipSearchFeedback),
    FEEDBACK_CLASS(SkipSearch, _SKSkipSearchFeedback),
    FEEDBACK_CLASS(CacheHit, SBLCacheHitFeedback),
    FEEDBACK_CLASS(CacheHit, _SKCacheHitFeedback),
    FEEDBACK_CLASS(SectionEngagement, RKSectionEngagementFeedback),
    FEEDBACK_CLASS(SectionEngagement, _SKSectionEngagementFeedback),
    FEEDBACK_CLASS(VisibleSectionHeader, RKVisibleSectionHeaderFeedback),
    FEEDBACK_CLASS(VisibleSectionHeader, _SKVisibleSectionHeaderFeedback),
    FEEDBACK_CLASS(SessionMissingResults, SableSessionMissingResults),
    FEEDBACK_CLASS(SessionMissingResults, _SKSessionMissingResultsFeedback),
    FEEDBACK_CLASS(SessionMissingSuggestions, SableSessionMissingSuggestions),
    FEEDBACK_CLASS(DidGoToSite, RKDidGoToSiteFeedback),
    FEEDBACK_CLASS(ConnectionInvalidated, SableConnectionInvalidated),
    FEEDBACK_CLASS(ConnectionInvalidated, _SKConnectionInvalidatedFeedback),
    FEEDBACK_CLASS(ResultGrading, _SKResultGradingFeedback),
    FEEDBACK_CLASS(DidGoToSearch, RKDidGoToSearchFeedback),
    FEEDBACK_CLASS(Untranslated, RKFeedback),
    FEEDBACK_CLASS(Untranslated, _SKFeedback),
};

#undef FEEDBACK_CLASS

}  // namespace

Dictionary FeedbackMessage::dictionary() const {
  if (auto own = ownObject()) return *std::move(own);
  std::string text;
  {
    JSONObject object{JSONPlace(text)};
    write(object);
  }
  return *parseJSON(text, text.size());
}

Expected<std::unique_ptr<FeedbackMessage>> FeedbackMessage::parse(std::string_view className,
                                                                  std::string_view bytes) {
  const auto* found = std::find_if(std::begin(kClasses), std::end(kClasses),
                                   [&](const FeedbackClass& each) { return each.name == className; });
  if (found == std::end(kClasses)) return refusal("unknown feedback class");
  return found->parse(found->name, bytes);
}

Expected<std::unique_ptr<FeedbackMessage>> FeedbackMessage::parseReported(std::string_view className,
                                                                          std::string_view bytes) {
  if (auto fault = tooLong(bytes)) return tl::unexpected(std::move(*fault));
  return parse(className, bytes);
}

Expected<std::unique_ptr<FeedbackMessage>> FeedbackMessage::parseReportedPayload(std::string_view bytes) {
  if (auto fault = tooLong(bytes)) return tl::unexpected(std::move(*fault));
  messages::_SKFeedbackPayload payload;
  if (!parseMessage(payload, bytes)) {
    return refusal("the bytes are no _SKFeedbackPayload");
  }
  return parse(payload.class_name(), payload.feedback());
}

std::vector<std::string_view> FeedbackMessage::classNames() {
  std::vector<std::string_view> names;
  for (const FeedbackClass& each : kClasses) names.push_back(each.name);
  return names;
}

}  // namespace sable
