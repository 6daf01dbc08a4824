#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <atomic>
#include <mutex>
#include <thread>

#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/UnixSocket.h"
#include "platform/simulated/SimulatedLog.h"
#include "tests/support/RawPeer.h"

// What strangers do to a HostRelay: other D-Bus libraries, raw bytes, peers that do not read.
namespace sable::platform::host {
namespace {

using test::RawPeer;
using test::WireBytes;
using test::WireCall;

constexpr RelayMethod kMethods[] = {
    {"Echo", "ay", "ay"}, {"Keep", "", ""}, {"Describe", "a{sv}", "s"}, {"Fetch", "t", "ay"}};
constexpr RelayInterface kInterface{"com.kestrel.Test", "/com/kestrel/test", kMethods};

/// A call of Echo, ready to be spoilt.
WireCall echo(std::size_t size = 0) {
  return {.path = "/com/kestrel/test",
          .interface = "com.kestrel.Test",
          .member = "Echo",
          .signature = "ay",
          .body = WireBytes().word(static_cast<std::uint32_t>(size)).raw(std::string(size, 'p')).bytes()};
}

class HostRelayTest : public ::testing::Test {
 protected:
  ~HostRelayTest() override { stop(); }

  void start() {
    configuration_.runtimeFolder = fmt::format("{}relay-{}", ::testing::TempDir(), getpid());
    relay_ = std::make_unique<HostRelay>(runtime_, configuration_);
    listener_ = relay_->namedListener("test");
    listener_->setAcceptHandler([this](std::shared_ptr<RelayConnection> connection) {
      connection->exportObject(kInterface, [this](RelayCall call) { handle(std::move(call)); });
      connection->setInvalidationHandler([ended = ended_] { ended->signal(); });
      connection->resume();
      const std::lock_guard lock(mutex_);
      connections_.push_back(std::move(connection));
      return true;
    });
    const auto resumed = listener_->resume();
    ASSERT_TRUE(resumed) << resumed.error().description();
  }
  void stop() {
    listener_.reset();
    const std::lock_guard lock(mutex_);
    connections_.clear();
    kept_.clear();
  }

  void handle(RelayCall call) {
    switch (call.method) {
      case 0:
        return call.reply.send(std::move(call.arguments));
      case 1: {
        const std::lock_guard lock(mutex_);
        kept_.push_back(std::move(call.reply));
        if (kept_.size() == keep_) kept_.clear();
        return;
      }
      case 2: {
        std::string text;
        for (const auto& member : std::get<RelayRecord>(call.arguments[0]).members()) {
          text += fmt::format("{}:{} ", member.name, member.value.signature());
        }
        return call.reply(text);
      }
      default:
        return call.reply(makeData(std::string(std::get<std::uint64_t>(call.arguments[0]), 'f')));
    }
  }

  std::string path() const { return *pathOf(listener_->endpoint()); }
  bool waitForEnd() { return ended_->wait(runtime_.ticks() + std::chrono::seconds(60)); }

  sd_bus* connectBus() {
    sd_bus* bus = nullptr;
    sd_bus_new(&bus);
    sd_bus_set_address(bus, listener_->endpoint().c_str());
    EXPECT_GE(sd_bus_start(bus), 0);
    return bus;
  }
  /// The reply's string, or the error's name.
  template <class... Arguments>
  static std::string ask(sd_bus* bus, const char* path, const char* interface, const char* member,
                         const char* types, Arguments... arguments) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    std::string answer = "no answer";
    if (sd_bus_call_method(bus, "any.destination", path, interface, member, &error, &reply, types,
                           arguments...) < 0) {
      if (error.name != nullptr) answer = error.name;
    } else if (const char* text = nullptr; sd_bus_message_read_basic(reply, 's', &text) > 0) {
      answer = text;
    } else {
      answer = sd_bus_message_get_signature(reply, 1);
    }
    sd_bus_error_free(&error);
    sd_bus_message_unref(reply);
    return answer;
  }
  bool stillServes() {
    sd_bus* bus = connectBus();
    const std::string answer = ask(bus, "/com/kestrel/test", nullptr, "Echo", "ay", 0);
    sd_bus_flush_close_unref(bus);
    return answer == "ay" && waitForEnd();
  }

  simulated::SimulatedLog log_;
  HostRelayConfiguration configuration_;
  std::size_t keep_ = 0;  // so many calls are kept, then dropped together
  HostRuntime runtime_;
  std::shared_ptr<Semaphore> ended_ = runtime_.semaphore(0);
  std::mutex mutex_;
  std::vector<std::shared_ptr<RelayConnection>> connections_;
  std::vector<RelayReply> kept_;
  std::unique_ptr<HostRelay> relay_;
  std::unique_ptr<RelayListener> listener_;
};

TEST_F(HostRelayTest, AnyClientOfDBusFindsItsWay) {
  start();
  sd_bus* bus = connectBus();
  const char* path = "/com/kestrel/test";
  EXPECT_EQ(ask(bus, "/org/freedesktop/DBus", "org.freedesktop.DBus", "Hello", "").substr(0, 3), ":1.");
  EXPECT_EQ(ask(bus, "/any", "org.freedesktop.DBus.Peer", "Ping", ""), "");
  EXPECT_EQ(ask(bus, "/any", "org.freedesktop.DBus.Peer", "GetMachineId", "").size(), 32u);
  const std::string xml = ask(bus, path, "org.freedesktop.DBus.Introspectable", "Introspect", "");
  EXPECT_NE(xml.find("<method name=\"Describe\">\n   <arg type=\"a{sv}\" direction=\"in\"/>"),
            std::string::npos)
      << xml;
  for (const char* parent : {"/", "/com", "/com/kestrel"}) {
    EXPECT_NE(ask(bus, parent, "org.freedesktop.DBus.Introspectable", "Introspect", "").find("<node name="),
              std::string::npos);
  }
  EXPECT_EQ(ask(bus, path, "org.freedesktop.DBus.Properties", "GetAll", "s", "com.kestrel.Test"), "a{sv}");
  const char* properties = "org.freedesktop.DBus.Properties";
  for (const auto& [answer, error] : std::initializer_list<std::pair<std::string, const char*>>{
           {ask(bus, path, properties, "Get", "ss", "com.kestrel.Test", "P"), "UnknownProperty"},
           {ask(bus, path, properties, "Set", "ssv", "com.kestrel.Test", "P", "b", 1), "UnknownProperty"},
           {ask(bus, path, properties, "GetAll", "s", "com.kestrel.None"), "UnknownInterface"},
           {ask(bus, path, nullptr, "None", ""), "UnknownMethod"},
           {ask(bus, "/com/kest", "com.kestrel.Test", "Echo", ""), "UnknownObject"},
       }) {
    EXPECT_EQ(answer, std::string("org.freedesktop.DBus.Error.") + error);
  }
  sd_bus_flush_close_unref(bus);
}

TEST_F(HostRelayTest, NarrowIntegersAreWidenedAndUnknownTypesLeftOut) {
  start();
  sd_bus* bus = connectBus();
  EXPECT_EQ(
      ask(bus, "/com/kestrel/test", "com.kestrel.Test", "Describe", "a{sv}", 8, "y", "y", 1, "n", "n", 1, "q",
          "q", 1, "i", "i", 1, "u", "u", 1, "o", "o", "/", "r", "(ii)", 1, 2, "as", "as", 1, "x"),
      "y:t n:x q:t i:x u:t as:as ");
  sd_bus_flush_close_unref(bus);
}

TEST_F(HostRelayTest, TheLogSaysWhyMalformedBytesEndedTheirConnection) {
  start();
  const std::string good = echo().bytes();
  const auto spoilt = [&](std::size_t at, char byte) {
    std::string bytes = good;
    bytes[at] = byte;
    return bytes;
  };
  {
    RawPeer peer(path());
    peer.authenticate();
    peer.send(good);
    EXPECT_NE(peer.receive().find("ay"), std::string::npos);
  }
  EXPECT_TRUE(waitForEnd());
  EXPECT_EQ(log_.count("closed"), 0u);
  const std::string notDBus = "it sent what is no D-Bus message";
  for (const auto& [bytes, reason] : {std::pair{spoilt(0, 'x'), notDBus},
                                      {spoilt(good.size() - 4, 100), notDBus},
                                      {"no D-Bus at all, not even close to it", notDBus},
                                      {spoilt(7, 0x20), "its message is too large"},
                                      {spoilt(3, 9), notDBus},
                                      {spoilt(16, 77), notDBus}}) {
    log_.clear();
    RawPeer peer(path());
    peer.authenticate();
    peer.send(bytes);
    EXPECT_EQ(peer.receive(), "hung up");
    EXPECT_TRUE(waitForEnd());
    EXPECT_EQ(log_.count("closed: " + reason), 1u) << reason;
  }
  EXPECT_TRUE(stillServes());
}

TEST_F(HostRelayTest, CallsInFlightAreCountedExactly) {
  configuration_.quotas.callsInFlight = 4;
  keep_ = 4;
  start();
  WireCall keep = echo();
  keep.member = "Keep";
  keep.signature = keep.body = "";
  RawPeer peer(path());
  peer.authenticate();
  for (int i = 0; i < 12; ++i) peer.send(keep.bytes());
  peer.send(echo().bytes());
  std::string said = peer.receive();
  while (said.find("ay") == std::string::npos && said != "hung up" && said != "silence")
    said = peer.receive();
  ASSERT_NE(said.find("ay"), std::string::npos) << said;
  {
    const std::lock_guard lock(mutex_);
    keep_ = 0;
  }
  for (int i = 0; i < 5; ++i) peer.send(keep.bytes());
  EXPECT_TRUE(waitForEnd());
  EXPECT_EQ(log_.count("closed: it has too many calls in flight"), 1u);
}

TEST_F(HostRelayTest, APeerThatDoesNotReadIsCutOffButALargeReplyIsNot) {
  configuration_.quotas.queuedBytes = 100'000;
  start();
  sd_bus* reader = connectBus();
  EXPECT_EQ(ask(reader, "/com/kestrel/test", "com.kestrel.Test", "Fetch", "t", std::uint64_t{20'000'000}),
            "ay");
  sd_bus_flush_close_unref(reader);
  EXPECT_TRUE(waitForEnd());
  RawPeer peer(path());
  peer.authenticate();
  const std::string call = echo(60'000).bytes();
  int calls = 0;
  while (peer.send(call)) ASSERT_LT(++calls, 2000);
  EXPECT_TRUE(waitForEnd());
  EXPECT_EQ(log_.count("closed: it does not read what it asked for"), 1u);
  EXPECT_TRUE(stillServes());
}

TEST_F(HostRelayTest, AMessagePastTheLimitEndsItsConnection) {
  configuration_.quotas.messageBytes = 50'000;
  start();
  const std::size_t largest = 50'000 - echo().bytes().size();
  for (const auto& [size, outcome] : {std::pair(largest, "ay"), {largest + 1, "hung up"}}) {
    RawPeer peer(path());
    peer.authenticate();
    peer.send(echo(size).bytes());
    EXPECT_NE(peer.receive().find(outcome), std::string::npos) << size;
  }
  EXPECT_TRUE(waitForEnd() && waitForEnd());
  EXPECT_EQ(log_.count("closed: its message is too large"), 1u);
}

TEST_F(HostRelayTest, ConnectingAndLeavingLeavesNothingBehind) {
  const auto openDescriptors = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
  };
  start();
  ASSERT_TRUE(stillServes());
  const auto before = openDescriptors();
  for (int i = 0; i < 500; ++i) {
    RawPeer peer(path());
    if (i % 2 == 0) peer.authenticate();
    if (i % 3 == 0) peer.send(echo().bytes().substr(0, 50));
  }
  for (int i = 0; i < 500; ++i) ASSERT_TRUE(waitForEnd());
  {
    const std::lock_guard lock(mutex_);
    for (const auto& connection : connections_) EXPECT_LE(connection.use_count(), 2);
    connections_.clear();
  }
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(HostRelayTest, ALackOfDescriptorsLosesNobody) {
  start();
  ASSERT_TRUE(stillServes());
  rlimit limit{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit low{std::min<rlim_t>(200, limit.rlim_max), limit.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
  std::vector<Descriptor> hogs;
  for (;;) {
    Descriptor hog(open("/dev/null", O_RDONLY | O_CLOEXEC));
    if (!hog) break;
    hogs.push_back(std::move(hog));
  }
  hogs.pop_back();
  RawPeer late(path());
  while (log_.count("cannot accept") == 0) std::this_thread::yield();
  hogs.clear();
  late.authenticate();
  late.send(echo().bytes());
  EXPECT_NE(late.receive().find("ay"), std::string::npos);
  EXPECT_EQ(log_.count("cannot accept"), 1u);
  setrlimit(RLIMIT_NOFILE, &limit);
}

TEST_F(HostRelayTest, TheSocketIsPrivateAndTakenOverFromTheDeadOnly) {
  start();
  struct stat status {};
  ASSERT_EQ(stat(path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0600u);
  ASSERT_EQ(stat(configuration_.runtimeFolder.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0700u);

  const std::string held = path();
  stop();
  EXPECT_NE(access(held.c_str(), F_OK), 0);

  { const auto dead = listenAt(held); }
  EXPECT_EQ(access(held.c_str(), F_OK), 0);
  start();
  EXPECT_TRUE(stillServes());
  stop();

  const auto withoutLock = listenAt(held);
  EXPECT_EQ(relay_->namedListener("test")->resume().error().reason, "another daemon holds " + held);
  unlink(held.c_str());

  HostRelayConfiguration tooLong;
  tooLong.socketPath = "/tmp/" + std::string(120, 'p');
  EXPECT_FALSE(HostRelay(runtime_, tooLong).namedListener("test")->resume());
}

TEST(UnixSocket, AddressesAreEscapedAndReadBack) {
  for (const std::string path : {"/run/relay.sock", "/tmp/a b,c=d%/käse;"})
    EXPECT_EQ(*pathOf(endpointOf(path)), path);
  EXPECT_EQ(*pathOf("unix:path=/a%20b,guid=0123"), "/a b");
  for (const char* bad : {"", "tcp:host=localhost", "unix:abstract=x", "unix:path=/a%2", "unix:path=/a%zz"}) {
    EXPECT_FALSE(pathOf(bad)) << bad;
  }
}

TEST_F(HostRelayTest, TheExecutableOfAProcessIsKnown) {
  start();
  EXPECT_NE(relay_->executablePath(getpid())->find("HostRelayTest"), std::string::npos);
  EXPECT_FALSE(relay_->executablePath(-1));
}

}  // namespace
}  // namespace sable::platform::host
