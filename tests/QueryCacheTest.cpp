#include <gtest/gtest.h>

#include "platform/Lowercase.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/ClientState.h"
#include "sabled/ClientStateManager.h"
#include "sabled/QueryCache.h"
#include "sabled/QueryCacheDecision.h"
#include "tests/support/VirtualDevice.h"

// The query cache by itself, and how searches of the whole daemon are answered from it.
namespace sable::test {
namespace {

using platform::LogLevel;

std::string sets(std::initializer_list<json> list) {
  return json(list).dump();
}

class QueryCaching : public testing::Test {
 protected:
  struct Given {
    std::string input, query;
    double score = 0, maxAge = 0;
    const char* scale = "";
    std::size_t bytes = 100;
  };

  std::shared_ptr<const CachedResultSet> entry(const Given& given) {
    platform::HTTPRequest request;
    if (*given.scale != '\0') request.headers.set("x-kestrel-ui-scale", given.scale);
    return std::make_shared<const CachedResultSet>(
        given.input, request, SearchResponse::ResultSet{given.query, given.score, given.maxAge, "OK"},
        platform.runtime().uuid(), makeData(std::string(given.bytes, ' ')), platform.runtime().now());
  }
  void keep(std::initializer_list<Given> list) {
    for (const Given& given : list) cache.set(entry(given));
    platform.runtime().run();
  }
  /// The query of the entry that answers; "" when none does.
  std::string answer(std::string text, double scale = 0, QueryCacheDecision* decision = nullptr) {
    SBLSearchRequest request = searchFor(std::move(text));
    request.scale = scale;
    const auto found = cache.getRequest(request, decision);
    return found == nullptr ? "" : found->query;
  }
  void raiseMemoryPressure() {
    platform.memoryPressure().fireCritical();
    platform.runtime().run();
  }

  static constexpr std::size_t kHalf = 1'048'576 - 1024;  ///< of the cache's budget, in bytes
  platform::simulated::SimulatedLog log;
  platform::simulated::SimulatedPlatform platform;
  Assembly assembly{platform};
  QueryCache cache{assembly};
};

TEST_F(QueryCaching, AnEntryAnswersWhatLiesBetweenItsInputAndItsQuery) {
  keep({{"We", "Weather"}});
  for (const char* text : {"we", "WEA", "weather"}) EXPECT_EQ(answer(text), "weather") << text;
  for (const char* text : {"", "w", "wet", "weathers"}) EXPECT_EQ(answer(text), "") << text;
  EXPECT_EQ(cache.get("wea")->query, "weather");
  EXPECT_TRUE(log.contains("cache lookup: wea"));
}

TEST_F(QueryCaching, LettersOfEveryScriptCompareInLowerCaseByTheirUTF16Length) {
  keep({{"Ét", "Été À Paris"}, {"🦋", "🦋🦋 Wings"}});
  EXPECT_EQ(answer("ÉTÉ"), "été à paris");
  EXPECT_EQ(answer("🦋🦋"), "🦋🦋 wings");
  keep({{"İ", "İstanbul"}});
  EXPECT_EQ(answer("İ"), "i̇stanbul") << "one character that becomes two, here and there";
  keep({{"İİ", "xyz"}});
  EXPECT_TRUE(log.contains("BUG: NOT caching 'i̇i̇' because input is longer than completed query 'xyz'"));
  EXPECT_EQ(platform::lowercased("\xffÄ"), "\xffä") << "what is no UTF-8 stays";
}

TEST_F(QueryCaching, TheChoiceFollowsItsRules) {
  struct Case {
    const char* says;
    std::vector<Given> entries;
    std::string chosen;
    std::vector<std::string_view> outcomes;
    double scale = 0;
  };
  const std::vector<Case> cases = {
      {"the shorter completion, whatever the scores",
       {{"we", "weather", 0.1}, {"we", "weather radar", 0.9}},
       "weather",
       {"chosen", "longer completion"}},
      {"of equal lengths the higher score",
       {{"we", "weather", 0.5}, {"we", "wealthy", 0.9}, {"we", "weasels", 0.9}},
       "wealthy",
       {"chosen", "no higher score", "no higher score"}},
      {"which may come last",
       {{"we", "wealthy", 0.5}, {"we", "weather", 0.9}, {"we", "wear it out", 1}},
       "weather",
       {"no higher score", "longer completion", "chosen"}},
      {"no score above 0: the first",
       {{"we", "weather", 0}, {"we", "wealthy", -1}},
       "wealthy",
       {"chosen", "no higher score"}},
      {"the scale that is asked for",
       {{"we", "wealthy", 0, 0, "3.0"}, {"we", "weather", 0, 0, "2.0"}, {"we", "weaving", 0}},
       "weather",
       {"other scale", "chosen", "other scale"},
       2},
      {"any scale where none is given", {{"we", "weather", 0, 0, "2.0"}}, "weather", {"chosen"}},
      {"no scale that a float cannot hold", {{"we", "weather", 0, 0, "2.0"}}, "", {"other scale"}, 1e300},
      {"nothing that is out of date or made for more",
       {{"we", "wealthy", 0, -1}, {"weat", "weather"}},
       "",
       {"expired", "input longer"}},
  };
  for (const Case& row : cases) {
    cache.removeAllObjects();
    for (const Given& given : row.entries) cache.set(entry(given));
    platform.runtime().run();
    QueryCacheDecision decision;
    EXPECT_EQ(answer("wea", row.scale, &decision), row.chosen) << row.says;
    std::vector<std::string_view> outcomes;
    for (const auto& [candidate, outcome] : decision.rows) outcomes.push_back(queryCacheOutcomeText(outcome));
    EXPECT_EQ(outcomes, row.outcomes) << row.says;
    EXPECT_EQ(answer("wea", row.scale), row.chosen) << "the same without asking why";
  }
  EXPECT_TRUE(log.contains("prefix: wealthy input: we score: 0.900000"));
  EXPECT_FALSE(log.contains("prefix: wear it out")) << "only those of the best length are candidates";
}

TEST_F(QueryCaching, AnEntryIsForgottenByTheFirstLookupAfterItsTime) {
  keep({{"we", "weather", 0, 1}, {"we", "weather radar", 0, 0}, {"we", "wealth", 0, 1e300}});
  platform.runtime().advance(999ms);
  EXPECT_EQ(answer("weat"), "weather");
  platform.runtime().advance(1ms);
  EXPECT_EQ(answer("wind"), "");
  EXPECT_EQ(cache.count(), 3u) << "no lookup has come by";
  EXPECT_EQ(answer("weat"), "weather radar");
  EXPECT_EQ(cache.count(), 2u);
  platform.runtime().advance(24h * 365 * 50);
  EXPECT_EQ(answer("weal"), "wealth");
  EXPECT_EQ(answer("weat"), "weather radar");
}

TEST_F(QueryCaching, WhatIsNoEntryIsNotKept) {
  auto nothing = entry({"we", "weather"});
  cache.set(std::make_shared<const CachedResultSet>("we", platform::HTTPRequest{}, nothing->resultSet,
                                                    nothing->uuid, nullptr, platform.runtime().now()));
  keep({{"", ""}, {"w", std::string("we\0ather", 8)}, {"weather", "wea"}});
  keep({{"we", "weather", 0, 0, "", 2'096'128}});
  EXPECT_EQ(cache.count(), 0u);
  EXPECT_EQ(log.count(LogLevel::error, "Sable_Caching"), 2u);
  EXPECT_TRUE(log.contains("BUG: NOT caching 'weather' because input is longer than completed query 'wea'"));
  EXPECT_TRUE(log.contains("NOT caching 'weather' with cost 2097152"));
  keep({{"we", "weather", 0, 0, "", 2'096'127}});
  EXPECT_EQ(cache.count(), 1u);
}

TEST_F(QueryCaching, AFullCacheIsFlushedWhole) {
  keep({{"a", "aa", 0, 0, "", kHalf}, {"b", "bb", 0, 0, "", kHalf - 1}});
  EXPECT_EQ(cache.count(), 2u) << "one byte below the budget";
  EXPECT_FALSE(log.contains("!!! exceeded max cost, flushing cache !!!"));
  keep({{"c", "cc", 0, 0, "", 1}});
  EXPECT_EQ(log.count("!!! exceeded max cost, flushing cache !!!"), 1u);
  EXPECT_EQ(cache.count(), 1u);
  EXPECT_EQ(answer("c"), "cc");

  log.clear();
  keep({{"c", "cc", 0, 0, "", kHalf}, {"c", "cc", 0, 0, "", kHalf}});
  EXPECT_EQ(log.count("!!! exceeded max cost, flushing cache !!!"), 1u)
      << "what was replaced stays charged until the next flush";
  EXPECT_EQ(log.count("query cache became empty"), 1u);
  EXPECT_EQ(log.count("query cache no longer empty"), 1u);
}

TEST_F(QueryCaching, ExpiredEntriesStayChargedButAnEmptyCacheListensToNothing) {
  keep({{"a", "aa", 0, 1, "", kHalf}});
  platform.runtime().advance(2s);
  EXPECT_EQ(answer("a"), "");
  EXPECT_TRUE(log.contains("query cache became empty"));
  raiseMemoryPressure();
  EXPECT_FALSE(log.contains("emptying caches under memory pressure"));
  keep({{"b", "bb", 0, 0, "", kHalf}});
  EXPECT_TRUE(log.contains("!!! exceeded max cost, flushing cache !!!"));
  EXPECT_EQ(cache.count(), 1u);
}

TEST_F(QueryCaching, MemoryPressureIsListenedToOnlyWhileThereIsSomethingToGive) {
  raiseMemoryPressure();
  EXPECT_FALSE(log.contains("emptying caches under memory pressure"));
  keep({{"we", "weather"}, {"wi", "wind"}});
  EXPECT_EQ(log.count("query cache no longer empty"), 1u);
  raiseMemoryPressure();
  raiseMemoryPressure();
  EXPECT_EQ(log.count("emptying caches under memory pressure"), 1u);
  EXPECT_EQ(log.count("query cache became empty"), 1u);
  EXPECT_EQ(cache.count(), 0u);
  keep({{"we", "weather"}});
  EXPECT_EQ(log.count("query cache no longer empty"), 2u);
}

TEST_F(QueryCaching, EveryChangeOfWhatShapesAnswersEmptiesIt) {
  for (const std::string_view name :
       {"SBLUserGUIDChangeNotification", "SBLSessionSoftLimitNotification", "SBLSessionMaxLimitNotification",
        "CountryCodeDidChange", "SystemTimeZoneDidChange", "CurrentLocaleDidChange",
        "EffectiveSettingsDidChange"}) {
    keep({{"we", "weather"}});
    ASSERT_EQ(cache.count(), 1u);
    platform.notificationCenter().post({name, nullptr, {}});
    EXPECT_EQ(answer("we"), "") << name;
  }
  keep({{"we", "weather"}});
  platform.notificationCenter().post({"AccountStoreDidChange", nullptr, {}});
  EXPECT_EQ(answer("we"), "weather") << "not any change";
}

TEST_F(QueryCaching, ACacheMayGoWhileWorkIsOnItsWay) {
  auto other = std::make_unique<QueryCache>(assembly);
  other->set(entry({"we", "weather"}));
  platform.runtime().run();
  platform.notificationCenter().post({"SBLUserGUIDChangeNotification", nullptr, {}});
  platform.memoryPressure().fireCritical();
  other->set(entry({"wi", "wind"}));
  other.reset();
  platform.runtime().run();
  EXPECT_FALSE(log.contains("emptying caches under memory pressure"));
}

// Searches

class CachedSearches : public testing::Test {
 protected:
  std::uint64_t hits() { return static_cast<std::uint64_t>(device.counter("beacon.ondevicecachehits")); }
  QueryCache& cacheOf(const char* identifier) {
    return *device.assembly().clientStateManager->stateForClientIdentifier(identifier)->queryCache();
  }

  VirtualDevice device;
};

TEST_F(CachedSearches, TypingAQueryAsksTheServiceOnce) {
  const std::string weather = sets({{{"query", "Weather Oslo"}, {"completion_score", 0.5}}});
  device.service.on("/search", after(80ms, answering(weather)));
  device.platform.mapsService().sessions = {{"id-1", "entity-1"}};
  VirtualClient& client = device.startWithClient();
  const std::string text = "weather oslo";
  for (std::size_t length = 1; length <= text.size(); ++length) {
    SBLSearchRequest request = searchFor(text.substr(0, length), length);
    request.scale = 2;
    request.verboseReply = true;
    const auto start = device.platform.runtime().ticks();
    const Answer answer = client.ask(request);
    const bool first = length == 1;
    EXPECT_EQ(answer.data(), weather);
    EXPECT_EQ(answer.reply->scale, 2);
    EXPECT_EQ(answer.reply->geoSessionEntityString, "entity-1");
    EXPECT_EQ(answer.reply->httpRequest.has_value(), first);
    EXPECT_EQ(answer.reply->httpResponse.has_value(), first);
    EXPECT_EQ(device.platform.runtime().ticks() - start, first ? 80ms : 0ms) << length;
    EXPECT_EQ(answer.queryId, length);
  }
  EXPECT_EQ(device.sent("/search"), 1u);
  EXPECT_EQ(device.counter("searches"), 1);
  EXPECT_EQ(hits(), 11u);
  EXPECT_EQ(device.counter("beacon.keystrokes"), 12);
  EXPECT_TRUE(device.log.contains("query cache ON for com.kestrel.beacon"));

  SBLSearchRequest larger = searchFor("weather o", 20);
  larger.scale = 3;
  EXPECT_EQ(client.ask(larger).reply->scale, 3);
  EXPECT_EQ(sentValue(device.service.requests("/search").back().request, "X-Kestrel-UI-Scale"), "3.0");
  EXPECT_EQ(device.sent("/search"), 2u) << "on a screen of another scale";
}

TEST_F(CachedSearches, ForcedQueryItemsGoToTheServiceAndTheirAnswersAreKept) {
  VirtualClient& client = device.startWithClient();
  SBLSearchRequest forced = searchFor("wea", 1);
  forced.queryItems = {{"debug", "1"}};
  client.ask(forced);
  forced.queryId = 2;
  client.ask(forced);
  EXPECT_EQ(device.sent("/search"), 2u);
  client.ask(searchFor("weath", 3));
  EXPECT_EQ(device.sent("/search"), 2u);
  EXPECT_EQ(hits(), 1u);
}

TEST_F(CachedSearches, EachGoodResultSetOfAnAnswerIsAnEntryOnTheSameBytes) {
  device.service.on("/search", answering(sets({{{"query", "weather"}, {"status", "OK"}},
                                               {{"query", "weather radar"}},
                                               {{"query", "weather map"}, {"status", "ERROR"}},
                                               "weather vane",
                                               {{"query", 7}}})));
  device.startWithClient().search("we");
  QueryCache& cache = cacheOf("com.kestrel.beacon");
  EXPECT_EQ(cache.count(), 2u);
  const auto first = cache.get("wea"), second = cache.get("weather r");
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->data, second->data) << "one buffer";
  EXPECT_EQ(first->uuid, second->uuid);
  EXPECT_EQ(cache.get("weather m"), nullptr);
}

TEST_F(CachedSearches, OnlySearchesThatAreArraysAreKept) {
  VirtualClient& client = device.startWithClient();
  for (const char* body : {R"({"query":"weather"})", R"([{"query":"weather"})", "[]", ""}) {
    device.service.on("/search", answering(body));
    client.search("we");
  }
  device.service.on("/search", answering(sets({{{"query", "weather"}}})));
  client.ask(SBLZeroKeywordRequest{});
  client.ask(SBLLookupRequest{});
  EXPECT_EQ(cacheOf("com.kestrel.beacon").count(), 0u);
}

TEST_F(CachedSearches, GatesStandBeforeTheCache) {
  VirtualClient& client = device.startWithClient();
  client.search("we");
  device.bag["enabled"] = false;
  device.publishBag();
  EXPECT_FALSE(client.search("weth").reply);
  EXPECT_EQ(cacheOf("com.kestrel.beacon").count(), 1u);
  EXPECT_EQ(hits(), 0u);
}

TEST_F(CachedSearches, AnotherUserAgentEmptiesTheCacheAndTheSameOneKeepsIt) {
  device.start();
  device.client("com.kestrel.beacon", "Beacon/1").search("we");
  device.client("com.kestrel.beacon", "Beacon/1").search("wet");
  EXPECT_EQ(device.sent("/search"), 1u);
  device.client("com.kestrel.beacon", "Beacon/2").search("weth");
  EXPECT_EQ(device.sent("/search"), 2u);
  EXPECT_EQ(cacheOf("com.kestrel.beacon").count(), 1u);
}

}  // namespace
}  // namespace sable::test
