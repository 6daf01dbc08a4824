#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <set>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "tests/support/VirtualDevice.h"

// An explanation is made by the code that decides: what it foretells is what a search then does. So is a
// report on privacy.
namespace sable::test {
namespace {

using platform::HTTPRequest;

class ExplainTest : public ::testing::Test {
 protected:
  /// The answer of the diagnostics, or why there is none.
  json diagnose(std::size_t method, platform::RelayArguments arguments) {
    const auto answer = client->call(kSBLDiagnosticsRelay, method, std::move(arguments));
    return answer ? json::parse(std::get<std::string>(answer->at(0))) : json(answer.error().reason);
  }
  json explain(const SBLSearchRequest& request) {
    return diagnose(SBLDiagnosticsRelay::explain,
                    {std::string(SBLSearchRequest::kClassName), encodeRequest(request)});
  }

  static SBLSearchRequest searchFor(std::string text, std::uint64_t queryId = 1000) {
    SBLSearchRequest request = test::searchFor(std::move(text), queryId);
    request.verboseReply = true;
    return request;
  }

  /// "gate: found" of the gate that stops the search.
  static std::string stoppedBy(const json& explanation) {
    const json& last = explanation["gates"].back();
    return last["passes"] ? "" : last["gate"].get<std::string>() + ": " + last["found"].get<std::string>();
  }

  VirtualClient& start(const std::string& agent = "Beacon/1") {
    device.start();
    client = &device.client("com.kestrel.beacon", agent);
    return *client;
  }

  VirtualDevice device;
  VirtualClient* client = nullptr;
};

TEST_F(ExplainTest, ForetellsTheRequestThatIsSent) {
  device.platform.userDefaults().setByUser("SBLDebugParameters", "a=1");
  start();
  SBLSearchRequest request = searchFor("weather");
  request.queryItems = {{"locale", "xx_YY"}, {"q", "else"}};
  const json explanation = explain(request);
  EXPECT_EQ(explanation["outcome"], "network");
  EXPECT_EQ(device.sent("/search"), 0u) << "nothing is asked to explain";
  EXPECT_EQ(device.counter("searches"), 0);
  EXPECT_EQ(device.counter("beacon.keystrokes"), 0);

  const Answer answer = client->ask(request);
  ASSERT_TRUE(answer.isClean());
  EXPECT_EQ(explanation["request"]["url"], answer.reply->httpRequest->url);

  // What the steps leave standing are the headers that were sent.
  std::map<std::string, std::string> headers, sent;
  for (const json& step : explanation["request"]["steps"]) {
    if (step["place"] == "header" && step["effect"] != "kept") headers[step["name"]] = step["value"];
  }
  for (const auto& [name, value] : answer.reply->httpRequest->headers.fields()) sent[name] = value;
  EXPECT_EQ(headers, sent);
}

TEST_F(ExplainTest, NamesWhatEachStepOverrodeOrGaveWayTo) {
  start();
  SBLSearchRequest request = searchFor("weather");
  request.queryItems = {{"locale", "xx_YY"}, {"q", "else"}};
  std::vector<std::string> rows;
  const json explanation = explain(request);
  for (const json& step : explanation["request"]["steps"]) {
    if (step["name"] != "q" && step["name"] != "locale") continue;
    rows.push_back(step["step"].get<std::string>() + " " + step["name"].get<std::string>() + "=" +
                   step["value"].get<std::string>() + " " + step["effect"].get<std::string>() + " " +
                   step.value("other_step", "") + " " + step.value("other_value", ""));
  }
  EXPECT_EQ(rows, (std::vector<std::string>{"query q=weather set  ", "client's items locale=xx_YY set  ",
                                            "client's items q=else replaced query weather",
                                            "_addLocaleQueryItem locale=en_US kept client's items xx_YY"}));
}

TEST_F(ExplainTest, TellsTheGateThatStopsASearch) {
  device.bag["minimum_query_length"] = 4;
  device.bag["agents"]["rover"]["enabled"] = false;
  start().search("weather");
  EXPECT_EQ(stoppedBy(explain(searchFor("weather", 1))), "query id: 1");
  EXPECT_EQ(stoppedBy(explain(searchFor("wea"))), "length of the input: 3");
  EXPECT_EQ(stoppedBy(explain(searchFor("weat"))), "");
  client = &device.client("com.kestrel.rover", "Rover/1");
  EXPECT_EQ(stoppedBy(explain(searchFor("weather"))), "enabled in the bag: false");
  EXPECT_EQ(explain(searchFor("weather"))["outcome"], "nothing");
}

TEST_F(ExplainTest, TellsTheRuleThatChoseOrDroppedEachCandidate) {
  start().search("wea");
  const json cached = explain(searchFor("weat"));
  EXPECT_EQ(cached["outcome"], "cache") << cached.dump(1);
  EXPECT_EQ(cached["cache"]["use"], "answers");
  EXPECT_EQ(cached["cache"]["candidates"][0]["outcome"], "chosen");
  EXPECT_TRUE(cached["request"].is_null());

  const json shorter = explain(searchFor("we"));
  EXPECT_EQ(shorter["outcome"], "network");
  EXPECT_EQ(shorter["cache"]["candidates"][0]["outcome"], "input longer");

  SBLSearchRequest forced = searchFor("weat");
  forced.queryItems = {{"cc", "US"}};
  EXPECT_EQ(explain(forced)["cache"]["use"], "not used: the client forces query items");
}

TEST_F(ExplainTest, ExplainsSearchesOnly) {
  start();
  const std::string error =
      diagnose(SBLDiagnosticsRelay::explain, {std::string("SBLCardRequest"), platform::RelayRecord{}});
  EXPECT_NE(error.find("explains a SBLSearchRequest"), std::string::npos) << error;
  EXPECT_TRUE(client->isConnected());
}

/// Of what a request carried, that which a privacy report tells of requests of its kind: "name=value".
class PrivacyTest : public ExplainTest {
 protected:
  json privacy() { return diagnose(SBLDiagnosticsRelay::privacy, {}); }

  static std::set<std::string> told(const json& report, std::string_view request) {
    std::set<std::string> values;
    for (const json& value : report["values"]) {
      const json& requests = value["requests"];
      if (std::find(requests.begin(), requests.end(), request) == requests.end()) continue;
      values.insert(value["name"].get<std::string>() + "=" + value["value"].get<std::string>());
    }
    return values;
  }

  /// What the newest request to the path carried, without what is the query's and not the device's.
  std::set<std::string> carried(std::string_view path) {
    const HTTPRequest request = device.service.requests(path).back().request;
    const std::set<std::string> ofTheQuery{"q",     "qtype",   "key",   "card",     "ldomain",
                                           "ltype", "context", "qlang", "lctxlang", "version"};
    std::set<std::string> values;
    for (const auto& item : platform::URL::parse(request.url)->queryItems()) {
      if (!ofTheQuery.contains(item.name)) values.insert(item.name + "=" + item.value.value_or(""));
    }
    for (const auto& [name, value] : request.headers.fields()) values.insert(name + "=" + value);
    return values;
  }
};

TEST_F(PrivacyTest, WhatItTellsOfEachKindOfRequestIsWhatIsSent) {
  device.bag["geo_location_sources"] = {"wifi"};
  device.bag["send_geo_environment_header"] = true;
  device.bag["feedback_url"] = "https://service.test/feedback";
  device.platform.userDefaults().setByUser("SBLDebugParameters", "cc=XX");
  device.platform.accountStore().values.managed = true;
  device.platform.mapsService().sessions = {{"maps-session", {}}};
  device.platform.userDefaults().set("SBLAppWhitelistSignature", "signature");
  device.platform.userDefaults().set("SBLAppWhitelistApplications", {"org.example.Mail"});
  device.platform.locationService().authorize(platform::LocationAuthorization::always);
  start("Rover/1");
  device.platform.locationService().deliver({51.507351, -0.127758, 5, device.platform.runtime().now()});
  device.run();
  const int located = device.platform.locationService().starts();
  const json report = privacy();
  EXPECT_EQ(device.sent("/search"), 0u) << "nothing is sent for it";
  EXPECT_EQ(device.platform.locationService().starts(), located) << "nor is the device located";
  for (const json& value : report["values"]) {
    EXPECT_NE(value["what"].get<std::string>().front(), '_') << "a step without words for users";
  }

  client->ask(searchFor("weather"));
  EXPECT_EQ(told(report, "search"), carried("/search"));
  client->ask(SBLZeroKeywordRequest{});
  EXPECT_EQ(told(report, "zero keyword"), carried("/search"));
  client->ask(SBLLookupRequest{});
  EXPECT_EQ(told(report, "lookup"), carried("/search"));
  SBLMoreResultsRequest more;
  more.moreResultsURL = "https://service.test/more";
  client->ask(more);
  EXPECT_EQ(told(report, "more results"), carried("/more"));
  SBLCardRequest card;
  card.cardURL = "https://service.test/card";
  client->ask(card);
  EXPECT_EQ(told(report, "card"), carried("/card"));
  EXPECT_EQ(told(report, "bag"), carried("/bag"));
  EXPECT_TRUE(told(report, "search").contains("mode=managed"));
  EXPECT_TRUE(told(report, "card").contains("latlng=51.500000,-0.100000"));
  EXPECT_TRUE(told(report, "upload").contains("du_enabled=1"));
  EXPECT_TRUE(told(report, "search").contains("X-Kestrel-Whitelisted-App-Signature=signature"));
  EXPECT_EQ(report["signed_applications"], json{"org.example.Mail"}) << "as it was saved";

  device.advance(14min);
  client = &device.client("com.kestrel.rover", "Rover/1");
  EXPECT_NEAR(privacy()["user_guid"]["rotates_in"].get<double>(), 60, 5);
  device.advance(2min);
  client = &device.client("com.kestrel.rover", "Rover/1");
  EXPECT_NE(privacy()["user_guid"]["value"], report["user_guid"]["value"]);
}

TEST_F(PrivacyTest, WhatIsNotAskedForSaysWhyAndTellsNothing) {
  device.bag["agents"]["rover"]["enabled"] = false;
  const auto unsent = [](const json& report) {
    std::map<std::string, std::string> why;
    for (const json& request : report["requests"]) {
      if (!request["sent"]) why[request["request"]] = request["why"];
    }
    return why;
  };
  start("Rover/1");
  const json disabled = privacy();
  EXPECT_EQ(unsent(disabled)["search"], "the bag does not enable it for this agent");
  EXPECT_TRUE(told(disabled, "search").empty());
  EXPECT_EQ(unsent(disabled)["upload"], "the bag collects no feedback from this agent");
  EXPECT_EQ(unsent(disabled).count("bag"), 0u);

  client = &device.client("com.kestrel.messages", "Messages/1");
  const json messages = privacy();
  EXPECT_FALSE(told(messages, "search").contains("geosrc=bagno.all"));
  EXPECT_TRUE(told(messages, "card").contains("geosrc=bagno.all"));
}

TEST_F(PrivacyTest, WithoutABagASearchEndsInAnErrorAndOnlyTheRequestForTheBagIsThere) {
  device.service.on("/bag", answering("", 500));
  start();
  const json explanation = explain(searchFor("weather")), report = privacy();
  EXPECT_EQ(stoppedBy(explanation), "bag: none");
  EXPECT_EQ(explanation["outcome"], "error");
  EXPECT_TRUE(report["bag"].is_null());
  EXPECT_TRUE(told(report, "search").empty());
  EXPECT_EQ(told(report, "bag"), carried("/bag"));
}

}  // namespace
}  // namespace sable::test
