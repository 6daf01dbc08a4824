#include <gtest/gtest.h>

#include "sabled/ClientNames.h"
#include "sabled/SableBagController.h"
#include "sabled/SableEnumerations.h"
#include "sabled/SableLogging.h"
#include "sabled/SableURLRequestBuilder.h"
#include "sabled/SearchResponse.h"
#include "sabled/UTF16Length.h"

// Small words and rules that peers depend on, as tables.
namespace sable {
namespace {

TEST(WireVocabulary, WordsParseAndPrintByTheirOwnTables) {
  const std::pair<const char*, int> features[] = {{"domain", 0},    {"tld", 0}, {"TLD", 3}, {"MediaType", 1},
                                                  {"mediatype", 1}, {"mt", 1},  {"MT", 3},  {"topic", 2},
                                                  {"Topic", 3},     {"", 3}};
  for (const auto& [word, value] : features) EXPECT_EQ(featureTypeFromString(word), value) << word;
  EXPECT_EQ(stringFromFeatureType(1), "mediaType");
  EXPECT_EQ(stringFromFeatureType(7), "unkonwn");
  EXPECT_EQ(clientTypeFromString("beacon"), 1);
  EXPECT_EQ(clientTypeFromString("Beacon"), 2);
  EXPECT_EQ(stringFromClientType(2), "unknown");
  EXPECT_EQ(stringFromFunctionType(funcTypeFromString("engrate")), "eng/render");
  EXPECT_EQ(stringFromFunctionType(2), "unknown");
  EXPECT_EQ(resultPlacementFromString("bottom"), 2);
  EXPECT_EQ(stringFromResultPlacement(resultPlacementFromString("middle")), "unkonw");
  EXPECT_EQ(convertIdentifierToString(0), "crowdsourcing");
  EXPECT_EQ(convertIdentifierToString(1), "Feedbacks");
  EXPECT_EQ(convertIdentifierToString(2), "");
}

TEST(WireVocabulary, ClientsAreKnownByTheirNames) {
  EXPECT_EQ(extractClientNameFromString("com.kestrel.NewsRover"), "rover");
  EXPECT_EQ(extractClientNameFromString("com.kestrel.editor"), std::nullopt);
  EXPECT_EQ(getClientFromUserAgent("BEACON and ROVER"), "rover");
  EXPECT_EQ(getClientFromUserAgent("Vox/1"), "unknown");
  EXPECT_EQ(getClientFromUserAgent(std::nullopt), "unknown");
  EXPECT_EQ(createTallyKey("rover", "keystrokes"), "com.kestrel.sabled.rover.keystrokes");
}

TEST(WireVocabulary, VersionsCompareByTheirNumbers) {
  const std::pair<const char*, const char*> ascending[] = {{"9", "10"},  {"1.9", "1.10"}, {"", "1"},
                                                           {"7", "7.1"}, {"1a", "1b"},    {"009", "10"}};
  for (const auto& [older, newer] : ascending) {
    EXPECT_TRUE(isOlderVersion(older, newer)) << older;
    EXPECT_FALSE(isOlderVersion(newer, older)) << older;
  }
  EXPECT_FALSE(isOlderVersion("10", "10"));
}

TEST(WireVocabulary, LengthsCountUTF16CodeUnits) {
  EXPECT_EQ(lengthInUTF16("abc"), 3u);
  EXPECT_EQ(lengthInUTF16("äß"), 2u);
  EXPECT_EQ(lengthInUTF16("🦋"), 2u);
  EXPECT_EQ(lengthInUTF16(""), 0u);
}

TEST(LoggingDeathTest, ACategoryThatDoesNotExistStopsTheProcess) {
  EXPECT_EQ(SableLogForCategory(18).category(), "Sable_Feedback_Storage");
  EXPECT_DEATH(SableLogForCategory(19), "SableLogForCategory.*category < SableLoggingCategoryCount");
}

std::string built(std::string_view url, const std::function<void(SableURLRequestBuilder&)>& steps) {
  auto builder = SableURLRequestBuilder::requestBuilderWithURL(url);
  EXPECT_TRUE(builder) << url;
  steps(*builder);
  return builder->createMutableUrlRequest().url;
}

TEST(URLRequestBuilder, ForceReplacesAndDefaultGivesWay) {
  EXPECT_EQ(built("http://s.example/p?b=2&a=1", [](auto& b) { b.defaultQueryItemWithName("a", "9"); }),
            "http://s.example/p?a=1&b=2");
  EXPECT_EQ(built("http://s.example/p?a=1&a=2", [](auto&) {}), "http://s.example/p?a=2");
  EXPECT_EQ(built("http://s.example/p",
                  [](auto& b) {
                    b.defaultQueryItemWithName("q", "x;y +&=ü");
                    b.forceQueryItemWithName("Q", std::nullopt);
                    b.forceQueryItemWithName("empty", "");
                  }),
            "http://s.example/p?Q&empty=&q=x%3By%20%2B%26%3D%C3%BC");
  EXPECT_EQ(built("http://s.example/p",
                  [](auto& b) {
                    b.defaultQueryItemWithName("q", "1");
                    b.forceQueryItemsFromArray({{"q", "2"}, {"q", "3"}});
                  }),
            "http://s.example/p?q=3");
  EXPECT_FALSE(SableURLRequestBuilder::requestBuilderWithURL("no url"));
}

TEST(URLRequestBuilder, HeadersFollowTheSameRules) {
  auto builder = *SableURLRequestBuilder::requestBuilderWithURL("http://s.example/");
  builder.defaultHttpHeaderWithName("X-One", "1");
  builder.defaultHttpHeaderWithName("x-one", "2");
  builder.forceHttpHeaderWithName("X-Two", "a");
  builder.forceHttpHeaderWithName("X-Two", "b");
  builder.forceHttpHeaderWithName("X-Three", "c");
  builder.forceHttpHeaderWithName("X-Three", std::nullopt);
  const auto headers = builder.createMutableUrlRequest().headers.fields();
  EXPECT_EQ(headers, (std::vector<std::pair<std::string, std::string>>{{"X-One", "1"}, {"X-Two", "b"}}));
}

TEST(SearchResponse, ReadsResultSetsAndImagesAndNothingElse) {
  const auto response = SearchResponse::parse(R"([
      {"query": "weather", "completion_score": 0.5, "max_age": 60, "status": "OK",
       "results": [{"image": {"url": "http://a/1"}, "deep": {"images": [{"id": "x"}, 3, {"url": "u", "id": "y"}]}}]},
      {"status": "ERROR"}, 7])");
  ASSERT_TRUE(response);
  ASSERT_EQ(response->resultSets.size(), 2u);
  EXPECT_EQ(response->resultSets[0].query, "weather");
  EXPECT_EQ(response->resultSets[0].completionScore, 0.5);
  EXPECT_EQ(response->resultSets[0].maxAge, 60);
  EXPECT_EQ(response->resultSets[1].status, "ERROR");
  ASSERT_EQ(response->images.size(), 3u);
  EXPECT_EQ(response->images[0].url, "http://a/1");
  EXPECT_EQ(response->images[2].id, "y");
  EXPECT_FALSE(response->isObject);
  EXPECT_TRUE(SearchResponse::parse(R"({"a": 1})")->isObject);
}

TEST(SearchResponse, RefusesWhatIsNoJson) {
  for (const std::string& text :
       {std::string(), std::string("<html>"), std::string("[1,"), std::string("\"\xff\""),
        std::string(2'000'000, '['), std::string("{\"a\":1}x")}) {
    const auto response = SearchResponse::parse(text);
    ASSERT_FALSE(response) << text.substr(0, 20);
    EXPECT_FALSE(response.error().reason.empty());
  }
}

}  // namespace
}  // namespace sable
