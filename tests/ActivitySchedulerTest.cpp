#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <vector>

#include "platform/host/HostActivityScheduler.h"
#include "platform/host/HostFileManager.h"
#include "platform/host/PowerSupply.h"
#include "platform/simulated/SimulatedActivityScheduler.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "sabled/SableRelayActivity.h"
#include "tests/support/ManualReactor.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;
using enum ActivityState;
using RunningActivity = std::shared_ptr<Activity>;

constexpr const char* kName = "com.kestrel.test";
constexpr ActivityCriteria kEveryTenMinutes{300s, 600s, 300s, true, true};
constexpr ActivityCriteria kWithoutGrace{300s, 600s, 0s, true, true};

TEST(FirstRunTest, HonoursDelayIntervalAndGrace) {
  const WallTime now = wallTimeFromSecondsSince1970(1.8e9);
  struct Row {
    const char* what;
    std::optional<Duration> sinceLastRun;
    double jitter;
    Duration expected;
  };
  for (const Row& row : {
           Row{"never ran", std::nullopt, 0, 300s},
           Row{"never ran, last moment of grace", std::nullopt, 1, 600s},
           Row{"has just run", 0s, 0, 600s},
           Row{"ran a while ago", 100s, 0, 500s},
           Row{"ran a while ago, middle of grace", 100s, 0.5, 650s},
           Row{"the delay is longer than the rest", 400s, 0, 300s},
           Row{"ran long ago", 30 * 24h, 0, 300s},
           Row{"ran in the future: the clock was set back", -24h, 0, 300s},
       }) {
    const auto last = row.sinceLastRun ? std::optional(now - *row.sinceLastRun) : std::nullopt;
    EXPECT_EQ(firstRunAfter(kEveryTenMinutes, now, last, row.jitter), row.expected) << row.what;
  }
}

struct ActivitySchedulerTest : testing::Test {
  simulated::SimulatedRuntime runtime{7};
  NotificationCenter center;
  simulated::SimulatedActivityScheduler scheduler{runtime, center};
  MonotonicTime begun = runtime.ticks();
  std::vector<Duration> runs;  ///< since begun

  void add(const ActivityCriteria& criteria, ActivityScheduler::Handler then = {}) {
    scheduler.registerActivity(kName, criteria, [this, then](const RunningActivity& activity) {
      runs.push_back(runtime.ticks() - begun);
      if (then) then(activity);
    });
  }
};

TEST_F(ActivitySchedulerTest, DevicesThatStartTogetherDoNotRunTogether) {
  std::set<Duration> first;
  for (std::uint64_t seed = 1; seed <= 20; ++seed) {
    simulated::SimulatedRuntime device(seed);
    simulated::SimulatedActivityScheduler activities(device, center);
    const auto start = device.ticks();
    activities.registerActivity(kName, kEveryTenMinutes,
                                [&](const auto&) { first.insert(device.ticks() - start); });
    device.advance(600s);
  }
  EXPECT_GE(first.size(), 19u);
}

TEST_F(ActivitySchedulerTest, ARestartNeitherSkipsNorDoublesARun) {
  add(kWithoutGrace);
  runtime.advance(400s);  // ran at 300 s
  scheduler.unregister(kName);
  runtime.advance(100s);
  add(kWithoutGrace);
  runtime.advance(399s);
  EXPECT_EQ(runs, std::vector<Duration>{300s});
  runtime.advance(1s);
  EXPECT_EQ(runs, (std::vector<Duration>{300s, 900s}));
}

TEST_F(ActivitySchedulerTest, AnUnregisteredActivityNeverRuns) {
  add(kEveryTenMinutes);
  runtime.advance(299s);
  scheduler.unregister(kName);
  runtime.advance(1h);
  EXPECT_TRUE(runs.empty());
  EXPECT_FALSE(scheduler.record().at(kName).nextRun);
  add({.delay = 10s, .allowBattery = true});
  runtime.advance(1h);
  EXPECT_EQ(runs.size(), 1u) << "one that does not repeat runs once";
}

TEST_F(ActivitySchedulerTest, WorkThatNeedsPowerWaitsForIt) {
  scheduler.setOnBattery(true);
  RunningActivity open;
  add({.delay = 60s, .interval = 600s, .repeating = true}, [&](const RunningActivity& activity) {
    EXPECT_TRUE(activity->setState(continueRunning));
    open = activity;
  });
  runtime.advance(1h);
  EXPECT_TRUE(runs.empty());
  scheduler.setOnBattery(false);
  runtime.run();
  EXPECT_EQ(runs, std::vector<Duration>{1h});

  EXPECT_FALSE(open->shouldDefer());
  scheduler.setOnBattery(true);
  EXPECT_TRUE(open->shouldDefer());
  EXPECT_TRUE(open->setState(defer));
  runtime.advance(1h);
  EXPECT_EQ(runs.size(), 1u);
  EXPECT_FALSE(scheduler.record().at(kName).lastRun) << "a deferred run is none";
  scheduler.setOnBattery(false);
  runtime.run();
  EXPECT_EQ(runs, (std::vector<Duration>{1h, 2h}));
}

TEST_F(ActivitySchedulerTest, ARunIsOpenUntilItIsDoneAndNeverTwiceAtOnce) {
  std::vector<RunningActivity> open;
  add(kWithoutGrace, [&](const RunningActivity& activity) {
    EXPECT_EQ(activity->state(), run);
    EXPECT_FALSE(activity->setState(checkIn));
    EXPECT_TRUE(activity->setState(continueRunning));
    EXPECT_FALSE(activity->setState(continueRunning));
    open.push_back(activity);
  });
  runtime.advance(2h);
  ASSERT_EQ(open.size(), 1u);
  EXPECT_EQ(SableRelayActivity::getStateForActivity(open[0]), continueRunning);
  EXPECT_TRUE(SableRelayActivity::setState(done, open[0]));
  EXPECT_FALSE(open[0]->setState(done));
  EXPECT_FALSE(open[0]->setState(defer));
  runtime.run();
  EXPECT_EQ(runs, (std::vector<Duration>{300s, 2h})) << "the run that came due meanwhile begins at once";

  scheduler.unregister(kName);  // while its second run is open
  add(kWithoutGrace);
  runtime.advance(1h);
  EXPECT_EQ(runs.size(), 2u);
  open.clear();  // nobody can end it any more
  runtime.run();
  EXPECT_EQ(runs, (std::vector<Duration>{300s, 2h, 3h}));
}

/// The host's files and facts, in virtual time.
struct HostActivitySchedulerTest : testing::Test {
  TemporaryFolder folder;
  host::Folders folders = folder.folders();
  simulated::SimulatedLog log;
  simulated::SimulatedRuntime runtime;
  ManualReactor reactor;
  NotificationCenter center;
  host::HostFileManager files{folders};
  host::HostSources sources{[](const char*) { return std::optional<std::string>(); }, folder.path() / "root"};
  host::HostFacts facts{folders, sources, reactor, center};
  int runs = 0;

  void supply(const char* name, const std::map<std::string, std::string>& attributes) {
    for (const auto& [attribute, value] : attributes)
      writeFile(sources.root / "sys/class/power_supply" / name / attribute, value + "\n");
  }
  /// A process that lives for so long.
  void live(Duration life, bool allowBattery) {
    host::HostActivityScheduler scheduler(runtime, center, facts, files, folders.activityRuns());
    scheduler.registerActivity(kName, {60s, 24h, {}, true, allowBattery}, [this](const auto&) { ++runs; });
    runtime.advance(life);
  }
};

TEST_F(HostActivitySchedulerTest, KeepsItsRhythmOverProcessesAndDamage) {
  live(1h, true);
  live(1h, true);
  EXPECT_EQ(runs, 1);
  live(22h + 1min, true);
  EXPECT_EQ(runs, 2);
  const auto record = host::decodeActivityRecord(readFile(folders.activityRuns()));
  ASSERT_TRUE(record.contains(kName));
  EXPECT_NEAR(toSeconds(*record.at(kName).nextRun - *record.at(kName).lastRun), 86400, 0.001);
  EXPECT_EQ(log.count(LogLevel::error), 0u);

  writeFile(folders.activityRuns(), "{torn");
  live(1h, true);
  EXPECT_EQ(runs, 3);
  std::filesystem::remove(folders.activityRuns());
  std::filesystem::create_directory(folders.activityRuns());
  live(1h, true);
  EXPECT_EQ(runs, 4) << "without a file it still runs";
  EXPECT_EQ(log.count(LogLevel::error), 2u) << "and says so once for reading, once for writing";
}

TEST_F(HostActivitySchedulerTest, ReadsOnlyTimesFromItsFile) {
  const auto record = host::decodeActivityRecord(
      R"({"a": {"last_run": 5, "next_run": "x"}, "b": [], "c": {"last_run": 1e300}, "d": {"last_run": -1}})");
  EXPECT_EQ(record.size(), 3u);
  EXPECT_EQ(record.at("a").lastRun, wallTimeFromSecondsSince1970(5));
  for (const char* name : {"a", "c", "d"}) EXPECT_FALSE(record.at(name).nextRun) << name;
  for (const char* name : {"c", "d"}) EXPECT_FALSE(record.at(name).lastRun) << name;
  EXPECT_TRUE(host::decodeActivityRecord("[]").empty());
}

TEST_F(HostActivitySchedulerTest, KnowsItsBatteryByTheKernel) {
  EXPECT_FALSE(host::runsOnBattery(sources.root));
  supply("BAT0", {{"type", "Battery"}, {"status", "Discharging"}});
  EXPECT_TRUE(host::runsOnBattery(sources.root));
  supply("AC", {{"type", "Mains"}, {"online", "1"}});
  EXPECT_FALSE(host::runsOnBattery(sources.root));
  supply("AC", {{"online", "0"}});
  supply("mouse", {{"type", "Battery"}, {"scope", "Device"}, {"status", "Discharging"}});
  EXPECT_TRUE(host::runsOnBattery(sources.root));
  supply("BAT0", {{"status", "Not charging"}});
  EXPECT_FALSE(host::runsOnBattery(sources.root));
}

TEST_F(HostActivitySchedulerTest, WaitsForPowerThatTheKernelDoesNotAnnounceAndTheFactsDo) {
  supply("BAT0", {{"type", "Battery"}, {"status", "Discharging"}});
  host::HostActivityScheduler scheduler(runtime, center, facts, files, folders.activityRuns());
  scheduler.registerActivity(kName, {60s, 24h, {}, true, false}, [this](const auto&) { ++runs; });
  runtime.advance(1h);
  EXPECT_EQ(runs, 0);
  supply("AC", {{"type", "Mains"}, {"online", "1"}});
  runtime.advance(kActivityRetryPause);
  EXPECT_EQ(runs, 1);

  writeFile(folders.userFacts(), "on_battery = true");
  reactor.run();
  runtime.advance(48h);
  EXPECT_EQ(runs, 1);
  writeFile(folders.userFacts(), "on_battery = false");
  reactor.run();
  runtime.run();
  EXPECT_EQ(runs, 2);
}

}  // namespace
}  // namespace sable::platform
