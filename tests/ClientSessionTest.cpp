#include <gtest/gtest.h>

#include "SableKit/SBLError.h"
#include "platform/UserDefaults.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionShared.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableUserGUIDController.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// Sessions of clients: what is recorded of them, and the envelope in which it is uploaded.
namespace sable::test {
namespace {

constexpr auto kStart = "RKStartSearchFeedback";
const UUID kGuid = *UUID::parse("F81D4FAE-7DEC-41D0-A765-00A0C91E6BF6");
const UUID kOtherGuid = *UUID::parse("00000000-7DEC-41D0-A765-00A0C91E6BF6");

class ClientSessions : public testing::Test {
 protected:
  ClientSessions() {
    device.start();
    device.platform.runtime().setWallClock(platform::wallTimeFromSecondsSince1970(1'780'000'000.75));
  }

  Assembly& assembly() { return device.assembly(); }
  /// A start of a search, `milliseconds` after the sender's clock began.
  std::shared_ptr<SableFeedback> at(unsigned milliseconds, std::string agent = "Beacon/1",
                                    std::optional<UUID> guid = kGuid) {
    return feedbackFromJSON(
        kStart, R"({"timestamp": ")" + std::to_string(milliseconds) + R"(000000", "input": "we"})",
        std::move(agent), guid);
  }
  /// The session as the flusher reads it back.
  std::shared_ptr<ClientSession> readBack(ClientSession& session) {
    session.sessionComplete();
    return session.storageHandle()->read();
  }
  json envelope(ClientSession& session) { return readBack(session)->getFeedbacksToSend(); }
  std::vector<std::string> reasons(ClientSession& session) {
    std::vector<std::string> reasons;
    for (const auto& each : readBack(session)->getSessionFeedbacks()) {
      const json record = each->dictionary();
      reasons.push_back(record["type"] == "error" ? record["error"]["reason"] : record["type"]);
    }
    return reasons;
  }
  std::int64_t firstUses(const std::string& client) { return device.counter(client + ".dailyactiveusers"); }

  VirtualDevice device;
};

TEST_F(ClientSessions, TheEnvelopeIsThisDocument) {
  ClientSession session(
      assembly(),
      feedbackFromJSON(
          "RKVisibleResultsFeedback",
          R"({"timestamp": "1250999999", "triggerEvent": 2, "results": [{"identifier": "private.a"}, {"identifier": "private.b"}]})",
          "Beacon/1", kGuid),
      6);
  session.addFeedback(feedbackFromJSON(
      "RKResultEngagementFeedback",
      R"({"timestamp": "3000000000", "triggerEvent": 1, "destination": 2, "result": {"identifier": "private.b"}})",
      "Beacon/1", kGuid));
  session.addFeedback(at(1000));  // comes late, and is the first all the same
  session.addFeedback(feedbackFromJSON(
      "RKVisibleSuggestionsFeedback",
      R"({"timestamp": "4000000000", "suggestions": [{"identifier": "private.a"}, {"identifier": "private.s"}]})",
      "Beacon/1", kGuid));
  const std::string sent = envelope(session).dump();
  EXPECT_EQ(sent.find("private"), std::string::npos);
  EXPECT_EQ(json::parse(sent).dump(2), json::parse(R"({
    "fb": [
      {"suggestions": [{"id": "1", "suggestion": null, "score": 0.0, "suggestion_type": "unknown"},
                       {"id": "3", "suggestion": null, "score": 0.0, "suggestion_type": "unknown"}],
       "type": "session_missing_suggestions", "timestamp": 0},
      {"results": [{"id": "1", "score": 0.0, "result_type": "unknown", "top_hit": "tophit_no",
                    "section_bundle_id": null, "bundle_id": null, "fbr": null, "static_correction": false}],
       "type": "session_missing_results", "timestamp": 0},
      {"trigger_event": "unknown", "input": "we", "uuid": null,
       "query_id": 7, "type": "search_start", "timestamp": 0},
      {"trigger_event": "scroll", "results": ["1", "2"],
       "query_id": 7, "type": "visible_results", "timestamp": 250},
      {"trigger_event": "enter", "destination": "punchout",
       "result": {"id": "2", "action_destination": "non_sable_result"},
       "query_id": 7, "type": "result_engagement", "timestamp": 2000},
      {"suggestions": [{"id": "1", "suggestion": null, "score": 0.0, "suggestion_type": "unknown"},
                       {"id": "3", "suggestion": null, "score": 0.0, "suggestion_type": "unknown"}],
       "suggestion_query": null, "query_id": 7, "type": "visible_suggestions", "timestamp": 3000}
    ],
    "agent": "Beacon/1",
    "user_guid": "F81D4FAE-7DEC-41D0-A765-00A0C91E6BF6",
    "resource_versions": {},
    "first_use": true,
    "base_time": 1780000000,
    "previous_session_end_reason": "engagement received"
  })")
                                           .dump(2));

  session.setResourceVersions({{"hints", "3"}, {"apps", "1"}});
  const auto stored = ClientSession::initWithData(assembly(), session.data());
  EXPECT_EQ(json(stored->getFeedbacksToSend()["resource_versions"]), json({{"apps", "1"}, {"hints", "3"}}));
}

TEST_F(ClientSessions, TheFirstUseOfADayIsToldOncePerClientAndDay) {
  struct Row {
    const char* agent;
    const char* client;  ///< null: not followed
  };
  for (const Row& row : {Row{"Beacon/1", "beacon"}, Row{"xROVERx", "rover"}, Row{"Rover (Vox)", "vox"},
                         Row{"lookup news messages", "news"}, Row{"Sabled/1.0", nullptr}, Row{"", nullptr}}) {
    EXPECT_EQ(ClientSession(assembly(), at(1, row.agent)).firstUseOfTheDay(), row.client != nullptr)
        << row.agent;
    EXPECT_FALSE(ClientSession(assembly(), at(1, row.agent)).firstUseOfTheDay()) << row.agent;
    if (row.client == nullptr) continue;
    EXPECT_EQ(firstUses(row.client), 1) << row.agent;
    EXPECT_TRUE(device.platform.userDefaults().date(std::string("SableFirstUseOfTheDay_") + row.client));
  }
  EXPECT_TRUE(device.log.contains("user default key not found for agent: Sabled/1.0"));
  EXPECT_EQ(device.counter("sabled.dailyactiveusers"), 0);

  EXPECT_FALSE(ClientSession(assembly(), at(1, "Rover and Beacon")).firstUseOfTheDay())
      << "beacon comes later";
  EXPECT_EQ(device.counter("Rover and Beacon.sessions"), 1);
  EXPECT_EQ(device.counter("Beacon/1.sessions"), 2);
}

TEST_F(ClientSessions, ADayIsTheUsersDay) {
  // 28 May 2026, 20:26:40 UTC: half past twelve at noon, eight hours behind it.
  EXPECT_TRUE(ClientSession(assembly(), at(1)).firstUseOfTheDay());
  device.advance(11h);
  EXPECT_FALSE(ClientSession(assembly(), at(1)).firstUseOfTheDay())
      << "midnight in London is no midnight here";
  device.advance(1h);
  EXPECT_TRUE(ClientSession(assembly(), at(1)).firstUseOfTheDay());
  EXPECT_FALSE(ClientSession(assembly(), at(1)).firstUseOfTheDay());
  auto values = device.platform.localeInfo().values;
  values.utcOffset = -9h;
  device.platform.localeInfo().change(values);
  EXPECT_FALSE(ClientSession(assembly(), at(1)).firstUseOfTheDay()) << "both are of the day before, there";
  device.platform.runtime().jumpWallClock(-48h);
  EXPECT_TRUE(ClientSession(assembly(), at(1)).firstUseOfTheDay()) << "another day, if an earlier one";
  EXPECT_EQ(firstUses("beacon"), 3);
}

TEST_F(ClientSessions, ASessionOfResultFeaturesDoesNotTellItsTime) {
  const auto features = [](unsigned type) {
    return feedbackFromJSON("RKCustomFeedback",
                            R"({"feedbackType": )" + std::to_string(type) + R"(, "jsonFeedback": "{}"})");
  };
  ClientSession plain(assembly(), features(2)), hidden(assembly(), features(3));
  EXPECT_EQ(envelope(plain)["base_time"], 1'780'000'000);
  plain.addFeedback(features(3));
  EXPECT_FALSE(plain.removeTimestamps()) << "the first feedback decides";
  EXPECT_EQ(envelope(hidden)["base_time"], 0);
  hidden.setSessionStart(std::nullopt);
  EXPECT_FALSE(hidden.sessionStart());
}

TEST_F(ClientSessions, ASessionWithoutFeedbackHasAnEnvelopeToo) {
  ClientSession session(assembly(), nullptr, 7);
  session.addFeedback(nullptr);
  EXPECT_TRUE(device.log.contains("attempted to add a nil feedback"));
  EXPECT_EQ(
      envelope(session).dump(),
      R"({"fb":[],"agent":"","user_guid":"","resource_versions":{},"first_use":false,"base_time":1780000000})")
      << "a reason without a word ends the document";
  session.addFeedback(at(1, "Vox/1"));
  EXPECT_EQ(session.agent(), "Vox/1");
  EXPECT_EQ(session.userGuidString(), "") << "the GUID of a session without one stays away";
}

TEST_F(ClientSessions, AFeedbackOfAnotherGuidIsFollowedByAnErrorThatSaysSo) {
  ClientSession session(assembly(), at(1));
  session.addFeedback(at(2));
  session.addFeedback(at(3, "Beacon/1", kOtherGuid));
  session.addFeedback(at(4, "Beacon/1", std::nullopt));
  EXPECT_EQ(reasons(session),
            (std::vector<std::string>{"search_start", "search_start", "search_start", "search_start",
                                      "different guid in session", "different guid in session"}))
      << "by time: the errors are of the daemon's clock";
  ClientSession anonymous(assembly(), at(1, "Beacon/1", std::nullopt));
  anonymous.addFeedback(at(2));
  EXPECT_EQ(reasons(anonymous), (std::vector<std::string>{"search_start", "search_start"}));
}

TEST_F(ClientSessions, AnErrorMakesASessionOfTheDaemonsOwn) {
  const auto session = ClientSession::createFeedbackSessionFromError(
      makeSBLError(SBLErrorCode::daemonSide, "invalid configuration"), assembly());
  EXPECT_EQ(reasons(*session), std::vector<std::string>{"invalid configuration"});
  EXPECT_EQ(session->agent(), "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Sabled/1.0");
  EXPECT_EQ(session->userGuid(), assembly().guidController->currentUserGUID());
}

TEST_F(ClientSessions, UnderTestFeedbackIsInMemoryOnceItIsInTheFile) {
  ClientSession without(assembly(), at(1));
  EXPECT_TRUE(without.getSessionFeedbacks().empty());
  assembly().testFeedbacks = true;
  ClientSession session(assembly(), at(2000));
  session.addFeedback(at(1000));
  EXPECT_EQ(session.getSessionFeedbacks().size(), 2u) << "readers wait for the disk";
  const json records = session.feedbacksWithRelativeTimestamp();
  EXPECT_EQ(records[0]["timestamp"], 0);
  EXPECT_EQ(records[1]["timestamp"], 1000);
  session.sessionComplete();
  session.addFeedback(at(3000));
  EXPECT_EQ(session.getSessionFeedbacks().size(), 2u) << "what is in no file is not in memory";
  device.platform.fileManager().failWith(ENOSPC);
  ClientSession homeless(assembly(), at(1));
  EXPECT_EQ(homeless.getSessionFeedbacks().size(), 1u) << "without any file there is nothing to wait for";
}

TEST_F(ClientSessions, ASharedSessionHasOneForEachAgent) {
  assembly().testFeedbacks = true;
  ClientSessionShared shared(assembly(), at(5000, "Vox/1", std::nullopt), 2);
  shared.addFeedback(at(9000, ""));
  shared.addFeedback(at(7000, "Beacon/1"));
  shared.addFeedback(at(6000, "Vox/1"));
  shared.addFeedback(at(7500, "Beacon/1"));
  device.run();
  const auto map = shared.sessionMap();
  ASSERT_EQ(map.size(), 2u);
  EXPECT_EQ(map.at("Vox/1")->userGuid(), kGuid) << "the first GUID that comes is filled in";
  EXPECT_EQ(map.at("Beacon/1")->previousSessionEndReason(), 2u);
  EXPECT_FALSE(shared.userGuid());
  shared.setUserGuid(kGuid);
  EXPECT_EQ(shared.userGuid(), kGuid);

  EXPECT_EQ(shared.getSessionFeedbacks().size(), 4u);
  for (const json& records :
       {shared.feedbacksWithRelativeTimestamp(), shared.privacyFilteredFeedbacksWithRelativeTimestamp({})}) {
    std::vector<int> times;
    for (const auto& record : records) times.push_back(record["timestamp"]);
    EXPECT_EQ(times, (std::vector<int>{0, 500, 0, 1000})) << "each client's own";
  }
  std::vector<std::pair<std::string, bool>> sessions;
  shared.enumerateSessions([&](ClientSession& session, bool isLast) {
    sessions.emplace_back(session.agent(), isLast);
    session.sessionComplete();
  });
  EXPECT_EQ(sessions, (std::vector<std::pair<std::string, bool>>{{"Beacon/1", false}, {"Vox/1", true}}));
  EXPECT_EQ(assembly().persistentStorage->getAvailableSessionHandles().size(), 3u) << "and the bag's fetch";
}

TEST_F(ClientSessions, ASharedSessionMayBeginWithoutAnAgent) {
  ClientSessionShared shared(assembly(), at(1, ""));
  ASSERT_TRUE(shared.sessionMap().contains(""));
  std::size_t calls = 0;
  shared.enumerateSessions([&](ClientSession&, bool isLast) { calls += isLast ? 1 : 100; });
  EXPECT_EQ(calls, 1u);
}

}  // namespace
}  // namespace sable::test
