#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>

#include "sabled/ArchivedDataIterator.h"
#include "sabled/ClientSession.h"
#include "sabled/FileContainer.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/UserAgent.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// Session files: what is in them, which of them are used, and what becomes of damaged ones.
namespace sable::test {
namespace {

using platform::LogLevel;
using Path = std::filesystem::path;

std::string recordOf(std::string_view payload) {
  const std::uint64_t length = payload.size();
  std::string record(sizeof length, '\0');
  std::memcpy(record.data(), &length, sizeof length);
  return record.append(payload);
}

class PersistentStorage : public testing::Test {
 protected:
  PersistentStorage() {
    device.start();
    // The bag's fetch has left a session.
    for (const auto& container : storage().getAvailableSessionHandles())
      storage().deleteSessionWithFileContainer(container);
    restart();
  }

  SablePersistentStorage& storage() { return *device.assembly().persistentStorage; }
  /// What a start of the daemon makes of the files that are there.
  void restart() {
    device.run();
    device.log.clear();
    device.assembly().persistentStorage = std::make_unique<SablePersistentStorage>(device.assembly());
  }
  std::shared_ptr<SableFeedback> feedback(const std::string& input = "we") {
    return feedbackFromJSON("RKStartSearchFeedback", R"({"timestamp": "5", "input": ")" + input + "\"}");
  }
  /// A session with its first feedback, in its file.
  std::unique_ptr<ClientSession> session() {
    auto made = std::make_unique<ClientSession>(device.assembly(), feedback());
    device.run();
    return made;
  }
  Path path(const std::string& name) { return directory / name; }
  std::string file(const std::string& name) {
    const auto bytes = device.platform.fileManager().read(path(name), 1u << 30);
    return bytes ? *bytes : "";
  }
  void writeFile(const std::string& name, std::string_view bytes) {
    ASSERT_TRUE(device.platform.fileManager().createDirectory(directory));
    ASSERT_TRUE(device.platform.fileManager().writeAtomically(path(name), bytes));
  }
  std::vector<std::string> available() {
    std::vector<std::string> names;
    for (const auto& container : storage().getAvailableSessionHandles())
      names.push_back(container->fileUrl().filename());
    return names;
  }
  /// What the file of these bytes is read as; the log holds what was said of it.
  std::shared_ptr<ClientSession> read(std::string_view bytes) {
    writeFile("session.900", bytes);
    device.log.clear();
    return container("session.900")->read();
  }
  std::shared_ptr<FileContainer> container(const std::string& name) {
    return std::make_shared<FileContainer>(device.assembly(), path(name), version,
                                           device.assembly().runtime.serialQueue("test"), 2097152);
  }

  VirtualDevice device;
  const Path directory = "/home/user/.cache/com.kestrel.sabled";
  const std::string version = sabledUserAgent(device.platform.deviceInfo());
};

TEST_F(PersistentStorage, AFileHoldsTheVersionTheSessionAndEachFeedbackAsItCame) {
  const auto opened = device.platform.transactions().openedCount("archiveObject");
  const auto session = this->session();
  session->addFeedback(feedback("weather"));
  const std::string before = recordOf(version) + recordOf(session->data()) + recordOf(feedback()->data());
  EXPECT_EQ(file("session.0"), before) << "who reports does not wait for the disk";
  device.run();
  EXPECT_EQ(file("session.0"), before + recordOf(feedback("weather")->data()));
  EXPECT_EQ(device.platform.transactions().openedCount("archiveObject") - opened, 4u);
  EXPECT_EQ(device.platform.transactions().openCount("archiveObject"), 0u);

  EXPECT_TRUE(available().empty());
  session->sessionComplete();
  EXPECT_EQ(available(), std::vector<std::string>{"session.0"});
  const auto container = storage().getAvailableSessionHandles()[0];
  const auto read = container->read();
  ASSERT_TRUE(read);
  ASSERT_EQ(read->getSessionFeedbacks().size(), 2u);
  EXPECT_EQ(read->getSessionFeedbacks()[1]->userAgent(), "Beacon/1");
  EXPECT_EQ(read->data(), session->data());

  storage().deleteSessionWithFileContainer(container);
  EXPECT_TRUE(available().empty());
  EXPECT_TRUE(file("session.0").empty());
  storage().deleteSessionWithFileContainer(container);
  EXPECT_TRUE(device.log.contains("File " + path("session.0").string() + " delete failed"));
}

TEST_F(PersistentStorage, ARecordThatWouldJustFillTheFileClosesIt) {
  session();
  const auto length = file("session.0").size();
  for (const auto& [limit, records] : {std::pair{length, 2}, std::pair{length + 1, 3}}) {
    device.platform.userDefaults().setByUser("SBLSessionSizeLimit", limit);
    restart();
    const auto session = this->session();
    session->addFeedback(feedback());
    session->sessionComplete();
    device.run();
    EXPECT_EQ(device.counter("filesizeexceeded"), records == 2 ? 1 : 2);
    EXPECT_EQ(device.log.count("exceeds max session size"), 1u);
    const auto read = storage().getAvailableSessionHandles().back()->read();
    ASSERT_TRUE(read) << "what there is goes to the service";
    EXPECT_EQ(read->getSessionFeedbacks().size(), static_cast<std::size_t>(records - 2));
  }
  EXPECT_TRUE(
      device.log.contains(fmt::format("bytes written ({}) + feedback ({}) exceeds max session size ({})",
                                      length, feedback()->data().size() + 8, length + 1)));
}

TEST_F(PersistentStorage, TheDefaultLimitIsTwoMebibytes) {
  const auto session = this->session();
  // Lengths inside the message grow with it: all of the same size are made by one that is as long.
  const std::string big(1'000'000, 'x');
  const auto overhead = recordOf(feedback(big)->data()).size() - big.size();
  session->addFeedback(feedback(big));
  device.run();
  const std::size_t rest = 2097152 - file("session.0").size();
  session->addFeedback(feedback(std::string(rest - overhead, 'x')));
  session->addFeedback(feedback());
  device.run();
  EXPECT_EQ(device.counter("filesizeexceeded"), 1);
  EXPECT_EQ(file("session.0").size(), 2097152 - rest) << "nothing is written after that, however short";
}

TEST_F(PersistentStorage, AFullDiskIsReportedOnceAndEndsOnlyTheFile) {
  const auto session = this->session();
  const auto before = file("session.0");
  device.log.clear();
  device.platform.fileManager().failWith(ENOSPC);
  for (int i = 0; i < 5; ++i) session->addFeedback(feedback());
  device.run();
  EXPECT_EQ(device.log.count(LogLevel::error), 1u);
  ClientSession homeless(device.assembly(), feedback());
  homeless.sessionComplete();
  EXPECT_TRUE(device.log.contains("Could not get a file url"));
  EXPECT_EQ(device.log.count(LogLevel::fault, "Sable_Session"), 1u);
  EXPECT_TRUE(device.log.contains("Storage Handle nil major error"));

  device.platform.fileManager().failWith(0);
  session->addFeedback(feedback());
  session->sessionComplete();
  EXPECT_EQ(available(), std::vector<std::string>{"session.0"});
  EXPECT_EQ(file("session.0"), before) << "what came after half a record could not be read";
}

TEST_F(PersistentStorage, FilesOfEarlierRunsAreFoundUnlessTheyAreTooOld) {
  writeFile("session.7", "old");
  device.advance(1s);
  for (const char* name : {"session.12", "session.3", "session.x", "session.99999999999"})
    writeFile(name, "x");
  writeFile("bag.plist", "x");
  writeFile("sessions", "x");
  ASSERT_TRUE(device.platform.fileManager().createDirectory(path("session.13")));
  device.advance(172800s);
  restart();
  EXPECT_EQ(available(),
            (std::vector<std::string>{"session.12", "session.3", "session.99999999999", "session.x"}));
  EXPECT_EQ(device.counter("filetooold"), 1);
  EXPECT_TRUE(file("session.7").empty());
  EXPECT_TRUE(device.log.contains("Attribute fetch error POSIXErrorDomain 21"));
  session();
  EXPECT_FALSE(file("session.14").empty()) << "a name that a folder has is passed over";
  EXPECT_EQ(device.log.count("Could not get a file url"), 0u);

  writeFile("session.4294967294", "x");
  writeFile("session.0", "x");
  restart();
  for (int i = 0; i < 2; ++i) session();
  EXPECT_FALSE(file("session.4294967295").empty());
  EXPECT_FALSE(file("session.1").empty()) << "past the last number they begin again";
  EXPECT_EQ(file("session.0"), "x");
}

TEST_F(PersistentStorage, TheAgeIsASettingAndAFirstStartFindsNothingToSay) {
  EXPECT_EQ(device.log.count(LogLevel::error, "Sable_Feedback_Storage"), 0u);

  device.platform.userDefaults().setByUser("SBLSessionMaxAge", 60);
  writeFile("session.1", "x");
  device.advance(60s);
  restart();
  EXPECT_EQ(available().size(), 1u);
  device.advance(1s);
  restart();
  EXPECT_TRUE(available().empty());

  device.platform.fileManager().failWith(EACCES);
  restart();
  EXPECT_TRUE(device.log.contains("error scanning cache directory, could not get path"));
}

TEST_F(PersistentStorage, AFileThatIsOpenOrTooLongIsNotDecoded) {
  session();
  const auto open = storage().createFileContainerForWriting();
  device.log.clear();
  EXPECT_FALSE(open->read());
  EXPECT_EQ(device.log.count(LogLevel::fault), 1u);
  EXPECT_TRUE(device.log.contains("file is already open closing it " + path("session.1").string()));
  EXPECT_TRUE(device.log.contains("empty file"));
  EXPECT_FALSE(read(file("session.0") + std::string(2097153 - file("session.0").size(), '\0')));
  EXPECT_EQ(device.counter("filetoolarge"), 1);
  EXPECT_TRUE(device.log.contains("Session too big to process"));
  EXPECT_TRUE(read(file("session.0") + std::string(2097152 - file("session.0").size(), '\0')));
  EXPECT_FALSE(container("session.none")->read());
  EXPECT_TRUE(device.log.contains("Attribute fetch error POSIXErrorDomain 2"));
}

TEST_F(PersistentStorage, OfADamagedFileWhatStandsBeforeTheDamageIsUsed) {
  const auto session = this->session();
  const std::string header = recordOf(version) + recordOf(session->data());
  const std::string one = recordOf(feedback()->data());
  const std::string giant = std::string(8, '\xff') + "x";
  struct Row {
    std::string bytes;
    int feedbacks;  ///< -1: no session
    const char* line;
  };
  const Row rows[] = {
      {"", -1, "empty file"},
      {"1234567", -1, "out of range"},
      {std::string(8, '\0'), -1, "out of range"},
      {std::string(9, '\0'), -1, "empty data file"},
      {giant, -1, "broken version string in file"},
      {recordOf("\xff\xfe") + header, -1, "version string not stored"},
      {recordOf("Sabled/0.9") + header, -1, "version not supported: Sabled/0.9"},
      {recordOf(version), -1, "client session not stored"},
      {recordOf(version) + recordOf("\xff\xff"), -1, "client session not stored"},
      {header, 0, "unarchive"},
      {header + one, 1, "unarchive"},
      {header + one + std::string(7, 'x'), 1, "unarchive"},
      {header + one + std::string(8, '\1'), 1, "out of range"},
      {header + one + giant + one, 1, "broken version string in file"},
      {header + one + std::string(9, '\0') + one, 1, "empty data file"},
      {header + one + recordOf("\xff") + one, 1, "sable feedback expected"},
      {header + one + header, 1, "could not unarchive feedback range"},
  };
  for (const Row& row : rows) {
    const auto read = this->read(row.bytes);
    EXPECT_EQ(read ? static_cast<int>(read->getSessionFeedbacks().size()) : -1, row.feedbacks) << row.line;
    EXPECT_TRUE(device.log.contains(row.line)) << row.line;
  }
}

TEST_F(PersistentStorage, NoCutAndNoFlippedBitDoesHarm) {
  const auto session = this->session();
  session->addFeedback(feedback("weather"));
  device.run();
  const std::string whole = file("session.0");
  const auto header = recordOf(version).size() + recordOf(session->data()).size();
  const auto first = header + recordOf(feedback()->data()).size();
  for (std::size_t length = 0; length < whole.size(); ++length) {
    const auto read = this->read(whole.substr(0, length));
    ASSERT_EQ(read != nullptr, length >= header) << length;
    if (read) {
      ASSERT_EQ(read->getSessionFeedbacks().size(), length < first ? 0u : 1u) << length;
    }
  }
  for (std::size_t at = 0; at < whole.size() * 8; ++at) {
    std::string damaged = whole;
    damaged[at / 8] = static_cast<char>(damaged[at / 8] ^ (1 << at % 8));
    const auto read = this->read(damaged);
    ASSERT_FALSE(read && at / 8 < recordOf(version).size()) << at;
    ASSERT_TRUE(!read || read->getFeedbacksToSend().is_object()) << at;
  }
}

}  // namespace
}  // namespace sable::test
