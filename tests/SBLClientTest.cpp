#include <gtest/gtest.h>

#include "SableKit/SBLClient.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "platform/simulated/SimulatedRelay.h"
#include "platform/simulated/SimulatedRuntime.h"

// The client against a daemon that says what each test wants, in virtual time.
namespace sable {
namespace {

using namespace std::chrono_literals;
using platform::RelayArguments;
using platform::RelayErrorCode;
using platform::RelayRecord;

class Client : public testing::Test {
 protected:
  Client() {
    listener_->setAcceptHandler([this](std::shared_ptr<platform::RelayConnection> connection) {
      connection->exportObject(kSBLDaemonRelay,
                               [this](platform::RelayCall call) { answer(std::move(call)); });
      connection->setInvalidationHandler([] {});
      connection->resume();
      connections_.push_back(std::move(connection));
      return true;
    });
    EXPECT_TRUE(listener_->resume());
    client_ = clientOf(listener_->endpoint());
  }

  std::shared_ptr<SBLClient> clientOf(const platform::RelayEndpoint& endpoint) {
    return SBLClient::create(runtime_, relay_, endpoint, {"com.example.app", "App/1"});
  }

  void answer(platform::RelayCall call) {
    calls_.push_back(call.method);
    if (silent_.contains(call.method)) return call.reply.forget();
    switch (call.method) {
      case SBLDaemonRelay::configure:
        configurations_.push_back(decodeConfiguration(std::get<RelayRecord>(call.arguments[0])));
        return call.reply("unix:path=/endpoint");
      case SBLDaemonRelay::bag:
        return call.reply(std::string("{}"), std::string("Agent"), RelayRecord());
      case SBLDaemonRelay::request: {
        SBLReply reply;
        reply.data = makeData(std::get<std::string>(call.arguments[0]));
        return call.reply(std::get<RelayRecord>(call.arguments[1]).unsignedInteger("queryId").value_or(0),
                          encodeReply(reply), RelayRecord());
      }
      default:
        return call.reply.fail("org.example.Refused", "not here");
    }
  }

  /// The outcome of a search: the reply's data, or the error's description.
  void search(std::uint64_t queryId) {
    SBLSearchRequest request;
    request.queryId = queryId;
    client_->request(request, [this](std::uint64_t id, std::optional<SBLReply> reply, auto error) {
      outcomes_.push_back(std::to_string(id) + " " + (error ? error->description() : *reply->data));
    });
  }

  void connect() {
    client_->connect([this](Expected<platform::RelayEndpoint> endpoint) {
      outcomes_.push_back(endpoint ? *endpoint : endpoint.error().description());
    });
  }

  std::vector<std::string> takeOutcomes() {
    runtime_.run();
    return std::exchange(outcomes_, {});
  }

  static std::string errorText(RelayErrorCode code) {
    return std::string(platform::kRelayErrorDomain) + " " + std::to_string(static_cast<int>(code));
  }

  platform::simulated::SimulatedRuntime runtime_;
  platform::simulated::SimulatedRelay relay_{runtime_};
  std::unique_ptr<platform::RelayListener> listener_ = relay_.namedListener("daemon");
  std::vector<std::shared_ptr<platform::RelayConnection>> connections_;
  std::vector<std::size_t> calls_;
  std::vector<SBLSessionConfiguration> configurations_;
  std::set<std::size_t> silent_;
  std::vector<std::string> outcomes_;
  std::shared_ptr<SBLClient> client_;
};

using Outcomes = std::vector<std::string>;

TEST_F(Client, ConfiguresItsConnectionBeforeItsFirstCall) {
  search(1);
  search(2);
  connect();
  EXPECT_TRUE(outcomes_.empty()) << "no handler runs within the call";
  const auto outcomes = takeOutcomes();
  EXPECT_EQ(std::multiset(outcomes.begin(), outcomes.end()),
            (std::multiset<std::string>{"1 SBLSearchRequest", "2 SBLSearchRequest", "unix:path=/endpoint"}));
  EXPECT_EQ(connections_.size(), 1u);
  EXPECT_EQ(calls_, (std::vector<std::size_t>{SBLDaemonRelay::configure, SBLDaemonRelay::request,
                                              SBLDaemonRelay::request}));
  ASSERT_EQ(configurations_.size(), 1u);
  EXPECT_EQ(configurations_[0].identifier, "com.example.app");
  EXPECT_EQ(configurations_[0].userAgent, "App/1");
}

TEST_F(Client, HearsOfBagsAndMayAskAgainFromItsHandlers) {
  Outcomes bags;
  client_->setBagHandler([&](const std::string& bag, const std::string& agent, const auto& error) {
    bags.push_back(bag + " " + agent + " " + (error ? error->reason : "-"));
    client_->bag(
        [&](std::string json, std::string userAgent, auto) { bags.push_back(json + " " + userAgent); });
  });
  client_->connect([&](auto) { search(1); });
  EXPECT_EQ(takeOutcomes(), Outcomes{"1 SBLSearchRequest"});
  connections_[0]->send(kSBLClientRelay, SBLClientRelay::bagDidLoad,
                        {std::string("{\"v\":1}"), std::string("A"), RelayRecord()});
  runtime_.run();
  EXPECT_EQ(bags, (Outcomes{"{\"v\":1} A -", "{} Agent"}));
}

TEST_F(Client, FailsWhatWasUnderWayWhenTheConnectionBreaksAndConnectsAnew) {
  silent_ = {SBLDaemonRelay::request};
  search(1);
  EXPECT_EQ(takeOutcomes(), Outcomes{});
  connections_[0]->invalidate();
  const auto lost = takeOutcomes();
  ASSERT_EQ(lost.size(), 1u);
  EXPECT_TRUE(lost[0].starts_with("1 " + errorText(RelayErrorCode::disconnected))) << lost[0];

  silent_.clear();
  search(2);
  EXPECT_EQ(takeOutcomes(), Outcomes{"2 SBLSearchRequest"});
  EXPECT_EQ(connections_.size(), 2u);
  EXPECT_EQ(configurations_.size(), 2u);
}

TEST_F(Client, AnswersEveryConnectOnceHoweverTheConnectionEnds) {
  silent_ = {SBLDaemonRelay::configure};
  const std::string disconnected = errorText(RelayErrorCode::disconnected);
  connect();
  runtime_.run();
  client_->disconnect();
  connect();  // a new connection, which the end of the old one must not disturb
  auto outcomes = takeOutcomes();
  ASSERT_EQ(outcomes.size(), 1u);
  EXPECT_TRUE(outcomes[0].starts_with(disconnected)) << outcomes[0];
  connections_.back()->invalidate();
  outcomes = takeOutcomes();
  ASSERT_EQ(outcomes.size(), 1u);
  EXPECT_TRUE(outcomes[0].starts_with(disconnected)) << outcomes[0];
}

TEST_F(Client, GivesUpOnAnAnswerAfterItsTimeout) {
  client_->setTimeout(3s);
  silent_ = {SBLDaemonRelay::request};
  search(1);
  runtime_.advance(2900ms);
  EXPECT_EQ(takeOutcomes(), Outcomes{});
  runtime_.advance(200ms);
  const auto outcomes = takeOutcomes();
  ASSERT_EQ(outcomes.size(), 1u);
  EXPECT_TRUE(outcomes[0].starts_with("1 " + errorText(RelayErrorCode::timedOut))) << outcomes[0];
}

TEST_F(Client, StartsAnewWhenItCouldNotBeConfigured) {
  client_->setTimeout(3s);
  silent_ = {SBLDaemonRelay::configure};
  connect();
  runtime_.advance(4s);
  const auto outcomes = takeOutcomes();
  ASSERT_EQ(outcomes.size(), 1u);
  EXPECT_TRUE(outcomes[0].starts_with(errorText(RelayErrorCode::timedOut))) << outcomes[0];
  silent_.clear();
  connect();
  EXPECT_EQ(takeOutcomes(), Outcomes{"unix:path=/endpoint"});
  EXPECT_EQ(connections_.size(), 2u);
}

TEST_F(Client, TellsWhenNobodyListens) {
  client_ = clientOf("unix:path=/nowhere");
  connect();
  search(5);
  EXPECT_TRUE(outcomes_.empty());
  EXPECT_EQ(takeOutcomes().size(), 2u);
  EXPECT_TRUE(connections_.empty());
}

TEST_F(Client, PassesTheDaemonsRefusalsOn) {
  Expected<RelayArguments> result;
  client_->call(kSBLDaemonRelay, SBLDaemonRelay::listSessions, {},
                [&](Expected<RelayArguments> answer) { result = answer; });
  runtime_.run();
  ASSERT_FALSE(result);
  EXPECT_TRUE(result.error().description().starts_with(errorText(RelayErrorCode::remoteError)));
}

}  // namespace
}  // namespace sable
