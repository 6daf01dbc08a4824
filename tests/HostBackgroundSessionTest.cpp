#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <atomic>
#include <mutex>

#include "platform/NotificationCenter.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/host/TransferStore.h"
#include "platform/simulated/SimulatedLog.h"
#include "tests/support/LoopbackServer.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

using namespace std::chrono_literals;
using host::HostHTTPSessions;
using host::HostRuntime;
using host::TransferDatabase;
using host::TransferStore;
using ::testing::ElementsAre;
using ::testing::UnorderedElementsAre;
using tests::LoopbackServer;
using Then = LoopbackServer::Reply::Then;

/// Notes ends and what was downloaded; one test thread waits for them.
class Listener final : public HTTPBackgroundSessionDelegate {
 public:
  explicit Listener(Runtime& runtime) : settled_(runtime.semaphore(0)) {}

  void didFinishDownloadingToURL(const HTTPBackgroundTask& task, const std::filesystem::path& path) override {
    note(task.description + " file " + readFile(path).substr(0, 10));
  }
  void didCompleteWithError(const HTTPBackgroundTask& task, const std::optional<Error>& error) override {
    ++ends_;
    note(task.description + (error ? " error " + std::to_string(error->code)
                                   : " status " + std::to_string(task.response->status)));
  }
  void didFinishEventsForBackgroundURLSession() override {
    settledEnds_ = ends_.load();
    settled_->signal();
  }

  /// What was heard until so many have ended since the last call, and nothing is left to run.
  std::vector<std::string> wait(int ends = 1) {
    expected_ += ends;
    while (settledEnds_ < expected_) EXPECT_TRUE(settled_->wait(MonotonicTime::max()));
    const std::lock_guard lock(mutex_);
    return std::exchange(words_, {});
  }

 private:
  void note(std::string word) {
    const std::lock_guard lock(mutex_);
    words_.push_back(std::move(word));
  }

  const std::unique_ptr<Semaphore> settled_;
  std::atomic<int> ends_ = 0, settledEnds_ = 0;
  int expected_ = 0;
  std::mutex mutex_;
  std::vector<std::string> words_;
};

class HostTransfers : public ::testing::Test {
 protected:
  HostTransfers() { configuration_.identifier = "test"; }

  void launch() {
    session_ = nullptr;
    sessions_ = nullptr;
    auto store = std::make_shared<TransferStore>(state_, [this] { return keepsUploads_; });
    sessions_ = std::make_unique<HostHTTPSessions>(
        runtime_, folder_ / "cache",
        HostHTTPSessions::Transfers{center_, std::move(store), [] { return TransferConditions{}; }});
    session_ = sessions_->backgroundSession(configuration_, listener_);
  }

  HTTPRequest request(const std::string& path) const {
    HTTPRequest request;
    request.url = server_.url(path);
    return request;
  }
  Expected<std::int64_t> upload(const std::string& path, const std::string& body, std::string token = "") {
    HTTPRequest request = this->request(path);
    request.method = "POST";
    request.headers.add("X-Digest", "abc");
    writeFile(folder_ / "body", body);
    auto identifier = session_->uploadTask(request, folder_ / "body", path, token);
    std::filesystem::remove(folder_ / "body");
    if (identifier) session_->resume(*identifier);
    return identifier;
  }
  void download(const std::string& path) {
    const auto identifier = session_->downloadTask(request(path), path, 1h);
    ASSERT_TRUE(identifier) << identifier.error().description();
    session_->resume(*identifier);
  }

  std::vector<std::string> files(const char* name) const {
    std::vector<std::string> names;
    for (const auto& file : std::filesystem::directory_iterator(state_ / name)) {
      names.push_back(file.path().filename());
      EXPECT_EQ(file.status().permissions(), std::filesystem::perms(0600));
    }
    return names;
  }
  void execute(const char* sql) {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(TransferStore::databaseIn(state_).c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, sql, nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
    sqlite3_close(database);
  }

  HostRuntime runtime_{2};
  simulated::SimulatedLog log_;
  NotificationCenter center_;
  TemporaryFolder folder_;
  const std::filesystem::path state_ = folder_ / "state";
  bool keepsUploads_ = true;
  Listener listener_{runtime_};
  LoopbackServer server_{runtime_};
  HTTPBackgroundSessionConfiguration configuration_;
  std::unique_ptr<HostHTTPSessions> sessions_;
  std::unique_ptr<HTTPBackgroundSession> session_;
};

TEST_F(HostTransfers, AnUploadLeavesAsItWasAndIsKeptForItsOwner) {
  const std::string body(300000, 'x');
  server_.on("/ok", LoopbackServer::ok("answer"));
  launch();
  EXPECT_FALSE(std::filesystem::exists(state_)) << "nothing is made before it is needed";
  EXPECT_EQ(upload("/ok", body, "token").value(), 1);
  EXPECT_THAT(listener_.wait(), ElementsAre("/ok status 200"));
  const auto request = server_.requests().at(0);
  EXPECT_TRUE(request.starts_with("POST /ok HTTP/1.1\r\n"));
  EXPECT_NE(request.find("X-Digest: abc\r\nContent-Length: 300000\r\n\r\n" + body), std::string::npos);
  EXPECT_TRUE(session_->hasAccepted("token"));
  EXPECT_TRUE(files("transfers").empty());
  EXPECT_THAT(files("uploads"), ElementsAre("1.deflate"));
  EXPECT_EQ(readFile(TransferStore::bodyIn(state_, 1)), body);

  for (int i = 0; i < host::kRememberedUploads + 1; ++i) upload("/ok", "more");
  listener_.wait(host::kRememberedUploads + 1);
  EXPECT_EQ(files("uploads").size(), static_cast<std::size_t>(host::kRememberedUploads));
  const auto rows = TransferDatabase::read(TransferStore::databaseIn(state_));
  ASSERT_TRUE(rows) << rows.error().description();
  EXPECT_EQ(rows->back().transfer.task.response->status, 200);
  keepsUploads_ = false;
  upload("/ok", "one more");
  listener_.wait();
  EXPECT_TRUE(files("uploads").empty());
}

TEST_F(HostTransfers, WhatBrokeOffIsTriedAgainAndNeverHandedOut) {
  const auto secondTimeWith = [](LoopbackServer::Reply first, const std::string& then) {
    return [=, count = 0](const std::string&) mutable {
      return count++ == 0 ? first : LoopbackServer::Reply{then};
    };
  };
  configuration_.maximumDownloadBytes = 1000;
  server_.on("/reset", secondTimeWith({"", Then::reset}, LoopbackServer::ok("")));
  server_.on("/cut", secondTimeWith({"HTTP/1.1 200 OK\r\nContent-Length: 999\r\n\r\nhalf", Then::close},
                                    LoopbackServer::ok("whole")));
  server_.on("/large", LoopbackServer::ok(std::string(1001, 'x')));
  server_.on("/none", "HTTP/1.1 304 Not Modified\r\n\r\n");
  launch();
  upload("/reset", "body");
  for (const char* path : {"/cut", "/large", "/none"}) download(path);
  EXPECT_THAT(listener_.wait(4),
              UnorderedElementsAre("/reset status 200", "/cut file whole", "/cut status 200",
                                   "/large error 8", "/none file ", "/none status 304"));
  EXPECT_TRUE(files("transfers").empty());
}

TEST_F(HostTransfers, TheNextProcessSendsWhatThisOneDidNot) {
  const auto arrived = runtime_.semaphore(0);
  server_.on("/a", [&](const std::string&) {
    arrived->signal();
    return LoopbackServer::Reply{"", Then::stall};
  });
  launch();
  upload("/a", "bytes", "token");
  ASSERT_TRUE(arrived->wait(MonotonicTime::max()));
  writeFile(state_ / "transfers" / "77.upload", "of a call that never returned");
  server_.on("/a", LoopbackServer::ok(""));
  launch();
  EXPECT_THAT(listener_.wait(), ElementsAre("/a status 200"));
  EXPECT_TRUE(server_.requests().at(1).ends_with("\r\n\r\nbytes"));
  EXPECT_TRUE(session_->hasAccepted("token"));
  EXPECT_TRUE(files("transfers").empty());

  // As if the process had been killed between the end and its report.
  session_ = nullptr;
  execute("UPDATE transfers SET state=2");
  std::filesystem::rename(state_ / "uploads" / "1.deflate", state_ / "transfers" / "1.upload");
  launch();
  EXPECT_THAT(listener_.wait(), ElementsAre("/a status 200"));
  EXPECT_EQ(server_.requests().size(), 2u);
  EXPECT_THAT(files("uploads"), ElementsAre("1.deflate"));
}

TEST_F(HostTransfers, AFullDiskRefusesTheNewAndKeepsTheOld) {
  server_.on("/a", LoopbackServer::Reply{"", Then::stall});
  launch();
  ASSERT_TRUE(upload("/a", "first"));
  writeFile(folder_ / "large", std::string(200000, 'x'));
  for (const rlim_t room : {100000, 1}) {  // the second is not enough for the database either
    const auto refused =
        withRoomFor(room, [&] { return session_->uploadTask(request("/a"), folder_ / "large", "", ""); });
    EXPECT_FALSE(refused) << room;
  }
  EXPECT_THAT(files("transfers"), ElementsAre("1.upload"));
  session_ = nullptr;
  server_.on("/a", LoopbackServer::ok(""));
  launch();
  listener_.wait();
  EXPECT_GT(upload("/a", "second").value(), 1);
  listener_.wait();
  EXPECT_TRUE(server_.requests().back().ends_with("second"));
}

TEST_F(HostTransfers, ADamagedDatabaseIsMovedAside) {
  server_.on("/a", LoopbackServer::ok(""));
  writeFile(TransferStore::databaseIn(state_), std::string(5000, 'x'));
  writeFile(state_ / "transfers" / "7.upload", "whose row is lost");
  launch();
  EXPECT_EQ(upload("/a", "bytes").value(), 8) << "numbers of files that are there are not used again";
  EXPECT_THAT(listener_.wait(), ElementsAre("/a status 200"));
  EXPECT_TRUE(std::filesystem::exists(state_ / "transfers.db.damaged"));
  EXPECT_EQ(log_.count("damaged"), 1u);

  TransferStore other(state_, [] { return true; });
  EXPECT_EQ(other.accept("test", {}, "", "/etc/passwd").error().code, EWOULDBLOCK) << "one process at a time";
}

}  // namespace
}  // namespace sable::platform
