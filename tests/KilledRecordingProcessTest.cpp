#include <fmt/core.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <iostream>
#include <list>
#include <map>
#include <mutex>
#include <nlohmann/json.hpp>
#include <random>

#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "platform/Tally.h"
#include "platform/host/HostPlatform.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "tests/support/LoopbackServer.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"
#include "tools/sablectl/SessionFile.h"

// The real daemon, killed again and again while it records as fast as clients can report.
namespace sable::test {
namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kRounds = 2;
#else
constexpr int kRounds = 5;
#endif
constexpr int kReporters = 4, kCallsInFlight = 16;
constexpr auto kPatience = std::chrono::seconds(30);

/// Numbers its feedback from 1, and has always some on its way.
class Reporter {
 public:
  Reporter(platform::host::HostRuntime& runtime, const std::string& address, std::string name,
           std::function<void()> acknowledged)
      : agent(std::move(name)),
        runtime_(runtime),
        client_(runtime, address, {agent, agent}),
        calls_(runtime.waitGroup()),
        acknowledged_(std::move(acknowledged)) {}

  void start() {
    for (int i = 0; i < kCallsInFlight; ++i) report();
  }
  /// Until the daemon is gone and all calls have failed.
  bool finish() { return calls_->wait(runtime_.ticks() + kPatience); }

  const std::string agent;
  std::atomic<std::int64_t> reported = 0, answered = 0;

 private:
  void report() {
    const std::lock_guard inOrder(numbering_);
    calls_->enter();
    client_.client().call(kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
                          {std::uint64_t{0}, ++reported, std::string("RKStartSearchFeedback"), message_},
                          [this](const Expected<platform::RelayArguments>& result) {
                            if (result) {
                              ++answered;
                              acknowledged_();
                              report();
                            }
                            calls_->leave();
                          });
  }

  platform::host::HostRuntime& runtime_;
  TestClient client_;
  std::mutex numbering_;
  const std::unique_ptr<platform::WaitGroup> calls_;
  const std::function<void()> acknowledged_;
  const Data message_ = makeData(*messageFromJSON("RKStartSearchFeedback", R"({"input": "weather in"})"));
};

struct Figures {
  std::int64_t answered = 0, inFiles = 0, answeredAndLost = 0;
  int torn = 0, empty = 0;  ///< files
};

class KilledRecording : public testing::Test {
 protected:
  KilledRecording() {
    server_.on("/bag",
               tests::LoopbackServer::ok(R"({"version": "1", "enabled": true, "feedback_enabled": true})"));
  }

  /// Lets clients report until so many calls are answered, then kills the daemon in the middle.
  void record(int round, int answers) {
    std::atomic<int> left = answers;
    const auto enough = runtime_.semaphore(0);
    std::list<Reporter> reporters;
    for (int i = 0; i < kReporters; ++i) {
      reporters.emplace_back(runtime_, world_.address(), fmt::format("round{}/{}", round, i), [&] {
        if (--left == 0) enough->signal();
      });
    }
    for (Reporter& reporter : reporters) reporter.start();
    EXPECT_TRUE(answers == 0 || enough->wait(runtime_.ticks() + kPatience));
    world_.killDaemon();
    for (Reporter& reporter : reporters) ASSERT_TRUE(reporter.finish());
    const auto inFiles = readNewFiles();
    for (const Reporter& reporter : reporters) judge(reporter, inFiles);
  }

  /// The numbers in the files that were not there before, by agent. What an earlier daemon wrote is
  /// as it was.
  std::map<std::string, std::vector<std::int64_t>> readNewFiles() {
    std::map<std::string, std::vector<std::int64_t>> found;
    for (const auto& entry : std::filesystem::directory_iterator(caches_)) {
      const std::string name = entry.path().filename();
      if (!name.starts_with("session.")) continue;
      const auto [known, isNew] = files_.try_emplace(name, entry.file_size());
      EXPECT_EQ(known->second, entry.file_size()) << name;
      if (isNew) readFileOf(found, readFile(entry.path()));
    }
    return found;
  }

  void readFileOf(std::map<std::string, std::vector<std::int64_t>>& found, const std::string& bytes) {
    const Dictionary file = sablectl::sessionFileDocument(bytes);
    if (!file["damage"].is_null()) {
      ++(bytes.empty() ? figures_.empty : figures_.torn);
      // Nothing but the last record, which is not all there.
      EXPECT_NE(file["damage"]["reason"].get<std::string>().find("expected, "), std::string::npos)
          << file["damage"];
    }
    for (const Dictionary& record : file["records"]) {
      if (record["class"] != "RKStartSearchFeedback") continue;
      const std::string agent = file["root"]["agent"];
      found[agent.substr(agent.rfind(' ') + 1)].push_back(record["query_id"]);
    }
  }

  void judge(const Reporter& reporter, const std::map<std::string, std::vector<std::int64_t>>& inFiles) {
    const auto own = inFiles.find(reporter.agent);
    const auto numbers = own == inFiles.end() ? std::vector<std::int64_t>() : own->second;
    for (std::size_t i = 0; i < numbers.size(); ++i)
      ASSERT_EQ(numbers[i], static_cast<std::int64_t>(i) + 1) << "none is missing, and none out of its place";
    const auto count = static_cast<std::int64_t>(numbers.size());
    EXPECT_LE(count, reporter.reported);
    figures_.answered += reporter.answered;
    figures_.inFiles += count;
    figures_.answeredAndLost += std::max<std::int64_t>(reporter.answered - count, 0);
  }

  /// Asks until the daemon that has just started has settled what the last one left.
  void expectSumsMeet() {
    nlohmann::json ledger;
    for (int attempt = 0; attempt < 1000; ++attempt) {
      ledger = world_.sablectlJSON({"ledger"});
      if (ledger["meets"] == true) break;
    }
    EXPECT_EQ(ledger["meets"], true) << ledger.dump(1);
    EXPECT_EQ(ledger["began"]["found"], 0);
    EXPECT_EQ(ledger["ended"]["missing"], 0);
  }

  /// As the next daemon would to send them.
  void readAllBack() {
    for (const auto& [name, folder] : std::map<std::string, std::string>{
             {"RUNTIME", "run"}, {"CACHES", "caches"}, {"STATE", "state"}, {"CONFIG", "config"}})
      setenv(("SABLED_" + name + "_DIR").c_str(), world_.folder(folder).c_str(), 1);
    platform::host::HostPlatform platform;
    Assembly assembly(platform);
    assembly.persistentStorage = std::make_unique<SablePersistentStorage>(assembly);
    std::int64_t records = 0;
    for (const auto& container : assembly.persistentStorage->getAvailableSessionHandles()) {
      const auto session = container->read();
      if (session && session->agent().find(" round") != std::string::npos)
        records += static_cast<std::int64_t>(session->getSessionFeedbacks().size());
      assembly.persistentStorage->deleteSessionWithFileContainer(container);
    }
    EXPECT_GT(records, 0);
    EXPECT_EQ(records, figures_.inFiles);
    const SBLFeedbackLedger ledger(platform.tally().snapshot());
    EXPECT_EQ(ledger.waiting(), 0);
    EXPECT_EQ(ledger.stored(), 0);
    EXPECT_EQ(ledger[SBLLedgerEntry::damaged], 0) << "a torn record was never counted as written";
    EXPECT_GE(ledger[SBLLedgerEntry::handedOver], records);
  }

  platform::host::HostRuntime runtime_;
  tests::LoopbackServer server_{runtime_};
  World world_{{.bagURL = server_.url("/bag"), .startDaemon = false}};
  const std::filesystem::path caches_ = world_.folder("caches") / "com.kestrel.sabled";
  std::map<std::string, std::uintmax_t> files_;  ///< known session files and their sizes
  Figures figures_;
};

TEST_F(KilledRecording, WhatHasReachedAFileIsReadBackAndTheRestIsAccountedFor) {
  const char* wanted = std::getenv("SABLED_KILL_ROUNDS");
  const int rounds = wanted == nullptr ? kRounds : std::atoi(wanted);
  std::mt19937 chance(1);
  for (int round = 0; round < rounds && !HasFailure(); ++round) {
    world_.startDaemon({"--log-level", "error"});
    if (round % 5 != 4) expectSumsMeet();  // else it may be killed while it settles
    record(round, static_cast<int>(chance() % 2000));
  }
  world_.startDaemon({"--log-level", "error"});
  expectSumsMeet();
  world_.killDaemon();
  readAllBack();
  if (wanted != nullptr)
    std::cout << fmt::format(
        "{} rounds: {} answered, {} in files, {} answered and lost, {} files torn, {} empty\n", rounds,
        figures_.answered, figures_.inFiles, figures_.answeredAndLost, figures_.torn, figures_.empty);
}

}  // namespace
}  // namespace sable::test
