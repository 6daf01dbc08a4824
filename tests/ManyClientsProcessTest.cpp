#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <deque>
#include <functional>
#include <latch>

#include "tests/support/LoopbackServer.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// Many clients at once and one after the other: what they cost the daemon, and that it is given back.
namespace sable::test {
namespace {

using tests::LoopbackServer;

// A sanitizer's shadow, quarantine and red zones say nothing about the daemon's own memory.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif
constexpr int kCycles = kSanitized ? 1'000 : 10'000;

class ManyClients : public testing::Test {
 protected:
  ManyClients() {
    server_.on("/bag", LoopbackServer::ok(R"({"version": "1", "enabled": true, "search_url": ")" +
                                          server_.url("/search") + "\"}"));
    server_.on("/search", LoopbackServer::ok("[" + std::string(4096, ' ') + "]"));
    world_.startDaemon({"--log-level", "fault"});
  }

  std::filesystem::path proc(const char* name) {
    return std::filesystem::path("/proc") / std::to_string(world_.daemon().pid()) / name;
  }

  std::int64_t residentKiB() {
    const std::string status = readFile(proc("status"));
    return std::stoll(status.substr(status.find("VmRSS:") + 6));
  }

  /// That the daemon has open.
  std::ptrdiff_t descriptors() { return std::distance(std::filesystem::directory_iterator(proc("fd")), {}); }

  /// Connects, says `greeting`, and leaves without a word.
  void connectAndDrop(std::string_view greeting) const {
    const int client = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    world_.socket().copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(connect(client, reinterpret_cast<sockaddr*>(&address), sizeof address), 0) << strerror(errno);
    ASSERT_EQ(send(client, greeting.data(), greeting.size(), MSG_NOSIGNAL), std::ssize(greeting));
    close(client);
  }

  platform::host::HostRuntime runtime_;
  LoopbackServer server_{runtime_};
  World world_{{.settings = "SBLUseBramble = false", .bagURL = server_.url("/bag"), .startDaemon = false}};
};

TEST_F(ManyClients, TwoHundredSearchAtOnceAndEachIsAnswered) {
  constexpr int kClients = 200;
  constexpr std::uint64_t kSearches = 5;
  // Who comes before the bag waits a second for it, which is not what is looked at here.
  ASSERT_TRUE(TestClient(runtime_, world_.address()).search("dog").isClean());
  const std::int64_t before = residentKiB();
  std::deque<TestClient> clients;
  for (int i = 0; i < kClients; ++i) {
    const std::string name = "client-" + std::to_string(i);
    clients.emplace_back(runtime_, world_.address(), SBLSessionConfiguration{name, name + "/1"});
  }
  std::latch answered(kClients * kSearches);
  std::atomic<int> clean = 0;
  // A newer search of a client supersedes its older one: so each waits for the one before.
  std::function<void(TestClient&, std::uint64_t)> ask = [&](TestClient& client, std::uint64_t id) {
    SBLSearchRequest search;
    search.queryId = id;
    search.queryString = "query " + std::to_string(id);
    client.client().request(
        search, [&, id](std::uint64_t, std::optional<SBLReply> reply, const std::optional<Error>& error) {
          if (reply && !error) ++clean;
          if (id < kSearches) ask(client, id + 1);
          answered.count_down();
        });
  };
  for (TestClient& client : clients) ask(client, 1);
  answered.wait();
  EXPECT_EQ(clean, static_cast<int>(kClients * kSearches));
  if (!kSanitized) {
    EXPECT_LT(residentKiB() - before, 64 << 10);
  }
}

TEST_F(ManyClients, ThoseWhoLeaveLeaveNothingBehind) {
  using namespace std::string_view_literals;
  static constexpr std::string_view kGreetings[] = {""sv, "\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n"sv,
                                                    "\xff junk"sv};
  const auto cycle = [&](int times) {
    for (int i = 0; i < times; ++i) {
      connectAndDrop(kGreetings[i % 3]);
      if (i % 100 == 0) {
        EXPECT_TRUE(TestClient(runtime_, world_.address()).search("dog").isClean());
      }
    }
  };
  EXPECT_TRUE(TestClient(runtime_, world_.address()).search("dog").isClean());
  const auto descriptorsBefore = descriptors();
  cycle(kCycles / 10);
  const std::int64_t before = residentKiB();
  cycle(kCycles);
  // A search is answered after all who came before have been accepted, not after they are gone; answered
  // from the cache, it may be quicker than their end.
  TestClient last(runtime_, world_.address());
  bool gone = false;
  for (int patience = 20'000; !gone && patience > 0; --patience) {
    last.search("dog");
    gone = descriptors() <= descriptorsBefore + 4;
  }
  EXPECT_TRUE(gone) << descriptors() << " descriptors, " << descriptorsBefore << " before";
  if (!kSanitized) {
    EXPECT_LT(residentKiB() - before, 4 << 10);
  }
}

}  // namespace
}  // namespace sable::test
