#include "sabled/ClientSessionManager.h"

#include <optional>
#include <utility>

#include "SableKit/SBLBag.h"
#include "platform/NotificationCenter.h"
#include "platform/Transaction.h"
#include "sabled/Assembly.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionShared.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/SableBagController.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableLogging.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UserAgent.h"

namespace sable {

namespace {

using feedback::SessionEndReason;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategorySession);
}

/// With the engagement with a result or a card the user has found what was looked for.
bool suggestsSessionEnd(const SableFeedback& feedback) {
  constexpr unsigned kResultEngagement = 8, kCardEngagement = 10;
  return feedback.type() == kResultEngagement || feedback.type() == kCardEngagement;
}

}  // namespace

/// The session of the moment and its timers. All but the constructor runs on `queue`.
class ClientSessionManager::Sessions : public std::enable_shared_from_this<Sessions> {
 public:
  Sessions(Assembly& assembly, SableUserGUIDController& guids, std::string name)
      : identifier(std::move(name)),
        guidController(guids),
        queue(assembly.runtime.serialQueue("com.kestrel.sabled.clientSessionManagerQueue")),
        assembly_(assembly) {}

  void add(const std::shared_ptr<SableFeedback>& feedback);
  void _updateState(const std::shared_ptr<SableFeedback>& feedback, SessionEvent event,
                    platform::Function<void()> callback = {});

  const std::string identifier;
  SableUserGUIDController& guidController;
  const std::shared_ptr<platform::SerialQueue> queue;

  SessionState currentState = SessionState::noSession;
  platform::WallTime expirationTime;
  std::shared_ptr<FeedbackSession> session;

 private:
  bool isWanted(const SableFeedback& feedback);
  SessionEvent eventOf(const SableFeedback& feedback) const;
  void _setNewSession(const std::shared_ptr<SableFeedback>& feedback);
  void _flushSessionWithReason(SessionEndReason reason, platform::Function<void()> callback);
  void logFlush(SessionEndReason reason) const;

  void startTimer(platform::Duration delay, void (Sessions::*expired)(std::uint64_t));
  void softLimitExpired(std::uint64_t expected);
  void _onUserGuidSoftLimitReached();
  void maxTimerExpired(std::uint64_t expected);
  void post(std::string_view notification) const;

  Assembly& assembly_;
  std::optional<UUID> sessionGuid_;   ///< under which it began; asking it would be to wait for its queue
  std::uint64_t sessionCounter_ = 0;  ///< tells a timer whether its session is still the current one
  SessionEndReason flushReason_ = SessionEndReason::noPreviousSession;
  std::shared_ptr<const SBLBag> bagOfLastAgent_;  ///< kept, for a client reports many things in a row
};

void ClientSessionManager::Sessions::add(const std::shared_ptr<SableFeedback>& feedback) {
  if (!isWanted(*feedback)) return ledger::count(assembly_.tally, SBLLedgerEntry::bagDisabled);
  feedback->setUserGuid(guidController.currentUserGUID());
  _updateState(feedback, eventOf(*feedback));
  expirationTime = assembly_.runtime.now() + kSessionIdleTime;
}

bool ClientSessionManager::Sessions::isWanted(const SableFeedback& feedback) {
  const auto bag = assembly_.bagController->inMemoryBag();
  if (bag == nullptr) return true;
  if (bagOfLastAgent_ == nullptr || bagOfLastAgent_->rawBag() != bag->rawBag() ||
      bagOfLastAgent_->userAgent() != feedback.userAgent()) {
    bagOfLastAgent_ = std::make_shared<const SBLBag>(bag->rawBag(), feedback.userAgent());
  }
  return bagOfLastAgent_->feedbackEnabled();
}

SessionEvent ClientSessionManager::Sessions::eventOf(const SableFeedback& feedback) const {
  if (currentState == SessionState::noSession) return SessionEvent::feedbackReceived;
  if (sessionGuid_ != feedback.userGuid()) return SessionEvent::guidChanged;
  if (currentState == SessionState::active) return SessionEvent::feedbackReceived;
  if (suggestsSessionEnd(feedback)) return SessionEvent::sentinelFeedback;
  return expirationTime > assembly_.runtime.now() ? SessionEvent::feedbackReceived
                                                  : SessionEvent::idleAfterSoftLimit;
}

void ClientSessionManager::Sessions::_updateState(const std::shared_ptr<SableFeedback>& feedback,
                                                  SessionEvent event, platform::Function<void()> callback) {
  queue->assertIsCurrent();
  const auto transition = sessionTransition(event, currentState);
  if (!transition) {
    if (event == SessionEvent::feedbackReceived) {
      log().debug("Avoided adding feedback in state {}", static_cast<std::uint64_t>(currentState));
    } else {
      log().debug("External event received {}", static_cast<std::uint64_t>(event));
    }
    return;
  }
  if (transition->addsFeedback) session->addFeedback(feedback);
  if (const auto reason = transition->end) {
    if (!callback) callback = [this, reason] { logFlush(*reason); };
    _flushSessionWithReason(*reason, std::move(callback));
  }
  if (transition->requestsUpload && assembly_.backgroundFlusher)
    assembly_.backgroundFlusher->insertFlushActivity(0);
  if (transition->resetsGUID) guidController.reset();
  if (transition->beginsSession) {
    if (transition->resetsGUID) feedback->setUserGuid(guidController.currentUserGUID());
    _setNewSession(feedback);
  }
  currentState = transition->next;
}

void ClientSessionManager::Sessions::_setNewSession(const std::shared_ptr<SableFeedback>& feedback) {
  ++sessionCounter_;
  sessionGuid_ = feedback->userGuid();
  const auto reason = static_cast<std::uint32_t>(flushReason_);
  if (assembly_.sharedSession) {
    session = std::make_shared<ClientSessionShared>(assembly_, feedback, reason);
  } else {
    session = std::make_shared<ClientSession>(assembly_, feedback, reason);
  }
  log().debug("new session id {} {}", sessionCounter_, identifier);
  startTimer(kSessionSoftLimit, &Sessions::softLimitExpired);
}

void ClientSessionManager::Sessions::_flushSessionWithReason(SessionEndReason reason,
                                                             platform::Function<void()> callback) {
  if (session) {
    flushReason_ = reason;
    session->enumerateSessions([&](ClientSession& client, bool) {
      if (reason != SessionEndReason::noPreviousSession) {
        client.addFeedback(std::make_shared<SableFeedback>(
            feedback::sessionEnd(assembly_.runtime.ticks(), reason), 0, client.userGuid(), client.agent()));
      }
      client.sessionComplete();
    });
  }
  callback();
  session = nullptr;
}

void ClientSessionManager::Sessions::logFlush(SessionEndReason reason) const {
  switch (reason) {
    case SessionEndReason::sessionIdle:
      return log().debug("session flushed because soft limit reached and idle time was beyond {} {}",
                         std::chrono::duration_cast<std::chrono::seconds>(kSessionIdleTime).count(),
                         identifier);
    case SessionEndReason::maxSessionTimePassed:
      return log().debug("session flushed because max timer expired {}", identifier);
    case SessionEndReason::guidChanged:
      return log().debug("session flushed because guid changed {}", identifier);
    case SessionEndReason::criticalMemory:
      return log().debug("session flushed because of critical memory");
    case SessionEndReason::engagementReceived:
      return log().debug("session flushed because soft limit reached and sentinel feedback received");
    case SessionEndReason::noPreviousSession:
    case SessionEndReason::externalRequest:
      return;
  }
}

void ClientSessionManager::Sessions::startTimer(platform::Duration delay,
                                                void (Sessions::*expired)(std::uint64_t)) {
  queue
      ->after(delay,
              [weak = weak_from_this(), expired, expected = sessionCounter_] {
                if (const auto self = weak.lock()) ((*self).*expired)(expected);
              })
      .detach();
}

void ClientSessionManager::Sessions::softLimitExpired(std::uint64_t expected) {
  log().debug("soft limit reached expected {} current {} {}", expected, sessionCounter_, identifier);
  if (expected == sessionCounter_) _onUserGuidSoftLimitReached();
}

void ClientSessionManager::Sessions::_onUserGuidSoftLimitReached() {
  queue->assertIsCurrent();
  if (!session) return;
  _updateState(nullptr, SessionEvent::softLimitReached);
  log().debug("soft limit reached, maxtimer session id {} {}", sessionCounter_, identifier);
  post(kSBLSessionSoftLimitNotification);
  startTimer(kSessionMaximumTimer, &Sessions::maxTimerExpired);
}

void ClientSessionManager::Sessions::maxTimerExpired(std::uint64_t expected) {
  log().debug("max timer expired expected {} current {}", expected, sessionCounter_);
  if (expected == sessionCounter_) {
    if (!session) return;
    _updateState(nullptr, SessionEvent::maxTimerExpired);
  }
  post(kSBLSessionMaxLimitNotification);
}

/// Not on `queue`: an observer may want to know the session.
void ClientSessionManager::Sessions::post(std::string_view notification) const {
  assembly_.runtime.globalQueue(platform::QualityOfService::standard)
      .async([&assembly = assembly_, notification] {
        assembly.notificationCenter.post({notification, nullptr, {}});
      });
}

ClientSessionManager::ClientSessionManager(Assembly& assembly, SableUserGUIDController& guidController,
                                           std::string identifier)
    : assembly_(assembly),
      sessions_(std::make_shared<Sessions>(assembly, guidController, std::move(identifier))) {
  log().info("Sable is using {} {}",
             assembly.sharedSession ? "shared session for all clients" : "individual session for clients",
             this->identifier());
}

ClientSessionManager::~ClientSessionManager() = default;

void ClientSessionManager::addSableFeedback(std::shared_ptr<SableFeedback> feedback) {
  ledger::take(assembly_.tally, *feedback);
  sessions_->queue->async(
      [sessions = sessions_, feedback = std::move(feedback),
       transaction = assembly_.platform.transactions().open("addFeedback")] { sessions->add(feedback); });
}

void ClientSessionManager::flushSession(platform::Function<void()> callback) {
  sessions_->queue->async([sessions = sessions_, callback = std::move(callback)]() mutable {
    sessions->_updateState(nullptr, SessionEvent::externalFlushRequest, std::move(callback));
  });
}

void ClientSessionManager::flushSessionInvalidationWithAgent(std::string agent,
                                                             platform::Function<void(bool)> callback) {
  if (!assembly_.sharedSession) {
    return flushSession([callback = std::move(callback)]() mutable { callback(true); });
  }
  addSableFeedback(std::make_shared<SableFeedback>(feedback::connectionInvalidated(assembly_.runtime.ticks()),
                                                   0, std::nullopt, std::move(agent)));
  callback(false);
}

void ClientSessionManager::reportErrorAsSabledFeedback(const Error& error, Assembly& assembly) {
  if (!assembly.clientSessionManager) return;
  assembly.clientSessionManager->addSableFeedback(std::make_shared<SableFeedback>(
      feedback::error(assembly.runtime.ticks(), error), 0, assembly.guidController->currentUserGUID(),
      sabledUserAgent(assembly.platform.deviceInfo())));
}

const std::string& ClientSessionManager::identifier() const {
  return sessions_->identifier;
}

SableUserGUIDController& ClientSessionManager::guidController() const {
  return sessions_->guidController;
}

const std::shared_ptr<platform::SerialQueue>& ClientSessionManager::sessionQueue() const {
  return sessions_->queue;
}

SessionState ClientSessionManager::currentState() const {
  return sessions_->queue->sync([this] { return sessions_->currentState; });
}

platform::WallTime ClientSessionManager::expirationTime() const {
  return sessions_->queue->sync([this] { return sessions_->expirationTime; });
}

std::shared_ptr<FeedbackSession> ClientSessionManager::session() const {
  return sessions_->queue->sync([this] { return sessions_->session; });
}

}  // namespace sable
