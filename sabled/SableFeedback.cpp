#include "sabled/SableFeedback.h"

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/wire_format_lite.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "sabled/FeedbackTables.h"
#include "sabled/JSONWriter.h"
#include "sabled/ParsedMessage.h"

namespace sable {

namespace {

constexpr std::uint64_t kNanosecondsPerMillisecond = 1'000'000;
constexpr std::size_t kTagBytes = 1;  // of fields up to 15

using StoredRecord = messages::_SKSableFeedback;
using StoredPayload = messages::_SKFeedbackPayload;
using Wire = google::protobuf::internal::WireFormatLite;

/// The tag and length of a field whose bytes follow.
std::uint8_t* writeLength(int field, std::size_t length, std::uint8_t* to) {
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
  SableFeedbackReader reader;
  auto feedback = reader.read(bytes);
  if (!feedback) return tl::unexpected(std::move(feedback.error()));
  return std::move(**feedback);
}

SableFeedbackReader::SableFeedbackReader() : record_(std::make_unique<StoredRecord>()) {}

SableFeedbackReader::~SableFeedbackReader() = default;

Expected<SableFeedback*> SableFeedbackReader::read(std::string_view bytes) {
  if (!parseMessage(*record_, bytes))
    return tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, "sable feedback expected"));
  const StoredPayload& payload = record_->payload();
  auto entry = ofClass_.find(payload.class_name());
  if (entry == ofClass_.end()) {
    auto message = FeedbackMessage::parse(payload.class_name(), payload.feedback());
    if (!message) return tl::unexpected(std::move(message.error()));
    SableFeedback feedback(std::move(*message), 0, std::nullopt, {});
    entry = ofClass_.emplace(payload.class_name(), std::move(feedback)).first;
  } else if (auto assigned = entry->second.feedback_->assign(payload.feedback()); !assigned) {
    return tl::unexpected(std::move(assigned.error()));
  }
  SableFeedback& feedback = entry->second;
  feedback.queryId_ = record_->query_id();
  feedback.clientQueryId_ = record_->client_query_id();
  feedback.relTimestamp_ = record_->rel_timestamp();
  return &feedback;
}

/// Straight into one string: a record object would have to hold the message's bytes, and be made of four
/// allocations, for every feedback.
void SableFeedback::appendData(std::string& bytes) const {
  const auto lengthBytes = [](std::size_t size) { return kTagBytes + Wire::LengthDelimitedSize(size); };
  const google::protobuf::MessageLite& message = feedback_->message();
  const std::string_view name = feedback_->className();
  const std::size_t messageSize = message.ByteSizeLong();
  const std::size_t payloadSize = lengthBytes(name.size()) + lengthBytes(messageSize);
  const std::size_t start = bytes.size();
  bytes.append(lengthBytes(payloadSize) + 3 * kTagBytes + Wire::SInt64Size(queryId_) +
                   Wire::UInt64Size(clientQueryId_) + Wire::UInt64Size(relTimestamp_),
               '\0');
  auto* to = reinterpret_cast<std::uint8_t*>(bytes.data()) + start;
  to = writeLength(StoredRecord::kPayloadFieldNumber, payloadSize, to);
  to = writeLength(StoredPayload::kClassNameFieldNumber, name.size(), to);
  to = std::copy(name.begin(), name.end(), to);
  to = writeLength(StoredPayload::kFeedbackFieldNumber, messageSize, to);
  to = message.SerializeWithCachedSizesToArray(to);
  to = Wire::WriteSInt64ToArray(StoredRecord::kQueryIdFieldNumber, queryId_, to);
  to = Wire::WriteUInt64ToArray(StoredRecord::kClientQueryIdFieldNumber, clientQueryId_, to);
  Wire::WriteUInt64ToArray(StoredRecord::kRelTimestampFieldNumber, relTimestamp_, to);
}

std::string SableFeedback::data() const {
  std::string bytes;
  appendData(bytes);
  return bytes;
}

Dictionary SableFeedback::dictionary() const {
  std::string text;
  writeJSON(text);
  return *parseJSON(text, text.size());
}

std::string SableFeedback::description() const {
  std::string text;
  writeJSON(text, feedback_->timestamp() / kNanosecondsPerMillisecond);
  return text;
}

void SableFeedback::writeJSON(std::string& text, std::uint64_t timestamp) const {
  if (auto own = feedback_->ownObject()) {
    // It may have the record's keys, which then are replaced where they stand.
    setRecordKeys(*own, timestamp);
    text += compactJSON(*own);
    return;
  }
  JSONObject object{JSONPlace(text)};
  feedback_->write(object);
  setRecordKeys(object, timestamp);
}

template <class Object>
void SableFeedback::setRecordKeys(Object& object, std::uint64_t timestamp) const {
  if (feedback_->requiresQueryId()) {
    object["query_id"] = queryId_;
    if (clientQueryId_ != 0) object["client_query_id"] = clientQueryId_;
  }
  object["type"] = eventTypeToString(type());
  object["timestamp"] = timestamp;
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
