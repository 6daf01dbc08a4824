#include "sabled/ClientSessionTransition.h"

namespace sable {

using feedback::SessionEndReason;

std::optional<SessionTransition> sessionTransition(SessionEvent event, SessionState state) {
  const bool isActive = state == SessionState::active;
  const bool isPastLimit = state == SessionState::softLimitReached;
  const bool isOpen = isActive || isPastLimit;
  const bool isNone = state == SessionState::noSession;
  const SessionTransition unchanged{.next = state};
  switch (event) {
    case SessionEvent::feedbackReceived:
      if (isOpen) return SessionTransition{.addsFeedback = true, .next = state};
      if (!isNone) return std::nullopt;
      return SessionTransition{.beginsSession = true, .next = SessionState::active};
    case SessionEvent::softLimitReached:
      return SessionTransition{.next = isActive ? SessionState::softLimitReached : state};
    case SessionEvent::maxTimerExpired:
      if (!isPastLimit) return unchanged;
      return SessionTransition{.end = SessionEndReason::maxSessionTimePassed};
    case SessionEvent::externalFlushRequest:
      if (!isOpen && !isNone) return unchanged;
      return SessionTransition{.end = SessionEndReason::externalRequest};
    case SessionEvent::criticalMemory:
      return SessionTransition{.end = SessionEndReason::criticalMemory, .requestsUpload = true};
    case SessionEvent::flushRequest:
    case SessionEvent::otherFlushRequest:
      return SessionTransition{.requestsUpload = true, .next = state};
    case SessionEvent::idleAfterSoftLimit:
      if (!isPastLimit) return unchanged;
      return SessionTransition{.end = SessionEndReason::sessionIdle,
                               .resetsGUID = true,
                               .beginsSession = true,
                               .next = SessionState::active};
    case SessionEvent::guidChanged:
      if (!isOpen) return unchanged;
      return SessionTransition{
          .end = SessionEndReason::guidChanged, .beginsSession = true, .next = SessionState::active};
    case SessionEvent::sentinelFeedback:
      if (!isPastLimit) return unchanged;
      return SessionTransition{
          .addsFeedback = true, .end = SessionEndReason::engagementReceived, .resetsGUID = true};
  }
  return std::nullopt;
}

}  // namespace sable
