#include <gtest/gtest.h>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "tests/support/VirtualDevice.h"

// An explanation is made by the code that decides: what it foretells is what a search then does.
namespace sable::test {
namespace {

class ExplainTest : public ::testing::Test {
 protected:
  json explain(const SBLSearchRequest& request) {
    json explanation;
    client->connection().call(kSBLDiagnosticsRelay, SBLDiagnosticsRelay::explain,
                              {std::string(SBLSearchRequest::kClassName), encodeRequest(request)}, 20s,
                              [&](Expected<platform::RelayArguments> result) {
                                ASSERT_TRUE(result) << result.error().reason;
                                explanation = json::parse(std::get<std::string>((*result)[0]));
                              });
    device.run();
    return explanation;
  }

  static SBLSearchRequest searchFor(std::string text, std::uint64_t queryId = 1000) {
    SBLSearchRequest request;
    request.queryString = std::move(text);
    request.queryId = queryId;
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

TEST_F(ExplainTest, WithoutABagASearchEndsInAnError) {
  device.service.on("/bag", answering("", 500));
  start();
  const json explanation = explain(searchFor("weather"));
  EXPECT_EQ(stoppedBy(explanation), "bag: none");
  EXPECT_EQ(explanation["outcome"], "error");
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
  std::string error;
  client->connection().call(
      kSBLDiagnosticsRelay, SBLDiagnosticsRelay::explain,
      {std::string("SBLCardRequest"), platform::RelayRecord{}}, 20s,
      [&](Expected<platform::RelayArguments> result) { error = result.error().reason; });
  device.run();
  EXPECT_NE(error.find("explains a SBLSearchRequest"), std::string::npos) << error;
  EXPECT_TRUE(client->isConnected());
}

}  // namespace
}  // namespace sable::test
