#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <set>
#include <sstream>

#include "platform/LocalRandomizer.h"
#include "tests/support/World.h"

// The real daemon: what it says of its user's privacy is what the service gets, and what applications
// link to is nowhere.
namespace sable::test {
namespace {

using nlohmann::json;

constexpr std::string_view kFacts = R"(
locale = "en_GB"
country_code = "GB"
time_zone = "Europe/London"
preferred_languages = ["en-GB", "de"]
managed_account = true
diagnostics_allowed = true
[location]
latitude = 51.507351
longitude = -0.127758
type = 4
)";

/// "name=value" of what a recorded request carried.
std::set<std::string> carried(const json& request) {
  std::set<std::string> values;
  for (const char* place : {"items", "headers"}) {
    for (const auto& pair : request[place]) {
      values.insert(pair[0].get<std::string>() + "=" + pair[1].get<std::string>());
    }
  }
  return values;
}

TEST(PrivacyProcess, WhatSablectlTellsIsWhatTheServiceGets) {
  const World world({.facts = std::string(kFacts)});
  world.waitForLog("location: wifi");
  const json report = world.sablectlJSON({"privacy"});
  EXPECT_EQ(world.sablectl({"search", "weather"}).exitCode, 0);
  EXPECT_EQ(world.sablectl({"lookup", "weather"}).exitCode, 0);

  const auto searches = world.requests("/search", 2);
  const auto search = carried(searches[0]), lookup = carried(searches[1]),
             bag = carried(world.requests("/bag", 1)[0]);
  std::size_t compared = 0;
  for (const json& value : report["values"]) {
    const std::string text = value["name"].get<std::string>() + "=" + value["value"].get<std::string>();
    const auto isTold = [&](std::string_view request) {
      return std::ranges::count(value["requests"], json(request)) > 0;
    };
    EXPECT_EQ(search.contains(text), isTold("search")) << text;
    EXPECT_EQ(lookup.contains(text), isTold("lookup")) << text;
    EXPECT_EQ(bag.contains(text), isTold("bag")) << text;
    ++compared;
  }
  EXPECT_GT(compared, 15u);
  EXPECT_TRUE(search.contains("mode=managed"));
  EXPECT_TRUE(lookup.contains("latlng=51.500000,-0.100000"));

  const auto shown = world.sablectl({"privacy"});
  EXPECT_EQ(shown.exitCode, 0) << shown.errors;
  for (const char* text :
       {"51.500000,-0.100000", "en_GB", "fact time_zone", "is renewed in 1", "randomised"}) {
    EXPECT_NE(shown.output.find(text), std::string::npos) << text << " is not in:\n" << shown.output;
  }
}

/// Deep links as applications drop them, some of them hostile, before the daemon starts.
struct Spool {
  static constexpr std::string_view kSecret = "s3cr3t";

  explicit Spool(const World& world) : folder(world.folder("state") / "deeplinks") {
    std::filesystem::create_directories(folder);
    for (int i = 0; i < 6; ++i) {
      const auto number = std::to_string(i);
      const json link{{"bundle_id", "org.example.Reader"},
                      {"url", "https://www" + number + ".example.org/s3cr3t/" + number + "?s3cr3t"},
                      {"eligible_for_public_indexing", true}};
      writeFile(folder / ("s3cr3t" + number), link.dump());
    }
    writeFile(folder / "s3cr3t-broken", "{\"url\": \"https://s3cr3t.example.org");
    writeFile(folder / "s3cr3t-huge", std::string(1 << 20, ' ') + "{}");
    EXPECT_EQ(mkfifo((folder / "s3cr3t-fifo").c_str(), 0600), 0);
    writeFile(folder.parent_path() / "linked",
              R"({"bundle_id": "org.example.Linked", "url": "https://linked.example.org/",
      "eligible_for_public_indexing": true})");
    std::filesystem::create_symlink("../linked", folder / "s3cr3t-symlink");
    std::filesystem::copy_file(folder.parent_path() / "linked", folder / "s3cr3t-foreign");
    constexpr uid_t kNobody = 65534;  // only root can make it another user's
    if (chown((folder / "s3cr3t-foreign").c_str(), kNobody, kNobody) != 0)
      writeFile(folder / "s3cr3t-foreign", "");
  }
  bool isEmpty() const { return std::filesystem::is_empty(folder); }

  const std::filesystem::path folder;
};

/// The files below a folder whose name or content holds the secret.
std::vector<std::string> leaks(const std::filesystem::path& folder) {
  std::vector<std::string> found;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(folder)) {
    const bool named = entry.path().filename().native().find(Spool::kSecret) != std::string::npos;
    if (named || (entry.is_regular_file() && occurrences(readFile(entry.path()), Spool::kSecret) > 0)) {
      found.push_back(entry.path());
    }
  }
  return found;
}

TEST(PrivacyProcess, DeepLinksBecomeReportsThatHoldNoneOfThem) {
  World world(
      {.settings = "SBLKeepPrivateReports = true", .facts = std::string(kFacts), .startDaemon = false});
  const Spool spool(world);
  world.startDaemon({"--log-level", "debug"});
  world.waitForLog("deep links: 6 read, 5 refused, 0 deleted unread, 0 stuck");
  EXPECT_TRUE(spool.isEmpty());
  EXPECT_TRUE(std::filesystem::exists(world.folder("state") / "linked")) << "only the link to it is deleted";

  const auto file = world.folder("state") / "privacy" / "reports.jsonl";
  waitForChange(world.folder("state"), [&] { return std::filesystem::exists(file.parent_path()); });
  waitForChange(file.parent_path(),
                [&] { return std::filesystem::exists(file) && occurrences(readFile(file), "\n") == 4; });
  EXPECT_EQ(std::filesystem::status(file).permissions(),
            std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);
  std::istringstream lines(readFile(file));
  for (std::string line; std::getline(lines, line);) {
    const json report = json::parse(line);
    EXPECT_EQ(report["key"], "com.kestrel.sable.deeplink");
    EXPECT_EQ(report["seed"].get<std::string>().size(), 16u);
    EXPECT_LT(report["bucket"].get<unsigned>(), platform::kRandomizerBuckets);
  }

  for (const char* folder : {"state", "caches", "run"}) {
    EXPECT_EQ(leaks(world.folder(folder)), std::vector<std::string>()) << folder;
  }
  EXPECT_EQ(occurrences(world.daemonErrors(), Spool::kSecret), 0u);
}

TEST(PrivacyProcess, WithoutASettingOrAFactNothingIsReported) {
  {
    World world({.facts = std::string(kFacts), .startDaemon = false});
    const Spool spool(world);
    world.startDaemon();
    world.waitForLog("targets left unreported");
    EXPECT_TRUE(spool.isEmpty());
    EXPECT_FALSE(std::filesystem::exists(world.folder("state") / "privacy"));
  }
  World world({.settings = "SBLKeepPrivateReports = true", .startDaemon = false});
  const Spool spool(world);
  world.startDaemon();
  world.waitForLog("deep links: 0 read, 0 refused, 11 deleted unread");
  EXPECT_TRUE(spool.isEmpty());
  EXPECT_FALSE(std::filesystem::exists(world.folder("state") / "privacy"));
}

}  // namespace
}  // namespace sable::test
