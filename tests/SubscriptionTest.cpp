#include <gtest/gtest.h>

#include "platform/host/HostSubscriptionRegistry.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "tests/support/ManualReactor.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/VirtualDevice.h"

// What the service learns of the user's subscriptions and store, and where the host learns it from.
namespace sable::test {
namespace {

using platform::Subscription;

struct SubscriptionTest : testing::Test {
  VirtualDevice device;
  platform::simulated::SimulatedSubscriptionRegistry& registry = device.platform.subscriptionRegistry();
  VirtualClient* client = nullptr;

  void SetUp() override {
    device.bag["subscription_provider_domains"] = {"video.example"};
    device.bag["subscription_provider_bundle_identifiers"] = {"com.example.video", "com.example.films"};
    device.bag["subscription_ttl"] = 3600;
  }
  void start() {
    client = &device.startWithClient();
    device.advance(2s);
  }
  void changeBag() {
    device.publishBag();
    device.advance(1s);
  }
  /// What a search says.
  std::string told(std::string_view name = "X-Kestrel-Subscriptions") {
    device.advance(2s);
    client->search("q" + std::to_string(++searches));
    return sentValue(device.service.requests("/search").back().request, name);
  }
  Subscription subscription(std::string provider, platform::Duration age, std::string domain = "") {
    return {std::move(provider), std::move(domain), "premium", device.platform.runtime().now() - age};
  }

  int searches = 0;
};

TEST_F(SubscriptionTest, WhatTheUserSubscribesToGoesWithEachRequestWhereTheBagNamesTheProvider) {
  start();
  EXPECT_EQ(told(), "-");
  Subscription plain = subscription("com.example.films", 0s);
  plain.info.reset();
  registry.change(
      {subscription("com.other", 0s), plain, subscription("com.on-the-web", 0s, "video.example")});
  EXPECT_EQ(told(), R"([{"provider":"com.example.films","active":true},)"
                    R"({"provider":"com.on-the-web","type":"premium","active":true}])");
  EXPECT_EQ(device.assembly().subscriptionManager->subscriptions().dump(), told());

  device.bag["subscription_provider_domains"] = json::array();
  changeBag();
  EXPECT_EQ(told(), R"([{"provider":"com.example.films","active":true}])");
  registry.change({});
  EXPECT_EQ(told(), "-") << "nothing is not told";
}

TEST_F(SubscriptionTest, OneIsActiveFromItsModificationUntilTheTimeToLiveInclusive) {
  start();
  const auto active = [&](platform::Duration age) {
    // The registry takes a second to answer.
    registry.change({subscription("com.example.video", age - 1s)});
    return told().find("\"active\":true") != std::string::npos;
  };
  EXPECT_FALSE(active(3600s + 1ns));
  EXPECT_TRUE(active(3600s));
  EXPECT_TRUE(active(0s));
  EXPECT_FALSE(active(-1ns)) << "in the future";
  EXPECT_EQ(told(), R"([{"provider":"com.example.video","type":"premium","active":false}])");
  device.bag["subscription_ttl"] = 1e300;
  registry.change({subscription("com.example.video", std::chrono::hours(24 * 365 * 40))});
  changeBag();
  EXPECT_EQ(told(), R"([{"provider":"com.example.video","type":"premium","active":true}])");
}

TEST_F(SubscriptionTest, TheMusicSubscriptionIsToldWhileTheAccountHasIt) {
  start();
  auto& account = device.platform.accountStore();
  registry.change({subscription("com.example.video", 0s)});
  for (const auto status : {std::optional(3), std::optional(2), std::optional<int>()}) {
    account.change({false, status, std::nullopt});
    EXPECT_EQ(told(), status == 3 ? R"([{"provider":"com.example.video","type":"premium","active":true},)"
                                    R"({"provider":"ember","attribute":"premium","active":true}])"
                                  : R"([{"provider":"com.example.video","type":"premium","active":true}])");
  }
}

TEST_F(SubscriptionTest, TheStoreFrontIsToldFromTheFirstRequestOnAndWhenItChanges) {
  auto& account = device.platform.accountStore();
  account.change({false, std::nullopt, "143444"});
  start();
  EXPECT_EQ(told("storefront"), "143444");
  device.log.clear();
  account.change({true, std::nullopt, "143441"});
  EXPECT_EQ(told("storefront"), "143441");
  account.change({true, std::nullopt, std::nullopt});
  EXPECT_EQ(told("storefront"), "-");
  EXPECT_FALSE(device.log.contains("updating subscription info"))
      << "subscriptions have nothing to do with it";
}

TEST_F(SubscriptionTest, ARegistryThatFailsContributesNothing) {
  device.platform.accountStore().change({false, 3, std::nullopt});
  registry.failure = Error{"Registry", 7, "no answer"};
  registry.change({subscription("com.example.video", 0s)});
  start();
  EXPECT_EQ(told(), R"([{"provider":"ember","attribute":"premium","active":true}])");
  EXPECT_EQ(device.log.count(
                "Error fetching third party subscription information from daemon: Registry 7: no answer"),
            1u);
}

TEST_F(SubscriptionTest, SubscriptionsThatWouldFillTheHeadAreNotTold) {
  start();
  Subscription wordy = subscription("com.example.video", 0s);
  wordy.info = std::string(70000, 'x');
  registry.change({wordy});
  EXPECT_EQ(told(), "-");
  EXPECT_TRUE(device.log.contains("bytes of subscriptions are not told"));
}

struct Delegate final : SableSubscriptionManagerDelegate {
  std::vector<std::string> lists, storefronts;
  void didUpdateSubscriptionDictionaries(const SableSubscriptionManager&, const Dictionary& list) override {
    lists.push_back(list.dump());
  }
  void didUpdateStorefrontIdentifier(const SableSubscriptionManager&,
                                     const std::string& identifier) override {
    storefronts.push_back(identifier);
  }
};

TEST_F(SubscriptionTest, EqualTablesAreToldOnceAndAMissingListEachTime) {
  start();
  Delegate delegate;
  SableSubscriptionManager manager(device.assembly(), delegate);
  EXPECT_EQ(delegate.storefronts, std::vector<std::string>{""});
  const auto change = [&](std::vector<Subscription> subscriptions) {
    registry.change(std::move(subscriptions));
    device.advance(2s);
  };
  change({});
  EXPECT_EQ(delegate.lists, std::vector<std::string>{"[]"}) << "this manager has not seen a bag";
  changeBag();
  EXPECT_EQ(delegate.lists.size(), 1u);
  const Subscription video = subscription("com.example.video", 0s),
                     films = subscription("com.example.films", 0s);
  change({video, films});
  change({films, video});
  EXPECT_EQ(delegate.lists.size(), 2u) << "the order of registration is none";
  device.bag.erase("subscription_provider_domains");
  changeBag();
  change({});
  EXPECT_EQ(delegate.lists.size(), 4u);
  EXPECT_EQ(delegate.lists.back(), "[]");
  EXPECT_EQ(manager.subscriptions(), Dictionary::array());
  device.bag["subscription_provider_domains"] = json::array();
  device.bag["subscription_provider_bundle_identifiers"] = "com.example.video";
  changeBag();
  EXPECT_EQ(delegate.lists.size(), 5u) << "one of the wrong type is missing, too";
}

// The host's registry

struct SubscriptionFiles : testing::Test {
  TemporaryFolder folder;
  platform::host::Folders folders = folder.folders();
  platform::simulated::SimulatedLog log;
  platform::simulated::SimulatedRuntime runtime;
  ManualReactor reactor;
  platform::NotificationCenter center;
  platform::host::HostFacts facts{folders, {}, reactor, center};
  platform::host::HostSubscriptionRegistry registry{folders, facts, runtime, reactor, center};
  int posted = 0;
  platform::NotificationCenter::Token token =
      center.observe(std::string(platform::kSubscriptionRegistryDidUpdateNotification),
                     [this](const platform::Notification&) { ++posted; });

  /// "PROVIDER INFO MODIFIED" of each, in order.
  std::vector<std::string> answer() {
    std::vector<std::string> lines;
    registry.activeSubscriptions(
        {"a", "b", "c"}, {"d.example"}, [&](Expected<std::vector<Subscription>> found) {
          for (const Subscription& each : *found) {
            lines.push_back(fmt::format("{} {} {}", each.provider, each.info.value_or("-"),
                                        platform::secondsSince1970(each.modified)));
          }
        });
    runtime.run();
    return lines;
  }
  /// Whether a change was told of.
  bool noticed() {
    reactor.run();
    return std::exchange(posted, 0) > 0;
  }
  static std::string entry(std::string_view provider, std::string_view rest = "") {
    return fmt::format("[[subscriptions]]\nprovider = \"{}\"\nmodified = 1970-01-01T00:00:07Z\n{}\n",
                       provider, rest);
  }
};

TEST_F(SubscriptionFiles, DroppedFilesAreSeenAsTheyComeChangeAndGo) {
  using Lines = std::vector<std::string>;
  EXPECT_EQ(answer(), Lines{});
  writeFile(folders.userSubscriptions() / "b.toml", entry("b", "info = \"gold\""));
  EXPECT_TRUE(noticed());
  writeFile(folders.systemSubscriptions() / "z.toml",
            entry("a") + entry("elsewhere", "domain = \"d.example\""));
  EXPECT_TRUE(noticed());
  writeFile(folders.userFacts(), entry("b") + entry("stranger", "domain = \"example\""));
  EXPECT_TRUE(noticed());
  writeFile(folders.userSubscriptions() / "notes.txt", entry("c"));
  EXPECT_FALSE(noticed());
  EXPECT_EQ(answer(), (Lines{"a - 7", "elsewhere - 7", "b gold 7", "b - 7"}));

  std::filesystem::remove(folders.userSubscriptions() / "b.toml");
  EXPECT_TRUE(noticed());
  std::filesystem::remove_all(folders.systemSubscriptions());
  EXPECT_TRUE(noticed());
  EXPECT_EQ(answer(), Lines{"b - 7"});
  writeFile(folders.systemSubscriptions() / "again.toml", entry("c"));
  EXPECT_TRUE(noticed());
  EXPECT_EQ(answer(), (Lines{"c - 7", "b - 7"}));
  EXPECT_EQ(log.count(platform::LogLevel::error), 0u);
}

TEST_F(SubscriptionFiles, ABadFileIsReportedOnceAndKeepsItsLastGoodContent) {
  const auto file = folders.userSubscriptions() / "a.toml";
  writeFile(file, entry("a"));
  EXPECT_EQ(answer(), std::vector<std::string>{"a - 7"});
  for (const char* bad :
       {"subscriptions = 5", "[[subscriptions]]\nprovider = \"a\"", "[[subscriptions]]\nmodified = 7",
        "[[subscriptions]]\nprovider = 5\nmodified = 7", "[[subscriptions]"}) {
    writeFile(file, bad);
    reactor.run();
    EXPECT_EQ(answer(), std::vector<std::string>{"a - 7"}) << bad;
    EXPECT_EQ(log.count(platform::LogLevel::error), 1u) << bad;
    EXPECT_TRUE(log.contains(file.native() + ":1:")) << bad;
    log.clear();
  }
  writeFile(file, "");
  EXPECT_TRUE(noticed());
  EXPECT_EQ(answer(), std::vector<std::string>{});
}

}  // namespace
}  // namespace sable::test
