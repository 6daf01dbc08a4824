#include <fmt/core.h>
#include <google/protobuf/message_lite.h>
#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <sstream>

#include "SableKit/messages/MessageJSON.h"
#include "platform/simulated/SimulatedLog.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/FeedbackTables.h"
#include "sabled/SableFeedback.h"
#include "sabled/SessionProcessingHelper.h"

// What becomes of every kind of feedback, held against the documentation, whose examples and tables
// are read here, and against the rows of tests/data/feedback.
namespace sable {
namespace {

constexpr platform::MonotonicTime kTime{std::chrono::milliseconds(42)};

/// The message of a class, from protobuf's JSON form.
std::unique_ptr<FeedbackMessage> message(std::string_view className, const std::string& json) {
  const auto bytes = messageFromJSON(className, json);
  if (!bytes) throw std::invalid_argument(bytes.error().reason + " in " + json);
  auto read = FeedbackMessage::parseReported(className, *bytes);
  if (!read) throw std::invalid_argument(read.error().reason + " in " + json);
  return std::move(*read);
}

/// As query 7, the client's third, a quarter of a second into its session.
SableFeedback record(std::unique_ptr<FeedbackMessage> feedback) {
  SableFeedback record(std::move(feedback), 7, std::nullopt, "Agent/1", 3);
  record.setRelTimestamp(250);
  return record;
}

std::string uploaded(std::unique_ptr<FeedbackMessage> feedback) {
  return compactJSON(record(std::move(feedback)).dictionary());
}

std::string compacted(const std::string& json) {
  const auto value = parseJSON(json, json.size());
  EXPECT_TRUE(value) << json;
  return value ? compactJSON(*value) : std::string();
}

std::ifstream source(const std::string& path) {
  std::ifstream file(std::string(SABLED_SOURCES "/") + path);
  EXPECT_TRUE(file) << path;
  return file;
}

struct Example {
  std::vector<std::string> classes;
  std::vector<std::string> blocks;  ///< message, document
};

/// The examples of docs/feedback.md: a line of classes, then two blocks of JSON.
std::vector<Example> documentedExamples() {
  auto file = source("docs/feedback.md");
  std::vector<Example> examples;
  bool inBlock = false;
  for (std::string line; std::getline(file, line);) {
    if (line == "```json") {
      examples.back().blocks.emplace_back();
      inBlock = true;
    } else if (line == "```") {
      inBlock = false;
    } else if (inBlock) {
      examples.back().blocks.back() += line + '\n';
    } else if (line.starts_with("Classes: ")) {
      const std::regex name("`((?:RK|SBL|Sable|_SK)\\w+)`");
      auto& example = examples.emplace_back();
      for (std::sregex_iterator it(line.begin(), line.end(), name), end; it != end; ++it)
        example.classes.push_back(it->str(1));
    }
  }
  return examples;
}

TEST(FeedbackTranslation, EveryClassBecomesWhatItsDocumentationShows) {
  std::set<std::string> shown{"RKFeedback", "_SKFeedback"};  // described in words
  for (const Example& example : documentedExamples()) {
    ASSERT_EQ(example.blocks.size(), 2u) << example.classes.front();
    for (const std::string& name : example.classes) {
      EXPECT_EQ(uploaded(message(name, example.blocks[0])), compacted(example.blocks[1])) << name;
      shown.insert(name);
    }
  }
  std::set<std::string> known;
  for (const std::string_view name : FeedbackMessage::classNames()) known.emplace(name);
  EXPECT_EQ(shown, known);
}

TEST(FeedbackTranslation, EdgesOfTheTranslation) {
  auto file = source("tests/data/feedback/edges.jsonl");
  std::size_t rows = 0;
  for (std::string line; std::getline(file, line); ++rows) {
    const Dictionary row = Dictionary::parse(line);
    for (const auto& name : row["class"]) {
      EXPECT_EQ(uploaded(message(name.get<std::string>(), row["message"].dump())), row["document"].dump())
          << row["name"];
    }
  }
  EXPECT_GT(rows, 0u);
}

TEST(FeedbackTranslation, TheDocumentedTablesHoldTheWords) {
  using Table = std::span<const std::string_view>;
  const std::map<std::string, Table> tables = {
      {"type", feedback::kTypes},
      {"session end reason", feedback::kSessionEndReasons},
      {"start search trigger", feedback::kStartSearchTriggers},
      {"endpoint", feedback::kEndpoints},
      {"lookup selection", feedback::kLookupSelections},
      {"local index", feedback::kLocalIndexes},
      {"result type", feedback::kResultTypes},
      {"top hit", feedback::kTopHits},
      {"visible results trigger", feedback::kVisibleResultsTriggers},
      {"result engagement trigger", feedback::kResultEngagementTriggers},
      {"destination", feedback::kDestinations},
      {"result action target", feedback::kResultActionTargets},
      {"card section engagement trigger", feedback::kCardSectionEngagementTriggers},
      {"card type", feedback::kCardTypes},
      {"store product page result", feedback::kStoreProductPageResults},
      {"card view disappear", feedback::kCardViewDisappearTriggers},
      {"suggestion type", feedback::kSuggestionTypes},
      {"clear input trigger", feedback::kClearInputTriggers},
      {"section engagement trigger", feedback::kSectionEngagementTriggers},
      {"section header type", feedback::kSectionHeaderTypes},
      {"search view appear trigger", feedback::kSearchViewAppearTriggers},
      {"search view disappear trigger", feedback::kSearchViewDisappearTriggers},
      {"skip search trigger", feedback::kSkipSearchTriggers},
      {"result grade", feedback::kResultGrades},
      {"maps place card", feedback::kMapsActions},
  };
  auto file = source("docs/feedback.md");
  std::string line;
  while (std::getline(file, line) && line != "## Tables") continue;
  std::size_t found = 0;
  const std::regex row("\\| ([a-z ]+) \\| (.*) \\|"), cell("(\\d+ )?([^,]+)(, )?");
  for (std::smatch parts; std::getline(file, line);) {
    if (!std::regex_match(line, parts, row) || !tables.contains(parts[1])) continue;
    ++found;
    const std::string name = parts[1], words = parts[2];
    std::map<std::size_t, std::string> documented, held;
    for (std::sregex_iterator it(words.begin(), words.end(), cell), end; it != end; ++it) {
      documented[it->str(1).empty() ? documented.size() : std::stoul(it->str(1))] = it->str(2);
    }
    const Table table = tables.at(name);
    for (std::size_t i = 0; i < table.size(); ++i) {
      if (!table[i].empty()) held[i] = table[i];
    }
    EXPECT_EQ(held, documented) << name;
  }
  EXPECT_EQ(found, tables.size());
  EXPECT_EQ(feedback::kMapsActions.size(), 223u);
}

TEST(FeedbackTranslation, WhatCannotBeTranslatedIsLogged) {
  platform::simulated::SimulatedLog log;
  using platform::LogLevel;
  message("RKFeedback", "{}")->dictionary();
  EXPECT_EQ(log.count(LogLevel::error), 0u);
  message("_SKFeedback", "{}")->dictionary();
  EXPECT_EQ(log.count("Feedback dictionary translation for _SKFeedback fell back to default implementation."),
            1u);
  message("_SKResultGradingFeedback", R"({"grade": 7})")->dictionary();
  EXPECT_EQ(log.count("No JSON string defined for result grade 7"), 1u);
  EXPECT_EQ(log.count(LogLevel::error, "Sable_Feedback_Errors"), 2u);
}

TEST(FeedbackTranslation, WhatAClientReportsWronglyIsRefusedWithItsReason) {
  struct Case {
    std::string_view className;
    std::string bytes;
    std::string_view reason;
  };
  const std::string tooLong(kMaximumFeedbackBytes + 1, '\0');
  const Case cases[] = {
      {"RKNothingFeedback", "", "unknown feedback class"},
      {"_SKClientSession", "", "unknown feedback class"},
      {"RKStartSearchFeedback", "\x1a\x05we", "the bytes are no RKStartSearchFeedback"},
      {"RKStartSearchFeedback", "\x1a\x01\xff", "the bytes are no RKStartSearchFeedback"},
      {"RKStartSearchFeedback", tooLong, "262145 bytes of feedback, more than the 262144 allowed"},
      {"RKCustomFeedback", "", "JSON of RKCustomFeedback: byte 0"},
      {"RKCustomFeedback", "\x1a\x02[]", "JSON of RKCustomFeedback is no object"},
  };
  for (const Case& each : cases) {
    const auto read = FeedbackMessage::parseReported(each.className, each.bytes);
    ASSERT_FALSE(read) << each.reason;
    EXPECT_EQ(read.error().code, 500);
    EXPECT_TRUE(read.error().reason.starts_with(each.reason)) << read.error().reason;
  }
  EXPECT_FALSE(FeedbackMessage::parseReportedPayload("\x0a\x05"));
  EXPECT_FALSE(FeedbackMessage::parseReportedPayload(""));
  EXPECT_FALSE(FeedbackMessage::parseReportedPayload(tooLong));
}

TEST(FeedbackTranslation, APayloadIsAMessageAndItsClass) {
  const auto read = FeedbackMessage::parseReportedPayload(*messageFromJSON(
      "_SKFeedbackPayload", R"({"className": "_SKEndSearchFeedback", "feedback": "EgJVMQ=="})"));
  ASSERT_TRUE(read) << read.error().reason;
  EXPECT_EQ((*read)->className(), "_SKEndSearchFeedback");
  EXPECT_EQ(compactJSON((*read)->dictionary()), R"({"uuid":"U1"})");
}

TEST(FeedbackTranslation, ARecordIsTheMessageThatItsSchemaDescribes) {
  for (const int inputBytes : {0, 100, 200, 20000}) {  // lengths of one byte, two and three
    const auto start =
        *messageFromJSON("RKStartSearchFeedback", fmt::format(R"({{"input": "{:x>{}}"}})", "", inputBytes));
    for (const std::int64_t queryId : {std::int64_t{0}, std::int64_t{-7}, std::int64_t{1} << 62}) {
      const SableFeedback feedback(*FeedbackMessage::parse("RKStartSearchFeedback", start), queryId,
                                   std::nullopt, "", 3);
      const auto json = messageToJSON("_SKSableFeedback", feedback.data());
      ASSERT_TRUE(json) << json.error().reason;
      EXPECT_EQ(*messageFromJSON("_SKSableFeedback", *json), feedback.data()) << inputBytes << " " << queryId;
      EXPECT_EQ(SableFeedback::parse(feedback.data())->queryId(), queryId);
    }
  }
}

TEST(FeedbackTranslation, ARecordSurvivesItsSessionFile) {
  // The last field is one that this build does not know.
  auto unknown =
      *messageFromJSON("RKStartSearchFeedback", R"({"timestamp": "7000000", "triggerEvent": 99})") +
      "\xf8\x3f\x01";
  const SableFeedback stored = record(*FeedbackMessage::parse("RKStartSearchFeedback", unknown));
  const auto read = SableFeedback::parse(stored.data());
  ASSERT_TRUE(read) << read.error().reason;
  EXPECT_EQ(read->data(), stored.data());
  EXPECT_EQ(read->feedback().message().SerializeAsString(), unknown);
  EXPECT_EQ(read->dictionary(), stored.dictionary());
  EXPECT_EQ(read->queryId(), 7);
  EXPECT_EQ(read->description(),
            R"({"trigger_event":null,"input":null,"uuid":null,"query_id":7,"client_query_id":3,)"
            R"("type":"search_start","timestamp":7})");
  EXPECT_FALSE(SableFeedback::parse("\x0a\x7f"));
  EXPECT_FALSE(SableFeedback::parse(""));

  const SableFeedback first(message("RKEndSearchFeedback", R"({"timestamp": "6"})"), -1, std::nullopt, "");
  EXPECT_EQ(compactJSON(first.dictionary()),
            R"({"uuid":null,"query_id":-1,"type":"search_end","timestamp":0})");
  EXPECT_EQ(SableFeedback::timeStampComparator(first, stored), -1);
  EXPECT_EQ(SableFeedback::timeStampComparator(stored, first), 1);
  EXPECT_EQ(SableFeedback::timeStampComparator(stored, stored), 0);
}

TEST(FeedbackTranslation, IdentifiersLeaveAsNumbersAndWhatWasNeverUsedIsMissing) {
  SessionProcessingHelper helper;
  const auto processed = [&](std::string_view className, const std::string& json) {
    auto feedback = message(className, json);
    feedback->process(helper);
    return feedback->dictionary();
  };
  EXPECT_EQ(
      processed("_SKVisibleResultsFeedback",
                R"({"results": [{"identifier": "x"}, {"identifier": "y", "fbr": "first"}, {}]})")["results"],
      Dictionary({"1", "2", nullptr}));
  EXPECT_EQ(processed("RKVisibleSuggestionsFeedback",
                      R"({"suggestions": [{"identifier": "g"}]})")["suggestions"][0]["id"],
            "3");
  const auto ranking = processed("RKRankingFeedback", R"({"sections": [{
      "section": {"identifier": "kept", "results": [{"identifier": "s"}]},
      "results": [{"hiddenResults": [{"identifier": "h"}], "duplicateResults": [{"identifier": "d"}],
                   "result": {"identifier": "y", "fbr": "second"}}]}]})")["sections"][0];
  EXPECT_EQ(ranking["id"], "kept");
  EXPECT_EQ(ranking["results"][0]["id"], "2");
  EXPECT_EQ(ranking["results"][0]["hidden_results"][0]["id"], "5");
  EXPECT_EQ(ranking["results"][0]["duplicate_results"][0]["id"], "6");
  EXPECT_EQ(processed("RKResultEngagementFeedback", R"({"result": {"identifier": "x"}})")["result"]["id"],
            "1");
  EXPECT_EQ(
      processed("RKLateSectionsAppendedFeedback",
                R"({"sections": [{"results": [{"identifier": "x"}]}]})")["sections"][0]["results"][0]["id"],
      "1");
  EXPECT_EQ(processed("_SKResultGradingFeedback", R"({"result": {"identifier": "h"}})")["result"]["id"], "5");
  EXPECT_EQ(processed("_SKSectionEngagementFeedback", R"({"identifier": "kept"})")["id"], "kept");

  const auto results =
      feedback::sessionMissingResults(kTime, helper.missingResults())->dictionary()["results"];
  std::vector<std::string> missing;
  for (const auto& result : results) missing.push_back(result["id"]);
  EXPECT_EQ(missing, (std::vector<std::string>{"2", "4", "6"}));
  EXPECT_EQ(results[0]["fbr"], "first");
  const auto suggestions = feedback::sessionMissingSuggestions(kTime, helper.missingSuggestions());
  EXPECT_EQ(suggestions->dictionary()["suggestions"][0]["id"], "3");
  processed("RKSuggestionEngagementFeedback", R"({"suggestion": {"identifier": "g"}})");
  EXPECT_TRUE(helper.missingSuggestions().empty());
}

TEST(FeedbackTranslation, AMessageTellsWhatItsWayDependsOn) {
  const std::string ranked = R"({"sections": [{"results": [{"result": {"queryId": "9"}}]}]})";
  EXPECT_EQ(message("_SKSBLRankerFeedback", ranked)->clientQueryId(), 9u);
  EXPECT_EQ(message("RKRankingFeedback", R"({"sections": [{}]})")->clientQueryId(), 0u);
  EXPECT_FALSE(message("RKResultEngagementFeedback", "{}")->resultEngagement()->topHit);
}

TEST(FeedbackTranslation, TheDaemonReportsOfItself) {
  platform::HTTPRequest request;
  request.url = "https://s.example/warm";
  request.headers.add("X-B", "\xff");
  const feedback::NetworkSearch search{.triggerEvent = feedback::kWarmTrigger,
                                       .endpoint = feedback::Endpoint::sableWarm,
                                       .input = "",
                                       .request = request,
                                       .uuid = "U"};
  feedback::NetworkSearchEnd end{.uuid = "U", .responseSize = 10, .statusCode = 200, .timing = {}};
  feedback::NetworkSearchEnd failed{.uuid = "U", .responseSize = 0, .statusCode = 0, .timing = {}};
  end.timing.start = platform::WallTime(std::chrono::seconds(1'800'000'000));
  end.timing.nameLookup = std::chrono::milliseconds(2);
  end.timing.responseStart = std::chrono::milliseconds(30);
  end.timing.total = std::chrono::milliseconds(31);
  end.timing.requestHeaderBytes = 200;
  end.timing.responseHeaderBytes = 100;
  end.timing.responseBodyBytes = 10;
  end.timing.peerAddress = "2001:db8::1";
  end.timing.peerPort = 443;
  const Error outer{"", 500, "bad \xff bytes"}, inner{"POSIXErrorDomain", 2, ""};
  const std::string query = R"(,"query_id":7,"client_query_id":3)";
  const std::pair<feedback::Message, std::string> cases[] = {
      {feedback::startNetworkSearch(kTime, search),
       R"({"trigger_event":"warm","input":"","uuid":"U","headers":{"X-B":"�"},"url":"https://s.example/warm",)"
       R"("endpoint_type":"sable_warm")" +
           query + R"(,"type":"network_search_start","timestamp":250})"},
      {feedback::startLookupNetworkSearch(kTime, search, -1),
       R"({"trigger_event":null,"input":"","uuid":"U","headers":{"X-B":"�"},"url":"https://s.example/warm",)"
       R"("endpoint_type":"sable_warm")" +
           query + R"(,"type":"network_search_start","timestamp":250})"},
      {feedback::endNetworkSearch(kTime, end),
       R"({"response_size":10,"status_code":200,"network_timing_data":[["FetchStart",0],["DomainLookupEnd",2],)"
       R"(["ResponseStart",30],["ResponseEnd",31],["ConnectionStopTimeCounts",{"TxBytes":200,"RxBytes":110}]],)"
       R"("connection_reused":false,"peer_address":"[2001:db8::1]:443","uuid":"U",)"
       R"("type":"network_search_end","timestamp":250})"},
      {feedback::endSableNetworkSearch(kTime, failed, {"noconnection", 0.5, std::nullopt, "192.0.2"}),
       R"({"response_size":0,"status_code":0,"network_timing_data":null,"uuid":"U","sable_status":"noconnection",)"
       R"("sable_duration":0.5,"fbq":null,"sable_partial_client_ip":"192.0.2","type":"network_search_end",)"
       R"("timestamp":250})"},
      {feedback::skipSearch(kTime, feedback::SkipSearchTrigger::bagFetchFailed, "we"),
       R"({"trigger_event":"bag_fetch_failed","input":"we")" + query +
           R"(,"type":"skip_sable_search","timestamp":250})"},
      {feedback::cacheHit(kTime, "we", "U"), R"({"trigger_event":"cache_hit","input":"we","uuid":"U")" +
                                                 query + R"(,"type":"skip_sable_search","timestamp":250})"},
      {feedback::error(kTime, outer, &inner),
       R"({"error":{"code":500,"domain":null,"reason":"bad � bytes"},)"
       R"("underlying_error":{"code":2,"domain":"POSIXErrorDomain","reason":null})" +
           query + R"(,"type":"error","timestamp":250})"},
      {feedback::sessionEnd(kTime, feedback::SessionEndReason::sessionIdle),
       R"({"reason":"session idle","type":"session_end","timestamp":250})"},
      {feedback::connectionInvalidated(kTime), R"({"type":"connection_invalidated","timestamp":250})"},
  };
  for (const auto& [made, document] : cases) {
    EXPECT_EQ(made->timestamp(), 42'000'000u) << document;
    EXPECT_EQ(uploaded(std::move(const_cast<feedback::Message&>(made))), document);
  }
  EXPECT_EQ(feedback::triggerEventEnumToString(1), "external request");
  EXPECT_EQ(feedback::triggerEventEnumToString(7), "");
}

}  // namespace
}  // namespace sable
