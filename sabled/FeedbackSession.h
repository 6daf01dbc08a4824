#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/UUID.h"

namespace sable {

class ClientSession;
class SableFeedback;

using SableFeedbacks = std::vector<std::shared_ptr<SableFeedback>>;

/// What a session is to those who fill and end it: the session of one client or of all.
class FeedbackSession {
 public:
  virtual ~FeedbackSession() = default;

  /// Records the feedback; does not wait for the disk.
  virtual void addFeedback(std::shared_ptr<SableFeedback> feedback) = 0;

  /// The feedback that is held in memory, by time.
  virtual SableFeedbacks getSessionFeedbacks() = 0;
  /// It as an array of its upload forms, timed from the first one.
  virtual Dictionary feedbacksWithRelativeTimestamp() = 0;
  /// `feedbacks` as an array of their upload forms, with no identifier that means anything outside
  /// it; they are processed for good.
  virtual Dictionary privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks& feedbacks) = 0;

  /// Calls with each client's session; `isLast` is true for the last one only.
  virtual void enumerateSessions(const std::function<void(ClientSession&, bool isLast)>& callback) = 0;

  virtual std::optional<UUID> userGuid() = 0;
  virtual void setUserGuid(std::optional<UUID> userGuid) = 0;
};

}  // namespace sable
