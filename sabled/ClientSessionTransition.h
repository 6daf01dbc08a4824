#pragma once

#include <cstdint>
#include <optional>

#include "sabled/DaemonFeedback.h"

namespace sable {

enum class SessionState : std::uint64_t {
  active = 0,            ///< a session is open and younger than its soft limit
  softLimitReached = 1,  ///< a session is open and ends at the next occasion
  noSession = 2,
};

enum class SessionEvent : std::uint64_t {
  feedbackReceived = 0,
  softLimitReached = 1,
  maxTimerExpired = 2,
  externalFlushRequest = 3,
  flushRequest = 5,
  criticalMemory = 6,
  otherFlushRequest = 7,   ///< the same
  idleAfterSoftLimit = 8,  ///< a feedback after a pause, past the soft limit
  guidChanged = 9,         ///< a feedback under another user GUID than the session's
  sentinelFeedback = 10,   ///< a feedback past the soft limit that concludes what the user did
};

/// What an event does, in this order.
struct SessionTransition {
  bool addsFeedback = false;                                     ///< to the open session
  std::optional<feedback::SessionEndReason> end = std::nullopt;  ///< of the open session, if there is one
  bool requestsUpload = false;                                   ///< of complete sessions
  bool resetsGUID = false;
  bool beginsSession = false;  ///< with the feedback
  SessionState next = SessionState::noSession;
};

/// Where the boundaries between sessions fall:
///
///     event                 no session       active            soft limit reached
///     feedbackReceived      begin -> active  add               add
///     softLimitReached                       -> soft limit reached
///     maxTimerExpired                                          end -> no session
///     externalFlushRequest  -> no session    end -> no session end -> no session
///     flushRequests         upload           upload            upload
///     criticalMemory        upload           end, upload       end, upload -> no session
///     idleAfterSoftLimit                                       end, new GUID, begin -> active
///     guidChanged                            end, begin        end, begin -> active
///     sentinelFeedback                                         add, end, new GUID -> no session
///
/// An event has no effect in the other states. There is no transition for an event that is none, nor
/// for a feedback in a state that is none.
std::optional<SessionTransition> sessionTransition(SessionEvent event, SessionState state);

}  // namespace sable
