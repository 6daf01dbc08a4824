#include <gtest/gtest.h>

#include <filesystem>

#include "platform/HTTPSession.h"
#include "platform/host/HostHTTPSession.h"
#include "tests/support/LoopbackServer.h"

namespace sable::platform {
namespace {

using host::HostHTTPSessions;
using host::HostRuntime;
using tests::LoopbackServer;
using Then = LoopbackServer::Reply::Then;

class HostSession : public ::testing::Test {
 protected:
  std::unique_ptr<HTTPSession> session(HTTPSessionConfiguration configuration = {}) {
    configuration.label = "test";
    return sessions_.session(std::move(configuration));
  }

  HTTPResult load(HTTPSession& session, HTTPRequest request, const std::string& proxy = "") {
    HTTPResult result;
    const auto done = runtime_.semaphore(0);
    const auto task = session.dataTask(std::move(request), [&](HTTPResult got) {
      EXPECT_TRUE(session.callbackQueue().isCurrent());
      result = std::move(got);
      done->signal();
    });
    if (!proxy.empty()) task->setProxy(proxy);
    task->resume();
    EXPECT_TRUE(done->wait(MonotonicTime::max()));
    return result;
  }

  HTTPRequest request(const std::string& path, std::string method = "GET") {
    HTTPRequest request;
    request.url = server_.url(path);
    request.method = std::move(method);
    return request;
  }

  static HTTPErrorCode codeOf(const HTTPResult& result) {
    EXPECT_TRUE(result.error) << "it succeeded";
    if (!result.error) return HTTPErrorCode{};
    EXPECT_EQ(result.error->domain, kHTTPErrorDomain);
    EXPECT_NE(result.error->reason, "");
    return static_cast<HTTPErrorCode>(result.error->code);
  }

  HostRuntime runtime_{2};
  LoopbackServer server_{runtime_};
  HostHTTPSessions sessions_{runtime_, std::filesystem::path()};
};

TEST_F(HostSession, ResponsesArriveWhole) {
  const std::string body(100000, 'x');
  server_.on("/ok", LoopbackServer::ok(body, "Set-X: 1\r\nSet-X:  2 \r\nx-y:\r\n"));
  const auto session = this->session();
  const auto result = load(*session, request("/ok"));
  ASSERT_FALSE(result.error) << result.error->description();
  EXPECT_EQ(*result.data, body);
  EXPECT_EQ(result.response->status, 200);
  EXPECT_EQ(result.response->url, server_.url("/ok"));
  EXPECT_FALSE(result.response->fromCache);
  const std::vector<std::pair<std::string, std::string>> fields{
      {"Set-X", "1"}, {"Set-X", "2"}, {"x-y", ""}, {"Content-Length", "100000"}};
  EXPECT_EQ(result.response->headers.fields(), fields);
  EXPECT_EQ(load(*session, request("/missing")).response->status, 404);
}

}  // namespace
}  // namespace sable::platform
