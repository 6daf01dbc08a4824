#include <gtest/gtest.h>

#include "SableKit/SBLBag.h"
#include "platform/PropertyList.h"
#include "sabled/SableBagController.h"
#include "tests/support/VirtualDevice.h"

// The bag's life on the virtual device: fetched, kept, refreshed, announced.
namespace sable::test {
namespace {

using platform::HTTPErrorCode;

constexpr const char* kFile = "/home/user/.cache/com.kestrel.sabled/bag.plist";

class BagController : public testing::Test {
 protected:
  SableBagController& controller() { return *device.assembly().bagController; }
  std::string version() { return controller().currentBag()->version(); }

  VirtualDevice device;
};

TEST_F(BagController, TransportErrorsAreTriedAgainFiveTimesOneAndAHalfSecondsApart) {
  device.service.failNext(6, HTTPErrorCode::cannotConnect);
  device.start();
  device.advance(20s);
  const auto attempts = device.service.requests("/bag");
  ASSERT_EQ(attempts.size(), 6u);
  for (std::size_t i = 1; i < attempts.size(); ++i) {
    EXPECT_GE(attempts[i].time - attempts[i - 1].time, 1500ms);
    EXPECT_LT(attempts[i].time - attempts[i - 1].time, 1700ms);
  }
  EXPECT_EQ(device.counter("bag.fetchesfailed"), 1) << "only the final outcome counts";
  EXPECT_EQ(controller().currentBag(), nullptr);
  device.advance(1s);
  EXPECT_EQ(version(), "1") << "asking again fetches again";
  EXPECT_EQ(device.platform.transactions().openCount("bagFetch"), 0u);
}

TEST_F(BagController, WhatIsNoBagLeavesTheOldOneInUse) {
  device.start();
  const std::string file = device.bagFile();
  const std::string deep(2'000'000, '[');
  for (const auto& answer :
       {answering("{\"version\":"), answering("[1]"), answering("<html>"), answering(deep),
        answering("{\"version\":\"9\",\"x\":\"" + std::string(5u << 20, 'x') + "\"}"), answering(""),
        answering("", 304), answering("{\"version\":\"9\"}", 500)}) {
    device.service.on("/bag", answer);
    controller().forceFetchBag({{"bag", 5}});
    device.advance(20s);
    EXPECT_EQ(version(), "1") << answer.body.substr(0, 12);
  }
  EXPECT_EQ(device.counter("bag.fetchesfailed"), 8);
  EXPECT_EQ(device.sent("/bag"), 9u) << "none is tried again";
  EXPECT_TRUE(device.log.contains("Error fetching bag status code: 304"));
  EXPECT_EQ(device.bagFile(), file);
}

TEST_F(BagController, ItIsRefreshedFromTenMinutesBeforeItsExpiry) {
  device.start();
  device.bag["version"] = "2";
  device.advance(4h - 11min);
  EXPECT_EQ(version(), "1");
  device.advance(1s);
  EXPECT_EQ(version(), "1") << "eleven minutes are left";
  device.advance(2min);
  EXPECT_EQ(version(), "1") << "a stale bag is served while the new one is fetched";
  device.advance(1s);
  EXPECT_EQ(version(), "2");
  EXPECT_EQ(device.sent("/bag"), 2u);
  EXPECT_EQ(device.counter("bag.expired"), 1);
}

TEST_F(BagController, AChangeOfLocaleOrCountryFetchesAndNothingElseDoes) {
  device.start();
  device.platform.localeInfo().changeTimeZone("Europe/Rome");
  device.platform.accountStore().change({true, std::nullopt, "143444"});
  device.platform.managedConfiguration().change({.mediaStoreAllowed = false});
  auto values = device.platform.localeInfo().values;
  values.measurementSystem = "Metric";
  device.platform.localeInfo().change(values);
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 1u);
  values.localeIdentifier = "de_DE";
  device.platform.localeInfo().change(values);
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 2u);
  EXPECT_TRUE(device.log.contains("bag url changed from: "));
  device.platform.countryConfiguration().change("cn");
  device.advance(1s);
  ASSERT_EQ(device.sent("/bag"), 3u);
  EXPECT_TRUE(device.service.requests("/bag")[2].request.url.starts_with("https://cn.service.test/bag?"));
}

TEST_F(BagController, TheSettingWinsOverTheDeploymentsEndpoints) {
  device.platform.countryConfiguration().change("CN");
  device.platform.userDefaults().setByUser("SBLBagURL", "https://own.test/bag");
  device.start();
  EXPECT_TRUE(device.service.requests("/bag")[0].request.url.starts_with("https://own.test/bag?"));
  device.platform.userDefaults().setByUser("SBLBagURL", "not a url");
  EXPECT_EQ(controller().bagFetchURLWithCountry("FR"), "https://service.test/bag");
  EXPECT_EQ(controller().bagFetchURLWithCountry("cn"), "https://cn.service.test/bag");
  EXPECT_TRUE(device.log.contains("Malformed sable bag URL in user defaults key SBLBagURL"));
}

TEST_F(BagController, AnAnnouncedVersionFetchesOnlyWhenItIsNewer) {
  device.bag["version"] = "9";
  device.start();
  device.bag["version"] = "10";
  controller().forceFetchBag({{"bag", 9}});
  controller().forceFetchBag({{"bog", 10}});
  controller().forceFetchBag({{"bag", "10"}});
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 1u);
  controller().forceFetchBag({{"bag", 10}});
  controller().forceFetchBag({{"bag", 10}});
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 2u) << "one fetch at a time";
  EXPECT_NE(device.service.requests("/bag")[1].request.url.find("version=10"), std::string::npos);
  controller().forceFetchBag({{"bag", 10}});
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 2u);
}

TEST_F(BagController, TheFileServesTheNextStart) {
  device.start();
  EXPECT_TRUE(device.bagFile().starts_with("bplist00"));
  const auto kept = platform::decodePropertyList(device.bagFile());
  ASSERT_TRUE(kept);
  EXPECT_EQ(stringMember(*kept, "version"), "1");
  EXPECT_GT(numberMember(*kept, "__expiration").value_or(0), 0);
  EXPECT_TRUE(stringMember(*kept, "__bagurl")->find("key=") == std::string::npos);

  device.killDaemon();
  device.service.failNext(100, HTTPErrorCode::cannotConnect);
  device.start();
  EXPECT_EQ(version(), "1");
  EXPECT_EQ(device.sent("/bag"), 1u) << "it is fresh";
  EXPECT_EQ(device.platform.notify().posted(), std::vector<std::string>{"com.kestrel.sable.enabled"})
      << "a bag from disk announces nothing";
}

TEST_F(BagController, ATornOrForeignFileIsReportedAndReplaced) {
  device.start();
  const std::string whole = device.bagFile();
  for (const std::string& bytes :
       {whole.substr(0, whole.size() / 2), std::string("{}"), std::string("bplist00"),
        *platform::encodePropertyList(Dictionary::array({1}))}) {
    device.killDaemon();
    ASSERT_TRUE(device.platform.fileManager().writeAtomically(kFile, bytes));
    device.log.clear();
    device.start();
    EXPECT_EQ(device.log.count(platform::LogLevel::error, "Sable_Bag"), 1u) << bytes.size();
    EXPECT_EQ(version(), "1");
    EXPECT_TRUE(platform::decodePropertyList(device.bagFile()));
  }
}

TEST_F(BagController, AnUnwritableFolderCostsOnlyTheCopy) {
  device.platform.fileManager().failWith(EACCES);
  device.start();
  EXPECT_EQ(version(), "1");
  EXPECT_TRUE(device.log.contains("Couldn't get path to cache bag.  Error: "));
}

TEST_F(BagController, WithoutABagAChangeOfLocaleFetchesOne) {
  device.service.on("/bag", answering("", 500));
  device.start();
  device.service.on("/bag", answering(device.bag.dump()));
  auto values = device.platform.localeInfo().values;
  values.localeIdentifier = "de_DE";
  device.platform.localeInfo().change(values);
  device.advance(1s);
  EXPECT_EQ(version(), "1");
}

TEST_F(BagController, ABagThatIsNeverToBeRefreshedIsNot) {
  device.bag["__refresh_disabled"] = 1;
  device.start();
  device.advance(48h);
  EXPECT_EQ(version(), "1");
  device.advance(1s);
  EXPECT_EQ(device.sent("/bag"), 1u);
}

TEST_F(BagController, WhichClientsItServesIsInSettingsAndForNewsAnnouncedWhenItChanges) {
  const auto visible = [&](const char* key) { return device.platform.userDefaults().boolean(key); };
  device.start();
  device.publishBag();
  device.bag["agents"] = {{"news", {{"enabled", false}}}};
  device.publishBag();
  EXPECT_EQ(visible("SBLNewsVisible"), false);
  EXPECT_EQ(visible("SBLHashtagImagesVisible"), true);
  EXPECT_EQ(device.platform.notify().posted(),
            (std::vector<std::string>{"com.kestrel.sable.enabled", "com.kestrel.sable.disabled"}));
  EXPECT_EQ(device.platform.transactions().openCount(), 0u);
  device.bag["agents"] = {{"messages", {{"enabled", false}}}};
  device.publishBag();
  EXPECT_EQ(visible("SBLNewsVisible"), true);
  EXPECT_EQ(visible("SBLHashtagImagesVisible"), false);
}

}  // namespace
}  // namespace sable::test
