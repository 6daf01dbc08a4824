#include <gtest/gtest.h>

#include <array>
#include <cmath>
#include <cstring>
#include <random>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLFeedbackLedger.h"
#include "platform/LocaleInfo.h"
#include "sabled/BackgroundFlusher.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/ClientState.h"
#include "sabled/ClientStateManager.h"
#include "sabled/FileContainer.h"
#include "sabled/SableBagController.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UserAgent.h"
#include "tests/support/Feedback.h"
#include "tests/support/VirtualDevice.h"

// Weeks of use in virtual time: whatever clients, clocks, limits and kills do, each feedback is in one
// session of its client's, in order, each session says why the one before it ended, and the ledger
// knows where every record is.
namespace sable::test {
namespace {

constexpr auto kWeek = 7 * 24h;

/// What a week has seen; shows that a simulation took the roads that it is to judge.
struct Seen {
  std::map<std::string, int> ends;  ///< by reason
  int feedbacks = 0, truncated = 0, firstUses = 0;
  int unwanted = 0;
  std::int64_t handedOver = 0, lost = 0;  ///< records
  int kills = 0, cut = 0;                 ///< `cut`: sessions that a kill ended
};

/// Feedback records in a session file, as its layout says.
std::int64_t recordsIn(std::string_view bytes) {
  std::int64_t records = -2;  // the version and the root
  for (std::uint64_t length = 0; bytes.size() > sizeof length; bytes.remove_prefix(sizeof length + length)) {
    std::memcpy(&length, bytes.data(), sizeof length);
    ++records;
  }
  return std::max<std::int64_t>(records, 0);
}

int numberOf(const std::filesystem::path& sessionFile) {
  return std::stoi(sessionFile.extension().string().substr(1));
}

class Week {
 public:
  struct Setting {
    std::uint64_t seed = 0;
    bool shared = true;
    int sizeLimit = 2097152;  ///< bytes
  };

  explicit Week(const Setting& setting) : chance_(setting.seed), device_(setting.seed) {
    device_.platform.userDefaults().setByUser("SBLSharedSession", setting.shared);
    device_.platform.userDefaults().setByUser("SBLSessionSizeLimit", setting.sizeLimit);
    startDaemon();
  }

  Seen run() {
    const auto end = runtime().ticks() + kWeek;
    while (runtime().ticks() < end && !testing::Test::HasFailure()) {
      ++step_;
      step();
      device_.run();
      judgeLedger();
      readEndedSessions();
      judgeLedger();
      device_.log.clear();
    }
    for (Client& client : clients_) managerOf(client).flushSession(nullptr);
    device_.run();
    readEndedSessions();
    const SBLFeedbackLedger ledger = judgeLedger();
    std::int64_t absent = 0;
    for (const Client& client : clients_) {
      EXPECT_TRUE(client.mayHaveGap || client.read == client.reported) << client.agent << " lost feedback";
      absent += client.reported - client.received;
    }
    seen_.lost = ledger[SBLLedgerEntry::lostWriting];
    EXPECT_LE(absent, seen_.lost + ledger[SBLLedgerEntry::tooOld] + ledger[SBLLedgerEntry::sizeLimit]);
    EXPECT_GE(device_.counter("filesizeexceeded"), seen_.truncated);
    EXPECT_LE(device_.counter("filesizeexceeded"), seen_.truncated + seen_.cut);
    return seen_;
  }

 private:
  struct Client {
    std::string identifier, product;
    std::string agent = "Sabled/1.0 (SableBook1,1; Sable OS 1A1) " + product;
    VirtualClient* connection = nullptr;
    std::int64_t reported = 0, read = 0;  ///< number of the last one
    std::int64_t received = 0;            ///< how many were read
    bool mayHaveGap = false;              ///< after `read`, where a file ended early
    std::vector<std::shared_ptr<SableFeedback>> feedbacks{};
    std::optional<std::int64_t> lastFirstUse{};  ///< day
    bool mayHaveUsed = false;  ///< on another day: the session that says so may have been lost
  };
  /// Sessions that ended together.
  struct Generation {
    std::uint64_t time = 0, step = 0;
    std::string reason, previousReason, guid, previousGuid;  ///< empty: not known
  };

  static inline const Generation kFirst{0, 0, "no previous session", "", "", ""};
  static constexpr std::int64_t kUnwanted = -1;  ///< as a record's query

  platform::simulated::SimulatedRuntime& runtime() { return device_.platform.runtime(); }
  Assembly& assembly() { return device_.assembly(); }
  double draw(double low, double high) { return std::uniform_real_distribution(low, high)(chance_); }
  /// Seconds, as often short as long.
  platform::Duration drawTime(double low, double high) {
    return platform::fromSeconds(std::exp(draw(std::log(low), std::log(high))));
  }
  ClientSessionManager& managerOf(const Client& client) {
    return *assembly().clientStateManager->stateForClientIdentifier(client.identifier)->sessionManager();
  }

  void step() {
    if (!device_.bag["feedback_enabled"] && chance_() % 16 == 0) return toggleFeedback();
    Client& client = clients_[chance_() % clients_.size()];
    const double what = draw(0, 100);
    if (what < 55) {
      report(client, "RKStartSearchFeedback");
      device_.advance(drawTime(0.05, 10));
    } else if (what < 62) {
      report(client, chance_() % 2 == 0 ? "RKResultEngagementFeedback" : "RKCardSectionEngagementFeedback");
    } else if (what < 88) {
      device_.advance(drawTime(5, 1800));
    } else if (what < 89) {
      device_.advance(drawTime(3600, 9 * 3600));
    } else if (what < 96) {
      goOrCome(client);
    } else if (what < 97) {
      managerOf(client).guidController().reset();
    } else if (what < 98) {
      managerOf(client).flushSession(nullptr);
    } else if (what < 98.4) {
      toggleFeedback();
    } else if (what < 98.8) {
      killInTheMiddle();
    } else if (what < 99) {
      device_.platform.memoryPressure().fireCritical();
    } else {
      runtime().jumpWallClock((chance_() % 2 == 0 ? 1 : -1) * drawTime(0.001, 3 * 86400));
    }
  }

  void report(Client& client, std::string_view className) {
    const auto now = runtime().ticks().time_since_epoch().count();
    const auto bag = assembly().bagController->inMemoryBag();
    const bool isWanted = bag == nullptr || bag->feedbackEnabled();
    auto feedback = feedbackFromJSON(className, R"({"timestamp": )" + std::to_string(now) + "}", client.agent,
                                     std::nullopt, isWanted ? ++client.reported : kUnwanted);
    if (isWanted) client.feedbacks.push_back(feedback);
    ++(isWanted ? seen_.feedbacks : seen_.unwanted);
    managerOf(client).addSableFeedback(std::move(feedback));
  }

  void toggleFeedback() {
    device_.bag["feedback_enabled"] = !device_.bag["feedback_enabled"];
    device_.publishBag();
  }

  /// The files are read here: nothing may upload them.
  void startDaemon() {
    device_.start();
    assembly().backgroundFlusher->setStopFlushing(true);
  }

  /// Reports are on their way when the daemon ends, each as far as chance would have it.
  void killInTheMiddle() {
    for (auto count = chance_() % 6; count > 0; --count)
      report(clients_[chance_() % clients_.size()], "RKStartSearchFeedback");
    auto items = chance_() % 24;
    runtime().runUntil([&] { return items-- == 0; }, 0s);
    device_.killDaemon();
    for (Client& client : clients_) client.connection = nullptr, client.mayHaveUsed = true;
    const auto tooOld = device_.counter("filetooold");
    startDaemon();
    if (device_.counter("filetooold") > tooOld) allowGaps();
    wasKilled_ = true;
    ++seen_.kills;
  }

  /// Nothing is on its way: what has come in has ended or is in a file.
  SBLFeedbackLedger judgeLedger() {
    const SBLFeedbackLedger ledger(device_.platform.tally().snapshot());
    std::int64_t stored = 0;
    for (const auto& [path, bytes] : device_.platform.fileManager().files()) {
      if (path.filename().string().starts_with("session.")) stored += recordsIn(bytes);
    }
    EXPECT_EQ(ledger.waiting(), 0);
    EXPECT_EQ(ledger.stored(), stored);
    EXPECT_EQ(ledger[SBLLedgerEntry::handedOver], seen_.handedOver);
    EXPECT_GE(ledger[SBLLedgerEntry::bagDisabled] + ledger[SBLLedgerEntry::lostWriting], seen_.unwanted);
    for (const auto never : {SBLLedgerEntry::found, SBLLedgerEntry::missing, SBLLedgerEntry::noAgent,
                             SBLLedgerEntry::noFile, SBLLedgerEntry::unwritten})
      EXPECT_EQ(ledger[never], 0) << counterOf(never);
    return ledger;
  }

  void goOrCome(Client& client) {
    if (client.connection != nullptr && client.connection->isConnected()) {
      client.connection->disconnect();
    } else {
      client.connection = &device_.client(client.identifier, client.product);
    }
  }

  void readEndedSessions() {
    auto containers = assembly().persistentStorage->getAvailableSessionHandles();
    std::ranges::sort(containers, {}, [](const auto& each) { return numberOf(each->fileUrl()); });
    for (const auto& container : containers) {
      const auto session = container->read();
      if (!session) {  // of a file that was only just made
        ASSERT_TRUE(wasKilled_);
        assembly().persistentStorage->deleteSessionWithFileContainer(container);
        continue;
      }
      seen_.handedOver += static_cast<std::int64_t>(session->getSessionFeedbacks().size());
      if (session->agent() == sabledUserAgent(device_.platform.deviceInfo())) {  // of a bag's fetch
        constexpr std::size_t kStartAndEnd = 2;
        if (session->getSessionFeedbacks().size() < kStartAndEnd) noteTruncated();
        assembly().persistentStorage->deleteSessionWithFileContainer(container);
        continue;
      }
      judge(*session);
      assembly().persistentStorage->deleteSessionWithFileContainer(container);
    }
    if (!std::exchange(wasKilled_, false)) return;
    allowGaps();
    generations_.clear();
  }

  void allowGaps() {
    for (Client& client : clients_) client.mayHaveGap = true;
  }

  void noteTruncated() { ++(wasKilled_ ? seen_.cut : seen_.truncated); }

  void judge(ClientSession& session) {
    const auto records = session.getSessionFeedbacks();
    ASSERT_TRUE(wasKilled_ || !records.empty()) << "a session without feedback";
    if (records.empty()) return;
    judgeEnd(session, *records.back());
    const auto client = std::ranges::find(clients_, session.agent(), &Client::agent);
    if (client == clients_.end()) return;
    judgeRecords(*client, session, records);
    const auto day = assembly().platform.localeInfo().dayNumber(*session.sessionStart());
    EXPECT_TRUE(client->mayHaveUsed || session.firstUseOfTheDay() == (client->lastFirstUse != day))
        << session.agent();
    if (session.firstUseOfTheDay())
      client->lastFirstUse = day, client->mayHaveUsed = false, ++seen_.firstUses;
    EXPECT_LE(records.back()->feedback().timestamp() - records.front()->feedback().timestamp(),
              static_cast<std::uint64_t>(platform::Duration(900s).count()));
  }

  /// Where clients have sessions of their own, each has a chain of its own.
  void judgeEnd(ClientSession& session, const SableFeedback& last) {
    const json record = last.dictionary();
    Generation& generation =
        generations_.try_emplace(assembly().sharedSession ? "" : session.agent(), kFirst).first->second;
    if (record["type"] != "session_end") {
      noteTruncated();
      generation = {};  // whatever ended it is not written
      return;
    }
    const std::uint64_t time = last.feedback().timestamp();
    if (generation.time != time || generation.step != step_) {
      generation = {time,           step_, record["reason"], generation.reason, session.userGuidString(),
                    generation.guid};
      ++seen_.ends[generation.reason];
      for (const char* reason : {"session idle", "engagement received", "guid changed"}) {
        EXPECT_FALSE(generation.previousReason == reason && generation.guid == generation.previousGuid)
            << reason;
      }
    }
    EXPECT_EQ(record["reason"], generation.reason);
    EXPECT_EQ(session.userGuidString(), generation.guid);
    const auto previous = feedback::triggerEventEnumToString(session.previousSessionEndReason());
    EXPECT_TRUE(generation.previousReason.empty() || previous == generation.previousReason) << previous;
  }

  /// A file that has reached its limit ends early; nothing is missing elsewhere.
  void judgeRecords(Client& client, ClientSession& session, const SableFeedbacks& records) {
    int mixed = 0, errors = 0;
    for (const auto& record : records) {
      errors += record->dictionary()["type"] == "error";
      if (record->queryId() == 0) continue;
      ASSERT_NE(record->queryId(), kUnwanted) << "recorded against the bag's wish";
      ASSERT_GT(record->queryId(), client.read) << "twice";
      ASSERT_TRUE(client.mayHaveGap || record->queryId() == client.read + 1)
          << client.agent << " lost feedback";
      client.mayHaveGap = false;
      client.read = record->queryId();
      ++client.received;
      const auto& reported = client.feedbacks.at(static_cast<std::size_t>(client.read - 1));
      EXPECT_EQ(record->type(), reported->type());
      mixed += reported->userGuid() != session.userGuid();
    }
    client.mayHaveGap |= records.back()->dictionary()["type"] != "session_end";
    EXPECT_EQ(mixed, errors) << "GUIDs are mixed without a word";
  }

  std::mt19937_64 chance_;
  VirtualDevice device_;
  std::array<Client, 3> clients_{
      {{"com.kestrel.beacon", "Beacon/1"}, {"com.kestrel.rover", "Rover/1"}, {"com.kestrel.vox", "Vox/1"}}};
  std::map<std::string, Generation> generations_;
  std::uint64_t step_ = 0;
  bool wasKilled_ = false;  ///< and what that daemon left has not been read yet
  Seen seen_;
};

/// Several weeks, until one fails.
Seen simulate(Week::Setting setting, std::uint64_t seeds) {
  Seen all;
  for (setting.seed = 1; setting.seed <= seeds && !testing::Test::HasFailure(); ++setting.seed) {
    SCOPED_TRACE("seed " + std::to_string(setting.seed));
    const Seen week = Week(setting).run();
    for (const auto& [reason, count] : week.ends) all.ends[reason] += count;
    all.feedbacks += week.feedbacks;
    all.truncated += week.truncated;
    all.firstUses += week.firstUses;
    all.unwanted += week.unwanted;
    all.lost += week.lost;
    all.kills += week.kills;
    all.cut += week.cut;
  }
  return all;
}

TEST(Simulation, OfClientsThatShareTheirSessions) {
  const Seen seen = simulate({.shared = true}, 4);
  for (const char* reason :
       {"external request", "session idle", "max session time passed", "guid changed", "engagement received"})
    EXPECT_GT(seen.ends.find(reason) == seen.ends.end() ? 0 : seen.ends.at(reason), 5) << reason;
  EXPECT_GT(seen.feedbacks, 5000);
  EXPECT_GT(seen.firstUses, 40);
  EXPECT_GT(seen.unwanted, 100);
  EXPECT_GT(seen.kills, 10);
  EXPECT_GT(seen.lost, 10);
  EXPECT_GT(seen.cut, 5);
}

TEST(Simulation, OfClientsWithSessionsOfTheirOwn) {
  const Seen seen = simulate({.shared = false}, 4);
  for (const char* reason : {"external request", "session idle", "max session time passed", "guid changed"})
    EXPECT_GT(seen.ends.find(reason) == seen.ends.end() ? 0 : seen.ends.at(reason), 5) << reason;
}

TEST(Simulation, OfFilesThatReachTheirLimit) {
  EXPECT_GT(simulate({.shared = true, .sizeLimit = 600}, 2).truncated, 20);
}

}  // namespace
}  // namespace sable::test
