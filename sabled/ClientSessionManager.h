#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/Runtime.h"
#include "sabled/ClientSessionTransition.h"

namespace sable {

class Assembly;
class FeedbackSession;
class SableFeedback;
class SableUserGUIDController;

/// Posted when a session has grown past its soft limit, and when the time is up in which it should
/// have ended since.
inline constexpr std::string_view kSBLSessionSoftLimitNotification = "SBLSessionSoftLimitNotification";
inline constexpr std::string_view kSBLSessionMaxLimitNotification = "SBLSessionMaxLimitNotification";

/// How long a session goes on before the next occasion to end is taken.
inline constexpr platform::Duration kSessionSoftLimit = std::chrono::seconds(600);
/// How long it waits for an occasion.
inline constexpr platform::Duration kSessionMaximumTimer = std::chrono::seconds(300);
/// How long nobody reports anything before a session counts as idle.
inline constexpr platform::Duration kSessionIdleTime = std::chrono::seconds(180);

/// Puts every feedback into a session under the user GUID of the moment, and decides where sessions
/// begin and end (ClientSessionTransition.h). A session names the reason for which the one before it
/// ended. Sessions are of one client, or shared by all (Assembly::sharedSession). Any thread.
class ClientSessionManager {
 public:
  /// `identifier` says in log lines whose sessions these are. The controller outlives the manager.
  ClientSessionManager(Assembly& assembly, SableUserGUIDController& guidController, std::string identifier);
  ~ClientSessionManager();

  /// Records the feedback, later, unless the bag turns feedback off for its agent. From here on the
  /// feedback belongs to the manager, which gives it its user GUID. Never null.
  void addSableFeedback(std::shared_ptr<SableFeedback> feedback);

  /// Ends the session, later, if there is one, and in any case calls back on sessionQueue(); `callback`
  /// may be null.
  void flushSession(platform::Function<void()> callback);

  /// For a client that has gone: ends the session and calls back with true on sessionQueue(). A shared
  /// session goes on with a note that the client has gone; then the callback gets false, at once.
  void flushSessionInvalidationWithAgent(std::string agent, platform::Function<void(bool)> callback);

  /// Records an error of the daemon's own; does nothing where no sessions are kept.
  static void reportErrorAsSabledFeedback(const Error& error, Assembly& assembly);

  const std::string& identifier() const;
  SableUserGUIDController& guidController() const;
  const std::shared_ptr<platform::SerialQueue>& sessionQueue() const;

  // Wait for what sessionQueue() is doing: not to be called from its work.
  SessionState currentState() const;
  platform::WallTime expirationTime() const;         ///< when the session counts as idle
  std::shared_ptr<FeedbackSession> session() const;  ///< the open one, or null

 private:
  class Sessions;

  Assembly& assembly_;
  const std::shared_ptr<Sessions> sessions_;  ///< held weakly by its timers
};

}  // namespace sable
