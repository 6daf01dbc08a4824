#include <gtest/gtest.h>

#include "SableKit/SBLError.h"
#include "platform/NotificationCenter.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientConnection.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientSessionShared.h"
#include "sabled/ClientState.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableService.h"
#include "sabled/SableUserGUIDController.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// Where sessions begin and end, on the whole daemon in virtual time.
namespace sable::test {
namespace {

using Records = std::vector<std::string>;

class Sessions : public testing::Test {
 protected:
  /// Starts the daemon and watches what it posts.
  void start(bool shared = true) {
    device.platform.userDefaults().setByUser("SBLSharedSession", shared);
    device.start();
    device.assembly().backgroundFlusher->setStopFlushing(true);  // the files are read here
    ended();                                                     // the bag's fetch was one
    for (const auto name : {kSBLSessionSoftLimitNotification, kSBLSessionMaxLimitNotification,
                            kSBLUserGUIDChangeNotification}) {
      observations.push_back(device.assembly().notificationCenter.observe(
          std::string(name), [this](const platform::Notification& each) { ++posted[each.name]; }));
    }
  }
  ClientSessionManager& manager() { return *device.assembly().clientSessionManager; }
  UUID guid() { return device.assembly().guidController->currentUserGUID(); }

  void report(const std::string& className, std::string agent = "Beacon/1") {
    manager().addSableFeedback(feedbackFromJSON(className, "{}", std::move(agent), kStrangersGuid));
    device.run();
  }
  void search(std::string agent = "Beacon/1") { report("RKStartSearchFeedback", std::move(agent)); }
  void flush() {
    manager().flushSession(nullptr);
    device.run();
  }
  void engage() { report("RKResultEngagementFeedback"); }
  /// Reports a search each minute, so that the session never counts as idle.
  void type(std::chrono::minutes duration) {
    for (; duration > 0min; duration -= 1min) {
      device.advance(1min);
      search();
    }
  }

  /// A session that was read back from its file, which is deleted.
  struct Ended {
    std::string agent, guid, previousReason;
    Records records;  ///< types; of a session's end its reason
  };
  Ended endedAlone() {
    const auto sessions = ended();
    EXPECT_EQ(sessions.size(), 1u);
    return sessions.empty() ? Ended() : sessions[0];
  }
  std::vector<Ended> ended() {
    std::vector<Ended> sessions;
    auto& storage = *device.assembly().persistentStorage;
    for (const auto& container : storage.getAvailableSessionHandles()) {
      const json envelope = container->read()->getFeedbacksToSend();
      Ended& session = sessions.emplace_back();
      session.agent = envelope["agent"];
      session.guid = envelope["user_guid"];
      session.previousReason = envelope["previous_session_end_reason"];
      for (const json& record : envelope["fb"])
        session.records.push_back(record[record["type"] == "session_end" ? "reason" : "type"]);
      storage.deleteSessionWithFileContainer(container);
    }
    return sessions;
  }

  static constexpr auto kStrangersGuid = UUID{};
  VirtualDevice device;
  std::map<std::string_view, int> posted;
  std::vector<platform::NotificationCenter::Token> observations;
};

TEST(SessionTransitions, AreThisTable) {
  const auto show = [](std::uint64_t event, std::uint64_t state) -> std::string {
    const auto transition =
        sessionTransition(static_cast<SessionEvent>(event), static_cast<SessionState>(state));
    if (!transition) return "none";
    std::string text = transition->addsFeedback ? "add " : "";
    if (transition->end) text += "end " + std::to_string(static_cast<unsigned>(*transition->end)) + " ";
    if (transition->requestsUpload) text += "upload ";
    if (transition->resetsGUID) text += "reset ";
    if (transition->beginsSession) text += "begin ";
    return text + "-> " + std::to_string(static_cast<std::uint64_t>(transition->next));
  };
  const char* const table[][4] = {
      // active, soft limit reached, no session, a state that is none
      {"add -> 0", "add -> 1", "begin -> 0", "none"},
      {"-> 1", "-> 1", "-> 2", "-> 3"},
      {"-> 0", "end 3 -> 2", "-> 2", "-> 3"},
      {"end 1 -> 2", "end 1 -> 2", "end 1 -> 2", "-> 3"},
      {"none", "none", "none", "none"},
      {"upload -> 0", "upload -> 1", "upload -> 2", "upload -> 3"},
      {"end 5 upload -> 2", "end 5 upload -> 2", "end 5 upload -> 2", "end 5 upload -> 2"},
      {"upload -> 0", "upload -> 1", "upload -> 2", "upload -> 3"},
      {"-> 0", "end 2 reset begin -> 0", "-> 2", "-> 3"},
      {"end 4 begin -> 0", "end 4 begin -> 0", "-> 2", "-> 3"},
      {"-> 0", "add end 6 reset -> 2", "-> 2", "-> 3"},
      {"none", "none", "none", "none"}};
  for (std::uint64_t event = 0; event < std::size(table); ++event) {
    for (std::uint64_t state = 0; state < 4; ++state)
      EXPECT_EQ(show(event, state), table[event][state]) << "event " << event << " in state " << state;
  }
}

TEST_F(Sessions, TheFirstFeedbackBeginsASessionUnderTheDaemonsOwnGuid) {
  start();
  EXPECT_EQ(manager().currentState(), SessionState::noSession);
  EXPECT_FALSE(manager().session());
  EXPECT_TRUE(device.log.contains("Sable is using shared session for all clients com.kestrel.sabled"));

  search();
  EXPECT_EQ(manager().currentState(), SessionState::active);
  EXPECT_EQ(manager().session()->userGuid(), guid()) << "not what its sender said";
  EXPECT_EQ(manager().expirationTime(), device.assembly().runtime.now() + 180s);
  EXPECT_TRUE(device.log.contains("new session id 1 com.kestrel.sabled"));
  EXPECT_EQ(device.platform.transactions().openedCount("addFeedback"), 1u);
  EXPECT_EQ(device.platform.transactions().openCount("addFeedback"), 0u);

  bool flushed = false;
  manager().flushSession([&] { flushed = true; });
  EXPECT_FALSE(flushed) << "later";
  device.run();
  EXPECT_TRUE(flushed);
  EXPECT_EQ(manager().currentState(), SessionState::noSession);
  const auto session = endedAlone();
  EXPECT_EQ(session.previousReason, "no previous session");
  EXPECT_EQ(session.guid, guid().string());
  EXPECT_EQ(session.records, (Records{"search_start", "external request"}));

  manager().flushSession([&] { flushed = false; });
  device.run();
  EXPECT_FALSE(flushed) << "also where there is nothing to end";
  flush();
  EXPECT_TRUE(ended().empty());
  search();
  flush();
  EXPECT_EQ(endedAlone().previousReason, "external request");
}

TEST_F(Sessions, WhatTheBagTurnsOffIsDroppedBeforeAnything) {
  device.bag["agents"] = {{"rover", {{"feedback_enabled", false}}}};
  start();
  search("Rover/1");
  EXPECT_EQ(manager().currentState(), SessionState::noSession);
  EXPECT_EQ(manager().expirationTime(), platform::WallTime{});
  search("Beacon/1");
  search("Rover/1");
  flush();
  EXPECT_EQ(endedAlone().agent, "Beacon/1");
}

TEST_F(Sessions, APausePastTheSoftLimitEndsTheSessionUnderANewGuid) {
  start();
  search();
  const UUID first = guid();
  device.advance(200s);
  search();
  EXPECT_EQ(device.log.count("new session id"), 1u) << "a pause before the limit ends nothing";
  device.advance(400s);
  EXPECT_EQ(manager().currentState(), SessionState::softLimitReached);
  EXPECT_EQ(posted[kSBLSessionSoftLimitNotification], 1);
  EXPECT_TRUE(device.log.contains("soft limit reached expected 1 current 1 com.kestrel.sabled"));
  EXPECT_TRUE(device.log.contains("soft limit reached, maxtimer session id 1 com.kestrel.sabled"));

  search();  // 200 s and 400 s after the ones before: idle already
  EXPECT_EQ(manager().currentState(), SessionState::active);
  EXPECT_TRUE(device.log.contains(
      "session flushed because soft limit reached and idle time was beyond 180 com.kestrel.sabled"));
  EXPECT_NE(guid(), first);
  EXPECT_EQ(manager().session()->userGuid(), guid());
  EXPECT_EQ(posted[kSBLUserGUIDChangeNotification], 1);
  EXPECT_EQ(device.counter("userguid"), 1);
  flush();
  const auto sessions = ended();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[0].records, (Records{"search_start", "search_start", "session idle"}));
  EXPECT_EQ(sessions[1].records, (Records{"search_start", "external request"}));
  EXPECT_EQ(sessions[1].previousReason, "session idle");
}

TEST_F(Sessions, APauseIsLongFrom180SecondsOn) {
  start();
  for (const auto& [pause, isLong] : {std::pair{180s - 1ns, false}, std::pair{180s + 0ns, true}}) {
    flush();
    device.assembly().guidController->reset();
    search();
    device.advance(500s);
    search();
    device.advance(pause);
    search();
    EXPECT_EQ(manager().currentState(), isLong ? SessionState::active : SessionState::softLimitReached);
  }
}

TEST_F(Sessions, AnEngagementPastTheSoftLimitClosesTheSessionItBelongsTo) {
  start();
  for (const char* className : {"RKResultEngagementFeedback", "RKCardSectionEngagementFeedback"}) {
    device.log.clear();
    search();
    engage();
    type(10min);
    EXPECT_EQ(manager().currentState(), SessionState::softLimitReached);
    report("RKSectionEngagementFeedback");
    EXPECT_EQ(manager().currentState(), SessionState::softLimitReached) << "concludes nothing";
    const UUID before = guid();
    report(className);
    EXPECT_EQ(manager().currentState(), SessionState::noSession);
    EXPECT_NE(guid(), before);
    EXPECT_TRUE(
        device.log.contains("session flushed because soft limit reached and sentinel feedback received"));
    const auto session = endedAlone();
    EXPECT_EQ(session.guid, before.string());
    EXPECT_EQ(session.records.size(), 15u);
    EXPECT_EQ(session.records.back(), "engagement received");
    search();
    flush();
    EXPECT_EQ(endedAlone().previousReason, "engagement received");
    device.assembly().guidController->reset();
  }
}

TEST_F(Sessions, ASessionThatNeverPausesEndsAtTheMaximumTimer) {
  start();
  device.advance(800s);
  device.assembly().guidController->reset();  // so that the GUID outlives the session
  search();
  type(14min);
  EXPECT_EQ(manager().currentState(), SessionState::softLimitReached);
  EXPECT_EQ(posted[kSBLSessionMaxLimitNotification], 0);
  device.advance(1min);
  EXPECT_EQ(manager().currentState(), SessionState::noSession);
  EXPECT_EQ(posted[kSBLSessionMaxLimitNotification], 1);
  EXPECT_TRUE(device.log.contains("max timer expired expected 1 current 1"));
  EXPECT_TRUE(device.log.contains("session flushed because max timer expired com.kestrel.sabled"));
  EXPECT_EQ(endedAlone().records.back(), "max session time passed");
}

TEST_F(Sessions, AnotherGuidEndsTheSessionInEitherState) {
  start();
  for (const auto pause : {0min, 10min}) {
    flush();
    ended();
    device.log.clear();
    search();
    type(pause);
    const auto open = manager().currentState();
    const UUID before = guid();
    device.assembly().guidController->reset();
    search();
    EXPECT_EQ(open, pause == 0min ? SessionState::active : SessionState::softLimitReached);
    EXPECT_EQ(manager().currentState(), SessionState::active);
    EXPECT_TRUE(device.log.contains("session flushed because guid changed com.kestrel.sabled"));
    const auto session = endedAlone();
    EXPECT_EQ(session.guid, before.string());
    EXPECT_EQ(session.records.back(), "guid changed");
    EXPECT_EQ(manager().session()->userGuid(), guid());
  }
}

TEST_F(Sessions, TimersOfASessionThatHasEndedLeaveTheNextOneAlone) {
  start();
  search();
  device.advance(300s);
  flush();
  search();  // the second, 300 s behind the first
  device.advance(300s);
  EXPECT_TRUE(device.log.contains("soft limit reached expected 1 current 2"));
  EXPECT_EQ(manager().currentState(), SessionState::active);
  EXPECT_EQ(posted[kSBLSessionSoftLimitNotification], 0);
  device.advance(300s);
  EXPECT_EQ(manager().currentState(), SessionState::softLimitReached);

  engage();
  search();  // the third
  device.advance(300s);
  EXPECT_TRUE(device.log.contains("max timer expired expected 2 current 3"));
  EXPECT_EQ(manager().currentState(), SessionState::active);
  EXPECT_EQ(posted[kSBLSessionMaxLimitNotification], 1) << "told all the same";

  device.advance(300s);
  flush();
  device.advance(300s);
  EXPECT_TRUE(device.log.contains("max timer expired expected 3 current 3"));
  EXPECT_EQ(posted[kSBLSessionMaxLimitNotification], 1) << "no session, nothing to tell";
}

TEST_F(Sessions, ClientsThatShareASessionEndTogether) {
  start();
  search("Beacon/1");
  search("Rover/1");
  VirtualClient& client = device.client("com.kestrel.beacon", "Beacon/1");
  client.disconnect();
  device.run();
  EXPECT_TRUE(device.log.contains("session not flushed on invalidation"));
  EXPECT_TRUE(device.daemon().service().getClientConnections().empty());
  flush();
  const auto sessions = ended();
  ASSERT_EQ(sessions.size(), 3u);
  EXPECT_EQ(sessions[1].records, (Records{"search_start", "external request"}));
  EXPECT_EQ(sessions[2].agent, "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1");
  EXPECT_EQ(sessions[2].records, (Records{"connection_invalidated", "external request"}));
  for (const auto& session : sessions) EXPECT_EQ(session.previousReason, "no previous session");
}

TEST_F(Sessions, AClientWithASessionOfItsOwnEndsItByGoing) {
  start(false);
  EXPECT_TRUE(device.log.contains("Sable is using individual session for clients com.kestrel.sabled"));
  VirtualClient& client = device.client("com.kestrel.beacon", "Beacon/1");
  VirtualClient& other = device.client("com.kestrel.rover", "Rover/1");
  const auto connections = device.daemon().service().getClientConnections();
  const auto managerOf = [&](std::size_t i) { return connections[i]->state()->sessionManager(); };
  ASSERT_EQ(managerOf(0)->identifier(), "com.kestrel.beacon");
  ASSERT_NE(managerOf(0), managerOf(1));
  for (const std::size_t i : {0u, 1u})
    managerOf(i)->addSableFeedback(feedbackFromJSON("RKStartSearchFeedback", "{}", i == 0 ? "B" : "R"));
  device.run();
  EXPECT_NE(managerOf(0)->session()->userGuid(), managerOf(1)->session()->userGuid());

  client.disconnect();
  device.run();
  EXPECT_TRUE(device.log.contains("session flushed on invalidation"));
  EXPECT_EQ(device.daemon().service().getClientConnections().size(), 1u);
  EXPECT_EQ(managerOf(1)->currentState(), SessionState::active);
  const auto session = endedAlone();
  EXPECT_EQ(session.agent, "B");
  EXPECT_EQ(session.records, (Records{"search_start", "external request"}));
  EXPECT_TRUE(other.isConnected());
}

TEST_F(Sessions, TimersGoWithTheManagerAndAnErrorNeedsNone) {
  start();
  search();
  device.assembly().clientSessionManager.reset();
  ClientSessionManager::reportErrorAsSabledFeedback(makeSBLError(SBLErrorCode::daemonSide, "oops"),
                                                    device.assembly());
  device.advance(1h);
  EXPECT_FALSE(device.log.contains("soft limit reached expected"));
}

TEST_F(Sessions, TheGuidRollsWhenItsTimeIsUpAndNotBefore) {
  start();
  const UUID first = guid();
  device.advance(900s - 200ms - 1ns);  // the daemon has been up for 200 ms
  EXPECT_EQ(guid(), first);
  device.advance(1ns);
  const UUID second = guid();
  EXPECT_NE(second, first);
  EXPECT_EQ(posted[kSBLUserGUIDChangeNotification], 0) << "told later";
  device.run();
  EXPECT_EQ(posted[kSBLUserGUIDChangeNotification], 1);
  device.assembly().guidController->reset();
  EXPECT_NE(guid(), second) << "at once for whoever asks";
  device.run();
  EXPECT_EQ(device.counter("userguid"), 2);
}

}  // namespace
}  // namespace sable::test
