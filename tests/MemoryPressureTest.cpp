#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "platform/MemoryPressure.h"
#include "platform/host/HostMemoryPressure.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;

class MemoryPressureTest : public testing::Test {
 protected:
  MemoryPressureTest() { std::filesystem::create_directories(folder_); }
  ~MemoryPressureTest() override { std::filesystem::remove_all(folder_); }

  static void write(const std::filesystem::path& path, const char* text) { std::ofstream(path) << text; }
  bool raised() { return raised_->wait(runtime_.ticks() + 30s); }
  auto listen(host::HostMemoryPressure& pressure) {
    return pressure.onCritical(runtime_.serialQueue("pressure"), [this] { raised_->signal(); });
  }

  const std::filesystem::path folder_ =
      std::filesystem::path(testing::TempDir()) / ("pressure." + std::to_string(::getpid()));
  host::HostRuntime runtime_{2};
  std::unique_ptr<Semaphore> raised_ = runtime_.semaphore(0);
};

TEST_F(MemoryPressureTest, AWriteToTheFileIsCriticalPressure) {
  host::HostMemoryPressure pressure(runtime_.reactor(),
                                    {.stalls = "/nowhere", .events = "/nowhere", .file = folder_ / "file"});
  EXPECT_FALSE(pressure.availability().available);
  auto first = listen(pressure);
  write(folder_ / "file", "now");
  EXPECT_TRUE(raised());
  auto second = listen(pressure);
  first.reset();
  write(folder_ / "file", "again");
  EXPECT_TRUE(raised());
  second.reset();
  auto third = listen(pressure);
  write(folder_ / "file", "and again");
  EXPECT_TRUE(raised());
}

TEST_F(MemoryPressureTest, ACgroupThatHitsItsLimitIsCriticalPressure) {
  const auto events = folder_ / "memory.events";
  write(events, "low 0\nhigh 3\nmax 0\noom 0\noom_kill 0\n");
  host::HostMemoryPressure pressure(runtime_.reactor(), {.stalls = "/nowhere", .events = events, .file = {}});
  EXPECT_EQ(pressure.availability().detail, "cgroup events");
  const auto source = listen(pressure);
  write(events, "low 7\nhigh 4\nmax 0\noom 0\noom_kill 0\n");
  EXPECT_TRUE(raised());
}

}  // namespace
}  // namespace sable::platform
