#include "sabled/SableFeedback.h"

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/wire_format_lite.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "sabled/FeedbackTables.h"
#include "sabled/JSONWriter.h"

namespace sable {

namespace {

constexpr std::uint64_t kNanosecondsPerMillisecond = 1'000'000;
constexpr std::size_t kTagBytes = 1;  // of fields up to 15

using StoredRecord = messages::_SKSableFeedback;
using StoredPayload = messages::_SKFeedbackPayload;
using Wire = google::protobuf::internal::WireFormatLite;
using Input = google::protobuf::io::CodedInputStream;

/// The tag and length of a field whose bytes follow.
std::uint8_t* writeLength(int field, std::size_t length, std::uint8_t* to) {
  to = Wire::WriteTagToArray(field, Wire::WIRETYPE_LENGTH_DELIMITED, to);
  return google::protobuf::io::CodedOutputStream::WriteVarint32ToArray(static_cast<std::uint32_t>(length),
                                                                       to);
}

/// A record's fields, in the bytes that it is read from: a record object would copy them.
struct Record {
  std::string_view className, feedback;
  std::uint64_t queryId = 0;  ///< zigzag
  std::uint64_t clientQueryId = 0, relTimestamp = 0;
};

/// Hands each field's tag to `read`, which takes its value or answers false.
template <class Read>
bool readFields(std::string_view bytes, const Read& read) {
  if (!std::in_range<int>(bytes.size())) return false;
  Input input(reinterpret_cast<const std::uint8_t*>(bytes.data()), static_cast<int>(bytes.size()));
  while (const std::uint32_t tag = input.ReadTag()) {
    if (!read(input, tag)) return false;
  }
  return input.ConsumedEntireMessage();
}

bool readBytes(Input& input, std::string_view& bytes) {
  std::uint32_t length = 0;
  if (!input.ReadVarint32(&length)) return false;
  const void* data = nullptr;
  int available = 0;
  input.GetDirectBufferPointer(&data, &available);
  if (std::cmp_greater(length, available)) return false;
  bytes = {static_cast<const char*>(data), length};
  return input.Skip(static_cast<int>(length));
}

constexpr std::uint32_t tagOf(int field, Wire::WireType type) {
  return static_cast<std::uint32_t>(field) << Wire::kTagTypeBits | static_cast<std::uint32_t>(type);
}

bool readPayload(std::string_view bytes, Record& record) {
  return readFields(bytes, [&](Input& input, std::uint32_t tag) {
    switch (tag) {
      case tagOf(StoredPayload::kClassNameFieldNumber, Wire::WIRETYPE_LENGTH_DELIMITED):
        return readBytes(input, record.className);
      case tagOf(StoredPayload::kFeedbackFieldNumber, Wire::WIRETYPE_LENGTH_DELIMITED):
        return readBytes(input, record.feedback);
      default:
        return Wire::SkipField(&input, tag);
    }
  });
}

bool readRecord(std::string_view bytes, Record& record) {
  return readFields(bytes, [&](Input& input, std::uint32_t tag) {
    std::string_view payload;
    switch (tag) {
      case tagOf(StoredRecord::kPayloadFieldNumber, Wire::WIRETYPE_LENGTH_DELIMITED):
        return readBytes(input, payload) && readPayload(payload, record);
      case tagOf(StoredRecord::kQueryIdFieldNumber, Wire::WIRETYPE_VARINT):
        return input.ReadVarint64(&record.queryId);
      case tagOf(StoredRecord::kClientQueryIdFieldNumber, Wire::WIRETYPE_VARINT):
        return input.ReadVarint64(&record.clientQueryId);
      case tagOf(StoredRecord::kRelTimestampFieldNumber, Wire::WIRETYPE_VARINT):
        return input.ReadVarint64(&record.relTimestamp);
      default:
        return Wire::SkipField(&input, tag);
    }
  });
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

Expected<SableFeedback*> SableFeedbackReader::read(std::string_view bytes) {
  Record record;
  if (!readRecord(bytes, record))
    return tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, "sable feedback expected"));
  auto entry = ofClass_.find(record.className);
  if (entry == ofClass_.end()) {
    auto message = FeedbackMessage::parse(record.className, record.feedback);
    if (!message) return tl::unexpected(std::move(message.error()));
    SableFeedback feedback(std::move(*message), 0, std::nullopt, {});
    entry = ofClass_.emplace(record.className, std::move(feedback)).first;
  } else if (auto assigned = entry->second.feedback_->assign(record.feedback); !assigned) {
    return tl::unexpected(std::move(assigned.error()));
  }
  SableFeedback& feedback = entry->second;
  feedback.queryId_ = Wire::ZigZagDecode64(record.queryId);
  feedback.clientQueryId_ = record.clientQueryId;
  feedback.relTimestamp_ = record.relTimestamp;
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
