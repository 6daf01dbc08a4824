#include <gtest/gtest.h>

#include <cerrno>

#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

namespace sable::test {
namespace {

using enum SBLLedgerEntry;

class FeedbackLedger : public testing::Test {
 protected:
  void report(int count = 1, const std::string& agent = "Beacon/1") {
    for (; count > 0; --count)
      device.assembly().clientSessionManager->addSableFeedback(
          feedbackFromJSON("RKStartSearchFeedback", "{}", agent));
    device.run();
  }
  /// Sends nothing, but reads and deletes what is complete, as who sends would.
  void handOver() {
    auto& storage = *device.assembly().persistentStorage;
    for (const auto& container : storage.getAvailableSessionHandles()) {
      const auto session = container->read();
      storage.deleteSessionWithFileContainer(container);
      if (session)
        ledger::count(device.platform.tally(), unsent,
                      static_cast<std::int64_t>(session->getSessionFeedbacks().size()));
    }
  }
  /// One that uploads nothing by itself.
  void startDaemon() {
    device.start();
    device.assembly().backgroundFlusher->setStopFlushing(true);
  }
  /// A daemon that has handed over the session of its own first fetch.
  void start() {
    startDaemon();
    handOver();
    before = counters();
  }
  SBLFeedbackLedger ledger() { return SBLFeedbackLedger(device.platform.tally().snapshot()); }
  using Counters = std::map<std::string, std::int64_t>;
  Counters counters() { return device.platform.tally().snapshot(); }
  /// By how much it has grown since start().
  std::int64_t grown(std::string_view key) { return counters()[std::string(key)] - before[std::string(key)]; }
  std::int64_t grown(SBLLedgerEntry entry) { return grown(counterOf(entry)); }
  void expectEnded(SBLLedgerEntry entry, std::int64_t records, std::int64_t files = 0) {
    EXPECT_EQ(grown(entry), records) << counterOf(entry);
    EXPECT_EQ(fileCounterOf(entry).empty() ? 0 : grown(fileCounterOf(entry)), files) << counterOf(entry);
    EXPECT_EQ(ledger().waiting(), 0);
  }

  /// The one session file, after the daemon has been killed.
  std::filesystem::path sessionFile() {
    for (const auto& [path, bytes] : device.platform.fileManager().files()) {
      if (path.filename().string().starts_with("session.") && bytes.find("Beacon/1") != std::string::npos)
        return path;
    }
    return {};
  }
  std::string bytesOf(const std::filesystem::path& path) {
    return device.platform.fileManager().files().at(path);
  }
  void replace(const std::filesystem::path& path, std::string_view bytes) {
    ASSERT_TRUE(device.platform.fileManager().writeAtomically(path, bytes));
  }

  VirtualDevice device;
  Counters before;
};

TEST_F(FeedbackLedger, ARecordThatReachesNoFileSaysWhy) {
  device.platform.userDefaults().setByUser("SBLSessionSizeLimit", 600);
  start();
  report();
  report(2, "");
  expectEnded(noAgent, 2);
  expectEnded(written, 1);
  report(40);
  EXPECT_EQ(grown(sizeLimit) + grown(written), 41);
  EXPECT_GT(grown(sizeLimit), 20) << "the first one that did not fit, and all after it";

  auto& files = device.platform.fileManager();
  files.failWith(EACCES);
  report(3, "Rover/1");
  expectEnded(noFile, 3);
  files.failWith(0);
  report(1, "Vox/1");
  files.failWith(ENOSPC);
  report(1, "Vox/1");
  files.failWith(0);
  report(1, "Vox/1");
  expectEnded(unwritten, 2);

  device.bag["feedback_enabled"] = false;
  device.publishBag();
  report(4);
  expectEnded(bagDisabled, 4);
}

TEST_F(FeedbackLedger, WhatAKillLeavesOnTheWayIsLostOrWrittenAtTheNextStart) {
  start();
  report(3);
  for (int i = 0; i < 2; ++i)
    device.assembly().clientSessionManager->addSableFeedback(feedbackFromJSON("RKStartSearchFeedback", "{}"));
  device.killDaemon();
  EXPECT_EQ(ledger().waiting(), 2);
  startDaemon();
  expectEnded(lostWriting, 2);
  expectEnded(written, 3 + grown(taken) - 5);

  // Killed after writing, before counting.
  device.killDaemon();
  device.platform.tally().add(counterOf(written), -1);
  startDaemon();
  expectEnded(lostWriting, 2);
  expectEnded(found, 0);
}

TEST_F(FeedbackLedger, AFileThatIsNotHandedOverSaysWhy) {
  start();
  report(3);
  device.killDaemon();
  const auto path = sessionFile();
  const std::string whole = bytesOf(path);

  std::string other = whole;
  other[8] = '?';
  replace(path, other);
  startDaemon();
  handOver();
  expectEnded(otherVersion, 3, 1);

  const auto again = [&](const std::string& bytes) {
    device.killDaemon();
    replace(path, bytes);
    startDaemon();
    EXPECT_EQ(ledger().waiting(), 0);
    handOver();
  };
  again(whole.substr(0, whole.size() - 1));
  expectEnded(found, 2);
  expectEnded(damaged, 0);  // a torn record is none
  std::string unreadable = whole;
  unreadable.replace(whole.rfind("RKStart"), 7, "XXStart");
  again(unreadable);
  expectEnded(damaged, 1, 1);
  device.platform.userDefaults().setByUser("SBLSessionSizeLimit", static_cast<int>(whole.size()) - 1);
  again(whole);
  expectEnded(tooLarge, 3, 1);
  EXPECT_EQ(ledger().stored(), 0);
}

TEST_F(FeedbackLedger, FilesThatComeAndGoWhileNoDaemonRunsAreNoticed) {
  start();
  report(3);
  device.killDaemon();
  const auto path = sessionFile();
  const std::string whole = bytesOf(path);
  replace(path.parent_path() / "session.77", whole);
  startDaemon();
  expectEnded(found, 3);
  device.killDaemon();
  ASSERT_TRUE(device.platform.fileManager().remove(path));
  startDaemon();
  expectEnded(missing, 3);
  device.advance(72h);
  handOver();
  report(5);
  device.advance(72h);
  const auto old = ledger().stored();
  device.killDaemon();
  startDaemon();
  EXPECT_GE(old, 5);
  EXPECT_GE(grown(tooOld), 5);
  EXPECT_EQ(grown(fileCounterOf(tooOld)), device.counter("filetooold"));
  EXPECT_EQ(ledger().waiting(), 0);
}

TEST_F(FeedbackLedger, CountersThatWereLostBeginWithWhatIsInTheFiles) {
  start();
  report(3);
  device.killDaemon();
  for (const auto& [key, value] : counters()) device.platform.tally().set(key, 0);
  before.clear();
  startDaemon();
  EXPECT_GE(grown(found), 3);
  EXPECT_EQ(ledger().waiting(), 0);
}

TEST(FeedbackLedgerOfUploads, WhatNoUploadCarriesAfterAStartIsLost) {
  platform::simulated::SimulatedTally tally;
  const auto sending = [&] { return SBLFeedbackLedger(tally.snapshot()).sending(); };
  ledger::count(tally, handedOver, 30);
  ledger::count(tally, uploaded, 10);
  ledger::count(tally, refused, 5);
  ledger::count(tally, unsent, 1);
  EXPECT_EQ(sending(), 14);
  ledger::settleSending(tally, 8);
  EXPECT_EQ(tally.value(std::string(counterOf(lostSending))), 6);
  EXPECT_EQ(sending(), 8);

  ledger::settleSending(tally, 12);  // a kill came before a deleted file was counted
  EXPECT_EQ(sending(), 12);

  platform::simulated::SimulatedTally lost;
  ledger::count(lost, uploaded, 7);
  ledger::settleSending(lost, 0);
  EXPECT_EQ(SBLFeedbackLedger(lost.snapshot()).sending(), 0);
  EXPECT_EQ(SBLFeedbackLedger(lost.snapshot()).stored(), 0);
}

}  // namespace
}  // namespace sable::test
