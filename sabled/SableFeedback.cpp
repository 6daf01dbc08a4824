#include "sabled/SableFeedback.h"

#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "sabled/FeedbackTables.h"
#include "sabled/ParsedMessage.h"

namespace sable {

namespace {

constexpr std::uint64_t kNanosecondsPerMillisecond = 1'000'000;

}  // namespace

SableFeedback::SableFeedback(std::unique_ptr<FeedbackMessage> feedback, std::int64_t queryId,
                             std::optional<UUID> userGuid, std::string userAgent, std::uint64_t clientQueryId)
    : feedback_(std::move(feedback)),
      queryId_(queryId),
      clientQueryId_(clientQueryId),
      userGuid_(userGuid),
      userAgent_(std::move(userAgent)) {}

Expected<SableFeedback> SableFeedback::parse(std::string_view bytes) {
  messages::_SKSableFeedback record;
  if (!parseMessage(record, bytes)) {
    return tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, "sable feedback expected"));
  }
  auto message = FeedbackMessage::parse(record.payload().class_name(), record.payload().feedback());
  if (!message) return tl::unexpected(std::move(message.error()));
  SableFeedback feedback(std::move(*message), record.query_id(), std::nullopt, {}, record.client_query_id());
  feedback.relTimestamp_ = record.rel_timestamp();
  return feedback;
}

std::string SableFeedback::data() const {
  messages::_SKSableFeedback record;
  record.mutable_payload()->set_class_name(std::string(feedback_->className()));
  record.mutable_payload()->set_feedback(feedback_->data());
  record.set_query_id(queryId_);
  record.set_client_query_id(clientQueryId_);
  record.set_rel_timestamp(relTimestamp_);
  return record.SerializeAsString();
}

Dictionary SableFeedback::dictionary() const {
  Dictionary dictionary = _dictionaryHelper();
  dictionary["timestamp"] = relTimestamp_;
  return dictionary;
}

std::string SableFeedback::description() const {
  Dictionary dictionary = _dictionaryHelper();
  dictionary["timestamp"] = feedback_->timestamp() / kNanosecondsPerMillisecond;
  return compactJSON(dictionary);
}

Dictionary SableFeedback::_dictionaryHelper() const {
  Dictionary dictionary = feedback_->dictionary();
  if (feedback_->requiresQueryId()) {
    dictionary["query_id"] = queryId_;
    if (clientQueryId_ != 0) dictionary["client_query_id"] = clientQueryId_;
  }
  dictionary["type"] = eventTypeToString(type());
  return dictionary;
}

int SableFeedback::timeStampComparator(const SableFeedback& one, const SableFeedback& other) {
  const auto first = one.feedback_->timestamp(), second = other.feedback_->timestamp();
  return first > second ? 1 : first < second ? -1 : 0;
}

std::span<const std::string_view> SableFeedback::eventTypes() {
  return feedback::kTypes;
}

std::string_view SableFeedback::eventTypeToString(unsigned type) {
  return feedback::wordOf(feedback::kTypes, type < eventTypes().size() ? type : feedback::kUnknownType);
}

}  // namespace sable
