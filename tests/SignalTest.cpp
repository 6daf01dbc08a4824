#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>

#include "platform/Process.h"
#include "platform/host/HostProcess.h"
#include "platform/host/HostRuntime.h"
#include "platform/simulated/SimulatedProcess.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;

TEST(HostProcessTest, ASignalReachesTheResumedSourcesOfItsNumber) {
  host::HostRuntime runtime(2);
  host::HostProcess process(runtime.reactor());
  process.ignoreSignal(TerminationSignal::terminate);
  const auto queue = runtime.serialQueue("signals");
  const auto heard = runtime.semaphore(0);
  int ended = 0;
  const auto count = [&] { heard->signal(); };
  const auto first = process.signalSource(TerminationSignal::terminate, *queue, count);
  const auto second = process.signalSource(TerminationSignal::terminate, *queue, count);
  auto gone = process.signalSource(TerminationSignal::terminate, *queue, [&] { ++ended; });
  const auto other = process.signalSource(TerminationSignal::interrupt, *queue, [&] { ++ended; });
  gone->resume();
  other->resume();
  gone.reset();

  ASSERT_EQ(::kill(::getpid(), SIGTERM), 0);  // kept until a source is resumed
  second->resume();
  EXPECT_TRUE(heard->wait(runtime.ticks() + 30s));
  first->resume();
  ASSERT_EQ(::kill(::getpid(), SIGTERM), 0);
  EXPECT_TRUE(heard->wait(runtime.ticks() + 30s));
  EXPECT_TRUE(heard->wait(runtime.ticks() + 30s));
  EXPECT_EQ(queue->sync([&] { return ended; }), 0);
}

TEST(HostProcessTest, TheMainLoopReturnsWhenStopped) {
  host::HostRuntime runtime(2);
  host::HostProcess process(runtime.reactor());
  runtime.globalQueue(QualityOfService::standard).async([&] { process.stop(); });
  process.runMainLoop();
  EXPECT_EXIT(process.exit(3), testing::ExitedWithCode(3), "");
}

TEST(SimulatedProcessTest, SignalsReachSourcesOrEndTheProcess) {
  simulated::SimulatedRuntime runtime;
  simulated::SimulatedProcess process(runtime);
  const auto queue = runtime.serialQueue("signals");
  process.ignoreSignal(TerminationSignal::terminate);
  const auto source = process.signalSource(TerminationSignal::terminate, *queue, [&] { process.exit(0); });
  process.raise(TerminationSignal::terminate);
  runtime.run();
  EXPECT_EQ(process.exitStatus(), std::nullopt);
  source->resume();
  process.raise(TerminationSignal::terminate);
  process.runMainLoop();
  EXPECT_EQ(process.exitStatus(), 0);

  simulated::SimulatedProcess unprepared(runtime);
  unprepared.raise(TerminationSignal::interrupt);
  EXPECT_EQ(unprepared.exitStatus(), 130);
}

}  // namespace
}  // namespace sable::platform
