// How a session's feedback leaves the device.
#include <cmath>
#include <nlohmann/json.hpp>

#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/SableFeedback.h"
#include "sabled/SessionProcessingHelper.h"

namespace sable {

namespace {

constexpr std::uint64_t kNanosecondsPerMillisecond = 1'000'000;

/// Times a record from the first one of its list; one that is older than that is of its time.
void setRelativeTimestamp(SableFeedback& feedback, const SableFeedback& first) {
  const std::uint64_t base = first.feedback().timestamp();
  const std::uint64_t time = std::max(base, feedback.feedback().timestamp());
  feedback.setRelTimestamp((time - base) / kNanosecondsPerMillisecond);
}

/// Whole seconds, towards zero; 0 for what is no date.
std::int64_t baseTime(std::optional<double> sessionStart) {
  constexpr double kMost = 9.2e18;  // as far as 64 bits reach
  if (!sessionStart || !(std::abs(*sessionStart) < kMost)) return 0;
  return static_cast<std::int64_t>(*sessionStart);
}

}  // namespace

Dictionary ClientSession::feedbacksWithRelativeTimestamp() {
  Dictionary result = Dictionary::array();
  const auto feedbacks = getSessionFeedbacks();
  for (const auto& feedback : feedbacks) {
    setRelativeTimestamp(*feedback, *feedbacks.front());
    result.push_back(feedback->dictionary());
  }
  return result;
}

Dictionary ClientSession::privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks& feedbacks) {
  SessionProcessingHelper helper;
  Dictionary result = Dictionary::array();
  for (const auto& feedback : feedbacks) {
    setRelativeTimestamp(*feedback, *feedbacks.front());
    feedback->process(helper);
    result.push_back(feedback->dictionary());
  }
  // Each goes to the front, so that the suggestions precede the results, and both all else.
  const auto insert = [&](feedback::Message message) {
    result.insert(result.begin(), SableFeedback(std::move(message), 0, userGuid(), agent_).dictionary());
  };
  const auto now = assembly_.runtime.ticks();
  if (const auto results = helper.missingResults(); !results.empty())
    insert(feedback::sessionMissingResults(now, results));
  if (const auto suggestions = helper.missingSuggestions(); !suggestions.empty())
    insert(feedback::sessionMissingSuggestions(now, suggestions));
  return result;
}

Dictionary ClientSession::getFeedbacksToSend() {
  Dictionary envelope;
  envelope["fb"] = privacyFilteredFeedbacksWithRelativeTimestamp(getSessionFeedbacks());
  envelope["agent"] = agent_;
  const auto guid = userGuid();
  envelope["user_guid"] = guid ? guid->string() : "";
  envelope["resource_versions"] = cpResourceVersions_;
  envelope["first_use"] = firstUseOfTheDay_;
  envelope["base_time"] = removeTimestamps_ ? 0 : baseTime(sessionStartSince1970_);
  const auto reason = feedback::triggerEventEnumToString(previousSessionEndReason_);
  if (!reason.empty()) envelope["previous_session_end_reason"] = reason;
  return envelope;
}

}  // namespace sable
