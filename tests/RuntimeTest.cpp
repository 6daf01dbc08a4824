#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <limits>
#include <memory>
#include <numeric>
#include <string>
#include <vector>

#include "platform/Runtime.h"
#include "platform/host/HostRuntime.h"
#include "platform/simulated/SimulatedRuntime.h"

namespace sable::platform {
namespace {

using host::HostRuntime;
using simulated::SimulatedRuntime;
using namespace std::chrono_literals;

/// What any runtime promises, asked of each. Nothing here sleeps: tests wait for what they caused.
class AnyRuntime : public testing::TestWithParam<const char*> {
 protected:
  MonotonicTime soon() const { return runtime_->ticks() + 30s; }
  std::unique_ptr<Runtime> runtime_ = GetParam() == std::string("host")
                                          ? std::unique_ptr<Runtime>(std::make_unique<HostRuntime>(2))
                                          : std::make_unique<SimulatedRuntime>();
};

INSTANTIATE_TEST_SUITE_P(Runtimes, AnyRuntime, testing::Values("host", "simulated"),
                         [](const auto& each) { return std::string(each.param); });

TEST_P(AnyRuntime, ASerialQueueRunsOnePieceAtATimeFirstInFirstOut) {
  constexpr int kProducers = 4;
  constexpr int kPieces = 500;
  const auto queue = runtime_->serialQueue("order");
  const auto done = runtime_->semaphore(0);
  std::array<int, kProducers> last{};
  int total = 0;
  std::atomic<int> running = 0;
  const auto piece = [&](int producer, int number) {
    EXPECT_EQ(++running, 1);
    EXPECT_EQ(std::exchange(last[static_cast<std::size_t>(producer)], number), number - 1);
    ++total;
    --running;
  };
  for (int producer = 0; producer < kProducers; ++producer) {
    runtime_->globalQueue(QualityOfService::standard).async([&, producer] {
      for (int number = 1; number <= kPieces; ++number) {
        if (number % 3 == 0) {
          queue->sync([&] { piece(producer, number); });
        } else {
          queue->async([&, producer, number] { piece(producer, number); });
        }
      }
      done->signal();
    });
  }
  for (int producer = 0; producer < kProducers; ++producer) ASSERT_TRUE(done->wait(soon()));
  EXPECT_EQ(queue->sync([&] { return total; }), kProducers * kPieces);
}

TEST_P(AnyRuntime, AQueueIsCurrentForItsWorkAndTheSyncCallsInIt) {
  const auto outer = runtime_->serialQueue("outer");
  const auto inner = runtime_->serialQueue("inner");
  const auto answered = runtime_->semaphore(0);
  outer->sync([&] {
    inner->sync([&] {
      EXPECT_TRUE(outer->isCurrent());
      EXPECT_TRUE(inner->isCurrent());
    });
    EXPECT_TRUE(outer->isCurrent());
    EXPECT_FALSE(inner->isCurrent());
    // Work that runs while this one waits is not on its queue.
    runtime_->globalQueue(QualityOfService::high).async([&] {
      EXPECT_FALSE(outer->isCurrent());
      answered->signal();
    });
    EXPECT_TRUE(answered->wait(soon()));
  });
  EXPECT_FALSE(outer->isCurrent());
}

TEST_P(AnyRuntime, SyncOntoItsOwnQueueStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto queue = runtime_->serialQueue("com.kestrel.sabled.own");
  EXPECT_DEATH(queue->sync([&] { queue->sync([] {}); }), "sync onto queue com.kestrel.sabled.own");
  EXPECT_DEATH(queue->assertIsCurrent(), "not on queue com.kestrel.sabled.own");
}

TEST_P(AnyRuntime, QueuedWorkKeepsItsQueue) {
  const auto ran = runtime_->semaphore(0);
  runtime_->serialQueue("kept")->async([&] { ran->signal(); });
  runtime_->serialQueue("kept")->after(1ms, [&] { ran->signal(); }).detach();
  EXPECT_TRUE(ran->wait(soon()) && ran->wait(soon()));
}

TEST_P(AnyRuntime, WorkThatNeverRanIsDroppedWithTheRuntime) {
  const auto token = std::make_shared<int>();
  const auto queue = runtime_->serialQueue("holds itself");
  auto timer = queue->after(1h, [token] {});
  ASSERT_EQ(token.use_count(), 2);
  runtime_->serialQueue("detached")->after(1h, [token] {}).detach();
  EXPECT_EQ(token.use_count(), 3);
  timer.cancel();
  EXPECT_EQ(token.use_count(), 2);
  for (int i = 0; i < 100; ++i) queue->async([queue, token] {});
  runtime_.reset();
  EXPECT_EQ(token.use_count(), 1);
}

TEST_P(AnyRuntime, TimersRunInOrderOfDeadlineAndNotOnceCancelled) {
  const auto queue = runtime_->serialQueue("timers");
  const auto last = runtime_->semaphore(0);
  std::vector<int> order;
  std::vector<Timer> timers;
  const auto add = [&](Duration delay, int number) {
    timers.push_back(queue->after(delay, [&order, number] { order.push_back(number); }));
  };
  const MonotonicTime start = runtime_->ticks();
  queue->sync([&] {
    add(9ms, 9);
    add(6ms, 6);
    add(7ms, -1);
    add(3ms, 3);
    add(-5s, 0);
    timers.push_back(queue->after(12ms, [&] { last->signal(); }));
    timers[2].cancel();
    {
      const auto destroyed = queue->after(0s, [&] { order.push_back(-2); });
    }
  });
  ASSERT_TRUE(last->wait(soon()));
  EXPECT_GE(runtime_->ticks() - start, 12ms);
  EXPECT_EQ(order, (std::vector{0, 3, 6, 9}));
}

TEST_P(AnyRuntime, CancellingADueTimerFromItsQueueIsExact) {
  const auto queue = runtime_->serialQueue("exact");
  const auto due = runtime_->semaphore(0);
  bool ran = false;
  Timer timer;
  queue->sync([&] {
    timer = queue->after(1ms, [&] { ran = true; });
    runtime_->serialQueue("other")->after(2ms, [&] { due->signal(); }).detach();
    EXPECT_TRUE(due->wait(soon()));  // by now the timer's work stands in this queue, behind this piece
    timer = Timer();
  });
  queue->sync([] {});
  EXPECT_FALSE(ran);
}

TEST_P(AnyRuntime, SemaphoresAndWaitGroupsKeepTheirDeadlines) {
  const auto semaphore = runtime_->semaphore(1);
  EXPECT_TRUE(semaphore->wait(MonotonicTime{}));
  EXPECT_FALSE(semaphore->wait(MonotonicTime{}));
  const MonotonicTime deadline = runtime_->ticks() + 2ms;
  EXPECT_FALSE(semaphore->wait(deadline));
  EXPECT_GE(runtime_->ticks(), deadline);

  const auto group = runtime_->waitGroup();
  EXPECT_TRUE(group->wait(MonotonicTime{}));
  std::atomic<int> left = 0;
  for (int i = 0; i < 8; ++i) {
    group->enter();
    runtime_->globalQueue(QualityOfService::background).async([&] {
      ++left;
      group->leave();
    });
  }
  EXPECT_TRUE(group->wait(MonotonicTime::max()));
  EXPECT_EQ(left, 8);
  group->enter();
  EXPECT_FALSE(group->wait(runtime_->ticks() + 2ms));
}

TEST_P(AnyRuntime, WaitingWorkDoesNotStarveTheWorkThatSignals) {
  constexpr int kWaiting = 12;
  const auto arrived = runtime_->semaphore(0);
  const auto finished = runtime_->semaphore(0);
  auto& queue = runtime_->globalQueue(QualityOfService::high);
  for (int i = 0; i < kWaiting; ++i) {
    queue.async([&] {
      EXPECT_TRUE(arrived->wait(soon()));
      finished->signal();
    });
  }
  runtime_->globalQueue(QualityOfService::background).async([&] {
    for (int i = 0; i < kWaiting; ++i) arrived->signal();
  });
  for (int i = 0; i < kWaiting; ++i) ASSERT_TRUE(finished->wait(soon()));
}

TEST_P(AnyRuntime, BarriersRunAloneAndInOrder) {
  const auto queue = runtime_->concurrentQueue("table");
  const auto done = runtime_->waitGroup();
  std::vector<int> written;
  const auto consistent = [&] {
    std::vector<int> expected(written.size());
    std::iota(expected.begin(), expected.end(), 0);
    return written == expected;
  };
  for (int i = 0; i < 200; ++i) {
    queue->barrierAsync([&, i] { written.push_back(i); });
    done->enter();
    runtime_->globalQueue(QualityOfService::standard).async([&] {
      EXPECT_TRUE(queue->sync([&] { return consistent() && queue->sync(consistent); }));
      done->leave();
    });
    if (i % 10 == 0) {
      EXPECT_EQ(queue->sync([&] { return written.size(); }), static_cast<std::size_t>(i) + 1);
    }
  }
  queue->barrierSync([&] { EXPECT_EQ(written.size(), 200U); });
  EXPECT_TRUE(done->wait(soon()));
}

TEST_P(AnyRuntime, ReadersRunSideBySide) {
  const auto queue = runtime_->concurrentQueue("readers");
  const auto inside = runtime_->semaphore(0);
  const auto outside = runtime_->semaphore(0);
  runtime_->globalQueue(QualityOfService::standard).async([&, queue] {
    queue->sync([&] { inside->signal(); });
    outside->signal();
  });
  queue->sync([&] { EXPECT_TRUE(inside->wait(soon())); });
  EXPECT_TRUE(outside->wait(soon()));
}

TEST_P(AnyRuntime, UUIDsAreVersionFourAndDiffer) {
  const UUID first = runtime_->uuid();
  EXPECT_EQ(first.string()[14], '4');
  EXPECT_NE(std::string("89AB").find(first.string()[19]), std::string::npos);
  EXPECT_NE(first, runtime_->uuid());
}

std::string interleaving(std::uint64_t seed) {
  SimulatedRuntime runtime(seed);
  std::string trace;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (char name = 'a'; name <= 'd'; ++name) {
    queues.push_back(runtime.serialQueue(std::string(1, name)));
    for (int i = 0; i < 5; ++i) queues.back()->async([&trace, name] { trace += name; });
  }
  runtime.run();
  return trace + runtime.uuid().string();
}

TEST(SimulatedRuntimeTest, ASeedIsARun) {
  EXPECT_EQ(interleaving(7), interleaving(7));
  EXPECT_NE(interleaving(7).substr(0, 20), interleaving(8).substr(0, 20));
}

TEST(SimulatedRuntimeTest, WhatCanNeverEndStopsTheProcess) {
  SimulatedRuntime runtime;
  const auto queue = runtime.serialQueue("stuck");
  const auto never = runtime.semaphore(0);
  EXPECT_DEATH((void)never->wait(MonotonicTime::max()), "nothing is left to end");
  runtime.globalQueue(QualityOfService::standard).async([&] { queue->sync([] {}); });
  EXPECT_DEATH(queue->sync([&] { (void)never->wait(runtime.ticks() + 1s); }),
               "sync onto queue stuck, whose work waits");
}

TEST(UUIDTest, ReadsCanonicalTextOnly) {
  const std::string text = "F81D4FAE-7DEC-41D0-A765-00A0C91E6BF6";
  EXPECT_EQ(UUID::parse(text)->string(), text);
  EXPECT_EQ(UUID::parse("f81d4fae-7dec-41d0-a765-00a0c91e6bf6"), UUID::parse(text));
  for (const char* bad : {"", "F81D4FAE7DEC41D0A76500A0C91E6BF6", "F81D4FAE-7DEC-41D0-A765-00A0C91E6BF",
                          "F81D4FAE-7DEC-41D0-A765-00A0C91E6BF6 ", "G81D4FAE-7DEC-41D0-A765-00A0C91E6BF6",
                          "F81D4FAE07DEC-41D0-A765-00A0C91E6BF6", "{F81D4FAE-7DEC-41D0-A765-00A0C91E6B}"}) {
    EXPECT_EQ(UUID::parse(bad), std::nullopt) << bad;
  }
}

TEST(RuntimeTest, SecondsBecomeDurationsWithinTheirRange) {
  EXPECT_EQ(fromSeconds(1.5), 1500ms);
  EXPECT_EQ(fromSeconds(-0.25), -250ms);
  EXPECT_EQ(fromSeconds(1e300), Duration::max());
  EXPECT_EQ(fromSeconds(-1e300), Duration::min());
  EXPECT_EQ(fromSeconds(std::numeric_limits<double>::quiet_NaN()), Duration::zero());
  EXPECT_EQ(secondsSince1970(wallTimeFromSecondsSince1970(1795381164.25)), 1795381164.25);
}

}  // namespace
}  // namespace sable::platform
