#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <chrono>
#include <memory>
#include <semaphore>

#include "platform/host/HostQueue.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {
namespace {

using namespace std::chrono_literals;

TEST(HostRuntimeTest, SyncNeedsNoFreeThread) {
  HostRuntime runtime(2);
  std::counting_semaphore<> release(0);
  for (int i = 0; i < 2; ++i) {
    runtime.globalQueue(QualityOfService::high).async([&] { release.acquire(); });
  }
  const auto queue = runtime.serialQueue("drained by its caller");
  const auto table = runtime.concurrentQueue("too");
  int ran = 0;
  for (int i = 0; i < 100; ++i) {
    queue->async([&] { ++ran; });
    table->barrierAsync([&] { ++ran; });
  }
  EXPECT_EQ(queue->sync([&] { return ran; }), 100);
  EXPECT_EQ(table->sync([&] { return ran; }), 200);
  release.release(2);
}

TEST(HostRuntimeTest, WorkPostedFromLongWorkFindsAWaitingThread) {
  HostRuntime runtime(2);
  std::binary_semaphore other(0);
  const auto done = runtime.semaphore(0);
  runtime.globalQueue(QualityOfService::standard).async([&] {
    runtime.globalQueue(QualityOfService::standard).async([&] { other.release(); });
    other.acquire();  // unknown to the runtime, as a slow disk is
    done->signal();
  });
  EXPECT_TRUE(done->wait(runtime.ticks() + 30s));
}

TEST(HostRuntimeTest, AnIdleQueueRunsWorkInline) {
  HostRuntime runtime(2);
  const auto queue = runtime.serialQueue("inline");
  auto& hostQueue = dynamic_cast<HostQueue&>(*queue);
  int ran = 0;
  Function<void()> work = [&] { ++ran; };
  queue->sync([&] { EXPECT_FALSE(hostQueue.tryRunInline(work)); });
  EXPECT_EQ(ran, 0);
  EXPECT_TRUE(hostQueue.tryRunInline(work));
  EXPECT_EQ(ran, 1);
}

class Sockets {
 public:
  Sockets() { EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, ends_.data()), 0); }
  ~Sockets() {
    ::close(ends_[0]);
    ::close(ends_[1]);
  }
  Sockets(const Sockets&) = delete;
  Sockets& operator=(const Sockets&) = delete;
  int near() const { return ends_[0]; }
  bool send() { return ::send(ends_[1], "x", 1, 0) == 1; }
  bool receive() { return ::recv(ends_[0], &byte_, 1, MSG_DONTWAIT) == 1; }

 private:
  std::array<int, 2> ends_{};
  char byte_ = 0;
};

TEST(HostReactorTest, AWatchGetsOneEventAnArm) {
  HostRuntime runtime(
      1);  // one thread takes events in their order, so a later one proves the absence of an earlier
  Sockets sockets;
  std::atomic<int> calls = 0;
  const auto watch = runtime.reactor().watch(sockets.near(), [&](Events events) {
    EXPECT_EQ(events, static_cast<Events>(EPOLLIN));
    ++calls;
  });
  const auto callsUntilNow = [&] {
    Sockets later;
    const auto called = runtime.semaphore(0);
    const auto laterWatch = runtime.reactor().watch(later.near(), [&](Events) { called->signal(); });
    laterWatch->arm(EPOLLOUT);
    EXPECT_TRUE(called->wait(MonotonicTime::max()));
    return calls.load();
  };
  ASSERT_TRUE(sockets.send());
  EXPECT_EQ(callsUntilNow(), 0);
  watch->arm(EPOLLIN);
  EXPECT_EQ(callsUntilNow(), 1);
  EXPECT_EQ(callsUntilNow(), 1);
  ASSERT_TRUE(sockets.receive());
  watch->arm(EPOLLIN);
  watch->arm(0);
  ASSERT_TRUE(sockets.send());
  EXPECT_EQ(callsUntilNow(), 1);
  watch->arm(EPOLLIN);
  EXPECT_EQ(callsUntilNow(), 2);
}

TEST(HostReactorTest, OneThreadAtATimeServesADescriptor) {
  HostRuntime runtime(4);
  Sockets sockets;
  ASSERT_TRUE(sockets.send());
  const auto done = runtime.semaphore(0);
  std::atomic<int> serving = 0;
  std::atomic<int> turns = 0;
  std::unique_ptr<Reactor::Watch> watch;
  watch = runtime.reactor().watch(sockets.near(), [&](Events) {
    EXPECT_EQ(++serving, 1);
    if (++turns < 2000) {
      watch->arm(EPOLLIN);
      watch->arm(EPOLLIN | EPOLLOUT);
    } else {
      done->signal();
    }
    --serving;
  });
  for (int i = 0; i < 100; ++i) watch->arm(EPOLLIN);
  EXPECT_TRUE(done->wait(runtime.ticks() + 30s));
}

TEST(HostReactorTest, AnEventNeverReachesTheNextOwnerOfADescriptorsNumber) {
  HostRuntime runtime(4);
  std::atomic<int> strayEvents = 0;
  for (int round = 0; round < 3000; ++round) {
    auto loud = std::make_shared<Sockets>();
    auto loudWatch = runtime.reactor().watch(loud->near(), [loud](Events) { loud->receive(); });
    loudWatch->arm(EPOLLIN);
    ASSERT_TRUE(loud->send());
    loudWatch.reset();
    loud.reset();
    const auto quiet = std::make_shared<Sockets>();
    const auto quietWatch = runtime.reactor().watch(quiet->near(), [&](Events) { ++strayEvents; });
    quietWatch->arm(EPOLLIN);
  }
  EXPECT_EQ(strayEvents, 0);
}

}  // namespace
}  // namespace sable::platform::host
