#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "platform/Dictionary.h"
#include "platform/UUID.h"
#include "sabled/FeedbackMessage.h"

namespace sable {

namespace messages {
class _SKSableFeedback;
}  // namespace messages

/// One feedback as it goes through a session: made when a client or the daemon reports it, processed
/// once, stored, and translated when its session is uploaded. One thread at a time.
class SableFeedback {
 public:
  /// `queryId` is the service's query, `clientQueryId` the client's own count of it, 0 for none. An
  /// empty agent is none.
  SableFeedback(std::unique_ptr<FeedbackMessage> feedback, std::int64_t queryId, std::optional<UUID> userGuid,
                std::string userAgent, std::uint64_t clientQueryId = 0);

  /// Reads data(): everything but the user GUID and the agent, which a session file has once for all
  /// its records. The error says what is wrong.
  static Expected<SableFeedback> parse(std::string_view bytes);

  /// The record in a session file: a `_SKSableFeedback`.
  std::string data() const;
  void appendData(std::string& bytes) const;

  /// The upload form: the kind's keys, then "query_id" and "client_query_id" where the kind has
  /// them, "type", and "timestamp" = relTimestamp().
  Dictionary dictionary() const;
  /// The same as compact JSON, behind what `text` holds already.
  void writeJSON(std::string& text) const { writeJSON(text, relTimestamp_); }
  /// The same for logs, with the sender's own time stamp in milliseconds.
  std::string description() const;

  const FeedbackMessage& feedback() const { return *feedback_; }
  unsigned type() const { return feedback_->type(); }
  void process(SessionProcessingHelper& helper) { feedback_->process(helper); }

  std::int64_t queryId() const { return queryId_; }
  std::uint64_t clientQueryId() const { return clientQueryId_; }
  const std::optional<UUID>& userGuid() const { return userGuid_; }
  void setUserGuid(std::optional<UUID> guid) { userGuid_ = guid; }
  const std::string& userAgent() const { return userAgent_; }
  void setUserAgent(std::string agent) { userAgent_ = std::move(agent); }
  /// Marks it as taken into the ledger of feedback; says whether it was not before.
  bool enterLedger() { return !std::exchange(isInLedger_, true); }
  /// Milliseconds since the first record of the session.
  std::uint64_t relTimestamp() const { return relTimestamp_; }
  void setRelTimestamp(std::uint64_t milliseconds) { relTimestamp_ = milliseconds; }

  /// -1, 0 or 1: which of two records was reported first.
  static int timeStampComparator(const SableFeedback& one, const SableFeedback& other);

  /// "type" values by type index; the word of an index past the end is "unknown".
  static std::span<const std::string_view> eventTypes();
  static std::string_view eventTypeToString(unsigned type);

 private:
  friend class SableFeedbackReader;

  void writeJSON(std::string& text, std::uint64_t timestamp) const;
  template <class Object>
  void setRecordKeys(Object& object, std::uint64_t timestamp) const;

  std::unique_ptr<FeedbackMessage> feedback_;
  std::int64_t queryId_ = 0;
  std::uint64_t clientQueryId_ = 0;
  std::uint64_t relTimestamp_ = 0;
  std::optional<UUID> userGuid_;
  std::string userAgent_;
  bool isInLedger_ = false;
};

/// Reads many records one after the other, each in the memory of the last one of its class: it is the
/// allocation of messages that takes the time.
class SableFeedbackReader {
 public:
  SableFeedbackReader();
  ~SableFeedbackReader();

  /// As SableFeedback::parse(). The feedback is the reader's, until the next one is read.
  Expected<SableFeedback*> read(std::string_view bytes);

 private:
  const std::unique_ptr<messages::_SKSableFeedback> record_;
  std::map<std::string, SableFeedback, std::less<>> ofClass_;
};

}  // namespace sable
