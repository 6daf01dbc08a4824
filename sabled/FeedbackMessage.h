#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"

namespace google::protobuf {
class MessageLite;
}

namespace sable {

class JSONObject;
class SessionProcessingHelper;

/// A client's longer message is refused: it would be kept, and translated as a whole.
inline constexpr std::size_t kMaximumFeedbackBytes = 256u << 10;

/// What the engagement with a result tells beside its record.
struct ResultEngagement {
  bool topHit = false;
  std::uint32_t resultType = 0;
  std::string completedQuery;
};

struct SearchViewAppearance {
  bool onLockScreen = false;
  std::uint32_t viewAppearEvent = 0;
};

/// The custom feedback type of what goes to the crowdsourcing address.
inline constexpr std::uint32_t kCrowdsourcingFeedback = 2;

/// A feedback message of one of the classes of SableKit/messages, of either family. What each class
/// becomes is in docs/feedback.md. One thread at a time.
class FeedbackMessage {
 public:
  virtual ~FeedbackMessage() = default;

  /// Reads a serialised message. The error (of kSBLErrorDomain) says what is wrong: the class is none
  /// of classNames(), or the bytes are no message of it.
  static Expected<std::unique_ptr<FeedbackMessage>> parse(std::string_view className, std::string_view bytes);

  /// The same for what a client reports through ReportEvent: also fails past kMaximumFeedbackBytes.
  static Expected<std::unique_ptr<FeedbackMessage>> parseReported(std::string_view className,
                                                                  std::string_view bytes);
  /// The same for the `_SKFeedbackPayload` of ReportEventData, and its limit.
  static Expected<std::unique_ptr<FeedbackMessage>> parseReportedPayload(std::string_view bytes);

  /// The classes that a feedback may have, in the order of their kinds.
  static std::vector<std::string_view> classNames();

  /// Becomes another message of its class, in the memory of this one. The error is that of parse(), and
  /// then the message is of no use.
  virtual Expected<void> assign(std::string_view bytes) = 0;

  virtual std::string_view className() const = 0;
  /// Writes the kind's own keys, in order, as they are uploaded; none where there is an ownObject().
  virtual void write(JSONObject& object) const = 0;
  /// The object that the client itself has made, for a kind that has such: any keys in any order.
  virtual std::optional<Dictionary> ownObject() const = 0;
  /// Either of them.
  Dictionary dictionary() const;
  /// Index into SableFeedback::eventTypes().
  virtual unsigned type() const = 0;
  /// Whether the record names the query that it belongs to.
  virtual bool requiresQueryId() const = 0;
  /// Whether process() does anything.
  virtual bool hasIdentifiers() const = 0;
  /// Puts the helper's replacements in place of identifiers, and tells it which ones were only
  /// shown and which were used.
  virtual void process(SessionProcessingHelper& helper) = 0;

  /// The sender's monotonic clock, in nanoseconds.
  virtual std::uint64_t timestamp() const = 0;
  /// The client's own count of the query, 0 for none.
  virtual std::uint64_t clientQueryId() const = 0;

  // What the way of a feedback depends on; nullopt for other kinds.
  virtual std::optional<ResultEngagement> resultEngagement() const = 0;
  virtual std::optional<SearchViewAppearance> searchViewAppearance() const = 0;
  virtual std::optional<std::uint32_t> customFeedbackType() const = 0;  ///< kCrowdsourcingFeedback, ...

  /// The message itself, for whoever serialises it; parse() reads that back.
  virtual const google::protobuf::MessageLite& message() const = 0;
};

}  // namespace sable
