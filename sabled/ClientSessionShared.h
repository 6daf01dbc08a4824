#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "platform/Runtime.h"
#include "sabled/FeedbackSession.h"

namespace sable {

class Assembly;

/// One session for all clients: a ClientSession for each user agent, which begin and end together.
/// Any thread.
class ClientSessionShared final : public FeedbackSession {
 public:
  /// Begins with a session for the agent of the first feedback.
  ClientSessionShared(Assembly& assembly, const std::shared_ptr<SableFeedback>& feedback,
                      std::uint32_t previousSessionEndReason = 0);
  ~ClientSessionShared() override;

  /// Adds it, later, to the session of its agent; a feedback without an agent is dropped.
  void addFeedback(std::shared_ptr<SableFeedback> feedback) override;

  // One client's after the other's, in the order of their agents; times count from each one's first.
  SableFeedbacks getSessionFeedbacks() override;
  Dictionary feedbacksWithRelativeTimestamp() override;
  /// Of the feedback in memory: the argument says nothing about whose it is and is left aside.
  Dictionary privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks&) override;

  void enumerateSessions(const std::function<void(ClientSession&, bool)>& callback) override;

  using SessionMap = std::map<std::string, std::shared_ptr<ClientSession>>;  ///< by user agent
  SessionMap sessionMap();
  std::optional<UUID> userGuid() override;
  void setUserGuid(std::optional<UUID> userGuid) override;

 private:
  struct State;

  const std::shared_ptr<platform::SerialQueue> sessionQueue_;
  const std::shared_ptr<State> state_;  ///< on sessionQueue_
};

}  // namespace sable
