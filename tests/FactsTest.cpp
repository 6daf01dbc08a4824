#include <gtest/gtest.h>

#include <map>
#include <memory>

#include "platform/SubscriptionRegistry.h"
#include "platform/host/FactFacilities.h"
#include "platform/host/HostDeviceInfo.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/LocaleNames.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "tests/support/ManualReactor.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform::host {
namespace {

using Variables = std::map<std::string, std::string>;

Environment environmentOf(Variables variables) {
  return [variables = std::move(variables)](const char* name) -> std::optional<std::string> {
    const auto found = variables.find(name);
    return found == variables.end() ? std::nullopt : std::optional(found->second);
  };
}

struct FactsTest : testing::Test {
  TemporaryFolder folder;
  Folders folders = folder.folders();
  simulated::SimulatedLog log;
  ManualReactor reactor;
  NotificationCenter center;
  std::vector<std::string> posted;
  std::vector<NotificationCenter::Token> tokens;

  void SetUp() override {
    for (const auto name : {kCurrentLocaleDidChangeNotification, kSystemTimeZoneDidChangeNotification,
                            kCountryCodeDidChangeNotification, kEffectiveSettingsDidChangeNotification,
                            kAccountStoreDidChangeNotification, kMusicSubscriptionStatusDidChangeNotification,
                            kStoreFrontDidChangeNotification, kSubscriptionRegistryDidUpdateNotification}) {
      tokens.push_back(center.observe(std::string(name), [this](const Notification& notification) {
        posted.emplace_back(notification.name);
      }));
    }
  }

  std::unique_ptr<HostFacts> open(Variables variables = {}) {
    return std::make_unique<HostFacts>(
        folders, HostSources{environmentOf(std::move(variables)), folder / "root"}, reactor, center);
  }
  /// Replaces the user's facts; what was posted for it.
  std::vector<std::string> change(std::string_view text) {
    posted.clear();
    writeFile(folders.userFacts(), text);
    reactor.run();
    return posted;
  }
};

TEST_F(FactsTest, TheUsersFactsLieOverTheSystems) {
  writeFile(folders.systemFacts, "country_code = \"DE\"\nstorefront = \"1\"\nscreen_scale = 3");
  writeFile(folders.userFacts(), "country_code = \"GB\"\nmusic_subscription_status = 3");
  const auto facts = open();
  EXPECT_EQ(HostCountryConfiguration(*facts).countryCode(), "GB");
  EXPECT_EQ(HostAccountStore(*facts).storeFrontIdentifier(), "1");
  EXPECT_EQ(HostAccountStore(*facts).musicSubscriptionStatus(), 3);
  EXPECT_EQ(HostDeviceInfo(*facts).mainScreenScale(), 3.0);
}

TEST_F(FactsTest, AChangeIsPostedForTheFacilitiesItChangesOnly) {
  using Names = std::vector<std::string>;
  const auto facts = open({{"LANG", "de_DE.UTF-8"}});
  EXPECT_TRUE(posted.empty());
  EXPECT_EQ(change("product_name = \"X\""), Names{});
  EXPECT_EQ(change("managed_account = true"), Names{"AccountStoreDidChange"});
  EXPECT_EQ(change("managed_account = true # still"), Names{});
  const std::string allowed = "managed_account = true\ndiagnostics_allowed = true\n";
  EXPECT_EQ(change(allowed), Names{"EffectiveSettingsDidChange"});
  EXPECT_EQ(change(allowed + "music_subscription_status = 3"), Names{"MusicSubscriptionStatusDidChange"});
  EXPECT_EQ(
      change(allowed + "storefront = \"1\"\n[[subscriptions]]\nprovider = \"a\"\nmodified = 2026-01-01"),
      (Names{"MusicSubscriptionStatusDidChange", "StoreFrontDidChange", "SubscriptionRegistryDidUpdate"}));
  change(allowed);
  EXPECT_EQ(change("country_code = \"DE\""), (Names{"EffectiveSettingsDidChange", "AccountStoreDidChange"}));
  EXPECT_EQ(change("locale = \"de_AT\""), (Names{"CurrentLocaleDidChange", "CountryCodeDidChange"}));
  const std::string locale = "locale = \"de_AT\"\nhour_cycle_24 = false\n";
  EXPECT_EQ(change(locale), Names{"CurrentLocaleDidChange"});
  EXPECT_EQ(change(locale + "time_zone = \"UTC\""), Names{});
  EXPECT_EQ(change(locale + "time_zone = \"Europe/Rome\""), Names{"SystemTimeZoneDidChange"});
  posted.clear();
  std::filesystem::remove(folders.userFacts());
  reactor.run();
  EXPECT_EQ(posted, (Names{"CurrentLocaleDidChange", "SystemTimeZoneDidChange", "CountryCodeDidChange"}));
}

TEST_F(FactsTest, TheHostsTimeZoneIsWatchedToo) {
  const auto facts = open();
  EXPECT_EQ(facts->timeZoneName(), "UTC");
  writeFile(folder / "root/etc/timezone", "Asia/Tokyo\n");
  reactor.run();
  EXPECT_EQ(facts->timeZoneName(), "Asia/Tokyo");
  std::filesystem::create_symlink("../usr/share/zoneinfo/Europe/London", folder / "root/etc/localtime");
  reactor.run();
  EXPECT_EQ(facts->timeZoneName(), "Europe/London");
  EXPECT_EQ(posted, (std::vector<std::string>{"SystemTimeZoneDidChange", "SystemTimeZoneDidChange"}));
}

TEST_F(FactsTest, AFactOfTheWrongTypeIsReportedAndKeepsItsLastGoodValue) {
  writeFile(folders.userFacts(), "managed_account = true\nstorefront = \"1\"");
  const auto facts = open();
  const HostAccountStore account(*facts);
  change("storefront = \"2\"\n  managed_account = \"no\"\nscreen_scale = \"big\"");
  EXPECT_TRUE(account.primaryAccountIsManaged());
  EXPECT_EQ(account.storeFrontIdentifier(), "2");
  EXPECT_EQ(HostDeviceInfo(*facts).mainScreenScale(), 1.0);
  EXPECT_TRUE(log.contains(folders.userFacts().native() + ":2:3: managed_account is not a boolean"));
  EXPECT_TRUE(log.contains(folders.userFacts().native() + ":3:1: screen_scale is not a number"));
  EXPECT_EQ(log.count(LogLevel::error), 2u);
  change("");
  EXPECT_FALSE(account.primaryAccountIsManaged());
}

TEST_F(FactsTest, WithoutFactsTheHostAnswers) {
  const auto root = folder / "root";
  writeFile(root / "usr/lib/os-release",
            "# c\nNAME=\"Some \\\"Linux\\\"\"\nBUILD_ID='2026.01'\nVERSION_ID=\n");
  writeFile(root / "proc/device-tree/model", std::string("Board Model 4 B\0", 16));
  {
    const auto facts = open();
    const HostDeviceInfo device(*facts);
    EXPECT_EQ(device.answer("ProductType"), "Board Model 4 B");
    EXPECT_EQ(device.answer("ProductName"), "Some \"Linux\"");
    EXPECT_EQ(device.answer("BuildVersion"), "2026.01");
    EXPECT_EQ(device.answer("Serial"), "");
  }
  writeFile(root / "etc/os-release", "NAME=Other\nVERSION_ID=12\nBUILD_ID=x\n");
  writeFile(root / "sys/class/dmi/id/product_name", "Standard PC (Q35 + ICH9, 2009) \n");
  const auto facts = open({{"LANG", "fr_FR.UTF-8"}});
  const HostDeviceInfo device(*facts);
  EXPECT_EQ(device.answer("ProductType"), "Standard PC (Q35 + ICH9, 2009)");
  EXPECT_EQ(device.answer("BuildVersion"), "12");

  simulated::SimulatedRuntime runtime;
  HostMapsService maps(runtime, *facts);
  EXPECT_FALSE(maps.userSessionEntity(true));
  EXPECT_EQ(maps.environmentName(), "prod");
  EXPECT_FALSE(maps.clientMetadata());
  EXPECT_FALSE(HostManagedConfiguration(*facts).diagnosticsSubmissionAllowed());
  EXPECT_TRUE(HostManagedConfiguration(*facts).mediaStoreAllowed());
  EXPECT_EQ(HostCountryConfiguration(*facts).countryCode(), "FR");
  EXPECT_FALSE(HostInputModes(*facts).preference(12));
  EXPECT_EQ(HostInputModes(*facts).defaultEnabledModes(), std::vector<std::string>{"fr_FR@sw=AZERTY"});

  change(
      "geo_session_id = \"S\"\nkeyboard_input_mode = \"en_GB@sw=QWERTY\"\nproduct_type = \"SableBook1,1\"");
  EXPECT_EQ(maps.userSessionEntity(false)->sessionId, "S");
  EXPECT_EQ(maps.userSessionEntity(false)->entityString, "S");
  const std::string drawn = maps.userSessionEntity(true)->sessionId;
  EXPECT_NE(drawn, "S");
  EXPECT_EQ(maps.userSessionEntity(false)->sessionId, drawn);
  EXPECT_NE(maps.userSessionEntity(true)->sessionId, drawn);
  EXPECT_EQ(HostInputModes(*facts).preference(12), "en_GB@sw=QWERTY");
  EXPECT_FALSE(HostInputModes(*facts).preference(11));
  EXPECT_EQ(device.answer("ProductType"), "SableBook1,1");
  change("geo_session_id = \"T\"");
  EXPECT_EQ(maps.userSessionEntity(false)->sessionId, "T");
}

TEST_F(FactsTest, WhatFollowsFromTheLocale) {
  struct Case {
    std::string locale, calendar, measurement, temperature, hours;
  };
  const Case cases[] = {
      {"en_US", "gregorian", "U.S.", "Fahrenheit", "h\u202Fa"},
      {"en_GB", "gregorian", "U.K.", "Celsius", "HH"},
      {"de_DE", "gregorian", "Metric", "Celsius", "HH 'Uhr'"},
      {"es_PR", "gregorian", "Metric", "Fahrenheit", "h\u202Fa"},
      {"th_TH", "buddhist", "Metric", "Celsius", "HH"},
      {"fa_IR", "persian", "Metric", "Celsius", "H"},
      {"ps_AF", "persian", "Metric", "Celsius", "H"},
      {"ja_JP@calendar=japanese", "japanese", "Metric", "Celsius", "H時"},
      {"en-US-u-ms-metric-mu-celsius-hc-h23-ca-buddhist", "buddhist", "Metric", "Celsius", "HH"},
      {"de_DE@mu=fahrenhe", "gregorian", "Metric", "Fahrenheit", "HH 'Uhr'"},
      {"nonsense", "gregorian", "Metric", "Celsius", "HH"},
  };
  const auto facts = open();
  const HostLocaleInfo locale(*facts);
  for (const Case& each : cases) {
    change("locale = \"" + each.locale + "\"");
    EXPECT_EQ(locale.localeIdentifier(), each.locale);
    EXPECT_EQ(locale.calendarIdentifier(), each.calendar) << each.locale;
    EXPECT_EQ(locale.measurementSystem(), each.measurement) << each.locale;
    EXPECT_EQ(locale.temperatureUnit(), each.temperature) << each.locale;
    EXPECT_EQ(locale.hourPattern(), each.hours) << each.locale;
  }
  change("locale = \"en_GB\"\nhour_cycle_24 = false\ncalendar = \"hebrew\"\nmeasurement_system = \"Metric\"");
  EXPECT_EQ(locale.hourPattern(), "h\u202Fa");
  EXPECT_EQ(locale.calendarIdentifier(), "hebrew");
  EXPECT_EQ(locale.measurementSystem(), "Metric");
  change("locale = \"en_US\"\nhour_cycle_24 = true");
  EXPECT_EQ(locale.hourPattern(), "HH");
}

TEST_F(FactsTest, LocaleAndLanguagesComeFromTheEnvironment) {
  struct Case {
    Variables variables;
    std::string locale;
    std::vector<std::string> languages;
    std::string country, mode;
  };
  const Case cases[] = {
      {{}, "en_US", {"en-US"}, "US", "en_US@sw=QWERTY"},
      {{{"LANG", "C.UTF-8"}}, "en_US", {"en-US"}, "US", "en_US@sw=QWERTY"},
      {{{"LANG", "POSIX"}, {"LANGUAGE", "de"}}, "en_US", {"de", "en-US"}, "US", "en_US@sw=QWERTY"},
      {{{"LANG", "de_DE@euro"}, {"LC_MESSAGES", "en_GB.UTF-8"}}, "en_GB", {"en-GB"}, "GB", "en_GB@sw=QWERTY"},
      {{{"LC_ALL", "de_CH.UTF-8"}, {"LC_MESSAGES", "en_GB"}, {"LANGUAGE", "de_CH:fr:C:de_CH"}},
       "de_CH",
       {"de-CH", "fr"},
       "CH",
       "de_CH@sw=QWERTZ"},
      {{{"LANG", "sr_RS.UTF-8@latin"}}, "sr_Latn_RS", {"sr-Latn-RS"}, "RS", "sr_Latn_RS@sw=QWERTY"},
      {{{"LANG", "eo"}}, "eo", {"eo"}, "", "eo@sw=QWERTY"},
  };
  for (const Case& each : cases) {
    const auto facts = open(each.variables);
    const HostLocaleInfo locale(*facts);
    EXPECT_EQ(locale.localeIdentifier(), each.locale);
    EXPECT_EQ(locale.preferredLanguages(), each.languages);
    EXPECT_EQ(locale.systemLanguage(), each.languages.front());
    EXPECT_EQ(facts->countryCode(), each.country);
    EXPECT_EQ(HostInputModes(*facts).defaultEnabledModes(), std::vector{each.mode});
  }
}

TEST_F(FactsTest, TheVariableNamesTheTimeZoneInAnyOfItsForms) {
  for (const auto& [value, zone] : Variables{{"Europe/London", "Europe/London"},
                                             {":America/New_York", "America/New_York"},
                                             {"/usr/share/zoneinfo/Asia/Tokyo", "Asia/Tokyo"},
                                             {":/etc/localtime", "UTC"},
                                             {"<+03>-3", "UTC"},
                                             {"CET-1CEST,M3.5.0,M10.5.0/3", "UTC"}}) {
    EXPECT_EQ(timeZoneOfHost(environmentOf({{"TZ", value}}), folder / "root"), zone) << value;
  }
}

TEST_F(FactsTest, ADayBeginsAtMidnightOfTheZoneInSummerAndWinter) {
  const auto facts = open();
  const HostLocaleInfo locale(*facts);
  struct Case {
    const char* zone;
    std::int64_t lastSecond;  ///< of a day, since 1970
    std::int64_t day;
  };
  for (const Case& each :
       {Case{"UTC", 86399, 0}, Case{"UTC", -1, -1}, Case{"Nowhere/Such", 86399, 0},
        Case{"America/Los_Angeles", 1768550399, 20468},  // 15 January 2026
        Case{"America/Los_Angeles", 1784185199, 20649},  // 15 July
        Case{"Asia/Kathmandu", 1768500899, 20468}, Case{"Pacific/Kiritimati", 1768471199, 20468},
        // 2 November 2018: Sao Paulo skipped the hour after the midnight of the 3rd
        Case{"America/Sao_Paulo", 1541213999, 17837}, Case{"America/Sao_Paulo", 1541300399, 17838}}) {
    change("time_zone = \"" + std::string(each.zone) + "\"");
    const WallTime last = wallTimeFromSecondsSince1970(static_cast<double>(each.lastSecond));
    EXPECT_EQ(locale.dayNumber(last), each.day) << each.zone;
    EXPECT_EQ(locale.dayNumber(last + std::chrono::seconds(1)), each.day + 1) << each.zone;
  }
}

}  // namespace
}  // namespace sable::platform::host
