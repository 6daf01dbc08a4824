#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>

#include "tests/support/World.h"

// Feedback through the real programs, to the disk and back.
namespace sable::test {
namespace {

using nlohmann::json;
using testing::HasSubstr;

class ReportingProcess : public testing::Test {
 protected:
  /// What sablectl makes of all session files that have a record of the class.
  std::vector<json> sessionsWith(const std::string& className) const {
    std::vector<json> found;
    for (const auto& entry : std::filesystem::directory_iterator(caches)) {
      if (!entry.path().filename().string().starts_with("session.")) continue;
      json session = world.sablectlJSON({"session", entry.path().string()});
      for (const json& record : session["records"]) {
        if (record["class"] == className) {
          found.push_back(std::move(session));
          break;
        }
      }
    }
    return found;
  }

  World world;
  const std::filesystem::path caches = world.folder("caches") / "com.kestrel.sabled";
};

TEST_F(ReportingProcess, WhatWasReportedIsReadBackAfterAKill) {
  EXPECT_EQ(world.sablectlJSON({"report", "RKStartSearchFeedback", "input=übung", "triggerEvent=3",
                                "--query-id", "-4"})["class"],
            "RKStartSearchFeedback");
  writeFile(world.folder("config") / "ranking.json",
            R"({"blendingDuration": 0.5, "sections": [{"section": {"identifier": "s"}}]})");
  EXPECT_EQ(world
                .sablectl({"report", "_SKRankingFeedback", "--file",
                           (world.folder("config") / "ranking.json").string()})
                .output,
            "reported _SKRankingFeedback, 16 bytes\n");
  EXPECT_EQ(
      world.sablectl({"report", "RKVisibleResultsFeedback", R"(results=[{"identifier": "a"}])"}).exitCode, 0);
  ASSERT_EQ(world.sablectl({"search", "dog"}).exitCode, 0);
  // The last record of the last client: what stands before it in the file is there, too.
  std::vector<json> sessions;
  waitForChange(caches, [&] {
    sessions = sessionsWith("_SKSKEndNetworkSearchFeedback");
    return !sessions.empty();
  });
  world.killDaemon();

  sessions = sessionsWith("RKStartSearchFeedback");
  ASSERT_EQ(sessions.size(), 1u);
  const json& session = sessions[0];
  EXPECT_THAT(session["version"].get<std::string>(), HasSubstr("Sabled/1.0 ("));
  EXPECT_THAT(session["root"]["agent"].get<std::string>(), HasSubstr("sablectl/1.0"));
  EXPECT_TRUE(session["damage"].is_null());
  std::vector<std::string> classes;
  for (const json& record : session["records"]) {
    if (record["class"] != "SableConnectionInvalidated") classes.push_back(record["class"]);
  }
  EXPECT_THAT(classes,
              testing::ElementsAre("RKStartSearchFeedback", "_SKRankingFeedback", "RKVisibleResultsFeedback",
                                   "RKStartNetworkSearchFeedback", "_SKSKEndNetworkSearchFeedback"));
  const json& first = session["records"][0];
  EXPECT_EQ(first["query_id"], -4);
  EXPECT_EQ(first["message"]["input"], "übung");
  EXPECT_EQ(first["message"]["triggerEvent"], 3);
  const json& end = session["records"].back()["class"] == "SableConnectionInvalidated"
                        ? session["records"][session["records"].size() - 2]
                        : session["records"].back();
  std::set<std::string> timing;
  for (const json& entry : end["message"]["networkTiming"]["entries"]) timing.insert(entry["key"]);
  for (const char* key : {"FetchStart", "ConnectEnd", "RequestStart", "ResponseStart", "ResponseEnd",
                          "ConnectionPeerAddress", "ConnectionReused"}) {
    EXPECT_TRUE(timing.contains(std::string("_kWickTimingData") + key)) << key;
  }
}

TEST_F(ReportingProcess, ADamagedFileIsShownUpToTheDamage) {
  ASSERT_EQ(world.sablectl({"report", "RKDidGoToSiteFeedback", "input=a"}).exitCode, 0);
  waitForChange(caches, [&] { return !sessionsWith("SableConnectionInvalidated").empty(); });
  world.killDaemon();
  for (const auto& entry : std::filesystem::directory_iterator(caches)) {
    const std::string bytes = entry.is_regular_file() ? readFile(entry.path()) : "";
    if (bytes.find("RKDidGoToSiteFeedback") == std::string::npos) continue;
    const auto torn = world.folder("config") / "torn";
    writeFile(torn, std::string_view(bytes).substr(0, bytes.size() - 1));
    const json shown = world.sablectlJSON({"session", torn.string()});
    EXPECT_EQ(shown["records"].size(), 1u);
    EXPECT_EQ(shown["records"][0]["message"]["input"], "a");
    EXPECT_THAT(shown["damage"]["reason"].get<std::string>(), HasSubstr("bytes expected, "));
    const auto told = world.sablectl({"session", torn.string()});
    EXPECT_EQ(told.exitCode, 1);
    EXPECT_THAT(told.errors, HasSubstr("stops at byte " + shown["damage"]["offset"].dump()));
    return;
  }
  FAIL() << "no session file holds the feedback";
}

TEST_F(ReportingProcess, WhatCannotBeReportedIsSaidBeforeAnythingIsSent) {
  for (const std::vector<std::string>& arguments :
       {std::vector<std::string>{"report", "RKUnheardOf"},
        {"report", "RKStartSearchFeedback", "unheardOf=1"},
        {"report", "RKStartSearchFeedback", "triggerEvent=many"},
        {"report", "RKStartSearchFeedback", "input"},
        {"report", "RKVisibleResultsFeedback", "results=[{"},
        {"report", "RKStartSearchFeedback", "--file", "/absent"}}) {
    const auto result = world.sablectl(arguments);
    EXPECT_EQ(result.exitCode, 2) << arguments.back();
    EXPECT_EQ(occurrences(result.errors, "\n"), 1u) << result.errors;
  }
  const auto refused = world.sablectl({"report", "RKSearchResult"});
  EXPECT_EQ(refused.exitCode, 1) << "a message, but no feedback";
  EXPECT_EQ(world.sablectl({"feedback"}).output, "no feedback in memory\n");
}

TEST(InteractionsProcess, AreKeptOnlyWhereThatIsAskedFor) {
  for (const bool wanted : {false, true}) {
    World world({.settings = wanted ? "SBLDonateInteractions = true\n" : ""});
    const auto folder = world.folder("state") / "activity", file = folder / "interactions.jsonl";
    ASSERT_EQ(world
                  .sablectl({"--identifier", "com.kestrel.rover", "report", "RKResultEngagementFeedback",
                             "completedQuery=weather", "result={}"})
                  .exitCode,
              0);
    if (wanted)
      waitForChange(folder, [&] { return std::filesystem::exists(file) && !readFile(file).empty(); });
    world.killDaemon();
    EXPECT_EQ(std::filesystem::exists(file), wanted);
    if (!wanted) continue;
    const json line = json::parse(readFile(file));
    EXPECT_EQ(line["domain"], "Rover");
    EXPECT_EQ(line["verb"], "Engagement");
    EXPECT_EQ(line["parameters"]["input"], "weather");
  }
}

}  // namespace
}  // namespace sable::test
