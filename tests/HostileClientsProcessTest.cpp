#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <latch>
#include <limits>
#include <list>

#include "tests/support/LoopbackServer.h"
#include "tests/support/RawPeer.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// What a hostile client says to the real daemon costs that client at most: another one searches on.
namespace sable::test {
namespace {

using namespace std::string_literals;
using testing::HasSubstr;
using testing::Not;
using tests::LoopbackServer;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

class HostileClients : public testing::Test {
 protected:
  HostileClients() {
    const nlohmann::json bag{{"version", "1"},
                             {"enabled", true},
                             {"search_url", server_.url("/search")},
                             {"padding", std::string(1 << 20, 'p')}};
    server_.on("/bag", LoopbackServer::ok(bag.dump()));
    for (const char* path : {"/search", "/more", "/card"}) server_.on(path, LoopbackServer::ok("{}"));
    world_.startDaemon({"--log-level", "error"});
    EXPECT_TRUE(honest_.search("before").isClean());
  }

  void TearDown() override { EXPECT_TRUE(honest_.search("after").isClean()) << world_.daemonErrors(); }

  std::filesystem::path proc(const char* name) {
    return std::filesystem::path("/proc") / std::to_string(world_.daemon().pid()) / name;
  }
  std::int64_t peakKiB() {
    const std::string status = readFile(proc("status"));
    return std::stoll(status.substr(status.find("VmHWM:") + 6));
  }

  platform::host::HostRuntime runtime_;
  LoopbackServer server_{runtime_};
  World world_{{.settings = "SBLUseBramble = false", .bagURL = server_.url("/bag"), .startDaemon = false}};
  TestClient honest_{runtime_, world_.address()};
};

TEST_F(HostileClients, WhoDoesNotShakeHandsIsHungUpOn) {
  std::list<RawPeer> peers;  // all at once: those who say too little have a few seconds
  for (const std::string& greeting :
       {""s, "\0"s, "\0AUTH EXTERNAL"s, "\0AUTH\r\nBEGIN\r\n"s, "\0AUTH EXTERNAL\r\n"s,
        "\0AUTH EXTERNAL\r\nDATA\r\n"s, "\0AUTH ANONYMOUS\r\n"s, "\0AUTH EXTERNAL zz\r\nDATA\r\nBEGIN\r\n"s,
        "\0BEGIN\r\n"s, "GET / HTTP/1.1\r\n\r\n"s, std::string(1 << 20, '\0'), std::string(1 << 20, '\xff'),
        "\0"s + std::string(1 << 20, 'A')}) {
    peers.emplace_back(world_.socket()).send(greeting);
  }
  EXPECT_TRUE(honest_.search("meanwhile").isClean());
  for (const RawPeer& peer : peers) {
    std::string said;
    while ((said = peer.receive()) != "hung up") ASSERT_NE(said, "silence");
  }
}

/// A call, and what the answer to it holds. A message of a kind that nobody knows passes unheard.
struct Case {
  const char* name;
  WireCall call;
  const char* outcome;
};
constexpr const char* kUnheard = "answer to the next call";

std::string nestedVariants(int depth) {
  WireBytes value;
  for (int i = 0; i < depth; ++i) value.signature("v");
  value.signature("y").byte(7);
  WireBytes entry;
  entry.string("identifier").signature("v").raw(value.bytes());
  return WireBytes().word(static_cast<std::uint32_t>(entry.size())).align(8).raw(entry.bytes()).bytes();
}

TEST_F(HostileClients, ABadMessageEndsItsConnectionAndAWrongCallIsRefused) {
  const std::string good = WireCall::record({{"identifier", "raw"}, {"userAgent", "raw/1"}});
  const Case cases[] = {
      {"a good call", {.body = good}, "unix:path="},
      {"an unknown byte order", {.body = good, .endianness = 'x'}, "hung up"},
      {"a type that nobody knows", {.body = good, .type = 77}, kUnheard},
      {"no type", {.body = good, .type = 0}, "hung up"},
      {"another version", {.body = good, .version = 9}, "hung up"},
      {"no path", {.path = "no/path", .body = good}, "hung up"},
      {"no interface", {.interface = "no interface", .body = good}, "hung up"},
      {"no member's name", {.member = "no.member", .body = good}, "hung up"},
      {"more than any message may have", {.body = good, .bodyLength = 0xfffffff0}, "hung up"},
      {"128 MiB announced", {.body = good, .bodyLength = 1u << 27}, "hung up"},
      {"no such object", {.path = "/nowhere", .body = good}, "UnknownObject"},
      {"no such interface", {.interface = "com.example.No", .body = good}, "UnknownInterface"},
      {"no such method", {.member = "No", .body = good}, "UnknownMethod"},
      {"other arguments", {.signature = "s", .body = WireBytes().string("x").bytes()}, "InvalidArgs"},
      {"no arguments", {.signature = ""}, "InvalidArgs"},
      {"no signature at all", {.signature = "a{", .body = good}, "hung up"},
      {"a body cut short", {.body = good.substr(0, good.size() - 9)}, "hung up"},
      {"no UTF-8", {.body = WireCall::record({{"identifier", "\xff\xfe"}, {"userAgent", "x"}})}, "hung up"},
      {"a NUL in a string",
       {.body = WireCall::record({{"identifier", "a\0b"s}, {"userAgent", "x"}})},
       "hung up"},
      {"a value of another type", {.body = WireCall::record({{"userAgent", "x"}})}, "hung up"},
      {"a variant in a variant", {.body = nestedVariants(1)}, "hung up"},
      {"deep variants", {.body = nestedVariants(60)}, "hung up"},
      {"variants past every limit", {.body = nestedVariants(1000)}, "hung up"},
      {"announced descriptors", {.body = good, .descriptors = 3}, "hung up"},
  };
  for (const Case& test : cases) {
    RawPeer peer(world_.socket());
    peer.authenticate();
    peer.send(test.call.bytes());
    if (test.call.bodyLength > 0) peer.send(std::string(17 << 20, 'x'));
    const bool unheard = test.outcome == kUnheard;
    if (unheard) peer.send(cases[0].call.bytes());
    EXPECT_THAT(peer.receive(), HasSubstr(unheard ? cases[0].outcome : test.outcome)) << test.name;
  }
}

TEST_F(HostileClients, DescriptorsThatNobodyAskedForAreClosedWithTheirConnection) {
  const auto passed = world_.folder("passed");
  const auto heldByDaemon = [&] {
    std::error_code gone;
    const std::filesystem::directory_iterator all(proc("fd"));
    return std::ranges::any_of(
        all, [&](const auto& held) { return std::filesystem::read_symlink(held, gone) == passed; });
  };
  const std::string body = WireCall::record({{"identifier", "raw"}, {"userAgent", "raw/1"}});
  const std::string announced = WireCall{.body = body, .descriptors = 1}.bytes();
  const std::string good = WireCall{.body = body}.bytes();
  const std::string bad = WireCall{.body = body, .version = 9}.bytes();
  const int file = open(passed.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  for (const auto& [first, second] : {std::pair{announced, ""s}, {good, ""s}, {bad, ""s}, {"", good}}) {
    RawPeer peer(world_.socket());
    peer.authenticate();
    peer.send(first, file);
    // ... or only behind the head of their message.
    peer.send(second.substr(0, second.size() / 2));
    peer.send(second.substr(second.size() / 2), file);
    EXPECT_EQ(peer.receive(), "hung up");
  }
  close(file);
  EXPECT_TRUE(honest_.search("meanwhile").isClean());
  EXPECT_FALSE(heldByDaemon());
}

TEST_F(HostileClients, AMessageMayComeByteByByte) {
  RawPeer peer(world_.socket());
  peer.authenticate();
  const std::string call =
      WireCall{.body = WireCall::record({{"identifier", "slow"}, {"userAgent", "slow/1"}})}.bytes();
  for (const char byte : call) ASSERT_TRUE(peer.send({&byte, 1}));
  EXPECT_THAT(peer.receive(), HasSubstr("unix:path="));
}

TEST_F(HostileClients, WhoNeverReadsIsHungUpOnBeforeItCostsMuch) {
  RawPeer peer(world_.socket());
  peer.authenticate();
  const std::int64_t before = peakKiB();
  ASSERT_TRUE(peer.send(
      WireCall{.body = WireCall::record({{"identifier", "deaf"}, {"userAgent", "deaf/1"}})}.bytes()));
  const std::string call = WireCall{.member = "Bag", .signature = ""}.bytes();
  int calls = 0;
  while (peer.send(call)) ASSERT_LT(++calls, 1'000'000);
  EXPECT_EQ(occurrences(world_.daemonErrors(), "it does not read what it asked for"), 1u)
      << world_.daemonErrors();
  if (!kSanitized) {
    EXPECT_LT(peakKiB() - before, 96 << 10);
  }
}

TEST_F(HostileClients, WhoIntroducesItselfAtLengthIsHungUpOn) {
  const std::string longName(1 << 20, 'n');
  for (const SBLSessionConfiguration& configuration :
       {SBLSessionConfiguration{longName, "agent/1"}, {"name", longName}, {"", "agent/1"}, {"name", ""}}) {
    TestClient client(runtime_, world_.address(), configuration);
    EXPECT_FALSE(client.connect()) << configuration.description().substr(0, 40);
  }
}

TEST_F(HostileClients, ExtremesOfARequestAreAnswered) {
  SBLSearchRequest search;
  for (const std::uint64_t id : {std::uint64_t{1} << 63, std::numeric_limits<std::uint64_t>::max()}) {
    search.queryId = id;
    search.queryString = "id";
    const Answer answer = honest_.request(search);
    EXPECT_TRUE(answer.isClean()) << answer.reason();
    EXPECT_EQ(answer.queryId, id);
  }
  search.queryId = 5;
  const Answer stale = honest_.request(search);
  EXPECT_FALSE(stale.reply || stale.error) << "older than the newest";
  TestClient other(runtime_, world_.address(), {{"other"}, {"other/1"}});
  for (const std::string& text :
       {std::string(1 << 20, 'q'), std::string(1 << 20, '\x01'), "\xff\xfe\xc0"s, "a\0b"s}) {
    const Answer answer = other.search(text);
    EXPECT_TRUE(answer.reply || answer.error) << text.substr(0, 9);
  }
  honest_.disconnect();  // a new connection counts from the start again
}

TEST_F(HostileClients, NothingThatAClientSaysBecomesALineOfTheRequest) {
  const std::string evil = "x\r\nX-Evil: 1\r\n\r\nGET /evil HTTP/1.1\r\nHost: x\r\n\r\n";
  for (const std::string& agent : {evil, "Sabled/1.0 (" + evil, "\n"s, "a\rb"s}) {
    TestClient client(runtime_, world_.address(), {evil, agent});
    const Answer answer = client.search("agent");
    EXPECT_THAT(answer.reason(), HasSubstr("User-Agent has a line break")) << agent;
  }
  TestClient client(runtime_, world_.address(), {{"evil"}, {"evil/1"}});
  SBLSearchRequest search;
  search.queryString = evil;
  search.keyboardInputMode = evil;
  search.queryItems = {{evil, evil}, {"", evil}, {"q\n", std::nullopt}};
  for (const std::string& topics :
       {evil, "[\"" + evil + "\"]", R"(["a\r\nX-Evil: 1"])"s, "[\r\n\"X\",\r\n\"X-Evil: 1\"]"s}) {
    ++search.queryId;
    search.topics = topics;
    const Answer answer = client.request(search);
    EXPECT_TRUE(answer.reply || answer.error) << topics;
  }
  const std::string urls[] = {server_.url("/more") + evil,    server_.url("/more?a=" + evil),
                              server_.url("/more\t#" + evil), evil,
                              "file:///etc/passwd",           "http://127.0.0.1:99999/"};
  std::latch answered(2 * std::ssize(urls));  // together, for each is tried three times
  const auto ask = [&](const SBLAnyRequest& request, const std::string& url) {
    client.client().request(
        request, [&](std::uint64_t, const std::optional<SBLReply>& reply, const std::optional<Error>& error) {
          EXPECT_TRUE(error && !reply) << url;
          answered.count_down();
        });
  };
  for (const std::string& url : urls) {
    SBLMoreResultsRequest more;
    more.moreResultsURL = url;
    ask(more, url);
    SBLCardRequest card;
    card.cardURL = url;
    ask(card, url);
  }
  answered.wait();
  for (const std::string& request : server_.requests()) {
    EXPECT_THAT(request, Not(HasSubstr("\nX-Evil"))) << request;
    EXPECT_THAT(request, Not(HasSubstr("GET /evil"))) << request;
  }
}

}  // namespace
}  // namespace sable::test
