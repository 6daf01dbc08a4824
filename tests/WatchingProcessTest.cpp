#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <latch>

#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// sablectl on the flusher control channel of the real daemon.
namespace sable::test {
namespace {

using nlohmann::json;
using testing::HasSubstr;

class Watching : public testing::Test {
 protected:
  /// Starts a tool and waits until the daemon knows it.
  std::unique_ptr<Program> watch(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), World::program("sablectl"));
    auto program = world.start(arguments);
    world.waitForLog("delegate: process " + std::to_string(program->pid()));
    return program;
  }
  /// Reports a visit to a site of that name; waits until it is acknowledged.
  void report(TestClient& client, const std::string& site) {
    const auto bytes = messageFromJSON("RKDidGoToSiteFeedback", json{{"input", site}}.dump());
    std::latch answered(1);
    bool good = false;
    client.client().call(kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
                         {std::uint64_t{0}, std::int64_t{7}, std::string("RKDidGoToSiteFeedback"),
                          std::make_shared<const std::string>(*bytes)},
                         [&](const Expected<platform::RelayArguments>& answer) {
                           good = answer.has_value();
                           answered.count_down();
                         });
    answered.wait();
    ASSERT_TRUE(good);
  }
  /// The next record that is not about tools coming and going.
  static json next(Program& program) {
    for (;;) {
      const std::string line = program.readLine();
      if (line.empty()) return {};
      json record = json::parse(line);
      if (record.value("type", "") != "connection_invalidated") return record;
    }
  }

  World world;
};

TEST_F(Watching, ShowsARecordAsSoonAsItIsAddedUntilItIsInterrupted) {
  const auto tool = watch({"--json", "watch"});
  ASSERT_EQ(
      world.sablectl({"report", "RKStartSearchFeedback", "input=übung", "triggerEvent=3", "--query-id", "4"})
          .exitCode,
      0);
  const json record = next(*tool);
  EXPECT_EQ(record["type"], "search_start");
  EXPECT_EQ(record["input"], "übung");
  EXPECT_EQ(record["query_id"], 4);
  tool->signal(SIGINT);
  EXPECT_EQ(tool->wait(), 0);
  world.waitForLog("Removed receiving stream listener");

  const auto rows = watch({"watch"});
  EXPECT_THAT(rows->readLine(), HasSubstr("kind"));
  ASSERT_EQ(world.sablectl({"report", "RKStartSearchFeedback", "input=a\x1b[31m"}).exitCode, 0);
  std::string row;
  while (row.find("search_start") == std::string::npos) row = rows->readLine();
  EXPECT_THAT(row, HasSubstr("input=a\\u001b[31m"));
  world.killDaemon();
  rows->readAll();
  EXPECT_EQ(rows->wait(), 3);
  EXPECT_THAT(world.daemonErrors(), HasSubstr("sablectl: the daemon has gone\n"));
  EXPECT_EQ(world.sablectl({"watch"}).exitCode, 3);
}

TEST_F(Watching, StopAndDumpAnswerWhenTheDaemonHasDoneIt) {
  EXPECT_EQ(world.sablectlJSON({"stop"}), json({{"stopped", true}}));
  world.waitForLog("flushing stopped; dump command will start flushing again");
  EXPECT_EQ(world.sablectlJSON({"dump"}), json({{"dumped", true}}));
  world.waitForLog("session flushed because of dump command Sabled/1.0 (");
  const auto sessions = watch({"watch", "--sent"});
  EXPECT_THAT(sessions->readLine(), HasSubstr("agent"));
  ASSERT_EQ(world.sablectl({"--agent", "Rover/7", "report", "RKDidGoToSiteFeedback", "input=a"}).exitCode, 0);
  EXPECT_EQ(world.sablectl({"dump"}).output, "all sessions have ended and are being uploaded\n");
  std::string row;
  do {
    row = sessions->readLine();
  } while (row.find("Rover/7") == std::string::npos);
  EXPECT_THAT(row, testing::ContainsRegex(" [0-9]+  [0-9A-F]{8}  [a-z ]+ Rover/7$"));
  EXPECT_EQ(world.sablectl({"watch", "--unheard-of"}).exitCode, 2);
}

TEST_F(Watching, AToolThatIsStoppedHoldsNobodyUpAndHearsWhatItMissed) {
  platform::host::HostRuntime runtime;
  TestClient client(runtime, world.address());
  ASSERT_TRUE(client.connect());
  const auto tool = watch({"--json", "watch"});
  tool->signal(SIGSTOP);
  constexpr int kReports = 700;
  const std::string site(20'000, 's');
  for (int i = 0; i < kReports; ++i) report(client, site);
  EXPECT_TRUE(client.search("dog").reply) << "searches go on";
  constexpr int kRecords = kReports + 2;  // and the search's beginning and end

  tool->signal(SIGCONT);
  int shown = 0;
  json record = next(*tool);
  for (; !record.contains("dropped"); record = next(*tool)) ++shown;
  EXPECT_GT(shown, 100);
  EXPECT_EQ(shown + record["dropped"].get<int>(), kRecords);
  report(client, "again");
  EXPECT_EQ(next(*tool)["input"], "again");
  EXPECT_EQ(occurrences(world.daemonErrors(), "Relay connection of process"), 0u);
}

}  // namespace
}  // namespace sable::test
