#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "sabled/ArchivedDataIterator.h"
#include "sabled/ClientConnection.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientState.h"
#include "sabled/SableBagController.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableService.h"
#include "sabled/SearchExplanation.h"
#include "tests/support/VirtualDevice.h"

// What the daemon records of queries, clients and itself, as its session files have it.
namespace sable::test {
namespace {

using platform::HTTPErrorCode;
using testing::ElementsAre;

constexpr const char* kBeacon = "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1";
constexpr const char* kDaemon = "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Sabled/1.0";

class Reporting : public testing::Test {
 protected:
  /// The sessions of an agent, each the list of its records, in the order of their files.
  std::vector<json> sessions(const std::string& agent) {
    device.run();
    std::vector<json> found;
    for (const auto& [path, bytes] : device.platform.fileManager().files()) {
      if (!path.filename().string().starts_with("session.")) continue;
      ArchivedDataIterator records(bytes);
      records.readNextObject();
      const auto session = ClientSession::initWithData(device.assembly(), *records.readNextObject());
      if (session->agent() != agent) continue;
      json& list = found.emplace_back(json::array());
      while (records.hasMore()) list.push_back(SableFeedback::parse(*records.readNextObject())->dictionary());
    }
    return found;
  }
  std::vector<json> records(const std::string& agent = kBeacon) {
    std::vector<json> all;
    for (const json& session : sessions(agent)) all.insert(all.end(), session.begin(), session.end());
    return all;
  }
  std::vector<std::string> types() {
    std::vector<std::string> types;
    for (const json& record : records()) types.push_back(record["type"]);
    return types;
  }
  /// Sends a feedback and tells whether it was acknowledged.
  bool report(VirtualClient& client, const std::string& className, const std::string& fields = "{}",
              std::int64_t queryId = 7) {
    const auto bytes = messageFromJSON(className, fields);
    return reportBytes(client, className, bytes ? *bytes : fields, queryId);
  }
  bool reportBytes(VirtualClient& client, const std::string& className, std::string bytes,
                   std::int64_t queryId) {
    const auto answer = client.call(kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
                                    {std::uint64_t{0}, queryId, className, makeData(std::move(bytes))});
    return answer.has_value();
  }

  VirtualDevice device;
};

// Queries

TEST_F(Reporting, ASearchLeavesItsStartItsEndAndItsCacheHit) {
  const auto answer =
      answering(R"([{"query": "weather", "completion_score": 1, "status": "OK", "fbq": "token"},
                                  {"partial_client_ip": "192.0.2", "duration": 0.25, "status": "LATE"}])");
  device.service.on("/search", after(80ms, answer));
  device.start();
  SBLSearchRequest request = searchFor("wea", 1);
  request.clientQueryId = 31;
  request.triggerEvent = 1;
  VirtualClient& client = device.client();
  client.ask(request);
  request.queryId = 2;
  request.queryString = "weat";
  client.ask(request);
  const auto found = records();
  ASSERT_EQ(found.size(), 3u);
  const json &start = found[0], &end = found[1], &hit = found[2];

  EXPECT_EQ(start["type"], "network_search_start");
  EXPECT_EQ(start["trigger_event"], "new_character");
  EXPECT_EQ(start["endpoint_type"], "sable_search");
  EXPECT_EQ(start["input"], "wea");
  EXPECT_EQ(start["query_id"], 1);
  EXPECT_EQ(start["client_query_id"], 31);
  const auto sent = device.service.requests("/search").at(0).request;
  EXPECT_EQ(start["url"], sent.url);
  EXPECT_EQ(start["headers"].size(), sent.headers.fields().size());

  EXPECT_EQ(end["type"], "network_search_end");
  EXPECT_EQ(end["uuid"], start["uuid"]);
  EXPECT_EQ(end["status_code"], 200);
  EXPECT_EQ(end["response_size"], answer.body.size());
  EXPECT_EQ(end["sable_status"], "OK");
  EXPECT_EQ(end["fbq"], "token");
  EXPECT_EQ(end["sable_partial_client_ip"], "192.0.2");
  EXPECT_EQ(end["sable_duration"], 0.25);
  EXPECT_EQ(end["network_timing_data"].front(), json::array({"FetchStart", 0}));
  EXPECT_THAT(end["network_timing_data"], testing::Contains(json::array({"ResponseEnd", 80})));

  EXPECT_EQ(hit, json({{"trigger_event", "cache_hit"},
                       {"input", "weat"},
                       {"uuid", start["uuid"]},
                       {"query_id", 2},
                       {"client_query_id", 31},
                       {"type", "skip_sable_search"},
                       {"timestamp", 0}}));
}

TEST_F(Reporting, AnAnswerThatIsNoJSONHasAnEndWithoutWords) {
  device.service.on("/search", answering("no JSON", 503));
  EXPECT_EQ(device.startWithClient().search("wea").data(), "no JSON");
  EXPECT_EQ(device.counter("beacon.fedapicall.serverstatus.503"), 1);
  const json end = records().at(1);
  EXPECT_EQ(end["status_code"], 503);
  EXPECT_EQ(end["response_size"], 7);
  EXPECT_TRUE(end["sable_status"].is_null());
}

TEST_F(Reporting, ARefusedQuerySaysWhy) {
  device.bag["minimum_query_length"] = 3;
  device.bag["agents"]["vox"]["enabled"] = false;
  device.start();
  device.client("com.kestrel.vox", "Vox/1").ask(searchFor("weather", 1));
  const auto disabled = records("Sabled/1.0 (SableBook1,1; Sable OS 1A1) Vox/1");
  ASSERT_EQ(disabled.size(), 1u);
  EXPECT_EQ(disabled[0]["trigger_event"], "bag_disabled");
  EXPECT_EQ(disabled[0]["input"], "weather");

  VirtualClient& client = device.client();
  client.ask(searchFor("we", 1));
  client.ask(searchFor("wea", 2));
  const auto tooShort = records();
  ASSERT_EQ(tooShort.size(), 3u);
  EXPECT_EQ(tooShort[0]["trigger_event"], "less_than_minimum_query_length");
  EXPECT_EQ(tooShort[0]["input"], "we");
  EXPECT_EQ(tooShort[0]["query_id"], 1);
}

TEST_F(Reporting, WithoutABagEveryKindOfQuerySaysSo) {
  device.service.on("/bag", answering("", 500));
  VirtualClient& client = device.startWithClient();
  device.advance(2s);
  client.ask(searchFor("wea", 1));
  client.ask(SBLZeroKeywordRequest{});
  SBLLookupRequest lookup;
  lookup.queryString = "otter";
  client.ask(lookup);
  std::vector<std::pair<std::string, std::string>> found;
  for (const json& record : records()) found.emplace_back(record["trigger_event"], record["input"]);
  EXPECT_THAT(found, ElementsAre(std::pair("bag_fetch_failed", "wea"), std::pair("bag_fetch_failed", ""),
                                 std::pair("bag_fetch_failed", "")));
}

TEST_F(Reporting, ALookupTellsHowItsTextWasSelectedAndNotTheText) {
  device.service.on("/search", answering(R"({"status": "OK", "duration": 0.5})"));
  device.start();
  SBLLookupRequest lookup;
  lookup.queryId = 4;
  lookup.queryString = "otter";
  lookup.lookupSelectionType = 2;
  device.client().ask(lookup);
  const auto found = records();
  ASSERT_EQ(found.size(), 2u);
  EXPECT_EQ(found[0]["trigger_event"], "lookup_hint_tap");
  EXPECT_EQ(found[0]["input"], "");
  EXPECT_EQ(found[0]["endpoint_type"], "sable_search");
  EXPECT_EQ(found[1]["uuid"], found[0]["uuid"]);
  EXPECT_EQ(found[1]["sable_duration"], 0.5);
}

TEST_F(Reporting, OnlyAMissingConnectionIsCalledOne) {
  VirtualClient& client = device.startWithClient();
  const std::pair<HTTPErrorCode, json> cases[] = {{HTTPErrorCode::cannotFindHost, "noconnection"},
                                                  {HTTPErrorCode::cannotConnect, "noconnection"},
                                                  {HTTPErrorCode::connectionLost, "noconnection"},
                                                  {HTTPErrorCode::proxyFailed, "noconnection"},
                                                  {HTTPErrorCode::timedOut, nullptr},
                                                  {HTTPErrorCode::secureConnectionFailed, nullptr},
                                                  {HTTPErrorCode::badResponse, nullptr}};
  std::uint64_t queryId = 0;
  for (const auto& [error, status] : cases) {
    device.service.failNext(1, error);
    client.ask(searchFor("wea", ++queryId));
    const json end = records().back();
    EXPECT_EQ(end["type"], "network_search_end");
    EXPECT_EQ(end["status_code"], 0);
    EXPECT_EQ(end["sable_status"], status) << static_cast<int>(error);
  }
}

TEST_F(Reporting, AnExplanationLeavesNothing) {
  VirtualClient& client = device.startWithClient();
  const auto& state = device.daemon().service().getClientConnections().at(0)->state();
  for (const char* text : {"", "weather"}) {
    SearchExplanation why;
    state->explain(searchFor(text, 1), why);
  }
  EXPECT_THAT(types(), ElementsAre());
  client.ask(searchFor("wea", 1));
  EXPECT_EQ(types().size(), 2u);
}

// What clients report

TEST_F(Reporting, AFeedbackIsARecordOfItsClient) {
  VirtualClient& client = device.startWithClient();
  EXPECT_TRUE(
      report(client, "RKStartSearchFeedback", R"({"input": "we", "triggerEvent": 3, "queryId": "5"})", -2));
  EXPECT_TRUE(report(client, "_SKRankingFeedback",
                     R"({"sections": [{"results": [{"result": {"identifier": "a", "queryId": "6"}}]}]})"));
  const auto payload = messageFromJSON("_SKFeedbackPayload", R"({"className": "RKDidGoToSiteFeedback"})");
  client.connection().send(
      kSBLDaemonRelay, SBLDaemonRelay::reportEventData,
      {std::uint64_t{0}, std::int64_t{8}, std::make_shared<const std::string>(*payload)});
  const auto found = records();
  ASSERT_EQ(found.size(), 3u);
  EXPECT_EQ(found[0]["query_id"], -2);
  EXPECT_EQ(found[0]["client_query_id"], 5);
  EXPECT_EQ(found[0]["trigger_event"], "backspace");
  EXPECT_EQ(found[1]["client_query_id"], 6);
  EXPECT_EQ(found[2]["type"], "did_go_to_site");
  EXPECT_EQ(found[2]["query_id"], 8);
}

TEST_F(Reporting, WhatIsNoFeedbackCostsItsSenderTheConnection) {
  VirtualClient& neighbour = device.startWithClient();
  const std::pair<std::string, std::string> cases[] = {{"RKUnheardOfFeedback", ""},
                                                       {"RKSearchResult", ""},
                                                       {"RKStartSearchFeedback", "\xff\xff"},
                                                       {"RKStartSearchFeedback", std::string(300000, '\x0a')},
                                                       {"RKCustomFeedback", "\x1a\x02[]"}};
  for (const auto& [className, bytes] : cases) {
    VirtualClient& client = device.client();
    EXPECT_FALSE(reportBytes(client, className, bytes, 7)) << className;
    EXPECT_FALSE(client.isConnected()) << className;
  }
  EXPECT_EQ(device.log.count("feedback refused: "), std::size(cases));
  EXPECT_TRUE(report(neighbour, "RKDidGoToSiteFeedback"));
}

TEST_F(Reporting, FeedbackBeforeConfigurationIsAnErrorInASessionOfItsOwn) {
  device.start();
  VirtualClient& client = device.connect();
  EXPECT_TRUE(report(client, "RKDidGoToSiteFeedback"));
  EXPECT_EQ(device.log.count("state must not be nil"), 1u);
  const json error = sessions(kDaemon).back();
  ASSERT_EQ(error.size(), 1u);
  EXPECT_EQ(error[0]["error"],
            json({{"code", 500}, {"domain", "SBLErrorDomain"}, {"reason", "client state nil"}}));
  client.configure("", "");
  device.run();
  EXPECT_EQ(records(kDaemon).back()["error"]["reason"], "invalid configuration");
}

TEST_F(Reporting, EngagementsAreCountedAndDonated) {
  VirtualClient& beacon = device.startWithClient();
  VirtualClient& vox = device.client("com.kestrel.vox", "Vox/1");
  VirtualClient& unknown = device.client("org.example.app", "App/1");
  const std::string engagement = R"({"completedQuery": "weather", "result": {"topHit": 2, "type": 1}})";
  for (VirtualClient* client : {&beacon, &vox, &unknown}) {
    EXPECT_TRUE(report(*client, "RKResultEngagementFeedback", engagement));
  }
  EXPECT_TRUE(report(beacon, "_SKResultEngagementFeedback", R"({"result": {"type": 2}})"));
  EXPECT_EQ(device.counter("beacon.tophit.engagements"), 1);
  EXPECT_EQ(device.counter("beacon.sable.engagements"), 1);
  EXPECT_EQ(device.counter("vox.sable.engagements"), 1);
  const auto& donated = device.platform.userActivity().donated();
  ASSERT_EQ(donated.size(), 1u);
  EXPECT_EQ(donated[0].domain, "Beacon");
  EXPECT_EQ(donated[0].value, "weather");
}

TEST_F(Reporting, CustomFeedbackGoesItsOwnWays) {
  VirtualClient& client = device.startWithClient();
  for (const char* type : {"0", "1", "2", "3", "4"}) {
    EXPECT_TRUE(report(client, "RKCustomFeedback",
                       R"({"jsonFeedback": "{\"a\": 1}", "feedbackType": )" + std::string(type) + "}"));
  }
  EXPECT_EQ(sessions(kBeacon).size(), 2u) << "one for each that makes a session";
  EXPECT_THAT(types(),
              testing::UnorderedElementsAre("custom_rover_autofill", "custom_beacon_result_features"));
  for (const json& record : records()) EXPECT_EQ(record["a"], 1);
  EXPECT_EQ(device.counter("dp.submit"), 1);
}

TEST_F(Reporting, ASearchViewThatAppearsWarmsTheConnectionOnceInThirtySeconds) {
  VirtualClient& client = device.startWithClient();
  const auto appear = [&](const std::string& fields) {
    EXPECT_TRUE(report(client, "_SKSearchViewAppearFeedback", fields));
  };
  appear(R"({"viewAppearEvent": 1})");
  appear(R"({"viewAppearEvent": 2, "onLockScreen": true})");
  EXPECT_EQ(device.sent("/warm"), 0u);
  appear(R"({"viewAppearEvent": 24})");
  device.advance(29s);
  appear(R"({"viewAppearEvent": 2})");
  EXPECT_EQ(device.sent("/warm"), 1u) << "the connection is still warm";
  device.advance(2s);
  EXPECT_TRUE(report(client, "RKSearchViewAppearFeedback", R"({"viewAppearEvent": 5})"));
  EXPECT_EQ(device.sent("/warm"), 2u);
  EXPECT_EQ(types().size(), 5u) << "all of them are recorded";

  const json warmUp = sessions(kDaemon).back();
  ASSERT_GE(warmUp.size(), 2u);
  EXPECT_EQ(warmUp[0]["trigger_event"], "warm");
  EXPECT_EQ(warmUp[0]["endpoint_type"], "sable_warm");
  EXPECT_EQ(warmUp[0]["query_id"], 0);
  EXPECT_EQ(warmUp[1]["type"], "network_search_end");
  EXPECT_EQ(warmUp[1]["uuid"], warmUp[0]["uuid"]);
}

TEST_F(Reporting, ABagThatTurnsFeedbackOffLeavesNothing) {
  device.bag["feedback_enabled"] = false;
  VirtualClient& client = device.startWithClient();
  EXPECT_TRUE(report(client, "RKDidGoToSiteFeedback")) << "it is accepted all the same";
  client.ask(searchFor("wea", 1));
  EXPECT_THAT(types(), ElementsAre());
}

// The daemon itself

TEST_F(Reporting, AFetchOfTheBagIsASessionOfItsOwn) {
  device.service.on("/bag", answering("[]"));
  device.start();
  device.service.on("/bag", answering("", 404));
  device.client();
  const auto found = sessions(kDaemon);
  ASSERT_EQ(found.size(), 2u);
  const std::vector<std::pair<int, std::string>> cases = {{200, "not JSON object"}, {404, "statusCode 404"}};
  for (std::size_t i = 0; i < cases.size(); ++i) {
    const json& fetch = found[i];
    ASSERT_EQ(fetch.size(), 3u);
    EXPECT_EQ(fetch[0]["trigger_event"], "bag");
    EXPECT_EQ(fetch[0]["endpoint_type"], "sable_bag");
    EXPECT_EQ(fetch[0]["input"], "");
    EXPECT_EQ(fetch[1]["uuid"], fetch[0]["uuid"]);
    EXPECT_EQ(fetch[1]["status_code"], cases[i].first);
    EXPECT_EQ(fetch[2]["error"]["reason"], cases[i].second);
    EXPECT_EQ(fetch[2]["error"]["code"], 2);
  }
  device.service.on("/bag", [&](const auto&) { return answering(device.bag.dump()); });
  device.assembly().bagController->currentBag();
  device.advance(1s);
  EXPECT_EQ(sessions(kDaemon).back().size(), 2u) << "no error";
}

TEST_F(Reporting, TheFeedbackOfTheCurrentSessionIsShownWhereItIsKept) {
  device.start();
  device.assembly().testFeedbacks = true;
  VirtualClient& client = device.client();
  const auto shown = [&] {
    const auto answer = client.call(kSBLDaemonRelay, SBLDaemonRelay::feedback);
    return std::get<platform::RelayStrings>(answer->at(0));
  };
  EXPECT_THAT(shown(), ElementsAre());
  report(client, "RKDidGoToSiteFeedback", R"({"timestamp": "1000000000", "input": "a"})");
  report(client, "RKDidGoToSiteFeedback", R"({"timestamp": "1250000000", "input": "b"})");
  EXPECT_THAT(shown(), ElementsAre(R"({"input":"a","query_id":7,"type":"did_go_to_site","timestamp":0})",
                                   R"({"input":"b","query_id":7,"type":"did_go_to_site","timestamp":250})"));
}

}  // namespace
}  // namespace sable::test
