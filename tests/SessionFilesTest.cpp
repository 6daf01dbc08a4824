#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <nlohmann/json.hpp>

#include "platform/host/HostPlatform.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionShared.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "tests/support/Feedback.h"
#include "tests/support/TemporaryFolder.h"

// Session files on a real disk, written from real threads.
namespace sable::test {
namespace {

class SessionFiles : public testing::Test {
 protected:
  SessionFiles() {
    for (const char* name : {"RUNTIME", "CACHES", "STATE", "CONFIG"})
      setenv((std::string("SABLED_") + name + "_DIR").c_str(), (folder / name).c_str(), 1);
    std::filesystem::create_directories(directory);
  }
  std::shared_ptr<SableFeedback> feedback(std::string agent = "Beacon/1") {
    return feedbackFromJSON("RKStartSearchFeedback", R"({"input": "we"})", std::move(agent));
  }

  TemporaryFolder folder;
  const std::filesystem::path directory = folder / "CACHES/com.kestrel.sabled";
};

TEST_F(SessionFiles, WhatIsNoFileKeepsItsNameAndHarmsNobody) {
  writeFile(folder / "victim", "untouched");
  ASSERT_EQ(mkfifo((directory / "session.0").c_str(), 0600), 0);
  ASSERT_EQ(symlink((folder / "victim").c_str(), (directory / "session.1").c_str()), 0);
  ASSERT_EQ(symlink((folder / "absent").c_str(), (directory / "session.2").c_str()), 0);
  std::filesystem::create_directory(directory / "session.3");

  platform::host::HostPlatform platform;
  Assembly assembly(platform);
  assembly.persistentStorage = std::make_unique<SablePersistentStorage>(assembly);
  EXPECT_TRUE(assembly.persistentStorage->getAvailableSessionHandles().empty());
  ClientSession session(assembly, feedback());
  session.sessionComplete();
  const auto containers = assembly.persistentStorage->getAvailableSessionHandles();
  ASSERT_EQ(containers.size(), 1u);
  EXPECT_EQ(containers[0]->fileUrl(), directory / "session.4");
  struct stat status {};
  ASSERT_EQ(lstat(containers[0]->fileUrl().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);

  const auto read = containers[0]->read();
  ASSERT_TRUE(read);
  EXPECT_EQ(read->getSessionFeedbacks().size(), 1u);
  assembly.persistentStorage->deleteSessionWithFileContainer(containers[0]);
  EXPECT_FALSE(std::filesystem::exists(directory / "session.4"));
  EXPECT_EQ(readFile(folder / "victim"), "untouched");
  EXPECT_FALSE(std::filesystem::exists(folder / "absent"));
  EXPECT_TRUE(std::filesystem::is_symlink(directory / "session.2"));
}

TEST_F(SessionFiles, ClientsThatReportAtTheSameTimeLoseNothing) {
  constexpr std::size_t kClients = 4, kFeedbacks = 50;
  platform::host::HostPlatform platform;
  Assembly assembly(platform);
  assembly.persistentStorage = std::make_unique<SablePersistentStorage>(assembly);
  ClientSessionShared shared(assembly, feedback("Beacon/0"));
  const auto clients = assembly.runtime.waitGroup();
  for (std::size_t client = 0; client < kClients; ++client) {
    clients->enter();
    assembly.runtime.globalQueue(platform::QualityOfService::standard).async([&, client] {
      const std::string agent = "Beacon/" + std::to_string(client);
      ClientSession own(assembly, nullptr);
      for (std::size_t i = 0; i < kFeedbacks; ++i) {
        shared.addFeedback(feedback(agent));
        own.addFeedback(feedback(agent));
      }
      own.sessionComplete();
      clients->leave();
    });
  }
  ASSERT_TRUE(clients->wait(platform::MonotonicTime::max()));
  shared.enumerateSessions([](ClientSession& session, bool) { session.sessionComplete(); });

  const auto containers = assembly.persistentStorage->getAvailableSessionHandles();
  ASSERT_EQ(containers.size(), 2 * kClients);
  std::size_t feedbacks = 0;
  for (const auto& container : containers) {
    const auto session = container->read();
    ASSERT_TRUE(session);
    feedbacks += session->getSessionFeedbacks().size();
    EXPECT_EQ(session->getFeedbacksToSend()["fb"].size(), session->getSessionFeedbacks().size());
  }
  EXPECT_EQ(feedbacks, 2 * kClients * kFeedbacks + 1);
}

}  // namespace
}  // namespace sable::test
