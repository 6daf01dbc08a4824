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
/// So much JSON is handed on at once, and a record more.
constexpr std::size_t kPieceBytes = 64u << 10;

/// Times a record from `base`, the time of the first one; one that is older than that is of its time.
void setRelativeTimestamp(SableFeedback& feedback, std::uint64_t base) {
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
    setRelativeTimestamp(*feedback, feedbacks.front()->feedback().timestamp());
    result.push_back(feedback->dictionary());
  }
  return result;
}

Dictionary ClientSession::privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks& feedbacks) {
  Dictionary result = Dictionary::array();
  visitRecordsToSend(feedbacks, [&](const SableFeedback& record) { result.push_back(record.dictionary()); });
  return result;
}

/// Each record in the order in which it is uploaded. What is missing goes first: the suggestions, then
/// the results. Only when all feedback is processed is it known.
void ClientSession::visitRecordsToSend(const SableFeedbacks& feedbacks, const RecordVisitor& visit) {
  SessionProcessingHelper helper;
  for (const auto& feedback : feedbacks) {
    setRelativeTimestamp(*feedback, feedbacks.front()->feedback().timestamp());
    feedback->process(helper);
  }
  visitMissing(helper, visit);
  for (const auto& feedback : feedbacks) visit(*feedback);
}

/// The same of the feedback in the file, which is never in memory as a whole: what is missing is found on a
/// way of its own, and on the second one each identifier gets the same replacement again.
void ClientSession::visitStoredRecordsToSend(const RecordVisitor& visit) {
  SableFeedbackReader reader;
  const auto read = [&](const StoredFeedback& stored) -> SableFeedback& {
    return **reader.read(stored.record);  // as it could be when the file was read
  };
  SessionProcessingHelper first, second;
  for (const auto& stored : storedFeedbacks_) {
    if (stored.hasIdentifiers) read(stored).process(first);
  }
  visitMissing(first, visit);
  for (const auto& stored : storedFeedbacks_) {
    SableFeedback& feedback = read(stored);
    setRelativeTimestamp(feedback, storedFeedbacks_.front().timestamp);
    feedback.process(second);
    visit(feedback);
  }
}

void ClientSession::visitMissing(const SessionProcessingHelper& helper, const RecordVisitor& visit) {
  const auto visitOne = [&](const std::vector<std::string>& missing, auto message) {
    if (!missing.empty())
      visit(SableFeedback(message(assembly_.runtime.ticks(), missing), 0, userGuid(), agent_));
  };
  visitOne(helper.missingSuggestions(), feedback::sessionMissingSuggestions);
  visitOne(helper.missingResults(), feedback::sessionMissingResults);
}

Dictionary ClientSession::getFeedbacksToSend() {
  Dictionary envelope;
  envelope["fb"] = privacyFilteredFeedbacksWithRelativeTimestamp(getSessionFeedbacks());
  envelope.update(envelopeBehindFeedback());
  return envelope;
}

void ClientSession::writeFeedbacksToSend(const std::function<void(std::string_view)>& write) {
  std::string piece = R"({"fb":[)";
  bool isFirst = true;
  const auto writeRecord = [&](const SableFeedback& record) {
    if (!std::exchange(isFirst, false)) piece += ',';
    record.writeJSON(piece);
    if (piece.size() < kPieceBytes) return;
    write(piece);
    piece.clear();
  };
  if (file_) {
    visitStoredRecordsToSend(writeRecord);
  } else {
    visitRecordsToSend(getSessionFeedbacks(), writeRecord);
  }
  piece.append("],").append(compactJSON(envelopeBehindFeedback()), 1);
  write(piece);
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
