#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <memory>

#include "platform/host/DesktopEntry.h"
#include "platform/host/HostApplicationRegistry.h"
#include "platform/simulated/SimulatedLog.h"
#include "tests/support/ManualReactor.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform::host {
namespace {

using testing::IsEmpty;
using testing::Pair;
using testing::UnorderedElementsAre;

constexpr std::string_view kApplication = "[Desktop Entry]\nType=Application\nName=X\nExec=x\n";

std::string metadata(std::string_view id, std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<component type=\"desktop-application\">\n  <id>" +
         std::string(id) + "</id>\n" + std::string(body) + "</component>\n";
}

const std::string kReleases =
    "<releases><release version=\"3.2\" date=\"2026-01-02\"/><release version=\"3.1\"/></releases>";

struct ApplicationRegistryTest : testing::Test {
  TemporaryFolder folder;
  simulated::SimulatedLog log;
  ManualReactor reactor;
  NotificationCenter center;
  int changes = 0;
  NotificationCenter::Token token = center.observe(std::string(kApplicationsDidChangeNotification),
                                                   [this](const Notification&) { ++changes; });
  std::unique_ptr<HostFacts> facts;
  std::unique_ptr<HostApplicationRegistry> registry;

  std::filesystem::path users(std::string_view name) const { return folder / "home/share" / name; }
  std::filesystem::path systems(std::string_view name) const { return folder / "usr/share" / name; }

  void open() {
    const Environment environment = [this](const char* name) -> std::optional<std::string> {
      const std::map<std::string_view, std::string> variables{
          {"XDG_DATA_HOME", folder / "home/share"},
          {"XDG_DATA_DIRS", (folder / "usr/share").string() + ":not/absolute"},
          {"PATH", folder / "bin"}};
      const auto found = variables.find(name);
      return found == variables.end() ? std::nullopt : std::optional(found->second);
    };
    Folders folders = folder.folders();
    folders.data = Folders::fromEnvironment(environment).data;
    facts = std::make_unique<HostFacts>(folders, HostSources{environment, folder / "root"}, reactor, center);
    registry = std::make_unique<HostApplicationRegistry>(folders, *facts, reactor, center);
  }
  std::map<std::string, std::string> versions() {
    std::map<std::string, std::string> all;
    for (const auto& [identifier, version] : registry->installedApplications()) {
      EXPECT_TRUE(all.emplace(identifier, version).second) << identifier << " is there twice";
    }
    return all;
  }
  /// How often a change was posted for what has happened since.
  int posted() {
    reactor.run();
    return std::exchange(changes, 0);
  }
};

TEST_F(ApplicationRegistryTest, AnEntryIsAnApplicationWithTheVersionOfItsMetadata) {
  writeFile(systems("applications/org.example.Mail.desktop"), kApplication);
  writeFile(systems("metainfo/org.example.Mail.metainfo.xml"), metadata("org.example.Mail", kReleases));
  writeFile(systems("applications/editor.desktop"), kApplication);
  writeFile(systems("appdata/editor.appdata.xml"),
            metadata("org.example.Editor",
                     "<launchable type=\"service\">a.service</launchable>\n<launchable "
                     "type=\"desktop-id\"> editor.desktop </launchable>" +
                         kReleases));
  writeFile(systems("applications/old.desktop"), kApplication);
  writeFile(systems("metainfo/old.appdata.xml"), metadata("old.desktop", kReleases));
  writeFile(systems("applications/vendor/deep/tool.desktop"), kApplication);
  writeFile(systems("metainfo/tool.metainfo.xml"), metadata("vendor-deep-tool", kReleases));
  writeFile(users("applications/portable.desktop"),
            std::string(kApplication) + "NoDisplay=true\nX-AppImage-Version=7\n");
  writeFile(systems("applications/unknown.desktop"), kApplication);
  writeFile(systems("applications/unreleased.desktop"), kApplication);
  writeFile(systems("metainfo/unreleased.metainfo.xml"), metadata("unreleased", "<releases/>"));
  constexpr std::string_view kElsewhere = "<releases type=\"external\"/>";
  writeFile(systems("applications/external.desktop"), kApplication);
  writeFile(systems("metainfo/external.metainfo.xml"), metadata("external", kElsewhere));
  writeFile(systems("metainfo/releases/external.releases.xml"), kReleases);
  writeFile(systems("applications/outside.desktop"), kApplication);
  writeFile(systems("metainfo/outside.metainfo.xml"),
            metadata("../outside", "<launchable type=\"desktop-id\">outside.desktop</launchable>" +
                                       std::string(kElsewhere)));
  writeFile(systems("metainfo/outside.releases.xml"), kReleases);
  writeFile(systems("applications/broken.desktop"), kApplication);
  writeFile(systems("metainfo/broken.metainfo.xml"), "<component><id>broken</id><releases>");
  open();
  EXPECT_THAT(versions(),
              UnorderedElementsAre(Pair("org.example.Mail", "3.2"), Pair("editor", "3.2"), Pair("old", "3.2"),
                                   Pair("vendor-deep-tool", "3.2"), Pair("portable", "7"),
                                   Pair("external", "3.2"), Pair("outside", ""), Pair("unknown", ""),
                                   Pair("unreleased", ""), Pair("broken", "")));
}

TEST_F(ApplicationRegistryTest, WhatIsHiddenOrWithoutItsProgramIsNotInstalled) {
  writeFile(systems("applications/kept.desktop"), kApplication);
  writeFile(systems("applications/removed.desktop"), kApplication);
  writeFile(users("applications/removed.desktop"), "[Desktop Entry]\nHidden=true\n");
  writeFile(systems("applications/link.desktop"), "[Desktop Entry]\nType=Link\nURL=https://example.org\n");
  writeFile(systems("applications/action.desktop"),
            "Type=Application\n[Desktop Action]\nType=Application\n[Desktop Entry]\n# Type=Application\n");
  writeFile(systems("applications/readme.txt"), kApplication);
  writeFile(systems("applications/there.desktop"), std::string(kApplication) + "TryExec=there\r\n");
  writeFile(systems("applications/gone.desktop"), std::string(kApplication) + "TryExec = gone\n");
  writeFile(systems("applications/away.desktop"), std::string(kApplication) + "TryExec=/nowhere/away\n");
  writeFile(folder / "bin/there", "");
  std::filesystem::permissions(folder / "bin/there", std::filesystem::perms::owner_all);
  std::filesystem::create_directory(systems("applications/folder.desktop"));
  std::filesystem::create_symlink("dangling", systems("applications/dangling.desktop"));
  std::filesystem::create_symlink(systems("applications/kept.desktop"),
                                  systems("applications/alias.desktop"));
  open();
  EXPECT_THAT(versions(), UnorderedElementsAre(Pair("kept", ""), Pair("there", ""), Pair("alias", "")));
}

TEST_F(ApplicationRegistryTest, WhatIsInstalledOrRemovedIsPosted) {
  open();
  EXPECT_THAT(versions(), IsEmpty());
  EXPECT_EQ(posted(), 0);
  writeFile(systems("applications/a.desktop"), kApplication);  // the folder is new as well
  EXPECT_GT(posted(), 0);
  writeFile(users("applications/b.desktop"), kApplication);
  EXPECT_GT(posted(), 0);
  writeFile(systems("metainfo/a.metainfo.xml"), metadata("a", kReleases));
  EXPECT_GT(posted(), 0);
  EXPECT_THAT(versions(), UnorderedElementsAre(Pair("a", "3.2"), Pair("b", "")));

  std::filesystem::create_directory(systems("applications/vendor"));
  EXPECT_GT(posted(), 0);
  writeFile(systems("applications/vendor/c.desktop"), kApplication);
  EXPECT_GT(posted(), 0);
  std::filesystem::remove(systems("applications/a.desktop"));
  EXPECT_GT(posted(), 0);
  EXPECT_THAT(versions(), UnorderedElementsAre(Pair("b", ""), Pair("vendor-c", "")));

  std::filesystem::rename(systems("applications"), systems("elsewhere"));
  EXPECT_GT(posted(), 0);
  std::filesystem::rename(systems("elsewhere"), systems("applications"));
  EXPECT_GT(posted(), 0);
  writeFile(systems("applications/d.desktop"), kApplication);
  EXPECT_GT(posted(), 0);
  writeFile(systems("icons/d.png"), "");
  EXPECT_EQ(posted(), 0);
}

TEST_F(ApplicationRegistryTest, TheFactReplacesTheHostsList) {
  writeFile(systems("applications/a.desktop"), kApplication);
  open();
  writeFile(folder.folders().userFacts(),
            "[[applications]]\nbundle_id = \"org.example.Mail\"\nversion = \"3.2\"\n"
            "[[applications]]\nbundle_id = \"org.example.News\"\nversion = 3\n");
  EXPECT_EQ(posted(), 1);
  EXPECT_THAT(versions(),
              UnorderedElementsAre(Pair("org.example.Mail", "3.2"), Pair("org.example.News", "")));
  std::filesystem::remove(systems("applications/a.desktop"));
  EXPECT_EQ(posted(), 0) << "what the host has does not matter";
  writeFile(folder.folders().userFacts(), "applications = []\n");
  EXPECT_EQ(posted(), 1);
  EXPECT_THAT(versions(), IsEmpty());
}

TEST(AppStream, DocumentsOfAnyKindAreReadWithoutHarm) {
  const std::string deep(200000, '<');
  std::string nested;
  for (int i = 0; i < 100000; ++i) nested += "<a>";
  for (const std::string& text : {std::string(), deep, nested, std::string("\0\xff<component>", 13),
                                  std::string("<!DOCTYPE c [<!ENTITY a \"&a;&a;\">]><c>&a;</c>")}) {
    EXPECT_THAT(parseAppStream(text).desktopIds, IsEmpty());
  }
}

}  // namespace
}  // namespace sable::platform::host
