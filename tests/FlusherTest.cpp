#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <random>
#include <string_view>

#include "SableKit/SBLFeedbackLedger.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/FileContainer.h"
#include "sabled/SableFeedbackFlusher.h"
#include "sabled/SablePersistentStorage.h"
#include "tests/support/Deflate.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// What becomes of sessions: the uploads that the service sees, on the whole daemon in virtual time.
namespace sable::test {
namespace {

using namespace std::string_view_literals;

using platform::HTTPErrorCode;
using platform::simulated::RecordedRequest;
using testing::Contains;
using testing::ElementsAre;
using testing::EndsWith;
using testing::IsEmpty;
using testing::Not;
using testing::UnorderedElementsAreArray;

constexpr std::size_t kMostJSON = 1u << 20;

/// What was searched for in the uploads.
std::vector<std::string> searchesIn(const std::vector<RecordedRequest>& uploads) {
  std::vector<std::string> inputs;
  for (const auto& upload : uploads) {
    const json envelope = json::parse(inflated(*upload.request.body, kMostJSON));
    for (const json& record : envelope["fb"]) {
      if (record["type"] == "search_start") inputs.push_back(record["input"]);
    }
  }
  return inputs;
}

class Flusher : public testing::Test {
 protected:
  Flusher() {
    device.bag["feedback_url"] = "https://service.test/feedback?old=1";
    device.bag["crowdsourcing_url"] = "https://service.test/crowd";
    for (const char* path : {"/feedback", "/crowd"}) device.service.on(path, answering("{}"));
  }

  /// Starts the daemon; what its own bag fetch leaves is gone.
  void start() {
    device.start();
    for (const auto& container : storage().getAvailableSessionHandles())
      storage().deleteSessionWithFileContainer(container);
  }
  SablePersistentStorage& storage() { return *device.assembly().persistentStorage; }
  BackgroundFlusher& flusher() { return *device.assembly().backgroundFlusher; }
  /// A complete session with a search for each input.
  void session(const std::vector<std::string>& inputs) {
    ClientSession session(device.assembly(), search(inputs.front()));
    for (std::size_t i = 1; i < inputs.size(); ++i) session.addFeedback(search(inputs[i]));
    session.sessionComplete();
    device.run();
  }
  static std::shared_ptr<SableFeedback> search(const std::string& input) {
    return feedbackFromJSON("RKStartSearchFeedback", R"({"input": ")" + input + "\"}");
  }
  /// Uploads what there is, now.
  void flush() {
    flusher().insertFlushActivity(0);
    device.advance(5s);
  }
  std::vector<RecordedRequest> uploads(std::string_view path = "/feedback") {
    return device.service.requests(path);
  }
  std::vector<std::string> uploaded(std::string_view path = "/feedback") { return searchesIn(uploads(path)); }
  /// Files of sessions, and of their uploads.
  std::vector<std::string> files() {
    std::vector<std::string> names;
    for (const auto& [path, bytes] : device.platform.fileManager().files()) {
      const std::string name = path.filename();
      const std::string prefix = name.substr(0, name.find_first_of("._"));
      if (prefix == "session" || prefix == "flushing" || prefix == "crowdsourcing" || prefix == "flusher")
        names.push_back(prefix);
    }
    return names;
  }
  SBLFeedbackLedger ledger() { return SBLFeedbackLedger(device.platform.tally().snapshot()); }

  VirtualDevice device;
};

TEST_F(Flusher, ASessionIsUploadedAsItsEnvelopeWithTheDigestOfItsText) {
  start();
  VirtualClient& client = device.client();
  client.search("we");
  device.assembly().clientSessionManager->flushSession(nullptr);
  device.advance(11min);
  ASSERT_EQ(uploads().size(), 1u);
  const auto request = uploads()[0].request;
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(sentValue(request, "v") + sentValue(request, "old"), "2-");
  EXPECT_EQ(*request.headers.find("Content-Encoding"), "deflate");
  const std::string text = inflated(*request.body, kMostJSON);
  EXPECT_EQ(*request.headers.find("X-Kestrel-Digest"), sha512(text));

  const json envelope = json::parse(text);
  std::vector<std::string> keys, types;
  for (const auto& [key, value] : envelope.items()) keys.push_back(key);
  EXPECT_THAT(keys, ElementsAre("fb", "agent", "user_guid", "resource_versions", "first_use", "base_time",
                                "previous_session_end_reason"));
  EXPECT_THAT(std::string(envelope["agent"]), EndsWith(" Beacon/1"));
  for (const json& record : envelope["fb"]) types.push_back(record["type"]);
  EXPECT_THAT(types, ElementsAre("network_search_start", "network_search_end", "session_end"));
  EXPECT_EQ(text, envelope.dump()) << "compact";

  EXPECT_EQ(device.counter("feedbacksent"), 3);
  EXPECT_EQ(ledger()[SBLLedgerEntry::uploaded], 3);
  EXPECT_EQ(ledger().sending(), 0);
  EXPECT_THAT(files(), Not(Contains(testing::StartsWith("fl"))));
  for (const char* line :
       {"started flush to wire in the background com.kestrel.sabled.flusher.background with interval "
        "600.000000 seconds",
        "scheduled flush feedbacks to wire com.kestrel.sabled.flusher.background",
        "Initialize flusher for Feedbacks", "Initialize flusher for crowdsourcing",
        "bag change notification received", "new endpoint: https://service.test/feedback?v=2",
        "Sessions Flushed 1", "flushing to ", "File removed ",
        "URLSession:task:didCompleteWithError: id=1, error=(null)",
        "URLSessionDidFinishEventsForBackgroundURLSession called"})
    EXPECT_TRUE(device.log.contains(line)) << line;
  EXPECT_EQ(device.platform.transactions().openCount("_flusherActivity"), 0u);
  EXPECT_GT(device.platform.transactions().openedCount("_flusherActivity"), 0u);
}

TEST_F(Flusher, WhatIsWrittenPieceByPieceIsTheEnvelopesJSON) {
  start();
  const auto results = feedbackFromJSON(
      "RKVisibleResultsFeedback", R"({"results": [{"identifier": "a"}, {"identifier": "b\u0001\u20ac"}]})");
  for (const bool isEmpty : {false, true}) {
    ClientSession session(device.assembly(), isEmpty ? nullptr : search("we"));
    if (!isEmpty) session.addFeedback(results);
    session.sessionComplete();
    std::string written;
    session.storageHandle()->read()->writeFeedbacksToSend([&](std::string_view json) { written += json; });
    EXPECT_EQ(written, compactJSON(session.storageHandle()->read()->getFeedbacksToSend()));
  }
}

TEST_F(Flusher, OnlyA200CountsAsSentAndNothingElseIsTriedAgain) {
  start();
  session({"a", "b"});
  device.service.on("/feedback", answering("{}", 500));
  flush();
  EXPECT_EQ(device.counter("feedbacksent"), 0);
  EXPECT_EQ(device.counter("feedbacknotsent"), 2);
  EXPECT_EQ(ledger()[SBLLedgerEntry::refused], 2);
  EXPECT_TRUE(device.log.contains("response error 500 "));
  device.advance(30min);
  EXPECT_EQ(uploads().size(), 1u);

  session({"c"});
  device.service.on("/feedback", failing(HTTPErrorCode::timedOut));
  flush();
  device.advance(8 * 24h);
  EXPECT_EQ(device.counter("fbrequesttimedout"), 1) << "when the upload's week is over";
  EXPECT_EQ(device.counter("feedbacknotsent"), 3);
  EXPECT_EQ(ledger()[SBLLedgerEntry::refused], 3);
}

TEST_F(Flusher, WithoutAnEndpointSessionsArePackedAndDropped) {
  start();
  for (const json& change : {json{{"feedback_enabled", false}},
                             {{"feedback_enabled", true}, {"feedback_url", nullptr}},
                             {{"feedback_url", "no URL"}}}) {
    device.bag.update(change);
    device.publishBag();
    session({"a"});
    device.log.clear();
    const auto unsent = ledger()[SBLLedgerEntry::unsent];
    flush();
    EXPECT_TRUE(device.log.contains("Server endpoint not set, data can't be sent to server"));
    EXPECT_TRUE(device.log.contains("flushing to "));
    EXPECT_TRUE(device.log.contains("File removed "));
    EXPECT_TRUE(uploads().empty());
    EXPECT_THAT(files(), IsEmpty());
    EXPECT_GE(ledger()[SBLLedgerEntry::unsent], unsent + 1);
  }
  EXPECT_FALSE(SableFeedbackFlusher::getServerEndpointForFeedback("no URL"));
}

TEST_F(Flusher, StoppedRunsLeaveTheFilesWhereTheyAre) {
  start();
  session({"a"});
  flusher().setStopFlushing(true);
  device.advance(25min);
  EXPECT_THAT(files(), ElementsAre("session"));
  EXPECT_TRUE(device.log.contains("flushing has been stopped, will start again with dump command"));
  flusher().setStopFlushing(false);
  device.advance(15min);
  EXPECT_THAT(uploaded(), ElementsAre("a"));
}

TEST_F(Flusher, AFileThatCannotBeReadIsDroppedAndTheOthersGo) {
  start();
  session({"a"});
  const auto damaged = storage().getAvailableSessionHandles()[0]->fileUrl();
  session({"b"});
  ASSERT_TRUE(device.platform.fileManager().writeAtomically(damaged, "no session"));
  session({"c"});
  ASSERT_TRUE(device.platform.fileManager().remove(storage().getAvailableSessionHandles()[2]->fileUrl()));
  flush();
  EXPECT_THAT(uploaded(), ElementsAre("b"));
  EXPECT_THAT(files(), IsEmpty());
  EXPECT_TRUE(storage().getAvailableSessionHandles().empty());
}

TEST_F(Flusher, CrowdsourcingHasItsOwnFilesAndAddress) {
  start();
  ClientSession session(device.assembly(),
                        feedbackFromJSON("RKCustomFeedback",
                                         R"({"feedbackType": 2, "jsonFeedback": "{\"input\": \"crowd\"}"})"));
  device.run();
  EXPECT_THAT(files(), ElementsAre("crowdsourcing")) << "a kill leaves it for its own address";
  storage().closeCrowdsourcingSessionWithFileContainer(session.storageHandle());
  device.run();
  device.killDaemon();
  device.start();
  flush();
  EXPECT_THAT(uploads("/crowd"), testing::SizeIs(1));
  EXPECT_THAT(uploads("/feedback"), IsEmpty());
  EXPECT_THAT(files(), IsEmpty());
}

TEST_F(Flusher, WithoutRoomOnTheDiskSessionsWaitForTheNextRun) {
  start();
  session({"a", "b"});
  device.platform.httpSessions().failAccepting(ENOSPC);
  flush();
  EXPECT_TRUE(
      device.log.contains("Error creating Upload Task. Exception POSIXErrorDomain occurred for reason"));
  EXPECT_THAT(files(), ElementsAre("flushing"));
  device.platform.httpSessions().failAccepting(0);
  for (int operations = 0; operations < 12; ++operations) {
    device.platform.fileManager().failAfter(operations, ENOSPC);
    flush();
    device.platform.fileManager().failWith(0);
  }
  EXPECT_TRUE(device.log.contains("Error creating file to write feedbacks to disk"));
  EXPECT_TRUE(device.log.contains("Invalid JSON Object Beacon/1 error POSIXErrorDomain"));
  flush();
  EXPECT_THAT(uploaded(), ElementsAre("a", "b"));
}

TEST_F(Flusher, CountsOfUploadsOutliveTheProcess) {
  start();
  session({"a", "b", "c"});
  device.service.on("/feedback", failing(HTTPErrorCode::cannotConnect));
  flush();
  EXPECT_EQ(ledger().sending(), 3);
  device.killDaemon();
  device.service.on("/feedback", answering("{}"));
  device.start();
  EXPECT_EQ(ledger().sending(), 3) << "it is still under way";
  device.advance(2h);
  EXPECT_EQ(device.counter("feedbacksent"), 3);
  EXPECT_EQ(ledger()[SBLLedgerEntry::uploaded], 3);
  EXPECT_EQ(ledger().sending(), 0);
  EXPECT_EQ(ledger()[SBLLedgerEntry::lostSending], 0);
}

TEST_F(Flusher, AKillAtAnyMomentNeitherLosesASessionNorSendsItTwice) {
  // What the disk does not take any more is what a killed process has not done.
  for (int operations = 0;; ++operations) {
    VirtualDevice other;
    other.bag["feedback_url"] = "https://service.test/feedback";
    other.service.on("/feedback", answering("{}"));
    other.start();
    for (const char* input : {"a", "b", "c"}) {
      ClientSession session(other.assembly(), search(input));
      session.sessionComplete();
    }
    other.run();
    other.platform.fileManager().failAfter(operations, EIO);
    other.assembly().backgroundFlusher->insertFlushActivity(0);
    other.advance(5s);  // so that no upload is on its way, which would begin anew
    const bool wasKilled = other.platform.fileManager().hasFailed();
    other.killDaemon();
    other.platform.fileManager().failWith(0);
    other.start();
    other.advance(20min);

    const auto inputs = searchesIn(other.service.requests("/feedback"));
    EXPECT_THAT(inputs, UnorderedElementsAreArray({"a", "b", "c"})) << operations;
    const SBLFeedbackLedger ledger(other.platform.tally().snapshot());
    EXPECT_EQ(ledger.sending(), 0) << operations;
    EXPECT_EQ(ledger.stored(), 0) << operations;
    for (const auto& [path, bytes] : other.platform.fileManager().files())
      EXPECT_FALSE(path.filename().string().starts_with("fl")) << path << " after " << operations;
    if (wasKilled) continue;
    EXPECT_GT(operations, 20);
    return;
  }
}

TEST_F(Flusher, WhatItBuffersIsPackedUnlessItIsDropped) {
  start();
  SableFeedbackFlusher feedbacks(device.assembly(), 1);
  const auto session = std::make_shared<ClientSession>(device.assembly(), search("a"));
  bool called = false;
  feedbacks.flush(session, [&] { called = true; });
  EXPECT_FALSE(called);
  device.run();
  EXPECT_TRUE(called);
  feedbacks.flushSyncFromArray({session});
  EXPECT_EQ(feedbacks.countOfDatabuffer(), 2u);
  feedbacks.dropFeedbacks();
  device.run();
  EXPECT_TRUE(feedbacks.flushToWireSync(true).empty());
  feedbacks.flushSyncFromArray({session});
  const auto envelopes = feedbacks.flushToWireSync(true);
  ASSERT_EQ(envelopes.size(), 1u);
  EXPECT_EQ(json::parse(envelopes[0])["agent"], "Beacon/1");
}

TEST_F(Flusher, AMonthWithOutagesKeepsTheScheduleAndLosesNothing) {
  std::mt19937 random(7);
  const auto hours = [&random](int from, int to) {
    return std::chrono::hours(std::uniform_int_distribution(from, to)(random));
  };
  bool down = false;
  for (const char* path : {"/feedback", "/search", "/bag"}) {
    device.service.on(path, [&, path](const platform::HTTPRequest&) {
      if (down) return failing(HTTPErrorCode::cannotConnect);
      return answering(path == "/bag"sv ? device.bag.dump() : "[]");
    });
  }
  device.platform.activityScheduler().setOnBattery(true);
  device.start();
  const auto& runs = device.platform.activityScheduler().record();
  const auto times = [&runs] { return runs.at("com.kestrel.sabled.flusher.background"); };
  const auto first = *times().nextRun - device.platform.runtime().now();
  EXPECT_GT(first, 300s) << "somewhere in its time of grace";
  EXPECT_LE(first, 600s);
  device.advance(first);

  platform::Duration change = hours(6, 48);
  auto last = times().lastRun.value();
  for (platform::Duration now{}; now < 30 * 24h; now += 1h) {
    if (now >= change) {
      down = !down && now < 26 * 24h;
      change = now + (down ? hours(2, 72) : hours(6, 48));
    }
    if (hours(0, 2) == 0h) {
      VirtualClient& client = device.client();
      for (const char* text : {"w", "we", "wea", "r", "ra", "rain"}) {
        client.search(text);
        device.assembly().clientSessionManager->flushSession(nullptr);
      }
      client.disconnect();
    }
    device.advance(1h);
    const auto latest = times().lastRun.value();
    EXPECT_EQ((latest - last) % 600s, 0s) << "no run is late or early";
    EXPECT_LE(device.platform.runtime().now() - latest, 600s) << "none is left out";
    last = latest;
  }

  const auto sent = uploads();
  for (std::size_t i = 4; i < sent.size(); ++i)
    EXPECT_GE(sent[i].time - sent[i - 4].time, 50ms) << "more than 4 at once";
  const auto records = ledger();
  EXPECT_GT(records[SBLLedgerEntry::uploaded], 1000);
  EXPECT_EQ(records[SBLLedgerEntry::refused] + records[SBLLedgerEntry::tooOld], 0);
  EXPECT_EQ(records.waiting() + records.sending(), 0);
  EXPECT_EQ(records[SBLLedgerEntry::taken], records[SBLLedgerEntry::uploaded] + records.stored());
  EXPECT_LE(records.stored(), 10) << "of the session that is still open";
}

}  // namespace
}  // namespace sable::test
