#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "SableKit/SBLBag.h"

namespace sable {
namespace {

SBLBag bag(const char* json, std::string userAgent = "Beacon/1") {
  return {std::make_shared<const Dictionary>(Dictionary::parse(json)), std::move(userAgent)};
}

TEST(SBLBag, AnEmptyBagHasTheAbsentValues) {
  const SBLBag empty = bag("{}");
  EXPECT_EQ(empty.version(), "");
  EXPECT_FALSE(empty.isEnabled());
  EXPECT_FALSE(empty.feedbackEnabled());
  EXPECT_FALSE(empty.searchURL() || empty.warmURL() || empty.feedbackURL() || empty.crowdsourcingURL());
  EXPECT_EQ(empty.minimumQueryLength(), 1u);
  EXPECT_EQ(empty.timeoutIntervalForRequest(), 15);
  EXPECT_EQ(empty.searchRenderTimeout(), 2);
  EXPECT_FALSE(empty.sendGeoEnvironmentHeader());
  EXPECT_TRUE(empty.supportedGeoLocationSources().empty());
  EXPECT_TRUE(empty.brambleConfiguration().is_null());
  EXPECT_FALSE(empty.urlForIdentifier("logo"));
  EXPECT_FALSE(empty.subscriptionProviderDomainWhitelist());
  EXPECT_TRUE(empty.problems().empty());
}

TEST(SBLBag, TheVersionIsAStringOrANumber) {
  EXPECT_EQ(bag(R"({"version": "1.2b"})").version(), "1.2b");
  EXPECT_EQ(bag(R"({"version": 10})").version(), "10");
  EXPECT_EQ(bag(R"({"version": [1]})").version(), "");
}

TEST(SBLBag, AnAgentsOwnValueHoldsInsteadOfTheTopLevelOne) {
  const char* json = R"({"enabled": false, "minimum_query_length": 2, "search_url": "http://a.example/",
      "agents": {"news": {"enabled": true}, "rover": {"minimum_query_length": 5}, "beacon": 3}})";
  EXPECT_TRUE(bag(json, "NEWS/1.0").isEnabled());
  EXPECT_EQ(bag(json, "news/1.0").minimumQueryLength(), 2u);
  EXPECT_FALSE(bag(json, "News Rover").isEnabled()) << "rover is looked for first";
  EXPECT_EQ(bag(json, "News Rover").minimumQueryLength(), 5u);
  EXPECT_EQ(bag(json, "beacon").minimumQueryLength(), 2u) << "an entry that is no object counts as absent";
}

TEST(SBLBag, AValueOfTheWrongTypeCountsAsAbsentAndIsReportedOnce) {
  const SBLBag wrong =
      bag(R"({"enabled": "yes", "search_url": "no url", "warm_url": 7, "minimum_query_length": -1,
      "request_timeout": "15", "geo_location_sources": "gps", "bramble": [], "subscription_provider_domains": "a", "unknown_key": 1})");
  EXPECT_FALSE(wrong.isEnabled());
  EXPECT_FALSE(wrong.searchURL());
  EXPECT_EQ(wrong.minimumQueryLength(), 1u);
  EXPECT_EQ(wrong.timeoutIntervalForRequest(), 15);
  EXPECT_TRUE(wrong.brambleConfiguration().is_null());
  EXPECT_EQ(wrong.problems().size(), 8u);
}

TEST(SBLBag, ListsAndImagesAreRead) {
  const SBLBag full =
      bag(R"({"geo_location_sources": ["gps", "wifi", 3], "image_urls": {"logo": "http://i.example/l"},
      "subscription_provider_domains": ["video.example"]})");
  EXPECT_EQ(full.supportedGeoLocationSources(), (std::set<std::string>{"gps", "wifi"}));
  EXPECT_EQ(full.urlForIdentifier("logo"), "http://i.example/l");
  EXPECT_EQ(full.subscriptionProviderDomainWhitelist(), std::vector<std::string>{"video.example"});
}

}  // namespace
}  // namespace sable
