#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include "tests/support/World.h"

// How the daemon is started and ended, and what it does with the files and folders that it finds.
namespace sable::test {
namespace {

using testing::HasSubstr;
using testing::StartsWith;

constexpr std::size_t kEndpoints = 2;  ///< of a daemon: for follow-up requests, and of the flusher

/// Sockets in the runtime folder beside the one that clients find by name.
std::size_t endpoints(const World& world) {
  std::size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(world.folder("run"))) {
    if (entry.is_socket() && entry.path().filename() != "relay.sock") ++count;
  }
  return count;
}

bool answers(const World& world) {
  // The item keeps it from being answered from the cache.
  return world.sablectlJSON({"search", "dog", "--item", "network=1"})["reply"].is_object();
}

TEST(CommandLine, WhatCannotBeUnderstoodIsOneLineAndTwo) {
  const World world({.startDaemon = false});
  for (const std::vector<std::string>& arguments :
       {std::vector<std::string>{"--nonsense"}, {"stray"}, {"--log-level"}, {"--log-level", "loud"}}) {
    const auto result = world.sabled(arguments);
    EXPECT_EQ(result.exitCode, 2) << arguments.back();
    EXPECT_THAT(result.errors, StartsWith("sabled: "));
    EXPECT_EQ(occurrences(result.errors, "\n"), 1u) << result.errors;
    EXPECT_EQ(result.output, "");
  }
}

TEST(CommandLine, VersionAndHelpArePrintedWithoutADaemon) {
  const World world({.startDaemon = false});
  const auto version = world.sabled({"--version"});
  EXPECT_EQ(version.output, "Sabled/1.0\n");
  EXPECT_EQ(version.exitCode, 0);
  const auto help = world.sabled({"--help"});
  EXPECT_THAT(help.output, HasSubstr("--check-config"));
  EXPECT_EQ(help.exitCode, 0);
}

TEST(Configuration, IsCheckedLineByLine) {
  const World world({.startDaemon = false});
  const auto defaults = world.folder("config") / "defaults.toml",
             facts = world.folder("config") / "facts.toml";
  const struct {
    std::filesystem::path file;
    const char* text;
    const char* problem;  // null: none
  } cases[] = {
      {defaults, "SBLSharedSession = false\n", nullptr},
      {defaults, "\nSBLSharedSession = \"yes\"\n", ":2:1: SBLSharedSession: not a boolean\n"},
      {defaults, "SBLBagURI = \"x\"\n", ":1:1: SBLBagURI: unknown\n"},
      {facts, "\n\n  screen_scale = true\n", ":3:3: screen_scale: not a number\n"},
      {facts, "locale = \"en_GB\"\nlocale = \n", ":2:"},
      {facts, "locale = \"\xff\"\n", ":1:"},
  };
  for (const auto& [file, text, problem] : cases) {
    writeFile(defaults, "");
    writeFile(facts, "");
    writeFile(file, text);
    const auto result = world.sabled({"--check-config"});
    EXPECT_EQ(result.exitCode, problem == nullptr ? 0 : 2) << text;
    EXPECT_THAT(result.errors, StartsWith(problem == nullptr ? "" : file.string() + problem));
    EXPECT_EQ(occurrences(result.errors, "\n"), problem == nullptr ? 0u : 1u) << result.errors;
  }
}

TEST(Configuration, AFileThatDoesNotParseKeepsTheDaemonFromStarting) {
  World world({.startDaemon = false});
  const auto facts = world.folder("config") / "facts.toml";
  writeFile(facts, "locale = \"en_GB\"\nno assignment\n");
  const auto result = world.sabled({});
  EXPECT_EQ(result.exitCode, 2);
  EXPECT_THAT(result.errors, HasSubstr(facts.string() + ":2:"));
  EXPECT_EQ(occurrences(result.errors, "\n"), 1u) << result.errors;
  EXPECT_FALSE(std::filesystem::exists(world.socket()));
}

TEST(Configuration, AValueOfTheWrongTypeIsReportedAndCountsAsAbsent) {
  World world({.settings = "SBLUseBramble = 1"});
  EXPECT_TRUE(answers(world));
  EXPECT_EQ(occurrences(world.daemonErrors(), "SBLUseBramble is not a boolean"), 1u) << world.daemonErrors();
}

TEST(Configuration, AFileThatBreaksLaterKeepsItsLastGoodContent) {
  World world;
  const auto facts = world.folder("config") / "facts.toml";
  ASSERT_TRUE(answers(world));
  writeFile(facts, "locale = \"de_DE\"\ncountry_code\n");
  world.waitForLog("its last good content stays");
  ASSERT_TRUE(answers(world));
  writeFile(facts, "locale = \"de_DE\"\ncountry_code = \"DE\"\n");
  world.waitForLog("something significant changed");
  ASSERT_TRUE(answers(world));
  std::vector<std::string> locales;
  for (const auto& request : world.requests("/search", 3)) {
    for (const auto& item : request["items"]) {
      if (item[0] == "locale") locales.push_back(item[1]);
    }
  }
  EXPECT_THAT(locales, testing::ElementsAre("en_GB", "en_GB", "de_DE"));
}

TEST(Life, ASecondDaemonLeavesTheSocketToTheFirst) {
  World world;
  const auto second = world.sabled({});
  EXPECT_EQ(second.exitCode, 1);
  EXPECT_THAT(second.errors, HasSubstr("sabled: another daemon holds " + world.socket() + "\n"));
  EXPECT_EQ(endpoints(world), kEndpoints) << "the first one's";
  EXPECT_TRUE(answers(world));
}

TEST(Life, SignalsEndTheDaemonInOrder) {
  for (const auto& [number, name] : {std::pair(SIGTERM, "SIGTERM"), std::pair(SIGINT, "SIGINT")}) {
    World world({.startDaemon = false});
    world.startDaemon({"--log-level", "debug"});
    ASSERT_TRUE(answers(world));
    world.daemon().signal(number);
    EXPECT_EQ(world.daemon().wait(), 0);
    EXPECT_EQ(occurrences(world.daemonErrors(), std::string(": ") + name + "\n"), 1u) << world.daemonErrors();
  }
}

TEST(Life, AKilledDaemonLeavesNothingInTheWayOfTheNext) {
  World world;
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(answers(world));
    world.killDaemon();
    EXPECT_TRUE(std::filesystem::exists(world.socket()));
    world.startDaemon();
  }
  EXPECT_EQ(endpoints(world), kEndpoints);
  EXPECT_TRUE(answers(world));
  EXPECT_EQ(world.requests("/bag", 1).size(), 1u) << "the bag was on disk";
}

TEST(Life, AnActivatedDaemonServesTheSocketThatItWasHanded) {
  World world({.startDaemon = false});
  const auto script = world.folder("activate.py"), handed = world.folder("handed.sock");
  writeFile(script, R"(
import os, socket, sys
listener = socket.socket(socket.AF_UNIX)
listener.bind(sys.argv[1])
listener.listen()
os.dup2(listener.fileno(), 3)
os.set_inheritable(3, True)
os.environ.update(LISTEN_PID=str(os.getpid()), LISTEN_FDS='1')
print('listening', flush=True)
os.execv(sys.argv[2], sys.argv[2:])
)");
  const auto daemon = world.start({"/usr/bin/python3", script, handed, World::program("sabled")});
  ASSERT_EQ(daemon->readLine(), "listening");
  EXPECT_EQ(world.sablectl({"--socket", handed, "search", "dog"}).exitCode, 0) << world.daemonErrors();
  EXPECT_FALSE(std::filesystem::exists(world.socket()));
}

TEST(Folders, ADaemonThatCanKeepNothingStillAnswers) {
  // What the daemon would write of these settings stands there already: it keeps nothing but what is looked
  // at.
  World world({.settings = "SBLHashtagImagesVisible = true\nSBLNewsVisible = true", .startDaemon = false});
  for (const char* name : {"caches", "state"}) {
    std::filesystem::remove_all(world.folder(name));
    writeFile(world.folder(name), "no folder");  // not even root can make one here
  }
  world.startDaemon();
  EXPECT_TRUE(answers(world));
  EXPECT_TRUE(answers(world));
  world.waitForLog("runs of activities are not kept");
  const std::string log = world.daemonErrors();
  EXPECT_EQ(occurrences(log, "counters are kept in memory only"), 1u) << log;
  // The bag and the record of activities miss their folders to read and to write, settings and the list of
  // applications to read, session files at the start; the sessions of the bag's fetch and of the clients miss
  // theirs, perhaps later.
  const auto sessions = occurrences(log, "Could not get a file url");
  EXPECT_LE(sessions, 2u) << log;
  EXPECT_EQ(occurrences(log, "Z error ") - sessions, 11u) << log;
}

TEST(BagFile, IsABinaryPropertyListForItsOwnerOnly) {
  const World world;
  const auto folder = world.folder("caches") / "com.kestrel.sabled", file = folder / "bag.plist";
  waitForChange(folder, [&] { return std::filesystem::exists(file); });
  struct stat status {};
  ASSERT_EQ(stat(file.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_THAT(readFile(file), StartsWith("bplist00"));
  const auto script = world.folder("read.py");
  writeFile(script,
            "import plistlib, sys\nbag = plistlib.load(open(sys.argv[1], 'rb'))\n"
            "print(bag['search_url'], bag['enabled'], bag['__expiration'] > 1e9, bag['__bagurl'][:16])\n");
  EXPECT_EQ(world.run({"/usr/bin/python3", script, file}).output,
            world.serviceURL() + "/search True True http://127.0.0.1\n");
}

TEST(BagFile, ATornOrForeignOneIsReportedAndReplaced) {
  World world;
  const auto folder = world.folder("caches") / "com.kestrel.sabled", file = folder / "bag.plist";
  waitForChange(folder, [&] { return std::filesystem::exists(file); });
  const std::string good = readFile(file);
  std::size_t reports = 0;
  for (const std::string& bad : {good.substr(0, good.size() / 2), std::string("not a list"), std::string()}) {
    world.killDaemon();
    writeFile(file, bad);
    world.startDaemon();
    waitForChange(folder, [&] { return readFile(file).size() > bad.size(); });
    EXPECT_THAT(readFile(file), StartsWith("bplist00"));
    EXPECT_EQ(occurrences(world.daemonErrors(), "Error reading from bag cache"), ++reports);
  }
  EXPECT_TRUE(answers(world));
}

}  // namespace
}  // namespace sable::test
