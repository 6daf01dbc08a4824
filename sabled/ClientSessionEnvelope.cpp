// How a session's feedback leaves the device.
#include <algorithm>
#include <cmath>
#include <nlohmann/json.hpp>
#include <utility>

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
  Dictionary result = Dictionary::array();
  visitRecordsToSend(feedbacks, [&](const Dictionary& record) {
    result.push_back(record);
    return true;
  });
  return result;
}

/// Each record in the order in which it is uploaded. What is missing goes first: the suggestions, then
/// the results. Only when all feedback is processed is it known. False when `visit` says so.
bool ClientSession::visitRecordsToSend(const SableFeedbacks& feedbacks, const RecordVisitor& visit) {
  SessionProcessingHelper helper;
  for (const auto& feedback : feedbacks) {
    setRelativeTimestamp(*feedback, *feedbacks.front());
    feedback->process(helper);
  }
  const auto visitMissing = [&](const std::vector<std::string>& missing, auto message) {
    if (missing.empty()) return true;
    return visit(
        SableFeedback(message(assembly_.runtime.ticks(), missing), 0, userGuid(), agent_).dictionary());
  };
  return visitMissing(helper.missingSuggestions(), feedback::sessionMissingSuggestions) &&
         visitMissing(helper.missingResults(), feedback::sessionMissingResults) &&
         std::ranges::all_of(feedbacks, [&](const auto& feedback) { return visit(feedback->dictionary()); });
}

Dictionary ClientSession::getFeedbacksToSend() {
  Dictionary envelope;
  envelope["fb"] = privacyFilteredFeedbacksWithRelativeTimestamp(getSessionFeedbacks());
  envelope.update(envelopeBehindFeedback());
  return envelope;
}

bool ClientSession::writeFeedbacksToSend(const std::function<bool(std::string_view)>& write) {
  std::string_view separator = R"({"fb":[)";
  const bool written = visitRecordsToSend(getSessionFeedbacks(), [&](const Dictionary& record) {
    return write(std::exchange(separator, ",")) && write(compactJSON(record));
  });
  if (!written || (separator != "," && !write(separator))) return false;
  const std::string rest = compactJSON(envelopeBehindFeedback());
  return write("],") && write(std::string_view(rest).substr(1));
}

/// The keys that follow "fb".
Dictionary ClientSession::envelopeBehindFeedback() {
  Dictionary envelope;
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
