#include <gtest/gtest.h>

#include <algorithm>

#include "tests/support/World.h"

// What the service receives from the real daemon, item by item and header by header.
namespace sable::test {
namespace {

using nlohmann::json;
using Pairs = std::vector<std::pair<std::string, std::string>>;

constexpr const char* kFacts = R"(
product_type = "SableBook1,1"
product_name = "Debian"
build_version = "12.5"
screen_scale = 2.0
keyboard_input_mode = "en_GB@sw=QWERTY"
locale = "en_GB"
preferred_languages = ["en-GB", "de", "fr", "it"]
system_language = "en-GB"
time_zone = "Europe/London"
country_code = "GB"
storefront = "143444"
managed_account = true
geo_environment = "prod"
geo_session_id = "session-1"
geo_metadata = "meta-1"
[location]
latitude = 51.507351
longitude = -0.127758
type = 5
)";

constexpr const char* kAgent = "Sabled/1.0 (SableBook1,1; Debian 12.5) sablectl/1.0";

Pairs items(const json& request) {
  return request["items"].get<Pairs>();
}

/// The headers that the daemon sets, sorted by name; the transport's own are left out.
Pairs headers(const json& request) {
  Pairs result;
  for (const auto& [name, value] : request["headers"].get<Pairs>()) {
    if (name == "User-Agent" || name == "If-None-Match" || name.starts_with("X-Kestrel-")) {
      result.emplace_back(name, name == "X-Kestrel-UserGuid" ? "GUID" : value);
    }
  }
  std::ranges::sort(result);
  return result;
}

class Requests : public testing::Test {
 protected:
  Requests() : world_({.settings = "SBLUseBramble = false", .facts = kFacts}) {
    world_.waitForLog("location: wifi");
  }

  json only(std::string_view path, std::initializer_list<std::string> command) {
    EXPECT_EQ(world_.sablectl(command).exitCode, 0);
    return world_.requests(path, 1).at(0);
  }

  World world_;
};

const Pairs kSearchHeaders{{"User-Agent", kAgent},
                           {"X-Kestrel-GeoEnvironment", "prod"},
                           {"X-Kestrel-GeoMetadata", "meta-1"},
                           {"X-Kestrel-GeoSession", "session-1"},
                           {"X-Kestrel-Languages", R"(["en-GB","de","fr"])"},
                           {"X-Kestrel-UI-Scale", "2.0"},
                           {"X-Kestrel-UserGuid", "GUID"}};

TEST_F(Requests, TheBagIsAskedForWithWhatItsUrlDependsOn) {
  const json request = only("/bag", {"bag"});
  EXPECT_EQ(
      items(request),
      (Pairs{{"bramble", "0"}, {"cc", "GB"}, {"esl", "en-GB"}, {"key", "tandem4371"}, {"locale", "en_GB"}}));
  EXPECT_EQ(headers(request), (Pairs{{"User-Agent", "Sabled/1.0 (SableBook1,1; Debian 12.5) Sabled/1.0"},
                                     {"X-Kestrel-Languages", R"(["en-GB","de","fr"])"}}));
}

TEST_F(Requests, AWarmUpCarriesNothingAtAll) {
  const json request = only("/warm", {"report", "RKSearchViewAppearFeedback", "viewAppearEvent=2"});
  EXPECT_EQ(request["method"], "GET");
  EXPECT_EQ(items(request), Pairs());
  EXPECT_EQ(headers(request), Pairs());
}

TEST_F(Requests, ASearchCarriesTheWholeContext) {
  const json request = only("/search", {"search", "weather; now", "--trigger", "8"});
  EXPECT_EQ(items(request), (Pairs{{"24h", "1"},
                                   {"calendar", "gregorian"},
                                   {"card", "1"},
                                   {"cc", "GB"},
                                   {"esl", "en-GB"},
                                   {"geosrc", "wifi"},
                                   {"kb_ime", "en_GB@sw=QWERTY"},
                                   {"key", "tandem4371"},
                                   {"latlng", "51.500000,-0.100000"},
                                   {"locale", "en_GB"},
                                   {"mode", "managed"},
                                   {"q", "weather; now"},
                                   {"qtype", "suggested"},
                                   {"storefront", "143444"},
                                   {"temp", "C"},
                                   {"time_zone", "Europe/London"},
                                   {"units", "UK"}}));
  EXPECT_NE(request["query"].get<std::string>().find("q=weather%3B%20now"), std::string::npos);
  EXPECT_EQ(headers(request), kSearchHeaders);
}

TEST_F(Requests, ZeroKeywordIsASearchWithoutAQuery) {
  const json request = only("/search", {"zkw"});
  EXPECT_EQ(items(request), (Pairs{{"24h", "1"},
                                   {"calendar", "gregorian"},
                                   {"cc", "GB"},
                                   {"esl", "en-GB"},
                                   {"geosrc", "wifi"},
                                   {"kb_ime", "en_GB@sw=QWERTY"},
                                   {"key", "tandem4371"},
                                   {"latlng", "51.500000,-0.100000"},
                                   {"locale", "en_GB"},
                                   {"mode", "managed"},
                                   {"qtype", "zkw"},
                                   {"storefront", "143444"},
                                   {"temp", "C"},
                                   {"time_zone", "Europe/London"},
                                   {"units", "UK"}}));
  EXPECT_EQ(headers(request), kSearchHeaders);
}

TEST_F(Requests, ALookupTellsWhereItComesFrom) {
  const json request =
      only("/search", {"lookup", "ちょうちょ", "--context",
                       "Der Schmetterling flog über die Wiese und den Garten hinweg", "--app",
                       "org.example.Reader", "--domain", "nature", "--selection", "2"});
  EXPECT_EQ(items(request), (Pairs{{"cc", "GB"},
                                   {"context", "org.example.Reader"},
                                   {"esl", "en-GB"},
                                   {"geosrc", "wifi"},
                                   {"kb_ime", "en_GB@sw=QWERTY"},
                                   {"key", "tandem4371"},
                                   {"latlng", "51.500000,-0.100000"},
                                   {"lctxlang", "de"},
                                   {"ldomain", "nature"},
                                   {"locale", "en_GB"},
                                   {"ltype", "hint"},
                                   {"mode", "managed"},
                                   {"q", "ちょうちょ"},
                                   {"qlang", "ja"},
                                   {"storefront", "143444"}}));
  EXPECT_EQ(headers(request), (Pairs{{"User-Agent", kAgent},
                                     {"X-Kestrel-GeoMetadata", "meta-1"},
                                     {"X-Kestrel-GeoSession", "session-1"},
                                     {"X-Kestrel-Languages", R"(["en-GB","de","fr"])"},
                                     {"X-Kestrel-UI-Scale", "2.0"},
                                     {"X-Kestrel-UserGuid", "GUID"}}));
}

TEST_F(Requests, TheServiceSaysWhatTextAHintFits) {
  const auto firstResult = [&](const char* selection) {
    const json answer = world_.sablectlJSON({"lookup", "new yo", "--selection", selection});
    return answer["reply"]["data"].at(0)["results"].at(0);
  };
  EXPECT_EQ(firstResult("2")["lookup_instructions"], (json{{"completion", "New York"}}));
  EXPECT_FALSE(firstResult("1").contains("lookup_instructions")) << "that was asked for";
}

TEST_F(Requests, MoreResultsAndCardsKeepTheItemsOfTheirUrl) {
  const json more = only("/more", {"more", world_.serviceURL() + "/more?q=weather&offset=10&locale=de"});
  EXPECT_EQ(items(more), (Pairs{{"esl", "en-GB"},
                                {"geosrc", "wifi"},
                                {"key", "tandem4371"},
                                {"latlng", "51.500000,-0.100000"},
                                {"locale", "de"},
                                {"mode", "managed"},
                                {"offset", "10"},
                                {"q", "weather"},
                                {"storefront", "143444"}}));
  EXPECT_EQ(headers(more), (Pairs{{"User-Agent", kAgent},
                                  {"X-Kestrel-Languages", R"(["en-GB","de","fr"])"},
                                  {"X-Kestrel-UI-Scale", "2.0"},
                                  {"X-Kestrel-UserGuid", "GUID"}}));

  const json card = only("/card", {"card", world_.serviceURL() + "/card?id=1"});
  EXPECT_EQ(items(card), (Pairs{{"cc", "GB"},
                                {"esl", "en-GB"},
                                {"geosrc", "wifi"},
                                {"id", "1"},
                                {"key", "tandem4371"},
                                {"latlng", "51.500000,-0.100000"},
                                {"locale", "en_GB"},
                                {"storefront", "143444"}}));
  EXPECT_EQ(headers(card), kSearchHeaders);
}

TEST_F(Requests, AClientsItemsReplaceTheQuery) {
  const json forced = only("/search", {"search", "weather", "--item", "q=other", "--item", "extra=a+b c"});
  const Pairs sent = items(forced);
  EXPECT_TRUE(std::ranges::find(sent, std::pair<std::string, std::string>("q", "other")) != sent.end());
  EXPECT_TRUE(std::ranges::find(sent, std::pair<std::string, std::string>("extra", "a+b c")) != sent.end());
  EXPECT_NE(forced["query"].get<std::string>().find("extra=a%2Bb%20c"), std::string::npos);
}

TEST(DebugParameters, ReplaceWhatARequestWouldHaveSaid) {
  World world({.settings = "SBLUseBramble = false\nSBLDebugParameters = \"key=abc&b&c=2=3&locale=xx\"",
               .facts = kFacts});
  world.waitForLog("location: wifi");
  EXPECT_EQ(world.sablectl({"card", world.serviceURL() + "/card?id=1"}).exitCode, 0);
  EXPECT_EQ(items(world.requests("/card", 1)[0]), (Pairs{{"cc", "GB"},
                                                         {"esl", "en-GB"},
                                                         {"geosrc", "wifi"},
                                                         {"id", "1"},
                                                         {"key", "abc"},
                                                         {"latlng", "51.500000,-0.100000"},
                                                         {"locale", "xx"},
                                                         {"storefront", "143444"}}));
}

TEST_F(Requests, AnAnswerTellsWhetherItCameFromTheServiceOrTheCache) {
  const json network = world_.sablectlJSON({"search", "weath"});
  ASSERT_FALSE(network["reply"]["data"].at(0)["query"].get<std::string>().empty());
  EXPECT_EQ(network["reply"]["source"], "network");
  EXPECT_EQ(world_.sablectlJSON({"search", "weathe"})["reply"]["source"], "network")
      << "the end of a connection empties the cache";
  EXPECT_EQ(world_.sablectlJSON({"explain", "weathe"})["outcome"], "network");
  EXPECT_EQ(world_.sablectlJSON({"explain", "weathe", "--after", "weath"})["outcome"], "cache");
  EXPECT_TRUE(world_.sablectlJSON({"search", "weathe", "--no-verbose"})["reply"]["source"].is_null())
      << "who does not ask is not told";
  const std::string typed = world_.sablectl({"type", "weather"}).output;
  EXPECT_NE(typed.find("from cache"), std::string::npos) << typed;
}

}  // namespace
}  // namespace sable::test
