#include "sabled/SableFeedback.h"

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/wire_format_lite.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "sabled/FeedbackTables.h"
#include "sabled/ParsedMessage.h"

namespace sable {

namespace {

constexpr std::uint64_t kNanosecondsPerMillisecond = 1'000'000;
constexpr std::size_t kTagBytes = 1;  // of fields up to 15

/// The tag and length of a field whose bytes follow.
std::uint8_t* writeLength(int field, std::size_t length, std::uint8_t* to) {
  using Wire = google::protobuf::internal::WireFormatLite;
  to = Wire::WriteTagToArray(field, Wire::WIRETYPE_LENGTH_DELIMITED, to);
  return google::protobuf::io::CodedOutputStream::WriteVarint32ToArray(static_cast<std::uint32_t>(length),
                                                                       to);
}

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

/// Straight into one string: a record object would have to hold the message's bytes, and be made of four
/// allocations, for every feedback.
std::string SableFeedback::data() const {
  using Record = messages::_SKSableFeedback;
  using Payload = messages::_SKFeedbackPayload;
  using Wire = google::protobuf::internal::WireFormatLite;
  const auto lengthBytes = [](std::size_t size) { return kTagBytes + Wire::LengthDelimitedSize(size); };
  const google::protobuf::MessageLite& message = feedback_->message();
  const std::string_view name = feedback_->className();
  const std::size_t messageSize = message.ByteSizeLong();
  const std::size_t payloadSize = lengthBytes(name.size()) + lengthBytes(messageSize);
  std::string bytes(lengthBytes(payloadSize) + 3 * kTagBytes + Wire::SInt64Size(queryId_) +
                        Wire::UInt64Size(clientQueryId_) + Wire::UInt64Size(relTimestamp_),
                    '\0');
  auto* to = reinterpret_cast<std::uint8_t*>(bytes.data());
  to = writeLength(Record::kPayloadFieldNumber, payloadSize, to);
  to = writeLength(Payload::kClassNameFieldNumber, name.size(), to);
  to = std::copy(name.begin(), name.end(), to);
  to = writeLength(Payload::kFeedbackFieldNumber, messageSize, to);
  to = message.SerializeWithCachedSizesToArray(to);
  to = Wire::WriteSInt64ToArray(Record::kQueryIdFieldNumber, queryId_, to);
  to = Wire::WriteUInt64ToArray(Record::kClientQueryIdFieldNumber, clientQueryId_, to);
  Wire::WriteUInt64ToArray(Record::kRelTimestampFieldNumber, relTimestamp_, to);
  return bytes;
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
