#include <gtest/gtest.h>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "sabled/ClientStateManager.h"
#include "sabled/SableService.h"
#include "tests/support/VirtualDevice.h"

// The whole daemon on the virtual device: what clients and the service see, in virtual time.
namespace sable::test {
namespace {

using platform::HTTPErrorCode;

class Daemon : public testing::Test {
 protected:
  VirtualDevice device;
};

// Connections

TEST_F(Daemon, AClientIsConfiguredAndGetsTheBag) {
  device.start();
  VirtualClient& client = device.client("com.kestrel.beacon", "Beacon/1");
  ASSERT_TRUE(client.endpoint());
  ASSERT_EQ(client.bags().size(), 1u);
  EXPECT_EQ(client.bags()[0].raw["version"], "1");
  EXPECT_EQ(client.bags()[0].userAgent, "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1");
  EXPECT_FALSE(client.bags()[0].error);
  VirtualClient& composed = device.client("com.kestrel.rover", "Sabled/1.0 (X; Y 1) Rover/2");
  EXPECT_EQ(composed.bags().at(0).userAgent, "Sabled/1.0 (X; Y 1) Rover/2") << "not composed again";

  device.publishBag();
  ASSERT_EQ(client.bags().size(), 2u) << "a new bag is pushed to whoever is there";
  EXPECT_EQ(client.bags()[1].raw["version"], "2");
}

TEST_F(Daemon, AClientThatRefusesItsBagIsToldOfInTheLogAndOneThatNeverAnswersIsNot) {
  constexpr const char* kLine =
      "(pid:100) remote proxy error: RelayErrorDomain 3: org.freedesktop.DBus.Error.UnknownMethod "
      "/com/kestrel/client has no method BagDidLoad";
  const auto configure = [&](platform::RelayConnection& connection) {
    connection.resume();
    connection.send(kSBLDaemonRelay, SBLDaemonRelay::configure,
                    {encodeConfiguration({{"client"}, {"Client/1"}})});
    device.advance(1s);
  };
  device.start();
  const std::string address = "unix:path=/simulated/" + std::string(kSBLServiceName);
  const auto without = *device.platform.relay().connectAs(address, {100, 1000});
  configure(*without);
  EXPECT_EQ(device.log.count(kLine), 1u);

  int bags = 0;
  const auto silent = *device.platform.relay().connectAs(address, {100, 1000});
  silent->exportObject(kSBLClientRelay, [&](platform::RelayCall call) {
    ++bags;
    call.reply.forget();
  });
  configure(*silent);
  device.publishBag();
  device.advance(60s);
  EXPECT_EQ(bags, 2) << "waiting for one answer keeps no bag back";
  EXPECT_EQ(device.log.count("remote proxy error"), 2u) << "again the first client's";
}

TEST_F(Daemon, AFailedConfigurationClosesTheConnectionWithoutAnAnswer) {
  device.start();
  for (const auto& [identifier, agent] : {std::pair{"com.kestrel.beacon", ""}, std::pair{"", "Beacon/1"}}) {
    VirtualClient& client = device.client(identifier, agent);
    EXPECT_FALSE(client.endpoint());
    EXPECT_FALSE(client.isConnected());
  }
  EXPECT_EQ(device.log.count("invalid configuration, closing connection"), 2u);
  EXPECT_EQ(device.log.count("configuration requires identifier and agent"), 1u);
  EXPECT_TRUE(device.daemon().service().getClientConnections().empty());
}

TEST_F(Daemon, ASilentConnectionIsClosedAfterSixtySecondsAndACallPostponesThat) {
  device.start();
  VirtualClient& silent = device.connect();
  VirtualClient& busy = device.client();
  device.advance(59s);
  EXPECT_TRUE(silent.isConnected());
  busy.search("wea");
  device.advance(2s);
  EXPECT_FALSE(silent.isConnected());
  device.advance(57s);
  EXPECT_TRUE(busy.isConnected());
  device.advance(2s);
  EXPECT_FALSE(busy.isConnected());
  EXPECT_EQ(device.log.count("timing out idle relay connection"), 2u);
}

TEST_F(Daemon, SeveralConnectionsOfOneProcessAreToldOfAndKept) {
  VirtualClient& first = device.startWithClient();
  VirtualClient& second = device.client();
  EXPECT_TRUE(device.log.contains("too many connections 2 from pid 100"));
  EXPECT_EQ(device.log.count("new connection from beacon (100)"), 2u);
  EXPECT_FALSE(first.search("wea").data().empty());
  EXPECT_FALSE(second.search("wea").data().empty());
  EXPECT_EQ(device.counter("clientconnection"), 2);
  first.disconnect();
  device.run();
  EXPECT_EQ(device.service.memoryPurges(), 0);
  second.disconnect();
  device.run();
  EXPECT_EQ(device.service.memoryPurges(), 1) << "when the last connection is gone";
  EXPECT_EQ(device.counter("beacon.realyinvalidation"), 2);
  EXPECT_EQ(device.platform.transactions().openCount(), 0u) << "the daemon may be stopped";
}

TEST_F(Daemon, AFailedSecondConfigurationEndsTheSessionOfTheFirst) {
  VirtualClient& client = device.startWithClient();
  client.search("wea");
  client.configure("com.kestrel.beacon", "");
  device.run();
  EXPECT_FALSE(client.isConnected());
  EXPECT_EQ(device.counter("ledger.noagent"), 0) << "what tells of its end has an agent";
}

TEST_F(Daemon, TheEndOfAConnectionEmptiesTheCacheOfItsClient) {
  VirtualClient& client = device.startWithClient();
  VirtualClient& other = device.client();
  client.search("wea");
  client.search("weat");
  EXPECT_EQ(device.sent("/search"), 1u);
  other.disconnect();
  device.run();
  client.search("weath");
  EXPECT_EQ(device.sent("/search"), 2u);
}

TEST_F(Daemon, AnAnswerThatWasAskedForInVainIsNotKept) {
  VirtualClient& client = device.startWithClient();
  device.service.setDefaultLatency(1s);
  const PendingAnswer answer = client.send(searchFor("wea", 1));
  device.advance(500ms);
  auto values = device.platform.localeInfo().values;
  values.localeIdentifier = "de_DE";
  device.platform.localeInfo().change(values);
  device.await(answer);
  client.ask(searchFor("weat", 2));
  EXPECT_EQ(device.sent("/search"), 2u) << "it was of another locale";
  client.ask(searchFor("weat", 3));
  EXPECT_EQ(device.sent("/search"), 2u);

  const PendingAnswer other = client.send(searchFor("pizz", 4));
  device.advance(500ms);
  device.client("com.kestrel.beacon", "Beacon/2");
  device.await(other);
  client.ask(searchFor("pizz", 5));
  EXPECT_EQ(device.sent("/search"), 4u) << "it was of another agent";
}

TEST_F(Daemon, ClientsOfAnEarlierRunShareTheSessionToo) {
  device.platform.userDefaults().setByUser("SBLPersistSessions", true);
  device.start();
  device.client("com.kestrel.rover", "Rover/1");
  device.restart();
  const auto guidOf = [&](const char* identifier, const char* agent) {
    device.client(identifier, agent).search("wea");
    return sentValue(device.service.requests("/search").back().request, "X-Kestrel-UserGuid");
  };
  EXPECT_EQ(guidOf("com.kestrel.rover", "Rover/1"), guidOf("com.kestrel.news", "News/1"));
}

TEST_F(Daemon, ConnectionsWithOneIdentifierShareAState) {
  device.platform.userDefaults().setByUser("SBLPersistSessions", true);
  device.start();
  device.client("com.kestrel.rover", "Rover/1");
  device.client("com.kestrel.rover", "Rover/1");
  device.client("com.kestrel.news", "News/1");
  const auto sessions = device.assembly().clientStateManager->sessions();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[0].identifier, "com.kestrel.news");
  const auto saved = device.platform.userDefaults().array("sessions");
  ASSERT_TRUE(saved);
  EXPECT_EQ(saved->size(), 2u);
  EXPECT_EQ((*saved)[1]["agent"], "Sabled/1.0 (SableBook1,1; Sable OS 1A1) Rover/1");
}

TEST_F(Daemon, TheEleventhEndpointConnectionIsRefusedUntilAPlaceIsFree) {
  const auto endpoint = *device.startWithClient().endpoint();
  std::vector<std::shared_ptr<platform::RelayConnection>> open;
  const auto invalidated = std::make_shared<int>(0);
  const auto connect = [&] {
    auto connection = *device.platform.relay().connectAs(endpoint, {100, 1000});
    connection->setInvalidationHandler([invalidated] { ++*invalidated; });
    connection->resume();
    open.push_back(std::move(connection));
    device.advance(150ms);
  };
  for (int i = 0; i < 11; ++i) connect();
  EXPECT_EQ(*invalidated, 1);
  EXPECT_EQ(device.log.count("endpoint semaphore timeout"), 1u);
  open.front()->invalidate();
  device.run();
  connect();
  EXPECT_EQ(device.log.count("endpoint semaphore timeout"), 1u);
}

// The road of a query

TEST_F(Daemon, TheGatesAnswerWithNothing) {
  device.bag["minimum_query_length"] = 3;
  device.bag["agents"] = {{"rover", {{"enabled", false}}}};
  VirtualClient& beacon = device.startWithClient();
  for (const char* tooShort : {"", "we", "🦋"}) {
    const Answer answer = beacon.search(tooShort);
    EXPECT_FALSE(answer.reply || answer.error) << tooShort;
  }
  EXPECT_TRUE(beacon.search("wea").reply);
  EXPECT_TRUE(beacon.search("🦋a").reply) << "two UTF-16 code units and one";
  EXPECT_TRUE(device.log.contains("query[2] input 'we' less than 3"));

  VirtualClient& rover = device.client("com.kestrel.rover", "Rover/1");
  EXPECT_FALSE(rover.search("weather").reply);
  EXPECT_FALSE(rover.ask(SBLZeroKeywordRequest{}).error);
  EXPECT_FALSE(rover.ask(SBLLookupRequest{}).reply);
  EXPECT_EQ(device.log.count("no search, bag disabled"), 1u);
  EXPECT_EQ(device.log.count("no zkw, bag disabled"), 1u);
  EXPECT_EQ(device.log.count("no lookup, bag disabled"), 1u);
  EXPECT_EQ(device.sent("/search"), 2u);
}

TEST_F(Daemon, WithoutABagAQueryWaitsASecondThenFails) {
  device.service.on("/bag", answering("not found", 404));
  VirtualClient& client = device.startWithClient();
  device.advance(2s);
  const auto start = device.platform.runtime().ticks();
  const Answer answer = client.search("wea");
  EXPECT_EQ(device.platform.runtime().ticks() - start, 1s);
  EXPECT_EQ(answer.error, (Error{"SBLErrorDomain", 1, "timeout"}));
  EXPECT_TRUE(device.log.contains("Bag fetch failed, can't complete non-cached query wea."));
  ASSERT_FALSE(client.bags().empty());
  EXPECT_EQ(client.bags()[0].error, (Error{"SBLErrorDomain", 1, "timeout"}));
}

TEST_F(Daemon, ABagThatArrivesWithinTheSecondServesEveryWaitingQuery) {
  device.service.on("/bag", after(700ms, answering(device.bag.dump())));
  device.start();
  std::vector<PendingAnswer> answers;
  for (int i = 0; i < 4; ++i) {
    VirtualClient& client = device.connect(100 + i);
    client.configure("com.kestrel.client" + std::to_string(i), "Client/1");
    answers.push_back(client.send(searchFor("wea", 1)));
  }
  for (const auto& answer : answers) {
    device.await(answer);
    EXPECT_TRUE((*answer)->reply);
  }
}

TEST_F(Daemon, OnlyTheNewestSearchIsAnsweredWithResults) {
  VirtualClient& client = device.startWithClient();
  const PendingAnswer first = client.send(searchFor("w", 1));
  const PendingAnswer second = client.send(searchFor("we", 5));
  const PendingAnswer stale = client.send(searchFor("wea", 4));
  const PendingAnswer repeated = client.send(searchFor("weat", 5));
  for (const auto& answer : {first, second, stale, repeated}) device.await(answer);
  EXPECT_FALSE((*first)->reply || (*first)->error) << "superseded while the service was busy";
  EXPECT_TRUE((*second)->reply);
  EXPECT_FALSE((*stale)->reply || (*stale)->error);
  EXPECT_FALSE((*repeated)->reply || (*repeated)->error);
  EXPECT_EQ(device.sent("/search"), 2u) << "stale searches do not reach the service";
}

TEST_F(Daemon, LookupsAreTriedAgainUntilTheirPageNoLongerWaitsAndSearchesAreNot) {
  VirtualClient& client = device.startWithClient();
  device.service.failNext(2, HTTPErrorCode::cannotConnect);
  EXPECT_TRUE(client.ask(SBLLookupRequest{}).reply);
  EXPECT_EQ(device.sent("/search"), 3u);

  device.service.on("/search", after(3s, failing(HTTPErrorCode::timedOut)));
  EXPECT_TRUE(client.ask(SBLLookupRequest{}).error);
  EXPECT_EQ(device.sent("/search"), 4u) << "after the deadline nothing is sent again";

  device.service.failNext(1, HTTPErrorCode::connectionLost);
  const Answer broken = client.search("weath");
  EXPECT_FALSE(broken.reply);
  EXPECT_EQ(broken.error->domain, platform::kHTTPErrorDomain);
  EXPECT_EQ(device.sent("/search"), 5u);
}

TEST_F(Daemon, MoreResultsAndCardsAreServedOnTheEndpointAndNothingElseIs) {
  VirtualClient& client = device.startWithClient();
  device.service.on("/card", answering("no object"));
  SBLMoreResultsRequest more;
  more.moreResultsURL = "https://service.test/more?page=2";
  EXPECT_EQ(client.ask(more).data(), "{}");
  SBLCardRequest card;
  card.cardURL = "https://service.test/card?id=1";
  EXPECT_EQ(client.ask(card).data(), "no object");
  EXPECT_TRUE(device.log.contains("Failed to deserialize card details for into a dictionary. Error: "));
  card.cardURL = "file:///etc/passwd";
  EXPECT_TRUE(client.ask(card).error);
  EXPECT_TRUE(device.log.contains("Card fetch failed with HTTP status code 0 error "));

  for (const SBLAnyRequest& flight :
       {SBLAnyRequest(SBLFlightSearchRequest{}), SBLAnyRequest(SBLFlightLookupRequest{})}) {
    const Answer answer = client.ask(flight);
    EXPECT_FALSE(answer.reply || answer.error);
  }
  const PendingAnswer unknown = std::make_shared<std::optional<Answer>>();
  client.connection().call(kSBLDaemonRelay, SBLDaemonRelay::request,
                           {std::string("SBLNoRequest"), platform::RelayRecord()}, 20s,
                           [unknown](auto) { unknown->emplace(); });
  device.advance(10s);
  EXPECT_FALSE(unknown->has_value()) << "a record of another class never gets an answer";
}

TEST_F(Daemon, AMessagesClientNeverGoesThroughThePrivacyProxy) {
  device.bag["bramble"] = {{"proxy", "http://proxy.test:8080"}, {"enabled", true}};
  device.start();
  const auto sent = [&] { return device.service.requests("/search").back(); };
  device.client("com.kestrel.messages", "Messages/1").search("wea");
  EXPECT_EQ(sent().proxyURL, "");
  EXPECT_FALSE(sent().request.proxied);
  device.client().search("wea");
  EXPECT_EQ(sent().proxyURL, "http://proxy.test:8080");
  device.client().ask(SBLZeroKeywordRequest{});
  EXPECT_EQ(sent().proxyURL, "") << "zero keyword says nothing worth hiding";
  device.platform.userDefaults().setByUser("SBLUseBramble", false);
  device.client("com.kestrel.vox", "Vox/1").search("wea");
  EXPECT_EQ(sent().proxyURL, "");
}

}  // namespace
}  // namespace sable::test
