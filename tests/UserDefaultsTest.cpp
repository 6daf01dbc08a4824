#include <gtest/gtest.h>

#include <memory>
#include <nlohmann/json.hpp>

#include "platform/UserDefaults.h"
#include "platform/host/ConfigurationSchema.h"
#include "platform/host/HostFileManager.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/TOMLUserDefaults.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "platform/simulated/SimulatedUserDefaults.h"
#include "tests/support/ManualReactor.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;

constexpr WallTime kMoment =
    std::chrono::sys_days(std::chrono::year(2026) / 1 / 2) + 3h + 4min + 5s + 678901234ns;

struct UserDefaultsTest : testing::Test {
  TemporaryFolder folder;
  host::Folders folders = folder.folders();
  simulated::SimulatedLog log;
  simulated::SimulatedRuntime runtime;
  ManualReactor reactor;
  host::HostFileManager files{folders};

  std::unique_ptr<host::TOMLUserDefaults> open() {
    return std::make_unique<host::TOMLUserDefaults>(folders, runtime, reactor, files);
  }
};

void expectValuesComeBack(UserDefaults& defaults) {
  const Dictionary list = {1, "two", 3.5, {4, {{"five", true}}}};
  const Dictionary table = {{"a b", -1}, {"é", {{"deep", "x\ny"}}}};
  defaults.set("boolean", true);
  defaults.set("integer", std::int64_t{-9223372036854775807});
  defaults.set("number", 0.1);
  defaults.set("string", "quote \" and \\ and é");
  defaults.set("array", list);
  defaults.set("table", table);
  defaults.setDate("date", kMoment);
  defaults.set("gone", 1);
  defaults.set("gone", nullptr);
  defaults.synchronize();

  EXPECT_EQ(defaults.boolean("boolean"), true);
  EXPECT_EQ(defaults.integer("integer"), -9223372036854775807);
  EXPECT_EQ(defaults.number("number"), 0.1);
  EXPECT_EQ(defaults.number("integer"), -9223372036854775807.0);
  EXPECT_EQ(defaults.string("string"), "quote \" and \\ and é");
  EXPECT_EQ(defaults.array("array"), list);
  EXPECT_EQ(defaults.dictionary("table"), table);
  EXPECT_EQ(defaults.date("date"), kMoment);
  EXPECT_FALSE(defaults.integer("gone"));
  EXPECT_FALSE(defaults.integer("never"));
}

TEST_F(UserDefaultsTest, WhatTheDaemonWritesComesBackAlsoAfterARestart) {
  simulated::SimulatedUserDefaults simulated;
  expectValuesComeBack(simulated);
  expectValuesComeBack(*open());
  EXPECT_EQ(open()->date("date"), kMoment);
  EXPECT_EQ(open()->number("number"), 0.1);
  EXPECT_EQ(open()->dictionary("table"), (Dictionary{{"a b", -1}, {"é", {{"deep", "x\ny"}}}}));
  EXPECT_FALSE(open()->integer("gone"));
  EXPECT_EQ(std::filesystem::status(folders.ownSettings()).permissions(), std::filesystem::perms(0600));
  EXPECT_EQ(log.count(LogLevel::error), 0u);
}

TEST_F(UserDefaultsTest, TheProfileComesBeforeTheUserTheDaemonAndTheRegistered) {
  writeFile(folders.profileSettings, "a = 1");
  writeFile(folders.userSettings(), "a = 2\nb = 2");
  auto host = open();
  simulated::SimulatedUserDefaults simulated;
  simulated.setByProfile("a", 1);
  for (const char* key : {"a", "b"}) simulated.setByUser(key, 2);
  for (UserDefaults* defaults :
       {static_cast<UserDefaults*>(host.get()), static_cast<UserDefaults*>(&simulated)}) {
    for (const char* key : {"a", "b", "c"}) defaults->set(key, 3);
    defaults->registerDefaults({{"a", 4}, {"b", 4}, {"c", 4}, {"d", 4}});
    EXPECT_EQ(defaults->integer("a"), 1);
    EXPECT_EQ(defaults->integer("b"), 2);
    EXPECT_EQ(defaults->integer("c"), 3);
    EXPECT_EQ(defaults->integer("d"), 4);
  }
}

TEST_F(UserDefaultsTest, AValueOfTheWrongTypeIsReportedOnceAndCountsAsAbsent) {
  writeFile(folders.userSettings(),
            "# settings\n  SBLSharedSession = \"yes\"\nSBLBagURL = 5\nfloat = 1.5\nday = 2026-01-02");
  auto defaults = open();
  defaults->registerDefaults({{"SBLSharedSession", true}});
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(defaults->boolean("SBLSharedSession"), true);
    EXPECT_FALSE(defaults->string("SBLBagURL"));
  }
  EXPECT_EQ(log.count(LogLevel::error), 2u);
  EXPECT_TRUE(log.contains(folders.userSettings().native() + ":2:3: SBLSharedSession is not a boolean"));
  EXPECT_TRUE(log.contains(folders.userSettings().native() + ":3:1: SBLBagURL is not a string"));
  EXPECT_FALSE(defaults->integer("float"));
  EXPECT_FALSE(defaults->number("day"));
  EXPECT_EQ(defaults->date("day"), WallTime(std::chrono::sys_days(std::chrono::year(2026) / 1 / 2)));
}

TEST_F(UserDefaultsTest, ChangesOfTheFilesAreSeenWhereverTheFoldersComeFrom) {
  auto defaults = open();
  EXPECT_EQ(reactor.run(), 0);
  EXPECT_FALSE(defaults->integer("a"));

  writeFile(folders.userSettings(), "a = 1");
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 1);

  writeFile(folders.config / "other", "a = 2");
  std::filesystem::rename(folders.config / "other", folders.userSettings());
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 2);

  EXPECT_EQ(log.count(LogLevel::error), 0u);
  writeFile(folders.userSettings(), "a = 3\nb = = 3");
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 2) << "what does not parse keeps the last good content";
  EXPECT_EQ(log.count(folders.userSettings().native() + ":2:5: "), 1u);
  writeFile(folders.userSettings(), "a = 2");

  writeFile(folders.profileSettings, "a = 3");
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 3);

  std::filesystem::remove_all(folders.profileSettings.parent_path());
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 2);

  std::filesystem::rename(folders.config, folder / "elsewhere");
  reactor.run();
  EXPECT_FALSE(defaults->integer("a"));
  writeFile(folder / "elsewhere/defaults.toml", "a = 4");
  std::filesystem::create_directory_symlink("elsewhere", folders.config);
  reactor.run();
  EXPECT_EQ(defaults->integer("a"), 4);
  EXPECT_EQ(reactor.run(), 0);
}

TEST_F(UserDefaultsTest, SetValuesAreWrittenTogetherAMomentLaterOrAtOnceOnDemand) {
  auto defaults = open();
  defaults->set("a", 1);
  defaults->set("b", 2);
  EXPECT_FALSE(std::filesystem::exists(folders.ownSettings()));
  runtime.advance(2s);
  EXPECT_EQ(readFile(folders.ownSettings()), "a = 1\nb = 2\n");

  std::filesystem::remove(folders.ownSettings());
  defaults->set("a", 1);
  runtime.advance(2s);
  EXPECT_FALSE(std::filesystem::exists(folders.ownSettings())) << "nothing had changed";

  defaults->set("a", 3);
  defaults->synchronize();
  EXPECT_EQ(readFile(folders.ownSettings()), "a = 3\nb = 2\n");
  defaults->set("a", 4);
  defaults.reset();
  EXPECT_EQ(readFile(folders.ownSettings()), "a = 4\nb = 2\n");
}

TEST_F(UserDefaultsTest, AFolderThatCannotBeWrittenIsReportedOnceAndLosesNothing) {
  writeFile(folders.state, "in the way");
  auto defaults = open();
  for (int i = 0; i < 3; ++i) {
    defaults->set("a", i);
    defaults->synchronize();
  }
  EXPECT_EQ(log.count("settings cannot be written"), 1u);
  EXPECT_EQ(defaults->integer("a"), 2);
  std::filesystem::remove(folders.state);
  defaults->synchronize();
  EXPECT_EQ(readFile(folders.ownSettings()), "a = 2\n");
}

TEST_F(UserDefaultsTest, ADamagedFileOfItsOwnIsKeptAside) {
  writeFile(folders.ownSettings(), "a = ");
  auto defaults = open();
  defaults->set("b", 1);
  defaults->synchronize();
  EXPECT_EQ(readFile(folders.ownSettings()), "b = 1\n");
  EXPECT_EQ(readFile(folders.ownSettings().string() + ".damaged"), "a = ");
}

TEST_F(UserDefaultsTest, ReadersAndWritersOfManyThreadsDoNotDisturbEachOther) {
  host::HostRuntime real(4);
  writeFile(folders.userSettings(), "a = 1\nwrong = 1");
  host::TOMLUserDefaults defaults(folders, real, real.reactor(), files);
  const auto done = real.waitGroup();
  for (int thread = 0; thread < 4; ++thread) {
    done->enter();
    real.globalQueue(QualityOfService::standard).async([&, thread] {
      for (int i = 0; i < 200; ++i) {
        defaults.set("own" + std::to_string(thread), i);
        EXPECT_EQ(defaults.integer("own" + std::to_string(thread)), i);
        EXPECT_FALSE(defaults.string("wrong"));
        if (i % 50 == 0) writeFile(folders.userSettings(), "a = 1\nwrong = " + std::to_string(i));
        if (i % 50 == 10) defaults.synchronize();
      }
      done->leave();
    });
  }
  ASSERT_TRUE(done->wait(MonotonicTime::max()));
  defaults.synchronize();
  EXPECT_EQ(readFile(folders.ownSettings()), "own0 = 199\nown1 = 199\nown2 = 199\nown3 = 199\n");
}

TEST_F(UserDefaultsTest, ASharedDomainHasAFileOfItsOwnThatIsReadWhenAsked) {
  const auto file = folders.config / "com.example.shared.toml";
  const auto defaults = open();
  const auto read = [&](std::string_view text) {
    writeFile(file, text);
    return defaults->sharedBoolean("com.example.shared", "Flag");
  };
  EXPECT_FALSE(defaults->sharedBoolean("com.example.shared", "Flag"));
  writeFile(folders.userSettings(), "Flag = true");
  EXPECT_EQ(read("Flag = true"), true);
  EXPECT_EQ(read("Flag = false"), false);
  EXPECT_EQ(read("Other = true"), std::nullopt) << "another domain's value does not show through";
  EXPECT_EQ(read("Flag = 1"), std::nullopt);
  EXPECT_TRUE(log.contains(file.native() + ":1:1: Flag is not a boolean"));
  EXPECT_EQ(read("Flag = false"), false);
  EXPECT_EQ(read("Flag = "), false) << "what does not parse keeps the last good content";
  EXPECT_EQ(log.count(LogLevel::error), 2u);
}

TEST_F(UserDefaultsTest, CheckingNamesFileLineColumnAndKey) {
  EXPECT_TRUE(host::checkConfiguration(folders).empty());
  writeFile(folders.profileSettings, "SBLSessionMaxAge = 3600\nSBLUseBramble = 1\n");
  writeFile(folders.userSettings(), "SBLBagURL = \"http://127.0.0.1/bag\"\n\n SBLBagUrl = \"x\"\n");
  writeFile(folders.sharedSettings("com.kestrel.lookup.shared"), "LookupSuggestionsDisabled = \"no\"\n");
  writeFile(folders.systemFacts, "locale = \"en_GB\"\n[location]\nlatitude = 1.0\n");
  writeFile(folders.userFacts(), "preferred_languages = [\"en\", 5]\n");
  EXPECT_EQ(host::checkConfiguration(folders),
            (std::vector<std::string>{
                folders.profileSettings.native() + ":2:1: SBLUseBramble: not a boolean",
                folders.userSettings().native() + ":3:2: SBLBagUrl: unknown",
                folders.config.native() +
                    "/com.kestrel.lookup.shared.toml:1:1: LookupSuggestionsDisabled: not a boolean",
                folders.userFacts().native() + ":1:1: preferred_languages: not an array of strings",
            }));
}

}  // namespace
}  // namespace sable::platform
