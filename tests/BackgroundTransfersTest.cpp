#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>

#include "platform/TransferRetry.h"
#include "tests/support/Fleet.h"
#include "tests/support/VirtualDevice.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;
using simulated::Scripted;
using test::after;
using test::answering;
using test::failing;
using ::testing::ElementsAre;

constexpr const char* kURL = "https://service.test/feedback";

Scripted askingForAPause(int status, std::string seconds) {
  Scripted answer = answering("", status);
  answer.headers.add("Retry-After", std::move(seconds));
  return answer;
}

class Listener final : public HTTPBackgroundSessionDelegate {
 public:
  explicit Listener(FileManager& files) : files_(files) {}

  void didSendBodyData(const HTTPBackgroundTask&, std::int64_t sent, std::int64_t expected) override {
    words.push_back("sent " + std::to_string(sent) + " of " + std::to_string(expected));
  }
  void didFinishDownloadingToURL(const HTTPBackgroundTask& task,
                                 const std::filesystem::path& location) override {
    words.push_back("file " + files_.read(location, 1000).value() + " from " + task.currentURL);
  }
  void didCompleteWithError(const HTTPBackgroundTask& task, const std::optional<Error>& error) override {
    words.push_back(task.description + (error ? " error " + std::to_string(error->code)
                                              : " status " + std::to_string(task.response->status)));
  }
  void didFinishEventsForBackgroundURLSession() override { words.push_back("all done"); }

  std::vector<std::string> words;

 private:
  FileManager& files_;
};

class VirtualTransfers : public ::testing::Test {
 protected:
  VirtualTransfers() {
    configuration_.identifier = "test";
    static_cast<void>(platform_.fileManager().createDirectory("/tmp"));
    launch();
  }

  void launch() {
    session_ = nullptr;
    session_ = platform_.httpSessions().backgroundSession(configuration_, listener_);
    platform_.runtime().run();
  }

  std::int64_t upload(std::string description, const std::string& token = "") {
    HTTPRequest request;
    request.url = kURL;
    request.method = "POST";
    EXPECT_TRUE(platform_.fileManager().writeAtomically("/tmp/body", "bytes"));
    const auto identifier = session_->uploadTask(request, "/tmp/body", std::move(description), token);
    EXPECT_TRUE(platform_.fileManager().remove("/tmp/body"));
    session_->resume(identifier.value());
    return *identifier;
  }
  std::int64_t download(std::string description, Duration window = 24h) {
    HTTPRequest request;
    request.url = "https://service.test/resource";
    const auto identifier = session_->downloadTask(request, std::move(description), window);
    session_->resume(identifier.value());
    return *identifier;
  }
  void advance(Duration time) { platform_.runtime().advance(time); }
  std::vector<simulated::RecordedRequest> requests() { return service_.requests("/"); }

  simulated::SimulatedPlatform platform_;
  simulated::ScriptedService& service_ = platform_.httpSessions().service();
  HTTPBackgroundSessionConfiguration configuration_;
  Listener listener_{platform_.fileManager()};
  std::unique_ptr<HTTPBackgroundSession> session_;
};

TEST_F(VirtualTransfers, ErrorsAreRetriedWithPausesThatDoubleToAnHour) {
  service_.on("/feedback", failing(HTTPErrorCode::cannotConnect));
  upload("a");
  advance(12h);
  const auto sent = requests();
  ASSERT_GT(sent.size(), 15u);
  for (std::size_t i = 1; i < sent.size(); ++i) {
    const double bound = std::min(5.0 * std::exp2(static_cast<double>(i) - 1), 3600.0);
    const double pause = toSeconds(sent[i].time - sent[i - 1].time);
    EXPECT_GE(pause, bound / 2) << i;
    EXPECT_LE(pause, bound + 0.1) << i;
  }
  service_.on("/feedback", answering(""));
  advance(1h);
  EXPECT_THAT(listener_.words, ElementsAre("sent 5 of 5", "a status 200", "all done"));
}

TEST_F(VirtualTransfers, OnlyErrorsThatMayPassAreRetried) {
  using enum HTTPErrorCode;
  for (const auto code : {badURL, notAllowed, tooManyRedirects, responseTooLarge}) {
    service_.on("/feedback", failing(code));
    upload("a");
    advance(1h);
    EXPECT_EQ(requests().size(), 1u);
    EXPECT_EQ(listener_.words.at(0), "a error " + std::to_string(static_cast<int>(code)));
    service_.forgetRequests();
    listener_.words.clear();
  }
}

TEST_F(VirtualTransfers, AResourceThatTakesTooLongEndsOnceWithATimeOut) {
  service_.on("/feedback", failing(HTTPErrorCode::connectionLost));
  upload("a");
  service_.on("/resource", after(10000h, answering("")));
  download("b");
  advance(7 * 24h - 1s);
  EXPECT_TRUE(listener_.words.empty());
  advance(1s);
  EXPECT_THAT(listener_.words, ElementsAre("a error 4", "b error 4", "all done"));
  service_.forgetRequests();
  advance(7 * 24h);
  EXPECT_TRUE(requests().empty());
  EXPECT_EQ(listener_.words.size(), 3u);
}

TEST_F(VirtualTransfers, AServiceThatAsksForAPauseGetsIt) {
  for (const auto& [status, pauses] : {std::pair(503, true), {429, true}, {500, false}, {408, false}}) {
    service_.on("/feedback", askingForAPause(status, "7200"));
    upload("a");
    advance(7199s);
    EXPECT_EQ(requests().size(), 1u);
    EXPECT_EQ(listener_.words.size(), pauses ? 1u : 3u) << status;
    service_.on("/feedback", answering(""));
    advance(3700s);
    EXPECT_EQ(requests().size(), pauses ? 2u : 1u);
    service_.forgetRequests();
    listener_.words.clear();
  }
  service_.on("/feedback", askingForAPause(503, "99999999999999999999"));
  upload("too late");
  service_.on("/resource", answering("", 503));
  download("no field");
  advance(1s);
  EXPECT_EQ(listener_.words.at(1), "too late status 503");
  EXPECT_EQ(listener_.words.at(3), "no field status 503");
}

TEST_F(VirtualTransfers, TheNextProcessGoesOnWithWhatTheLastOneLeft) {
  service_.on("/", failing(HTTPErrorCode::cannotConnect));
  const auto first = upload("a", "token");
  download("b");
  advance(10h);
  session_ = nullptr;
  const auto sent = requests().size();
  advance(10min);
  EXPECT_EQ(requests().size(), sent) << "nothing runs without a session";
  EXPECT_TRUE(listener_.words.empty());

  platform_.runtime().jumpWallClock(-48h);
  service_.on("/", answering(""));
  launch();
  EXPECT_TRUE(session_->hasAccepted("token"));
  EXPECT_FALSE(session_->hasAccepted("other"));
  EXPECT_FALSE(session_->hasAccepted(""));
  advance(1h);
  EXPECT_THAT(listener_.words, ::testing::UnorderedElementsAre("sent 5 of 5", "a status 200",
                                                               "file  from https://service.test/resource",
                                                               "b status 200", "all done"));
  EXPECT_GT(upload("c"), first + 1);
  advance(10 * 24h);
  EXPECT_FALSE(session_->hasAccepted("token")) << "older than the time of a resource";
}

TEST_F(VirtualTransfers, AfterALongSleepThereIsOneMoreAttempt) {
  service_.on("/feedback", failing(HTTPErrorCode::cannotConnect));
  upload("a");
  advance(1h);
  session_ = nullptr;
  platform_.runtime().jumpWallClock(365 * 24h);
  service_.on("/feedback", answering(""));
  launch();
  advance(1s);
  EXPECT_EQ(listener_.words.at(1), "a status 200");
}

TEST_F(VirtualTransfers, DiscretionaryOnesWaitForPowerAndAFreeNetwork) {
  configuration_.discretionary = true;
  configuration_.allowsExpensiveNetworkAccess = false;
  launch();
  auto& sessions = platform_.httpSessions();
  service_.on("/", answering(""));
  sessions.setConditions({true, false});
  upload("a");
  download("b", 24h);
  advance(23h);
  EXPECT_TRUE(requests().empty());
  advance(2h);
  EXPECT_EQ(requests().size(), 1u) << "a window that has passed waits for no power";
  sessions.setConditions({false, true});
  download("c", 1h);
  advance(2h);
  EXPECT_EQ(requests().size(), 1u) << "but for a network that costs nothing";
  sessions.setConditions({false, false});
  advance(1s);
  EXPECT_EQ(requests().size(), 3u);
}

TEST_F(VirtualTransfers, CancelledAndRefusedOnesLoseNothingElseWhichEndsOnce) {
  service_.on("/", answering(""));
  platform_.httpSessions().failAccepting(ENOSPC);
  HTTPRequest request;
  request.url = kURL;
  EXPECT_EQ(session_->downloadTask(request, "x", 1h).error().code, ENOSPC);
  platform_.httpSessions().failAccepting(0);
  EXPECT_EQ(session_->uploadTask(request, "/tmp/missing", "x", "").error().code, ENOENT);
  EXPECT_EQ(session_->downloadTask({}, "x", 1h).error().domain, kHTTPErrorDomain);

  const auto cancelled = upload("a");
  upload("b");
  download("c");
  std::size_t listed = 0;
  session_->getAllTasks([&](std::vector<HTTPBackgroundTask> tasks) { listed = tasks.size(); });
  session_->cancel(cancelled);
  session_->cancel(cancelled);
  advance(1s);
  launch();
  advance(24h);
  EXPECT_EQ(listed, 3u);
  EXPECT_THAT(listener_.words,
              ElementsAre("a error 10", "sent 5 of 5", "b status 200",
                          "file  from https://service.test/resource", "c status 200", "all done"));
  EXPECT_TRUE(platform_.httpSessions().pendingTransfers().empty());
}

TEST(TransferRetry, AFleetThatLostTheServiceComesBackSpread) {
  test::FleetPlan plan;
  const auto isSpread = [](const test::FleetHour& hour) { return hour.peak <= 3 * hour.mean; };
  const auto back = plan.goodTimes + plan.outage;
  auto minutes = test::requestsPerMinute(plan);
  const auto start = test::hourFrom(minutes, 0s);
  const auto second = test::hourFrom(minutes, back + 1h);
  EXPECT_PRED1(isSpread, start) << start.peak << " of " << start.mean;
  EXPECT_NEAR(second.mean, plan.devices / 10.0, 1) << "nothing is left over";

  for (const auto powerCut : {0h, 2h}) {
    plan.powerCut = powerCut;
    if (powerCut > 0h) minutes = test::requestsPerMinute(plan);
    const auto hour = test::hourFrom(minutes, back);
    EXPECT_PRED1(isSpread, hour) << hour.peak << " of " << hour.mean;
    EXPECT_GT(hour.mean, 4 * plan.devices / 10.0) << "the outage's uploads come";
  }
}

TEST(TransferRetry, AFieldSaysSecondsOrADate) {
  const auto now = wallTimeFromSecondsSince1970(784111777);  // Sun, 06 Nov 1994 08:49:37 GMT
  struct Row {
    const char* field;
    const char* date;
    std::optional<Duration> expected;
  };
  for (const Row& row : {Row{"0", "", 0s},
                         {"120", "", 120s},
                         {"Sun, 06 Nov 1994 08:51:37 GMT", "", 120s},
                         {"Sunday, 06-Nov-94 08:51:37 GMT", "", 120s},
                         {"Sun Nov  6 08:51:37 1994", "", 120s},
                         {"Sun, 06 Nov 1994 08:51:37 GMT", "Sun, 06 Nov 1994 08:51:27 GMT", 10s},
                         {"Sun, 06 Nov 1994 08:00:00 GMT", "", 0s},
                         {"", "", std::nullopt},
                         {"-5", "", std::nullopt},
                         {"1.5", "", std::nullopt},
                         {"soon", "", std::nullopt}}) {
    HTTPResponse response{"", 503, {}, false};
    response.headers.add("Retry-After", row.field);
    if (*row.date != '\0') response.headers.add("Date", row.date);
    EXPECT_EQ(retryAfter(response, now), row.expected) << row.field;
    response.status = 200;
    EXPECT_EQ(retryAfter(response, now), std::nullopt);
  }
}

}  // namespace
}  // namespace sable::platform
