#include <gtest/gtest.h>
#include <zlib.h>

#include <functional>
#include <nlohmann/json.hpp>

#include "platform/ConfiguredServiceProxy.h"
#include "platform/HTTPSession.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/simulated/SimulatedPlatform.h"
#include "tests/support/LoopbackServer.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

using host::HostHTTPSessions;
using host::HostRuntime;
using tests::LoopbackServer;
using Then = LoopbackServer::Reply::Then;
using Fields = std::vector<std::pair<std::string, std::string>>;

HTTPRequest get(std::string url) {
  HTTPRequest request;
  request.url = std::move(url);
  return request;
}

class HostSession : public ::testing::Test {
 protected:
  std::unique_ptr<HTTPSession> session(const std::function<void(HTTPSessionConfiguration&)>& configure =
                                           [](HTTPSessionConfiguration&) {}) {
    HTTPSessionConfiguration configuration;
    configuration.label = "test";
    configure(configuration);
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

  HTTPRequest request(const std::string& path, std::string method = "GET", const Fields& fields = {}) {
    HTTPRequest request = get(server_.url(path));
    request.method = std::move(method);
    for (const auto& [name, value] : fields) request.headers.add(name, value);
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
  NotificationCenter center_;
  TemporaryFolder folder_;
  HostHTTPSessions sessions_{runtime_, folder_.path(), {center_, nullptr, {}}};
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
  const Fields fields{{"Set-X", "1"}, {"Set-X", "2"}, {"x-y", ""}, {"Content-Length", "100000"}};
  EXPECT_EQ(result.response->headers.fields(), fields);
  EXPECT_EQ(load(*session, request("/missing")).response->status, 404);
}

TEST_F(HostSession, RequestsLeaveAsTheyWereMade) {
  server_.on("/a/../r", LoopbackServer::ok(""));
  const auto session = this->session();
  const std::string host = "Host: 127.0.0.1:" + std::to_string(server_.port()) + "\r\n";
  const std::string encodings = "Accept-Encoding: deflate, gzip, br, zstd\r\n";
  const std::string usual = host + "Accept: */*\r\n" + encodings;
  const Fields odd{{"X-Empty", ""}, {"X-Blank", "  "}, {"User-Agent", "a b"}, {"X", "1"}, {"X", "2"}};
  const Fields json{{"Content-Type", "application/json"}};
  const struct {
    std::string method;
    Data body;
    Fields headers;
    std::string expected;
  } rows[] = {
      {"GET", nullptr, {}, usual + "\r\n"},
      {"GET", nullptr, odd, usual + "X-Empty:\r\nX-Blank:\r\nUser-Agent: a b\r\nX: 1\r\nX: 2\r\n\r\n"},
      {"GET", nullptr, {{"Accept", "text/json"}}, host + encodings + "Accept: text/json\r\n\r\n"},
      {"POST", makeData("body"), {}, usual + "Content-Length: 4\r\n\r\nbody"},
      {"POST", nullptr, {}, usual + "Content-Length: 0\r\n\r\n"},
      {"POST", makeData("{}"), json, usual + "Content-Type: application/json\r\nContent-Length: 2\r\n\r\n{}"},
      {"PUT", makeData("x"), {}, usual + "Content-Length: 1\r\n\r\nx"},
      {"DELETE", nullptr, {}, usual + "\r\n"},
      {"HEAD", nullptr, {}, usual + "\r\n"},
  };
  for (const auto& row : rows) {
    HTTPRequest request = this->request("/a/../r?q=%2b+;#f", row.method, row.headers);
    request.body = row.body;
    const auto result = load(*session, std::move(request));
    ASSERT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(server_.requests().back(), row.method + " /a/../r?q=%2b+; HTTP/1.1\r\n" + row.expected);
  }
  EXPECT_EQ(server_.connections(), 1);
}

TEST_F(HostSession, InvalidRequestsEndBeforeAnythingIsSent) {
  using enum HTTPErrorCode;
  const struct {
    std::string url, method, name, value;
    HTTPErrorCode code;
  } rows[] = {
      {"127.0.0.1/", "GET", "X", "", badURL},
      {"http://", "GET", "X", "", badURL},
      {"", "GET", "X", "", badURL},
      {"file:///etc/passwd", "GET", "X", "", badURL},
      {"ftp://127.0.0.1/", "GET", "X", "", notAllowed},
      {server_.url("/"), "GET /x", "X", "", other},
      {server_.url("/"), "", "X", "", other},
      {server_.url("/"), "GET", "X Y", "", other},
      {server_.url("/"), "GET", "", "v", other},
      {server_.url("/"), "GET", "X", "a\r\nEvil: 1", other},
      {server_.url("/"), "GET", "X", "a\n", other},
      {server_.url("/"), "GET", "X", std::string("a\0b", 3), other},
  };
  const auto session = this->session();
  for (const auto& row : rows) {
    HTTPRequest request = get(row.url);
    request.method = row.method;
    request.headers.add(row.name, row.value);
    EXPECT_EQ(codeOf(load(*session, std::move(request))), row.code) << row.url << row.method << row.value;
  }
  EXPECT_TRUE(server_.requests().empty());
}

TEST_F(HostSession, WhatGoesWrongHasACodeAndKeepsWhatCame) {
  using enum HTTPErrorCode;
  const std::string head = "HTTP/1.1 200 OK\r\n", cut = head + "Content-Length: 9\r\n\r\nabc";
  const std::string chunked = head + "Transfer-Encoding: chunked\r\n\r\n";
  const auto redirect = [](const std::string& to) {
    return LoopbackServer::Reply{"HTTP/1.1 302 F\r\nLocation: " + to + "\r\nContent-Length: 0\r\n\r\n"};
  };
  const std::string gzip = head + "Content-Encoding: gzip\r\nContent-Length: 4\r\n\r\nabcd";
  const std::string longHeaders = LoopbackServer::ok("", "X: " + std::string(2000, 'x') + "\r\n");
  const std::string endless = head + "\r\n" + std::string(100000, 'x'), allowed(1000, 'x');
  const struct {
    std::string name;
    LoopbackServer::Reply reply;
    HTTPErrorCode code;
    std::optional<std::string> data;
  } rows[] = {
      {"cut body", {cut, Then::close}, badResponse, "abc"},
      {"cut chunks", {chunked + "3\r\nabc\r\n", Then::close}, badResponse, "abc"},
      {"no chunks", {chunked + "zz\r\n", Then::close}, badResponse, {}},
      {"cut headers", {head + "Content-Le", Then::close}, badResponse, {}},
      {"not HTTP", {"SSH-2.0-x\r\n", Then::close}, badResponse, {}},
      {"bad gzip", {gzip}, badResponse, {}},
      {"nothing", {"", Then::close}, connectionLost, {}},
      {"reset", {cut, Then::reset}, connectionLost, "abc"},
      {"stalled headers", {head, Then::stall}, timedOut, {}},
      {"stalled body", {cut, Then::stall}, timedOut, "abc"},
      {"long body", {LoopbackServer::ok(allowed + "x")}, responseTooLarge, allowed},
      {"endless body", {endless, Then::stall}, responseTooLarge, allowed},
      {"long headers", {longHeaders}, responseTooLarge, {}},
      {"one huge header", {head + "X: " + std::string(200000, 'x'), Then::stall}, responseTooLarge, {}},
      {"redirect to ftp", redirect("ftp://h/"), notAllowed, {}},
      {"redirect to nowhere", redirect("http://"), badURL, {}},
      {"redirect loop", redirect("/fault"), tooManyRedirects, {}},
  };
  const auto session = this->session([](auto& to) {
    to.maximumResponseBytes = to.maximumHeaderBytes = 1000;
    to.maximumRedirects = 3;
  });
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    server_.on("/fault", row.reply);
    HTTPRequest request = this->request("/fault");
    if (row.code == timedOut) request.timeout = 0.2;
    const auto result = load(*session, std::move(request));
    EXPECT_EQ(codeOf(result), row.code) << result.error.value_or(Error{}).reason;
    EXPECT_EQ(result.data ? std::optional(*result.data) : std::nullopt, row.data);
  }
  // The session is none the worse for it.
  server_.on("/fault", LoopbackServer::ok("fine"));
  EXPECT_EQ(*load(*session, request("/fault")).data, "fine");

  EXPECT_EQ(codeOf(load(*session, get("http://127.0.0.1:1/"))), cannotConnect);
  EXPECT_EQ(codeOf(load(*session, get("http://name.invalid/"))), cannotFindHost);
  const std::string secure = "https://127.0.0.1:" + std::to_string(server_.port()) + "/";
  EXPECT_EQ(codeOf(load(*session, get(secure))), secureConnectionFailed);
}

TEST_F(HostSession, EncodedBodiesCountWithTheirDecodedSizeForTheLimitOfTheirRequest) {
  const std::string plain(5 << 20, 'a');
  uLongf size = compressBound(plain.size());
  std::string packed(size, '\0');
  ASSERT_EQ(compress(reinterpret_cast<Bytef*>(packed.data()), &size,
                     reinterpret_cast<const Bytef*>(plain.data()), plain.size()),
            Z_OK);
  packed.resize(size);
  server_.on("/bomb", LoopbackServer::ok(packed, "Content-Encoding: deflate\r\n"));
  const auto session = this->session();
  HTTPRequest little = request("/bomb");
  little.maximumResponseBytes = 1 << 20;
  const auto cut = load(*session, little);
  EXPECT_EQ(codeOf(cut), HTTPErrorCode::responseTooLarge);
  EXPECT_EQ(cut.data->size(), 1u << 20);

  const auto whole = load(*session, request("/bomb"));
  ASSERT_FALSE(whole.error);
  EXPECT_EQ(*whole.data, plain);
  EXPECT_EQ(whole.timing.responseBodyBytes, static_cast<std::int64_t>(packed.size()));
}

TEST_F(HostSession, RedirectsAreFollowedAndTimed) {
  server_.on("/from", "HTTP/1.1 302 F\r\nLocation: /to?x=1\r\nX: first\r\nContent-Length: 4\r\n\r\nskip");
  server_.on("/to",
             "HTTP/1.1 103 Early Hints\r\nX: early\r\n\r\n" + LoopbackServer::ok("end", "Y: last\r\n"));
  const auto session = this->session();
  const auto result = load(*session, request("/from"));
  ASSERT_FALSE(result.error);
  EXPECT_EQ(*result.data, "end");
  EXPECT_EQ(result.response->url, server_.url("/to?x=1"));
  EXPECT_EQ(result.response->headers.find("X"), nullptr);
  EXPECT_EQ(*result.response->headers.find("y"), "last");
  EXPECT_EQ(result.timing.redirects, 1);
  EXPECT_GT(result.timing.redirect, Duration{});
}

TEST_F(HostSession, TimingTellsWhatHappened) {
  server_.on("/t", LoopbackServer::ok("12345"));
  const auto session = this->session();
  const auto first = load(*session, request("/t")).timing;
  EXPECT_FALSE(first.reusedConnection);
  EXPECT_GT(first.connect, Duration{});
  EXPECT_EQ(first.secureConnect, Duration{});
  EXPECT_LE(first.connect, first.requestStart);
  EXPECT_LE(first.requestStart, first.responseStart);
  EXPECT_LE(first.responseStart, first.total);
  EXPECT_EQ(first.requestHeaderBytes, static_cast<std::int64_t>(server_.requests().back().size()));
  EXPECT_EQ(first.responseHeaderBytes, static_cast<std::int64_t>(LoopbackServer::ok("12345").size() - 5));
  EXPECT_EQ(first.responseBodyBytes, 5);
  EXPECT_EQ(first.protocol, "http/1.1");
  EXPECT_EQ(first.peerAddress, "127.0.0.1");
  EXPECT_EQ(first.peerPort, server_.port());

  for (const std::size_t size : {1000u, 200000u}) {
    HTTPRequest request = this->request("/t", "POST");
    request.body = makeData(std::string(size, 'x'));
    const auto next = load(*session, std::move(request)).timing;
    EXPECT_TRUE(next.reusedConnection);
    EXPECT_EQ(next.nameLookup + next.connect, Duration{});
    EXPECT_EQ(next.requestBodyBytes, static_cast<std::int64_t>(size));
    EXPECT_EQ(next.requestHeaderBytes, static_cast<std::int64_t>(server_.requests().back().size() - size));
  }
}

TEST_F(HostSession, ProxiesCarryTheWholeURLAndTheirFailuresAreTheirs) {
  server_.on("http://name.invalid/x", LoopbackServer::ok("by proxy"));
  const auto session = this->session();
  const auto result = load(*session, get("http://name.invalid/x"), server_.url(""));
  ASSERT_FALSE(result.error) << result.error->description();
  EXPECT_EQ(*result.data, "by proxy");
  EXPECT_TRUE(result.timing.proxied);

  EXPECT_EQ(codeOf(load(*session, get("https://name.invalid/"), server_.url(""))),
            HTTPErrorCode::proxyFailed);
  for (const char* proxy : {"http://127.0.0.1:1", "socks5h://127.0.0.1:1", "ftp://127.0.0.1", "nonsense"}) {
    EXPECT_EQ(codeOf(load(*session, request("/"), proxy)), HTTPErrorCode::proxyFailed) << proxy;
  }
}

TEST_F(HostSession, ATaskEndsOnceWhateverIsAskedOfIt) {
  server_.on("/stall", LoopbackServer::Reply{"", Then::stall});
  server_.on("/ok", LoopbackServer::ok("x"));
  auto session = this->session();
  const auto done = runtime_.semaphore(0);
  std::vector<HTTPErrorCode> codes;
  const auto record = [&](HTTPResult result) {
    codes.push_back(result.error ? codeOf(result) : HTTPErrorCode{});
    done->signal();
  };
  const auto wait = [&] { ASSERT_TRUE(done->wait(MonotonicTime::max())); };

  const auto stalled = session->dataTask(request("/stall"), record);
  stalled->resume();
  stalled->resume();
  stalled->cancel();
  wait();
  const auto unstarted = session->dataTask(request("/ok"), record);
  unstarted->cancel();
  unstarted->resume();
  wait();
  const auto finished = session->dataTask(request("/ok"), record);
  finished->resume();
  wait();
  finished->cancel();
  session->dataTask(request("/ok"), nullptr)->resume();
  session->dataTask(request("/stall"), record)->resume();  // nobody holds it
  session = nullptr;
  wait();
  unstarted->resume();
  EXPECT_EQ(codes, (std::vector{HTTPErrorCode::cancelled, HTTPErrorCode::cancelled, HTTPErrorCode{},
                                HTTPErrorCode::cancelled}));
}

TEST_F(HostSession, CancellingWhileConnectingHarmsNoLaterTask) {
  server_.on("/ok", LoopbackServer::ok("x"));
  for (int i = 0; i < 30; ++i) {
    const auto session = this->session();
    const auto task = session->dataTask(request("/ok"), nullptr);
    task->resume();
    task->cancel();
    HTTPRequest next = request("/ok");
    next.timeout = 10;
    EXPECT_FALSE(load(*session, std::move(next)).error);
  }
}

TEST_F(HostSession, ManyTasksFromManyThreadsGetTheirOwnAnswers) {
  server_.on("/n", [](const std::string& request) {
    return LoopbackServer::Reply{LoopbackServer::ok(request.substr(0, request.find(" HTTP")))};
  });
  const auto session = this->session();
  const auto done = runtime_.semaphore(0);
  constexpr int kTasks = 200;
  for (int i = 0; i < kTasks; ++i) {
    runtime_.globalQueue(QualityOfService::standard).async([&, i] {
      const std::string query = "/n?" + std::to_string(i);
      const auto task = session->dataTask(request(query), [&, query](HTTPResult result) {
        EXPECT_FALSE(result.error);
        EXPECT_EQ(result.data ? *result.data : "", "GET " + query);
        done->signal();
      });
      task->resume();
    });
  }
  for (int i = 0; i < kTasks; ++i) ASSERT_TRUE(done->wait(MonotonicTime::max()));
}

TEST_F(HostSession, IdleConnectionsAreClosedAndReplaced) {
  server_.on("/ok", LoopbackServer::ok("x"));
  const auto session =
      this->session([](auto& to) { to.idleConnectionTimeout = std::chrono::milliseconds(50); });
  EXPECT_FALSE(load(*session, request("/ok")).error);
  server_.waitUntilNoneIsOpen();
  EXPECT_FALSE(load(*session, request("/ok")).timing.reusedConnection);

  // One that the server closed meanwhile is noticed, too.
  server_.on("/last", LoopbackServer::Reply{LoopbackServer::ok("x"), Then::close});
  const auto patient = this->session();
  EXPECT_FALSE(load(*patient, request("/last")).error);
  EXPECT_EQ(*load(*patient, request("/ok")).data, "x");
}

TEST_F(HostSession, ACacheAsksTheServerOnlyForWhatItMust) {
  const auto cached = [](auto& to) {
    to.allowsCache = true;
    to.cacheMemoryCapacity = to.cacheDiskCapacity = 1 << 20;
  };
  auto session = this->session(cached);
  const auto load = [&](const std::string& path, const Fields& fields = {}, std::string method = "GET",
                        HTTPCachePolicy policy = HTTPCachePolicy::useProtocol) {
    HTTPRequest request = this->request(path, std::move(method), fields);
    request.cachePolicy = policy;
    auto result = HostSession::load(*session, std::move(request));
    EXPECT_FALSE(result.error);
    return result;
  };
  const auto asked = [&] { return server_.requests().size(); };

  server_.on("/fresh", LoopbackServer::ok("fresh", "Cache-Control: max-age=600\r\nVary: X\r\n"));
  EXPECT_FALSE(load("/fresh").response->fromCache);
  const auto second = load("/fresh");
  EXPECT_TRUE(second.response->fromCache);
  EXPECT_EQ(*second.data, "fresh");
  EXPECT_NE(second.response->headers.find("Age"), nullptr);
  EXPECT_EQ(asked(), 1u);
  EXPECT_FALSE(load("/fresh", {{"X", "other"}}).response->fromCache);
  EXPECT_FALSE(load("/fresh", {}, "GET", HTTPCachePolicy::ignoreLocal).response->fromCache);
  EXPECT_FALSE(load("/fresh", {{"Range", "bytes=0-1"}}).response->fromCache);
  EXPECT_EQ(asked(), 4u);

  session->purgeMemoryCache();
  EXPECT_TRUE(load("/fresh").response->fromCache);
  session = nullptr;
  session = this->session(cached);
  EXPECT_TRUE(load("/fresh").response->fromCache) << "the file outlives the session";
  EXPECT_EQ(asked(), 4u);
  load("/fresh", {}, "POST");
  EXPECT_FALSE(load("/fresh").response->fromCache);

  server_.on("/checked", [](const std::string& request) -> LoopbackServer::Reply {
    if (request.find("If-None-Match: \"1\"\r\n") == std::string::npos)
      return {LoopbackServer::ok("checked", "ETag: \"1\"\r\nX: old\r\n")};
    return {"HTTP/1.1 304 Not Modified\r\nX: new\r\n\r\n"};
  });
  EXPECT_FALSE(load("/checked").response->fromCache);
  const auto validated = load("/checked");
  EXPECT_TRUE(validated.response->fromCache);
  EXPECT_EQ(validated.response->status, 200);
  EXPECT_EQ(*validated.response->headers.find("X"), "new");
  EXPECT_EQ(*validated.data, "checked");
  EXPECT_EQ(load("/checked", {{"If-None-Match", "\"1\""}}).response->status, 304)
      << "the caller's own condition";

  server_.on("/moved", "HTTP/1.1 302 F\r\nLocation: /fresh\r\nContent-Length: 0\r\n\r\n");
  const auto before = asked();
  load("/moved");
  load("/moved");
  EXPECT_EQ(asked(), before + 4) << "what a redirect led to is not kept under the first URL";
}

TEST(ScriptedSession, LimitsAndCancellingEndATaskOnce) {
  simulated::SimulatedPlatform platform;
  simulated::Scripted large, slow;
  large.body = "12345";
  slow.latency = std::chrono::seconds(10);
  platform.httpSessions().service().on("/large", large);
  platform.httpSessions().service().on("/slow", slow);
  HTTPSessionConfiguration configuration;
  configuration.maximumResponseBytes = 4;
  const auto session = platform.httpSessions().session(configuration);
  std::vector<HTTPResult> results;
  const auto start = [&](const char* url) {
    HTTPRequest request = get(url);
    request.timeout = 10;
    auto task =
        session->dataTask(std::move(request), [&](HTTPResult got) { results.push_back(std::move(got)); });
    task->resume();
    return task;
  };
  start("http://h/slow")->cancel();
  for (const char* url : {"http://h/large", "http://h/slow", "h/", "ftp://h/"}) {
    const auto task = start(url);
    task->resume();
    platform.runtime().advance(std::chrono::seconds(10));
    task->cancel();
    platform.runtime().run();
  }
  using enum HTTPErrorCode;
  std::vector<HTTPErrorCode> codes;
  for (const HTTPResult& result : results) codes.push_back(HTTPErrorCode{result.error.value().code});
  EXPECT_EQ(codes, (std::vector{cancelled, responseTooLarge, timedOut, badURL, notAllowed}));
  EXPECT_EQ(*results[1].data, "1234");
}

TEST(ServiceProxy, AConfiguredOneCarriesTasks) {
  simulated::SimulatedPlatform platform;
  const auto session = platform.httpSessions().session({});
  ConfiguredServiceProxy proxies;
  const auto task = [&] { return session->dataTask(proxies.brambleRequest(get("http://h/")), nullptr); };
  const auto set = [&](std::string_view client, std::string_view json) {
    return proxies.setConfiguration(client, *parseJSON(json, 1000)).has_value();
  };
  EXPECT_FALSE(proxies.enable(*task()));
  EXPECT_TRUE(set("b", R"({"proxy": "http://b:1", "enabled": true})"));
  EXPECT_TRUE(set("a", R"({"proxy": "http://a:1", "enabled": false})"));
  for (const char* unusable : {R"({"enabled": true})", R"({"proxy": "a:1", "enabled": true})",
                               R"({"proxy": "ftp://a/"})", "[]", "\"http://a:1\""}) {
    EXPECT_FALSE(set("b", unusable)) << unusable;
  }
  ASSERT_TRUE(proxies.isEnabled());
  const auto proxied = task();
  EXPECT_TRUE(proxies.enable(*proxied));
  proxied->resume();
  const auto sent = platform.httpSessions().service().requests().back();
  EXPECT_EQ(sent.proxyURL, "http://b:1");
  EXPECT_TRUE(sent.request.proxied);
  EXPECT_TRUE(set("b", R"({"enabled": false})"));
  EXPECT_FALSE(proxies.isEnabled());
  EXPECT_TRUE(set("b", R"({"proxy": "socks5h://b:1", "enabled": true})"));
  EXPECT_TRUE(proxies.isEnabled());
  EXPECT_TRUE(set("b", "null"));
  EXPECT_FALSE(proxies.isEnabled());
}

}  // namespace
}  // namespace sable::platform
