#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/support/LoopbackServer.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// What reaches a client of the real daemon when the service, or the way to it, is at fault.
namespace sable::test {
namespace {

using platform::HTTPErrorCode;
using testing::HasSubstr;
using tests::LoopbackServer;
using Then = LoopbackServer::Reply::Then;

/// The daemon between a client and a service that says whatever a test wants.
class ServiceFaults : public testing::Test {
 protected:
  ServiceFaults() {
    const nlohmann::json bag{
        {"version", "1"}, {"enabled", true}, {"search_url", server_.url("/search")}, {"request_timeout", 1}};
    server_.on("/bag", LoopbackServer::ok(bag.dump()));
  }

  TestClient client() { return {runtime_, world_.address()}; }

  platform::host::HostRuntime runtime_;
  LoopbackServer server_{runtime_};
  World world_{{.settings = "SBLUseBramble = false", .bagURL = server_.url("/bag")}};
};

std::string everyByte(std::size_t size) {
  std::string bytes(size, '\0');
  for (std::size_t i = 0; i < size; ++i) bytes[i] = static_cast<char>(i * 7 + i / 256);
  return bytes;
}

TEST_F(ServiceFaults, AnyBytesUpToTheLimitReachTheClientWithWhatIsWrongWithThem) {
  auto asking = client();
  for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{4096}, std::size_t{8} << 20}) {
    const std::string body = everyByte(size);
    server_.on("/search", LoopbackServer::ok(body));
    const Answer answer = asking.search("bytes");
    ASSERT_TRUE(answer.reply) << size << answer.reason();
    EXPECT_TRUE(answer.data() == body) << size;
    ASSERT_TRUE(answer.error) << size;
    EXPECT_EQ(answer.error->domain, "JSONErrorDomain");
  }
  server_.on("/search", LoopbackServer::ok(everyByte((std::size_t{8} << 20) + 1)));
  EXPECT_EQ(asking.search("too much").error->code, std::int64_t(HTTPErrorCode::responseTooLarge));
  server_.on("/search", LoopbackServer::ok("[]"));
  EXPECT_TRUE(asking.search("fine").isClean());
}

TEST_F(ServiceFaults, EveryStatusReachesTheClientWithItsBody) {
  auto asking = client();
  for (const int status : {201, 400, 404, 500, 503}) {
    server_.on("/search", "HTTP/1.1 " + std::to_string(status) +
                              " X\r\nRetry-After: 5\r\nContent-Length: 11\r\n\r\n[\"body\", 1]");
    const Answer answer = asking.search("status");
    ASSERT_TRUE(answer.isClean()) << status << answer.reason();
    EXPECT_EQ(answer.data(), "[\"body\", 1]");
    EXPECT_EQ(answer.reply->httpResponse->status, status);
  }
}

TEST_F(ServiceFaults, WhatGoesWrongOnTheWayIsAnErrorAndCostsOneAnswer) {
  const auto redirect = [](const std::string& to) {
    return "HTTP/1.1 302 Found\r\nContent-Length: 0\r\nLocation: " + to + "\r\n\r\n";
  };
  const struct {
    LoopbackServer::Reply reply;
    HTTPErrorCode code;
  } cases[] = {
      {{LoopbackServer::ok("[]", "X: " + std::string(300 << 10, 'x') + "\r\n")},
       HTTPErrorCode::responseTooLarge},
      {{redirect("/search")}, HTTPErrorCode::tooManyRedirects},
      {{redirect("file:///etc/passwd")}, HTTPErrorCode::notAllowed},
      {{redirect("ftp://127.0.0.1/")}, HTTPErrorCode::notAllowed},
      {{redirect("http://127.0.0.1:1/")}, HTTPErrorCode::cannotConnect},
      {{"", Then::reset}, HTTPErrorCode::connectionLost},
      {{"HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\n[]", Then::close}, HTTPErrorCode::badResponse},
      {{"HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\n[]", Then::stall}, HTTPErrorCode::timedOut},
      {{"\x16\x03\x01 what?\r\n\r\n", Then::close}, HTTPErrorCode::badResponse},
  };
  auto asking = client();
  for (const auto& [reply, code] : cases) {
    server_.on("/search", reply);
    const Answer answer = asking.search("fault");
    ASSERT_TRUE(answer.error) << reply.bytes.substr(0, 80);
    EXPECT_EQ(answer.error->domain, platform::kHTTPErrorDomain);
    EXPECT_EQ(answer.error->code, std::int64_t(code)) << answer.reason() << reply.bytes.substr(0, 80);
    EXPECT_FALSE(answer.reply);
  }
  // Many header lines, each small, up to the limit.
  std::string many;
  while (many.size() < 200 << 10) many += "X-Line: " + std::string(500, 'y') + "\r\n";
  server_.on("/search", LoopbackServer::ok("[]", many));
  const Answer answer = asking.search("many headers");
  EXPECT_TRUE(answer.isClean()) << answer.reason();
}

TEST(NoService, IsToldToTheClientThatWaitsForIt) {
  platform::host::HostRuntime runtime;
  World world({.settings = "SBLUseBramble = false", .bagURL = "http://127.0.0.1:1/bag"});
  TestClient asking(runtime, world.address());
  ASSERT_TRUE(asking.connect());
  for (int i = 0; i < 2; ++i) {
    const Answer answer = asking.search("nobody");
    EXPECT_FALSE(answer.reply);
    EXPECT_EQ(answer.reason(), "timeout");
  }
}

TEST(NoService, AKnownBagIsServedWithoutANetwork) {
  platform::host::HostRuntime runtime;
  std::optional<LoopbackServer> server(runtime);
  server->on("/bag", LoopbackServer::ok(R"({"version": "7", "enabled": true, "search_url": ")" +
                                        server->url("/search") + "\"}"));
  World world({.settings = "SBLUseBramble = false", .bagURL = server->url("/bag")});
  const auto folder = world.folder("caches") / "com.kestrel.sabled";
  waitForChange(folder, [&] { return std::filesystem::exists(folder / "bag.plist"); });
  server.reset();
  world.killDaemon();
  world.startDaemon();
  TestClient asking(runtime, world.address());
  const Answer answer = asking.search("gone");
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->code, std::int64_t(HTTPErrorCode::cannotConnect)) << answer.reason();
}

TEST(NoService, NoSessionBusIsLoggedOnce) {
  for (const char* address : {"", "unix:path=/nonexistent/bus", "nonsense"}) {
    World world(
        {.settings = "SBLUseBramble = false", .environment = {{"DBUS_SESSION_BUS_ADDRESS", address}}});
    world.waitForLog("notifications reach no other process");
    platform::host::HostRuntime runtime;
    EXPECT_TRUE(TestClient(runtime, world.address()).search("dog").isClean());
    EXPECT_EQ(occurrences(world.daemonErrors(), "notifications reach no other process"), 1u);
  }
}

}  // namespace
}  // namespace sable::test
