#include <gtest/gtest.h>
#include <zlib.h>

#include <filesystem>
#include <functional>
#include <nlohmann/json.hpp>

#include "platform/ConfiguredServiceProxy.h"
#include "platform/HTTPSession.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/simulated/SimulatedFileManager.h"
#include "platform/simulated/SimulatedHTTP.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "tests/support/LoopbackServer.h"

namespace sable::platform {
namespace {

using host::HostHTTPSessions;
using host::HostRuntime;
using tests::LoopbackServer;
using Then = LoopbackServer::Reply::Then;

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

  HTTPRequest request(const std::string& path, std::string method = "GET") {
    HTTPRequest request = get(server_.url(path));
    request.method = std::move(method);
    return request;
  }

  static HTTPRequest get(std::string url) {
    HTTPRequest request;
    request.url = std::move(url);
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
  HostHTTPSessions sessions_{runtime_, std::filesystem::path(), {center_, nullptr, {}}};
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

TEST_F(HostSession, RequestsLeaveAsTheyWereMade) {
  server_.on("/a/../r", LoopbackServer::ok(""));
  const auto session = this->session();
  const std::string common = "Host: 127.0.0.1:" + std::to_string(server_.port()) + "\r\n";
  const std::string accepts = "Accept: */*\r\nAccept-Encoding: deflate, gzip, br, zstd\r\n";
  const struct {
    std::string method;
    Data body;
    std::vector<std::pair<std::string, std::string>> headers;
    std::string expected;
  } rows[] = {
      {"GET", nullptr, {}, common + accepts + "\r\n"},
      {"GET",
       nullptr,
       {{"X-Empty", ""}, {"X-Blank", "  "}, {"User-Agent", "a b"}, {"X", "1"}, {"X", "2"}},
       common + accepts + "X-Empty:\r\nX-Blank:\r\nUser-Agent: a b\r\nX: 1\r\nX: 2\r\n\r\n"},
      {"GET",
       nullptr,
       {{"Accept", "text/json"}},
       common + "Accept-Encoding: deflate, gzip, br, zstd\r\nAccept: text/json\r\n\r\n"},
      {"POST", makeData("body"), {}, common + accepts + "Content-Length: 4\r\n\r\nbody"},
      {"POST", nullptr, {}, common + accepts + "Content-Length: 0\r\n\r\n"},
      {"POST",
       makeData("{}"),
       {{"Content-Type", "application/json"}},
       common + accepts + "Content-Type: application/json\r\nContent-Length: 2\r\n\r\n{}"},
      {"PUT", makeData("x"), {}, common + accepts + "Content-Length: 1\r\n\r\nx"},
      {"DELETE", nullptr, {}, common + accepts + "\r\n"},
      {"HEAD", nullptr, {}, common + accepts + "\r\n"},
  };
  for (const auto& row : rows) {
    HTTPRequest request = this->request("/a/../r?q=%2b+;#f", row.method);
    for (const auto& [name, value] : row.headers) request.headers.add(name, value);
    request.body = row.body;
    const auto result = load(*session, std::move(request));
    ASSERT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(server_.requests().back(), row.method + " /a/../r?q=%2b+; HTTP/1.1\r\n" + row.expected);
  }
  EXPECT_EQ(server_.connections(), 1);
}

TEST_F(HostSession, InvalidRequestsEndBeforeAnythingIsSent) {
  const struct {
    std::string url, method, name, value;
    HTTPErrorCode code;
  } rows[] = {
      {"127.0.0.1/", "GET", "X", "", HTTPErrorCode::badURL},
      {"http://", "GET", "X", "", HTTPErrorCode::badURL},
      {"", "GET", "X", "", HTTPErrorCode::badURL},
      {"file:///etc/passwd", "GET", "X", "", HTTPErrorCode::badURL},
      {"ftp://127.0.0.1/", "GET", "X", "", HTTPErrorCode::notAllowed},
      {server_.url("/"), "GET /x", "X", "", HTTPErrorCode::other},
      {server_.url("/"), "", "X", "", HTTPErrorCode::other},
      {server_.url("/"), "GET", "X Y", "", HTTPErrorCode::other},
      {server_.url("/"), "GET", "", "v", HTTPErrorCode::other},
      {server_.url("/"), "GET", "X", "a\r\nEvil: 1", HTTPErrorCode::other},
      {server_.url("/"), "GET", "X", "a\n", HTTPErrorCode::other},
      {server_.url("/"), "GET", "X", std::string("a\0b", 3), HTTPErrorCode::other},
  };
  const auto session = this->session();
  for (const auto& row : rows) {
    HTTPRequest request;
    request.url = row.url;
    request.method = row.method;
    request.headers.add(row.name, row.value);
    EXPECT_EQ(codeOf(load(*session, std::move(request))), row.code) << row.url << row.method << row.value;
  }
  EXPECT_TRUE(server_.requests().empty());
}

TEST_F(HostSession, WhatGoesWrongHasACodeAndKeepsWhatCame) {
  const std::string head = "HTTP/1.1 200 OK\r\n";
  const struct {
    std::string name;
    LoopbackServer::Reply reply;
    HTTPErrorCode code;
    std::optional<std::string> data;
  } rows[] = {
      {"cut body", {head + "Content-Length: 9\r\n\r\nabc", Then::close}, HTTPErrorCode::badResponse, "abc"},
      {"cut chunks",
       {head + "Transfer-Encoding: chunked\r\n\r\n3\r\nabc\r\n", Then::close},
       HTTPErrorCode::badResponse,
       "abc"},
      {"no chunks",
       {head + "Transfer-Encoding: chunked\r\n\r\nzz\r\n", Then::close},
       HTTPErrorCode::badResponse,
       std::nullopt},
      {"cut headers", {head + "Content-Le", Then::close}, HTTPErrorCode::badResponse, std::nullopt},
      {"not HTTP", {"SSH-2.0-x\r\n", Then::close}, HTTPErrorCode::badResponse, std::nullopt},
      {"bad gzip",
       {head + "Content-Encoding: gzip\r\nContent-Length: 4\r\n\r\nabcd", Then::keep},
       HTTPErrorCode::badResponse,
       std::nullopt},
      {"nothing", {"", Then::close}, HTTPErrorCode::connectionLost, std::nullopt},
      {"reset", {head + "Content-Length: 9\r\n\r\nabc", Then::reset}, HTTPErrorCode::connectionLost, "abc"},
      {"stalled headers", {head, Then::stall}, HTTPErrorCode::timedOut, std::nullopt},
      {"stalled body", {head + "Content-Length: 9\r\n\r\nabc", Then::stall}, HTTPErrorCode::timedOut, "abc"},
      {"long body",
       {LoopbackServer::ok(std::string(1001, 'x'))},
       HTTPErrorCode::responseTooLarge,
       std::string(1000, 'x')},
      {"endless body",
       {head + "\r\n" + std::string(100000, 'x'), Then::stall},
       HTTPErrorCode::responseTooLarge,
       std::string(1000, 'x')},
      {"long headers",
       {LoopbackServer::ok("", "X: " + std::string(2000, 'x') + "\r\n")},
       HTTPErrorCode::responseTooLarge,
       std::nullopt},
      {"one huge header",
       {head + "X: " + std::string(200000, 'x'), Then::stall},
       HTTPErrorCode::responseTooLarge,
       std::nullopt},
      {"redirect to ftp",
       {"HTTP/1.1 302 F\r\nLocation: ftp://h/\r\nContent-Length: 0\r\n\r\n"},
       HTTPErrorCode::notAllowed,
       std::nullopt},
      {"redirect to nowhere",
       {"HTTP/1.1 302 F\r\nLocation: http://\r\nContent-Length: 0\r\n\r\n"},
       HTTPErrorCode::badURL,
       std::nullopt},
      {"redirect loop",
       {"HTTP/1.1 302 F\r\nLocation: /fault\r\nContent-Length: 0\r\n\r\n"},
       HTTPErrorCode::tooManyRedirects,
       std::nullopt},
  };
  const auto session = this->session([](auto& to) {
    to.maximumResponseBytes = to.maximumHeaderBytes = 1000;
    to.maximumRedirects = 3;
  });
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    server_.on("/fault", row.reply);
    HTTPRequest request = this->request("/fault");
    if (row.code == HTTPErrorCode::timedOut) request.timeout = 0.2;
    const auto result = load(*session, std::move(request));
    EXPECT_EQ(codeOf(result), row.code) << result.error.value_or(Error{}).reason;
    EXPECT_EQ(result.data ? std::optional(*result.data) : std::nullopt, row.data);
  }
  // The session is none the worse for it.
  server_.on("/fault", LoopbackServer::ok("fine"));
  EXPECT_EQ(*load(*session, request("/fault")).data, "fine");

  EXPECT_EQ(codeOf(load(*session, get("http://127.0.0.1:1/"))), HTTPErrorCode::cannotConnect);
  EXPECT_EQ(codeOf(load(*session, get("http://name.invalid/"))), HTTPErrorCode::cannotFindHost);
  const std::string secure = "https://127.0.0.1:" + std::to_string(server_.port()) + "/";
  EXPECT_EQ(codeOf(load(*session, get(secure))), HTTPErrorCode::secureConnectionFailed);
}

TEST_F(HostSession, EncodedBodiesCountWithTheirDecodedSize) {
  std::string plain(5 << 20, 'a'), packed(1 << 16, '\0');
  z_stream stream{};
  ASSERT_EQ(deflateInit2(&stream, 9, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY), Z_OK);
  stream.next_in = reinterpret_cast<Bytef*>(plain.data());
  stream.avail_in = static_cast<uInt>(plain.size());
  stream.next_out = reinterpret_cast<Bytef*>(packed.data());
  stream.avail_out = static_cast<uInt>(packed.size());
  ASSERT_EQ(deflate(&stream, Z_FINISH), Z_STREAM_END);
  packed.resize(stream.total_out);
  deflateEnd(&stream);

  server_.on("/bomb", LoopbackServer::ok(packed, "Content-Encoding: gzip\r\n"));
  const auto small = session([](auto& to) { to.maximumResponseBytes = 1 << 20; });
  const auto cut = load(*small, request("/bomb"));
  EXPECT_EQ(codeOf(cut), HTTPErrorCode::responseTooLarge);
  EXPECT_EQ(cut.data->size(), 1u << 20);

  const auto large = session();
  const auto whole = load(*large, request("/bomb"));
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

TEST_F(HostSession, ATaskMayTakeARedirectItselfAndLessThanTheSessionAllows) {
  server_.on("/from", "HTTP/1.1 302 F\r\nLocation: /to\r\nContent-Length: 4\r\n\r\nskip");
  server_.on("/large", LoopbackServer::ok(std::string(1 << 20, 'x')));
  const auto session = this->session();
  HTTPRequest from = request("/from");
  from.followsRedirects = false;
  const auto redirect = load(*session, from);
  ASSERT_FALSE(redirect.error);
  EXPECT_EQ(redirect.response->status, 302);
  EXPECT_EQ(*redirect.response->headers.find("Location"), "/to");
  EXPECT_EQ(server_.requests().size(), 1u);

  HTTPRequest large = request("/large");
  large.maximumResponseBytes = 1000;
  const auto cut = load(*session, large);
  ASSERT_TRUE(cut.error);
  EXPECT_EQ(cut.error->code, std::int64_t(HTTPErrorCode::responseTooLarge));
  EXPECT_EQ(cut.data->size(), 1000u);
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

TEST_F(HostSession, ManyTasksFromManyThreadsShareAFewConnections) {
  server_.on("/n", [](const std::string& request) {
    return LoopbackServer::Reply{LoopbackServer::ok(request.substr(0, request.find(" HTTP")))};
  });
  const auto session = this->session();
  const auto done = runtime_.semaphore(0);
  constexpr int kTasks = 200;
  for (int i = 0; i < kTasks; ++i) {
    runtime_.globalQueue(QualityOfService::standard).async([&, i] {
      const std::string query = "/n?" + std::to_string(i);
      session
          ->dataTask(request(query),
                     [&, query](HTTPResult result) {
                       EXPECT_FALSE(result.error);
                       EXPECT_EQ(result.data ? *result.data : "", "GET " + query);
                       done->signal();
                     })
          ->resume();
    });
  }
  for (int i = 0; i < kTasks; ++i) ASSERT_TRUE(done->wait(MonotonicTime::max()));
  EXPECT_LE(server_.connections(), kTasks);
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

class ScriptedSession : public ::testing::Test {
 protected:
  ScriptedSession() {
    HTTPSessionConfiguration configuration;
    configuration.label = "scripted";
    configuration.maximumResponseBytes = 4;
    session_ = sessions_.session(std::move(configuration));
  }

  static simulated::Scripted answer(int status, std::string body, int latencySeconds) {
    simulated::Scripted answer;
    answer.status = status;
    answer.body = std::move(body);
    answer.latency = std::chrono::seconds(latencySeconds);
    return answer;
  }

  std::shared_ptr<HTTPDataTask> start(const std::string& url, const std::string& proxy = "") {
    HTTPRequest request;
    request.url = url;
    request.timeout = 10;
    const auto task = session_->dataTask(std::move(request), [this](HTTPResult result) {
      EXPECT_TRUE(session_->callbackQueue().isCurrent());
      results_.push_back(std::move(result));
    });
    if (!proxy.empty()) task->setProxy(proxy);
    task->resume();
    return task;
  }

  HTTPErrorCode lastCode() const {
    return results_.back().error ? HTTPErrorCode{results_.back().error->code} : HTTPErrorCode{};
  }

  simulated::SimulatedRuntime runtime_;
  NotificationCenter center_;
  simulated::SimulatedFileManager files_{runtime_};
  simulated::SimulatedHTTPSessions sessions_{runtime_, center_, files_};
  simulated::ScriptedService& service_ = sessions_.service();
  std::unique_ptr<HTTPSession> session_;
  std::vector<HTTPResult> results_;
};

TEST_F(ScriptedSession, AnswersComeByPathAfterTheirLatency) {
  service_.setDefaultLatency(std::chrono::seconds(1));
  service_.on("/s", answer(200, "s", 1));
  service_.on("/search", answer(201, "long", 3));
  start("http://h/search?q=/s", "http://proxy:1");
  start("http://h/s/x");
  start("http://h");
  runtime_.advance(std::chrono::milliseconds(999));
  EXPECT_TRUE(results_.empty());
  runtime_.advance(std::chrono::milliseconds(1));
  ASSERT_EQ(results_.size(), 2u);
  EXPECT_EQ(results_[0].response->status + results_[1].response->status, 200 + 404);
  runtime_.advance(std::chrono::seconds(2));
  ASSERT_EQ(results_.size(), 3u);
  EXPECT_EQ(*results_[2].data, "long");
  EXPECT_EQ(results_[2].response->status, 201);
  EXPECT_EQ(results_[2].timing.total, std::chrono::seconds(3));
  EXPECT_TRUE(results_[2].timing.proxied);
  EXPECT_EQ(service_.requests().size(), 3u);
  ASSERT_EQ(service_.requests("/search").size(), 1u);
  EXPECT_EQ(service_.requests("/search")[0].proxyURL, "http://proxy:1");
  EXPECT_EQ(service_.requests("/search")[0].session, "scripted");
}

TEST_F(ScriptedSession, FaultsLimitsAndCancellingEndATaskOnce) {
  service_.on("/long", answer(200, "12345", 1));
  service_.on("/slow", answer(200, "", 10));
  service_.failNext(2, HTTPErrorCode::connectionLost);
  const struct {
    std::string url;
    HTTPErrorCode code;
  } rows[] = {{"http://h/", HTTPErrorCode::connectionLost},
              {"http://h/long", HTTPErrorCode::connectionLost},
              {"http://h/long", HTTPErrorCode::responseTooLarge},
              {"http://h/slow", HTTPErrorCode::timedOut},
              {"h/", HTTPErrorCode::badURL},
              {"ftp://h/", HTTPErrorCode::notAllowed}};
  for (const auto& row : rows) {
    const auto task = start(row.url);
    task->resume();
    runtime_.advance(std::chrono::seconds(10));
    task->cancel();
    runtime_.run();
    EXPECT_EQ(lastCode(), row.code) << row.url;
  }
  EXPECT_EQ(*results_[2].data, "1234");
  EXPECT_EQ(results_.size(), std::size(rows));
  start("http://h/slow")->cancel();
  runtime_.advance(std::chrono::minutes(1));
  EXPECT_EQ(lastCode(), HTTPErrorCode::cancelled);
  EXPECT_EQ(results_.size(), std::size(rows) + 1);
}

TEST_F(ScriptedSession, AConfiguredProxyCarriesTasks) {
  ConfiguredServiceProxy proxies;
  const auto task = [&] {
    HTTPRequest request;
    request.url = "http://h/";
    return session_->dataTask(proxies.brambleRequest(std::move(request)), nullptr);
  };
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
  EXPECT_EQ(service_.requests().back().proxyURL, "http://b:1");
  EXPECT_TRUE(service_.requests().back().request.proxied);
  EXPECT_TRUE(set("b", R"({"enabled": false})"));
  EXPECT_FALSE(proxies.isEnabled());
  EXPECT_TRUE(set("b", R"({"proxy": "socks5h://b:1", "enabled": true})"));
  EXPECT_TRUE(proxies.isEnabled());
  EXPECT_TRUE(set("b", "null"));
  EXPECT_FALSE(proxies.isEnabled());
}

}  // namespace
}  // namespace sable::platform
