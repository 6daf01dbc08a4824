#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/support/World.h"

// Resource files of an earlier run, through the real programs. That a file is fetched takes a minute, and is
// seen in virtual time.
namespace sable::test {
namespace {

using nlohmann::json;
using testing::HasSubstr;

constexpr const char* kURL = "http://127.0.0.1:9/notes?version=3";

TEST(DownloadProcess, FilesOfAnEarlierRunAreHandedOutListedAndDropped) {
  World::Options options;
  options.startDaemon = false;
  World world(std::move(options));
  const auto caches = world.folder("caches") / "com.kestrel.sabled";
  std::filesystem::create_directories(caches);
  std::filesystem::permissions(caches, std::filesystem::perms::owner_all);
  const std::string content(100'000, 'x');
  writeFile(caches / "installed_app_whitelist", content);
  writeFile(caches / "dropped", "old");
  const std::string url = world.serviceURL() + "/resources/installed_app_whitelist?version=1";
  writeFile(world.folder("state") / "defaults.toml", "[download_resources.installed_app_whitelist]\nurl = '" +
                                                         url + "'\n[download_resources.dropped]\nurl = '" +
                                                         kURL + "'\n");
  world.startDaemon();
  world.waitForLog("deleting resource: dropped");
  world.waitForLog("downloading file: lookup_hints_weekly ");

  const auto saved = world.folder("state") / "saved";
  const json got = world.sablectlJSON({"resource", "installed_app_whitelist", "--save", saved.string()});
  EXPECT_EQ(got["bytes"], content.size());
  EXPECT_EQ(got["attributes"]["size"], content.size());
  EXPECT_EQ(readFile(saved), content);
  for (const char* identifier : {"dropped", "../bag.plist", "bag.plist", ""}) {
    EXPECT_EQ(world.sablectl({"resource", identifier}).exitCode, 1) << identifier;
  }
  EXPECT_THAT(world.sablectl({"resource", "bag.plist"}).errors,
              HasSubstr("identifier: bag.plist exception: no place for a resource of that name"));
  EXPECT_FALSE(std::filesystem::exists(caches / "dropped"));

  const json resources = world.sablectlJSON({"resources"});
  ASSERT_EQ(resources.size(), 3u);
  EXPECT_EQ(resources[0]["identifier"], "installed_app_whitelist");
  EXPECT_EQ(resources[0]["version"], "1");
  EXPECT_EQ(resources[0]["state"], "there");
  EXPECT_EQ(resources[2]["reason"], "update");
  EXPECT_THAT(world.sablectl({"resources"}).output, HasSubstr(" s (update)"));
}

}  // namespace
}  // namespace sable::test
