#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <memory>

#include "platform/OpenMetrics.h"
#include "platform/Tally.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/MappedTally.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedTally.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

using Counters = std::map<std::string, std::int64_t>;
using host::MappedTally;

struct TallyTest : testing::Test {
  TemporaryFolder folder;
  simulated::SimulatedLog log;
  std::filesystem::path path = folder / "state/counters.tally";
};

TEST_F(TallyTest, CountersAddUpAndCanBeSet) {
  MappedTally mapped(path);
  simulated::SimulatedTally simulated;
  for (Tally* tally : {static_cast<Tally*>(&mapped), static_cast<Tally*>(&simulated)}) {
    tally->add("searches", 2);
    tally->add("searches", 3);
    tally->add("balance", -7);
    tally->set("level", 40);
    tally->set("level", 4);
    EXPECT_EQ(tally->snapshot(), (Counters{{"searches", 5}, {"balance", -7}, {"level", 4}}));
  }
}

TEST_F(TallyTest, CountersOutliveAProcessThatIsKilled) {
  const pid_t child = fork();
  if (child == 0) {
    MappedTally tally(path);
    tally.add("before", 1);
    for (int i = 0; i < 100; ++i) tally.add("key" + std::to_string(i), i);
    raise(SIGKILL);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status));

  EXPECT_EQ(MappedTally::snapshotOf(path)->size(), 101u);
  MappedTally tally(path);
  tally.add("key99", 1);
  EXPECT_EQ(tally.snapshot().at("key99"), 100);
  EXPECT_EQ(MappedTally::snapshotOf(path)->at("key99"), 100);
  struct stat file {};
  ASSERT_EQ(stat(path.c_str(), &file), 0);
  EXPECT_EQ(file.st_mode & 07777, 0600u);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(TallyTest, TheFileLiesAsDescribed) {
  MappedTally(path).add("abc", 0x0102030405060708);
  const std::string bytes = readFile(path);
  ASSERT_GE(bytes.size(), 256u);
  EXPECT_EQ(bytes.size() % 128, 0u);
  EXPECT_EQ(bytes.substr(0, 16), std::string("SBLTALLY\x01\0\0\0\x80\0\0\0", 16));
  EXPECT_EQ(bytes.substr(128, 12),
            "\x08\x07\x06\x05\x04\x03\x02\x01\x03"
            "abc");
  EXPECT_EQ(bytes.find_first_not_of('\0', 140), std::string::npos);
}

TEST_F(TallyTest, AFileThatIsSomethingElseIsKeptAsideAndReplaced) {
  MappedTally(path).add("a", 1);
  std::string badLength = readFile(path), badVersion = badLength;
  badLength[128 + 8] = 120;
  badVersion[8] = 2;
  for (const std::string& bytes :
       {std::string("hello"), std::string(4096, 'x'), badLength, badVersion, std::string(1 << 20, '\0')}) {
    log.clear();
    writeFile(path, bytes);
    EXPECT_FALSE(MappedTally::snapshotOf(path));
    MappedTally tally(path);
    tally.add("b", 2);
    EXPECT_EQ(*MappedTally::snapshotOf(path), (Counters{{"b", 2}}));
    EXPECT_EQ(readFile(path.string() + ".damaged"), bytes);
    EXPECT_EQ(log.count(LogLevel::error), 1u);
  }
}

TEST_F(TallyTest, WhereTheFileCannotBeHadMemoryServesAndThatIsSaidOnce) {
  writeFile(folder / "file", "");
  const MappedTally holder(path);
  std::filesystem::create_directories(folder / "folder/counters.tally");
  for (const auto& taken : {folder / "file/counters.tally", path, folder / "folder/counters.tally"}) {
    log.clear();
    MappedTally tally(taken);
    EXPECT_FALSE(tally.isPersistent());
    for (int i = 0; i < 1000; ++i) tally.add("key" + std::to_string(i % 500), 1);
    EXPECT_EQ(tally.snapshot().size(), 500u);
    EXPECT_EQ(tally.snapshot().at("key7"), 2);
    EXPECT_EQ(log.count(LogLevel::error), 1u);
  }
}

TEST_F(TallyTest, KeysEndAtTheBoundaryAndSoDoesTheirNumber) {
  MappedTally tally(path);
  const std::string longest(MappedTally::kMaximumKeyBytes, 'k');
  tally.add(longest, 1);
  tally.add(longest + "k", 1);
  tally.add("", 1);
  EXPECT_EQ(log.count(LogLevel::error), 1u);
  for (std::size_t i = 0; i < MappedTally::kMaximumKeys + 10; ++i) tally.add("key" + std::to_string(i), 1);
  EXPECT_EQ(tally.snapshot().size(), MappedTally::kMaximumKeys);
  EXPECT_EQ(tally.snapshot(), *MappedTally::snapshotOf(path));
  EXPECT_EQ(tally.snapshot().at(longest), 1);
}

TEST_F(TallyTest, AdditionsFromManyThreadsAreAllCounted) {
  MappedTally tally(path);
  host::HostRuntime runtime(4);
  const auto done = runtime.waitGroup();
  for (int thread = 0; thread < 4; ++thread) {
    done->enter();
    runtime.globalQueue(QualityOfService::standard).async([&] {
      for (int i = 0; i < 10'000; ++i) tally.add("key" + std::to_string(i % 200), 1);
      EXPECT_LE(tally.snapshot().size(), 200u);
      done->leave();
    });
  }
  ASSERT_TRUE(done->wait(MonotonicTime::max()));
  for (const auto& [key, value] : tally.snapshot()) EXPECT_EQ(value, 200) << key;
}

TEST(OpenMetricsTest, NamesAreLabelsWithTheirQuotesEscaped) {
  EXPECT_EQ(openMetricsText({{"com.kestrel.sabled.searches", 3}, {"a\"b\\c\nd", -1}}),
            "# TYPE sabled_tally gauge\n"
            "# HELP sabled_tally Aggregate counters of the search daemon.\n"
            "sabled_tally{key=\"a\\\"b\\\\c\\nd\"} -1\n"
            "sabled_tally{key=\"com.kestrel.sabled.searches\"} 3\n"
            "# EOF\n");
}

}  // namespace
}  // namespace sable::platform
