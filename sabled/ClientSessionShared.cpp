#include "sabled/ClientSessionShared.h"

#include <nlohmann/json.hpp>
#include <utility>

#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/SableFeedback.h"

namespace sable {

/// Feedback that is still to be added keeps it alive.
struct ClientSessionShared::State {
  Assembly& assembly;
  const std::uint32_t previousSessionEndReason;
  std::optional<UUID> userGuid;
  SessionMap sessionMap;

  void add(const std::shared_ptr<SableFeedback>& feedback) {
    const std::string& agent = feedback->userAgent();
    auto& session = sessionMap[agent];
    if (!session) {
      session = std::make_shared<ClientSession>(assembly, feedback, previousSessionEndReason);
      return;
    }
    if (session->agent().empty()) session->setAgent(agent);
    if (session->userGuidString().empty() && feedback->userGuid()) session->setUserGuid(feedback->userGuid());
    session->addFeedback(feedback);
  }
};

ClientSessionShared::ClientSessionShared(Assembly& assembly, const std::shared_ptr<SableFeedback>& feedback,
                                         std::uint32_t previousSessionEndReason)
    : sessionQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.clientSessionSharedQueue")),
      state_(new State{assembly, previousSessionEndReason, feedback->userGuid(), {}}) {
  state_->add(feedback);
}

ClientSessionShared::~ClientSessionShared() = default;

void ClientSessionShared::addFeedback(std::shared_ptr<SableFeedback> feedback) {
  sessionQueue_->async([state = state_, feedback = std::move(feedback)] {
    if (!feedback) return;
    if (feedback->userAgent().empty()) return ledger::count(state->assembly.tally, SBLLedgerEntry::noAgent);
    state->add(feedback);
  });
}

SableFeedbacks ClientSessionShared::getSessionFeedbacks() {
  return sessionQueue_->sync([this] {
    SableFeedbacks all;
    for (const auto& [agent, session] : state_->sessionMap) {
      const auto own = session->getSessionFeedbacks();
      all.insert(all.end(), own.begin(), own.end());
    }
    return all;
  });
}

Dictionary ClientSessionShared::feedbacksWithRelativeTimestamp() {
  return sessionQueue_->sync([this] {
    Dictionary all = Dictionary::array();
    for (const auto& [agent, session] : state_->sessionMap) {
      for (auto& each : session->feedbacksWithRelativeTimestamp()) all.push_back(std::move(each));
    }
    return all;
  });
}

Dictionary ClientSessionShared::privacyFilteredFeedbacksWithRelativeTimestamp(const SableFeedbacks&) {
  return sessionQueue_->sync([this] {
    Dictionary all = Dictionary::array();
    for (const auto& [agent, session] : state_->sessionMap) {
      for (auto& each :
           session->privacyFilteredFeedbacksWithRelativeTimestamp(session->getSessionFeedbacks()))
        all.push_back(std::move(each));
    }
    return all;
  });
}

void ClientSessionShared::enumerateSessions(const std::function<void(ClientSession&, bool)>& callback) {
  sessionQueue_->sync([&] {
    std::size_t count = 0;
    for (const auto& [agent, session] : state_->sessionMap)
      callback(*session, ++count == state_->sessionMap.size());
  });
}

ClientSessionShared::SessionMap ClientSessionShared::sessionMap() {
  return sessionQueue_->sync([this] { return state_->sessionMap; });
}

std::optional<UUID> ClientSessionShared::userGuid() {
  return sessionQueue_->sync([this] { return state_->userGuid; });
}

void ClientSessionShared::setUserGuid(std::optional<UUID> userGuid) {
  sessionQueue_->sync([&] { state_->userGuid = userGuid; });
}

}  // namespace sable
