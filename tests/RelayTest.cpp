#include <fmt/ranges.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <mutex>

#include "platform/Relay.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "platform/simulated/SimulatedRelay.h"
#include "platform/simulated/SimulatedRuntime.h"

// What every Relay does, on the host's sockets and threads and on the simulated one.
namespace sable::platform {
namespace {

constexpr RelayMethod kMethods[] = {
    {"Echo", "bxtdsayasa{sv}aa{sv}a(ss)a{ss}a{say}ah", "bxtdsayasa{sv}aa{sv}a(ss)a{ss}a{say}ah"},
    {"Fail", "", ""},
    {"Drop", "", ""},
    {"Forget", "", ""},
    {"CallBack", "s", "s"},
    {"Note", "ts", ""},
    {"Keep", "", ""},
    {"Open", "a{sv}", "a{sv}ah"}};
enum Method : std::size_t { kEcho, kFail, kDrop, kForget, kCallBack, kNote, kKeep, kOpen };
constexpr RelayInterface kServer{"com.kestrel.Test", "/com/kestrel/test", kMethods};

constexpr RelayMethod kClientMethods[] = {{"Shout", "s", "s"}};
constexpr RelayInterface kClient{"com.kestrel.TestClient", "/com/kestrel/client", kClientMethods};
constexpr RelayMethod kOtherMethods[] = {{"Nothing", "", ""}};
constexpr RelayMethod kMistakenMethods[] = {{"Note", "t", ""}};
constexpr RelayInterface kMistaken{"com.kestrel.Test", "/com/kestrel/test", kMistakenMethods};
constexpr RelayInterface kNowhere{"com.kestrel.Nowhere", "/com/kestrel/test", kOtherMethods};

constexpr Duration kLong = std::chrono::seconds(60);

/// A value and its type as text, to compare and to print.
std::string show(const RelayValue& value);

struct Show {
  std::string operator()(const auto& v) { return fmt::format("{}", v); }
  std::string operator()(std::monostate) { return "nothing"; }
  std::string operator()(const Data& v) { return v ? *v : "null"; }
  std::string operator()(const RelayRecord& v) {
    std::string text;
    for (const auto& member : v.members()) text += member.name + "=" + show(member.value) + " ";
    return text;
  }
  std::string operator()(const RelayRecords& v) {
    std::string text;
    for (const auto& record : v) text += "[" + (*this)(record) + "]";
    return text;
  }
  std::string operator()(const RelayStringPairs& v) { return fmt::format("{}", v.pairs); }
  std::string operator()(const RelayStringMap& v) { return fmt::format("{}", v.entries); }
  std::string operator()(const RelayDataMap& v) {
    std::string text;
    for (const auto& [name, data] : v.entries) text += name + "=" + (*this)(data) + " ";
    return text;
  }
  std::string operator()(const RelayFile& v) { return v.descriptor ? "file" : "no file"; }
};

std::string show(const RelayValue& value) {
  return fmt::format("{}({})", value.signature(), std::visit(Show{}, value));
}

std::string show(const Expected<RelayArguments>& result) {
  if (!result) return result.error().reason;
  std::string text;
  for (const auto& value : *result) text += show(value) + "; ";
  return text;
}

RelayArguments oneOfEach() {
  RelayRecord inner;
  inner.add("n", std::int64_t{-1});
  inner.add("text", std::string("käse"));
  RelayRecord record;
  record.add("flag", true);
  record.add("big", std::uint64_t{0xFFFFFFFFFFFFFFFF});
  record.add("half", 0.5);
  record.add("bytes", makeData(std::string("\0\xff", 2)));
  record.add("inner", inner);
  record.add("pairs", RelayStringPairs{{{"a", "1"}, {"a", "2"}}});
  record.add("strings", RelayStrings{"x", ""});
  return {true,
          std::int64_t{-5},
          std::uint64_t{5},
          1e300,
          std::string("text"),
          makeData(std::string(5000, 'd')),
          RelayStrings{"one", "two"},
          record,
          RelayRecords{inner, RelayRecord(), record},
          RelayStringPairs{{{"q", "1"}, {"q", "2"}}},
          RelayStringMap{{{"Accept", "*/*"}}},
          RelayDataMap{{{"image", makeData("png")}}},
          RelayFile()};
}

struct World {
  std::unique_ptr<Runtime> runtime;
  std::unique_ptr<Relay> relay;
  std::function<Expected<std::shared_ptr<RelayConnection>>(const RelayEndpoint&)> connectAsStranger;
  std::function<void(std::string_view stream, std::optional<std::string> name)> raiseEvent;
};

World hostWorld() {
  const auto admitting = std::make_shared<std::atomic<bool>>(true);
  host::HostRelayConfiguration configuration;
  configuration.runtimeFolder = fmt::format("{}relay-{}", ::testing::TempDir(), getpid());
  configuration.admits = [admitting](uid_t) { return admitting->load(); };
  auto runtime = std::make_unique<host::HostRuntime>();
  auto* relay = new host::HostRelay(*runtime, configuration);
  return {std::move(runtime), std::unique_ptr<Relay>(relay),
          [=](const auto& endpoint) {
            *admitting = false;
            return relay->connect(endpoint);
          },
          [=](auto stream, auto name) { relay->raiseEvent(stream, std::move(name)); }};
}

World simulatedWorld() {
  auto runtime = std::make_unique<simulated::SimulatedRuntime>();
  auto* relay = new simulated::SimulatedRelay(*runtime);
  return {std::move(runtime), std::unique_ptr<Relay>(relay),
          [=](const auto& endpoint) { return relay->connectAs(endpoint, {.pid = 77, .uid = 77}); },
          [=](auto stream, auto name) { relay->raiseEvent(stream, std::move(name)); }};
}

/// Lines that queues add and the test waits for.
class Heard {
 public:
  explicit Heard(Runtime& runtime) : runtime_(runtime), added_(runtime.semaphore(0)) {}
  void add(std::string line) {
    const std::lock_guard lock(mutex_);
    lines_.push_back(std::move(line));
    added_->signal();
  }
  /// The next `count` lines.
  std::vector<std::string> next(std::size_t count = 1) {
    std::vector<std::string> taken;
    for (; count > 0; --count) {
      if (!added_->wait(runtime_.ticks() + kLong)) return taken;
      const std::lock_guard lock(mutex_);
      taken.push_back(std::move(lines_.front()));
      lines_.erase(lines_.begin());
    }
    return taken;
  }
  bool silent() {
    const std::lock_guard lock(mutex_);
    return lines_.empty();
  }

 private:
  Runtime& runtime_;
  const std::unique_ptr<Semaphore> added_;
  std::mutex mutex_;
  std::vector<std::string> lines_;
};

using Lines = std::vector<std::string>;

class RelayContract : public ::testing::TestWithParam<std::string> {
 protected:
  RelayContract() {
    listener_ = relay().namedListener("test");
    serve(*listener_);
  }
  ~RelayContract() override {
    listener_.reset();
    kept_.clear();
    const std::lock_guard lock(mutex_);
    served_.clear();
  }

  Runtime& runtime() { return *world_.runtime; }
  Relay& relay() { return *world_.relay; }

  void serve(RelayListener& listener) {
    listener.setAcceptHandler([this](std::shared_ptr<RelayConnection> connection) {
      connection->exportObject(kServer, [this, weak = std::weak_ptr(connection)](RelayCall call) {
        handle(std::move(call), weak.lock());
      });
      connection->setInvalidationHandler([heard = server_] { heard->add("ended"); });
      connection->resume();
      const std::lock_guard lock(mutex_);
      served_.push_back(std::move(connection));
      return true;
    });
    EXPECT_TRUE(listener.resume());
  }

  void handle(RelayCall call, const std::shared_ptr<RelayConnection>& connection) {
    switch (call.method) {
      case kEcho:
        return call.reply.send(std::move(call.arguments));
      case kFail:
        return call.reply.fail("com.kestrel.Error.Test", "as asked");
      case kDrop:
        return;
      case kForget:
        return call.reply.forget();
      case kNote:
        return server_->add(show(call.arguments[0]));
      case kKeep: {
        const std::lock_guard lock(mutex_);
        kept_.push_back(std::move(call.reply));
        return server_->add("kept");
      }
      case kOpen:
        return call.reply(call.arguments[0], file_);
      default:
        break;
    }
    connection->call(kClient, 0, {std::get<std::string>(call.arguments[0])}, kLong,
                     [reply = std::move(call.reply)](Expected<RelayArguments> result) mutable {
                       reply(std::get<std::string>(result->at(0)) + "?");
                     });
  }

  std::shared_ptr<RelayConnection> connect() { return connect(listener_->endpoint()); }
  std::shared_ptr<RelayConnection> connect(const RelayEndpoint& endpoint) {
    auto connection = relay().connect(endpoint);
    EXPECT_TRUE(connection);
    (*connection)->exportObject(kClient, [](RelayCall call) {
      call.reply(std::get<std::string>(call.arguments[0]) + "!");
    });
    (*connection)->setInvalidationHandler([heard = client_] { heard->add("ended"); });
    (*connection)->resume();
    return *connection;
  }

  void call(RelayConnection& connection, std::size_t method, RelayArguments arguments = {},
            const RelayInterface& interface = kServer, Duration timeout = kLong) {
    connection.call(interface, method, std::move(arguments), timeout,
                    [heard = client_](Expected<RelayArguments> result) { heard->add(show(result)); });
  }

  World world_ = GetParam() == "host" ? hostWorld() : simulatedWorld();
  // Shared, for a connection's last words come after it is let go of.
  const std::shared_ptr<Heard> client_ = std::make_shared<Heard>(runtime());
  const std::shared_ptr<Heard> server_ = std::make_shared<Heard>(runtime());
  std::mutex mutex_;
  std::vector<std::shared_ptr<RelayConnection>> served_;
  std::vector<RelayReply> kept_;
  RelayFile file_;
  std::unique_ptr<RelayListener> listener_;
};

INSTANTIATE_TEST_SUITE_P(Worlds, RelayContract, ::testing::Values("host", "simulated"),
                         [](const auto& world) { return world.param; });

TEST_P(RelayContract, EveryTypeOfValueArrivesAsItWasSent) {
  const auto connection = connect();
  call(*connection, kEcho, oneOfEach());
  EXPECT_EQ(client_->next(), Lines{show(oneOfEach())});
}

TEST_P(RelayContract, AFileArrivesOpenAndAbsentMembersDoNotArrive) {
  int ends[2];
  ASSERT_EQ(pipe(ends), 0);
  file_ = RelayFile{std::make_shared<const int>(ends[1])};
  RelayRecord record;
  record.add("none", RelayValue());
  record.add("null", Data());
  record.add("empty", makeData(""));
  const auto connection = connect();
  connection->call(kServer, kOpen, {record}, kLong, [&](Expected<RelayArguments> result) {
    const auto& file = std::get<RelayFile>(result->at(1));
    EXPECT_EQ(write(*file.descriptor, "x", 1), 1);
    client_->add(show(result->at(0)));
  });
  EXPECT_EQ(client_->next(), Lines{"a{sv}(empty=ay() )"});
  char byte = 0;
  EXPECT_EQ(read(ends[0], &byte, 1), 1);
  close(ends[0]);
  close(ends[1]);
}

TEST_P(RelayContract, ACallThatGoesWrongIsAnsweredWithTheReason) {
  const auto connection = connect();
  call(*connection, kFail);
  EXPECT_EQ(client_->next(), Lines{"com.kestrel.Error.Test as asked"});
  call(*connection, kDrop);
  EXPECT_EQ(client_->next(), Lines{"org.freedesktop.DBus.Error.NoReply The call was dropped unanswered"});
  call(*connection, 0, {}, kNowhere);
  EXPECT_EQ(client_->next()[0].substr(0, 34), "org.freedesktop.DBus.Error.Unknown");
  call(*connection, 0, {std::uint64_t{1}}, kMistaken);
  EXPECT_EQ(client_->next(), Lines{"org.freedesktop.DBus.Error.InvalidArgs Note takes \"ts\", not \"t\""});
}

TEST_P(RelayContract, AForgottenCallIsNeverAnswered) {
  const auto connection = connect();
  call(*connection, kForget);
  call(*connection, kFail);
  EXPECT_EQ(client_->next(), Lines{"com.kestrel.Error.Test as asked"});
  call(*connection, kForget, {}, kServer, std::chrono::milliseconds(1));
  EXPECT_EQ(client_->next(), Lines{"No answer came in time"});
  EXPECT_TRUE(client_->silent());
}

TEST_P(RelayContract, EitherSideCallsTheOtherDuringACall) {
  const auto connection = connect();
  call(*connection, kCallBack, {std::string("hello")});
  EXPECT_EQ(client_->next(), Lines{"s(hello!?); "});
}

TEST_P(RelayContract, OneWayCallsArriveInOrderHoweverMany) {
  const auto connection = connect();
  Lines sent;
  for (std::uint64_t i = 0; i < 2000; ++i) {
    connection->send(kServer, kNote, {i, std::string(1000, 'n')});
    sent.push_back(show(RelayValue(i)));
  }
  EXPECT_EQ(server_->next(2000), sent);
}

TEST_P(RelayContract, AnEndedConnectionIsHeardOfOnceAfterItsPendingCalls) {
  const auto connection = connect();
  call(*connection, kKeep);
  call(*connection, kKeep);
  EXPECT_EQ(server_->next(2), (Lines{"kept", "kept"}));
  connection->invalidate();
  connection->invalidate();
  EXPECT_EQ(client_->next(3), (Lines{"The connection has ended", "The connection has ended", "ended"}));
  EXPECT_EQ(server_->next(), Lines{"ended"});
  call(*connection, kFail);
  EXPECT_EQ(client_->next(), Lines{"The connection has ended"});
  EXPECT_TRUE(server_->silent());
}

TEST_P(RelayContract, APeerThatIsDroppedIsHeardOfAndReleased) {
  auto connection = connect();
  call(*connection, kKeep);
  EXPECT_EQ(server_->next(), Lines{"kept"});
  const std::weak_ptr<RelayConnection> client = connection;
  connection.reset();
  EXPECT_EQ(client_->next(2), (Lines{"The connection has ended", "ended"}));
  EXPECT_EQ(server_->next(), Lines{"ended"});
  EXPECT_TRUE(client.expired());
  std::weak_ptr<RelayConnection> server;
  {
    const std::lock_guard lock(mutex_);
    server = served_.front();
    served_.clear();
    kept_.clear();
  }
  EXPECT_TRUE(server.expired());
}

TEST_P(RelayContract, AConnectionMayEndWithinItsOwnCall) {
  const auto connection = connect();
  connection->call(kServer, kFail, {}, kLong, [&](Expected<RelayArguments>) {
    connection->invalidate();
    client_->add("answered");
  });
  EXPECT_EQ(client_->next(2), (Lines{"answered", "ended"}));
}

TEST_P(RelayContract, AnAnonymousListenerIsFoundByItsEndpointOnly) {
  auto listener = relay().anonymousListener();
  serve(*listener);
  EXPECT_NE(listener->endpoint(), listener_->endpoint());
  const auto endpoint = listener->endpoint();
  const auto connection = connect(endpoint);
  call(*connection, kFail);
  EXPECT_EQ(client_->next(), Lines{"com.kestrel.Error.Test as asked"});
  listener.reset();
  EXPECT_FALSE(relay().connect(endpoint));
}

TEST_P(RelayContract, ARefusedConnectionEnds) {
  auto listener = relay().anonymousListener();
  listener->setAcceptHandler([](const std::shared_ptr<RelayConnection>&) { return false; });
  ASSERT_TRUE(listener->resume());
  const auto connection = connect(listener->endpoint());
  EXPECT_EQ(client_->next(), Lines{"ended"});
}

TEST_P(RelayContract, AStrangerIsRefusedBeforeAnybodyHearsOfHim) {
  const auto connection = world_.connectAsStranger(listener_->endpoint());
  ASSERT_TRUE(connection);
  (*connection)->setInvalidationHandler([heard = client_] { heard->add("ended"); });
  call(**connection, kFail);
  (*connection)->resume();
  EXPECT_EQ(client_->next(2), (Lines{"The connection has ended", "ended"}));
  const std::lock_guard lock(mutex_);
  EXPECT_TRUE(served_.empty());
}

TEST_P(RelayContract, EventsReachTheirStreamsHandlerThoughItCameLater) {
  world_.raiseEvent("one", "early");
  relay().setEventStreamHandler(
      "one", runtime().serialQueue("events"),
      [this](std::optional<std::string> name) { server_->add(name.value_or("unnamed")); });
  world_.raiseEvent("two", "other");
  world_.raiseEvent("one", std::nullopt);
  EXPECT_EQ(server_->next(2), (Lines{"early", "unnamed"}));
}

}  // namespace
}  // namespace sable::platform
