#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/FlusherTool.h"
#include "sabled/SableFlusherRelay.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// The flusher control channel of the whole daemon, as a tool meets it.
namespace sable::test {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

/// A diagnostic tool: what it was told, in order. It answers as long as it `reads`.
class Tool {
 public:
  Tool(VirtualDevice& device, pid_t pid) : device_(device) {
    auto connected =
        device.platform.relay().connectAs(device.assembly().flusherRelayListener->endpoint(), {pid, 1000});
    connection_ = std::move(*connected);
    connection_->exportObject(kSBLFlusherListenerRelay,
                              [this](platform::RelayCall call) { hear(std::move(call)); });
    connection_->setInvalidationHandler([this] { ended = true; });
    connection_->resume();
  }
  ~Tool() {
    connection_->invalidate();
    device_.run();
  }

  /// Whether the intent was accepted.
  bool ask(std::uint64_t intent) {
    bool accepted = false;
    connection_->call(
        kSBLFlusherListener, SBLFlusherListener::initiateConnectionWithIntent, {intent}, 5s,
        [&](const Expected<platform::RelayArguments>& answer) { accepted = answer.has_value(); });
    device_.run();
    return accepted;
  }
  bool ask(SBLFlusherIntent intent) { return ask(static_cast<std::uint64_t>(intent)); }
  void readOn() {
    reads = true;
    for (platform::RelayReply& reply : std::exchange(unanswered_, {})) reply.send({});
    device_.run();
  }
  std::vector<std::string> take() { return std::exchange(heard, {}); }

  std::vector<std::string> heard;
  bool reads = true, ended = false;

 private:
  void hear(platform::RelayCall call) {
    switch (call.method) {
      case SBLFlusherListenerRelay::workDone:
        heard.emplace_back("done");
        break;
      case SBLFlusherListenerRelay::receiveFeedback:
        heard.push_back(json::parse(std::get<std::string>(call.arguments[0]))["type"]);
        break;
      case SBLFlusherListenerRelay::receiveSessions:
        for (const auto& text : std::get<platform::RelayStrings>(call.arguments[0])) heard.push_back(text);
        break;
      default:
        heard.push_back("dropped " + std::to_string(std::get<std::uint64_t>(call.arguments[0])));
    }
    if (!reads) return unanswered_.push_back(std::move(call.reply));
    call.reply.send({});
  }

  VirtualDevice& device_;
  std::shared_ptr<platform::RelayConnection> connection_;
  std::vector<platform::RelayReply> unanswered_;
};

struct RecordingFlusher final : BackgroundFlusher {
  bool stopFlushing() const override { return stopped; }
  void setStopFlushing(bool stop) override { stopped = stop; }
  void insertFlushActivity(int) override { ++inserted; }

  bool stopped = false;
  int inserted = 0;
};

struct FlusherRelay : testing::Test {
  FlusherRelay() { start(); }
  void start() {
    device.start();
    auto made = std::make_unique<RecordingFlusher>();
    flusher = made.get();
    replaced = std::exchange(device.assembly().backgroundFlusher, std::move(made));
  }
  void report(VirtualClient& client, std::size_t count = 1) {
    const auto bytes = messageFromJSON("RKDidGoToSiteFeedback", R"({"input": "dog"})");
    for (std::size_t i = 0; i < count; ++i) {
      client.connection().send(kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
                               {std::uint64_t{0}, std::int64_t{7}, std::string("RKDidGoToSiteFeedback"),
                                std::make_shared<const std::string>(*bytes)});
      if (i % 100 == 99) device.run();
    }
    device.run();
  }
  SableFlusherRelay& relay() { return *device.assembly().flusherRelayListener; }

  VirtualDevice device;
  std::unique_ptr<BackgroundFlusher> replaced;  ///< still there: it is the delegate of uploads
  RecordingFlusher* flusher = nullptr;
};

TEST_F(FlusherRelay, AToolHearsOfEachFeedbackFromWhenItAskedUntilItLeaves) {
  VirtualClient& client = device.client();
  report(client);
  {
    Tool tool(device, 200);
    report(client);
    EXPECT_THAT(tool.take(), IsEmpty()) << "it has not asked yet";
    EXPECT_TRUE(tool.ask(SBLFlusherIntent::watchFeedback));
    report(client, 3);
    EXPECT_THAT(tool.take(), ElementsAre("did_go_to_site", "did_go_to_site", "did_go_to_site"));
    client.search("dog");
    device.run();
    EXPECT_THAT(tool.take(), ElementsAre("network_search_start", "network_search_end"));

    Tool other(device, 201);
    EXPECT_TRUE(other.ask(SBLFlusherIntent::watchFeedback));
    report(client);
    EXPECT_THAT(tool.take(), IsEmpty()) << "the stream has one listener";
    EXPECT_THAT(other.take(), ElementsAre("did_go_to_site"));
  }
  report(client);
  for (const char* line :
       {"listener invalidated", "Removed receiving stream listener", "Removed remote listener",
        "new listener for client feedbacks, delegate: process 201"})
    EXPECT_GE(device.log.count(line), 1u) << line;
  EXPECT_FALSE(relay().hasSendingStreamListener());
}

TEST_F(FlusherRelay, AToolThatConnectedEarlierIsStillTheOneThatAsks) {
  Tool first(device, 200), second(device, 201);
  EXPECT_TRUE(first.ask(SBLFlusherIntent::watchSessions));
  relay().sendDataToSendingStreamListener({"a", "b"});
  device.run();
  EXPECT_THAT(first.take(), ElementsAre("a", "b"));
  EXPECT_THAT(second.take(), IsEmpty());
  EXPECT_FALSE(second.ask(4)) << "no such intent";
  EXPECT_EQ(device.log.count("Unsupported command yet: 4"), 1u);
  EXPECT_TRUE(second.ask(SBLFlusherIntent::stop)) << "and costs the tool nothing";
}

TEST_F(FlusherRelay, StopAndDumpSteerTheFlusherAndSayWhenTheyAreDone) {
  VirtualClient& one = device.client("com.kestrel.beacon", "Beacon/1");
  VirtualClient& two = device.client("com.kestrel.rover", "Rover/1");
  report(one);
  report(two);
  Tool tool(device, 200);
  EXPECT_TRUE(tool.ask(SBLFlusherIntent::stop));
  EXPECT_TRUE(flusher->stopped);
  EXPECT_THAT(tool.take(), ElementsAre("done"));

  device.connect();  // has no state, and so no session
  device.run();
  EXPECT_TRUE(tool.ask(SBLFlusherIntent::dump));
  EXPECT_FALSE(flusher->stopped);
  EXPECT_EQ(flusher->inserted, 2);
  EXPECT_THAT(tool.take(), ElementsAre("done"));
  EXPECT_EQ(device.log.count("no listener for sending stream setting this client as remote"), 1u);
  for (const char* agent : {"Beacon/1", "Rover/1"}) {
    EXPECT_EQ(
        device.log.count(std::string("session flushed because of dump command Sabled/1.0 (SableBook1,1; "
                                     "Sable OS 1A1) ") +
                         agent),
        1u);
  }
  relay().sendDataToSendingStreamListener({"{}"});
  device.run();
  EXPECT_THAT(tool.take(), ElementsAre("{}")) << "who dumps hears of what is uploaded";
}

TEST_F(FlusherRelay, WorksWithoutFlusherAndClients) {
  device.assembly().backgroundFlusher = nullptr;
  Tool tool(device, 200);
  EXPECT_TRUE(tool.ask(SBLFlusherIntent::stop));
  EXPECT_TRUE(tool.ask(SBLFlusherIntent::dump));
  EXPECT_THAT(tool.take(), ElementsAre("done", "done"));
}

TEST_F(FlusherRelay, AToolThatDoesNotReadLosesRecordsAndHearsHowMany) {
  VirtualClient& client = device.client();
  Tool tool(device, 200);
  tool.ask(SBLFlusherIntent::watchFeedback);
  tool.reads = false;
  constexpr std::size_t kKept = kFlusherWindowCalls + kFlusherWaitingCalls, kLost = 500;
  report(client, kKept + kLost);
  EXPECT_EQ(tool.heard.size(), kFlusherWindowCalls);
  EXPECT_FALSE(tool.ended);
  client.search("dog");  // nobody waits for the tool

  tool.readOn();
  ASSERT_EQ(tool.heard.size(), kKept + 1);
  EXPECT_EQ(tool.heard.back(), "dropped " + std::to_string(kLost + 2));
  EXPECT_EQ(std::ranges::count(tool.heard, "did_go_to_site"), static_cast<std::ptrdiff_t>(kKept));
  tool.take();
  report(client);
  EXPECT_THAT(tool.take(), ElementsAre("did_go_to_site"));
}

TEST_F(FlusherRelay, BytesCountAndWhatIsTooLargeIsLeftOut) {
  Tool tool(device, 200);
  tool.ask(SBLFlusherIntent::watchSessions);
  const auto send = [&](std::vector<std::string> envelopes) {
    relay().sendDataToSendingStreamListener(std::move(envelopes));
    device.run();
  };
  send({std::string(kFlusherWaitingBytes, 'a'), "b"});
  EXPECT_THAT(tool.take(), ElementsAre("dropped 2"));
  tool.reads = false;
  const std::string half(kFlusherWaitingBytes / 2, 'h');
  send({half});  // goes out, as it would whatever its size
  send({half});
  send({half});  // these wait
  send({"lost"});
  tool.ask(SBLFlusherIntent::stop);
  tool.readOn();
  EXPECT_THAT(tool.take(), ElementsAre(half, half, half, "dropped 1", "done"));

  tool.reads = false;
  send({"x"});
  device.advance(25h);
  EXPECT_TRUE(tool.ended) << "it has not answered for a day";
  EXPECT_FALSE(relay().hasSendingStreamListener());
}

}  // namespace
}  // namespace sable::test
