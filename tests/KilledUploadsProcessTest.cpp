#include <fmt/core.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <sys/inotify.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <iostream>
#include <list>
#include <map>
#include <random>

#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// The real daemon, killed again and again while it uploads: what the service has in the end.
namespace sable::test {
namespace {

using nlohmann::json;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kRounds = 4;
#else
constexpr int kRounds = 8;
#endif

/// Tells when a number of things have happened to the files in some folders.
class FileEvents {
 public:
  explicit FileEvents(const std::vector<std::filesystem::path>& folders)
      : queue_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    for (const auto& folder : folders) {
      std::filesystem::create_directories(folder);
      std::filesystem::permissions(folder, std::filesystem::perms::owner_all);
      inotify_add_watch(queue_, folder.c_str(), IN_CREATE | IN_MODIFY | IN_MOVED_TO | IN_DELETE);
    }
  }
  ~FileEvents() { close(queue_); }
  FileEvents(const FileEvents&) = delete;
  FileEvents& operator=(const FileEvents&) = delete;

  /// Returns how many there were: fewer when nothing happens any more.
  int wait(int count) const {
    constexpr int kQuietMilliseconds = 100;
    int seen = 0;
    alignas(inotify_event) char events[4096];
    for (pollfd descriptor{queue_, POLLIN, 0};
         seen < count && poll(&descriptor, 1, kQuietMilliseconds) > 0;) {
      const ssize_t bytes = read(queue_, events, sizeof events);
      for (ssize_t at = 0; at < bytes; ++seen)
        at += ssize_t(sizeof(inotify_event)) + reinterpret_cast<const inotify_event*>(events + at)->len;
    }
    return seen;
  }

 private:
  const int queue_;
};

json ledgerWhen(const World& world, const std::function<bool(const json&)>& holds) {
  json ledger;
  for (int attempt = 0; attempt < 2000; ++attempt) {
    ledger = world.sablectlJSON({"ledger"});
    if (holds(ledger)) break;
  }
  return ledger;
}

std::ptrdiff_t queued(const World& world) {
  const json uploads = world.sablectlJSON({"uploads"});
  if (!uploads.is_array()) return 1;  // its journal is being rolled back
  return std::ranges::count_if(
      uploads, [](const json& upload) { return upload.is_object() && upload.value("state", "") != "ended"; });
}

/// But for what tells that sablectl has disconnected after its dump. Returns the ledger.
json expectEverythingSent(const World& world) {
  ledgerWhen(world, [&](const json& now) {
    return now["meets"] == true && now["in_files"] <= 1 && now["sending"] == 0 && queued(world) == 0;
  });
  json ledger = world.sablectlJSON({"ledger"});
  EXPECT_EQ(ledger["meets"], true) << ledger.dump(1);
  EXPECT_LE(ledger["in_files"], 1) << ledger.dump(1);
  EXPECT_EQ(ledger["sending"], 0) << ledger.dump(1);
  EXPECT_EQ(queued(world), 0);
  return ledger;
}

struct Figures {
  int flushing = 0;  ///< kills that left sessions on their way to an upload
  int queued = 0;    ///< kills that left uploads without an end
  int packing = 0;   ///< kills that left a temporary file
  int repeated = 0;  ///< uploads that arrived twice
  int atOnce = 0;    ///< feedback reported while the daemon was about to be killed
  int lost = 0;      ///< of these
};

class KilledUploads : public testing::Test {
 protected:
  KilledUploads() {
    // Without a bag nobody wants feedback.
    waitForChange(caches_, [this] { return std::filesystem::exists(caches_ / "bag.plist"); });
    world_.killDaemon();
  }

  std::string report(TestClient& client) {
    const std::string input = fmt::format("number {}", ++reported_);
    const auto message = messageFromJSON("RKStartSearchFeedback", json{{"input", input}}.dump());
    client.client().call(
        kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
        {std::uint64_t{0}, std::int64_t{reported_}, std::string("RKStartSearchFeedback"), makeData(*message)},
        [](const Expected<platform::RelayArguments>&) {});
    return input;
  }

  /// Feedback that is in its files is flushed, other feedback comes in, and then the daemon is killed.
  void round(int number) {
    world_.startDaemon({"--log-level", "error"});
    platform::host::HostRuntime runtime(2);
    TestClient client(runtime, world_.address(), {"test", fmt::format("round{}", number)});
    const auto taken =
        ledgerWhen(world_, [](const json&) { return true; })["began"]["taken"].get<std::int64_t>();
    constexpr int kCount = 3;
    for (int i = 0; i < kCount; ++i) stored_.push_back(report(client));
    const auto ledger = ledgerWhen(world_, [&](const json& now) {
      return now["waiting"] == 0 && now["began"]["taken"].get<std::int64_t>() >= taken + kCount;
    });
    ASSERT_EQ(ledger["waiting"], 0) << ledger.dump(1);
    const FileEvents events(
        {caches_, caches_ / "temporary", world_.folder("state"), world_.folder("state") / "transfers"});
    const auto dump = world_.start({World::program("sablectl"), "dump"});
    (void)events.wait(static_cast<int>(chance_() % 40));
    for (auto left = chance_() % 3; left > 0; --left) atOnce_.push_back(report(client));
    (void)events.wait(static_cast<int>(chance_() % 4));
    world_.killDaemon();
    noteWhatIsLeft();
  }

  void noteWhatIsLeft() {
    const auto holds = [](const std::filesystem::path& folder, std::string_view part) {
      return std::ranges::any_of(std::filesystem::directory_iterator(folder), [&](const auto& entry) {
        return entry.path().filename().string().find(part) != std::string::npos;
      });
    };
    figures_.flushing += holds(caches_, "flushing.");
    figures_.packing += holds(caches_ / "temporary", "flusher_");
    figures_.queued += holds(world_.folder("state") / "transfers", ".upload");
  }

  void expectEachOnce() {
    std::map<std::string, int> accepted;
    for (const json& upload : world_.requests("/feedback", 0)) {
      if (upload["status"] != 200) continue;
      EXPECT_EQ(upload["digest_ok"], true);
      if (upload["repeated"] == true) {
        ++figures_.repeated;
        continue;
      }
      for (const json& record : upload["json"]["fb"])
        if (record["type"] == "search_start") ++accepted[record["input"]];
    }
    for (const std::string& input : stored_) EXPECT_EQ(accepted[input], 1) << input;
    for (const std::string& input : atOnce_) {
      EXPECT_LE(accepted[input], 1) << input;
      figures_.lost += accepted[input] == 0;
    }
    figures_.atOnce = static_cast<int>(atOnce_.size());
  }

  World world_{{.serviceArguments = {"--fault", "/feedback:latency=3"}}};
  const std::filesystem::path caches_ = world_.folder("caches") / "com.kestrel.sabled";
  std::mt19937 chance_{1};
  std::int64_t reported_ = 0;
  std::vector<std::string> stored_, atOnce_;  ///< inputs of feedback
  Figures figures_;
};

TEST_F(KilledUploads, BringEachSessionToTheServiceOnce) {
  const char* wanted = std::getenv("SABLED_KILL_ROUNDS");
  const int rounds = wanted == nullptr ? kRounds : std::atoi(wanted);
  for (int number = 0; number < rounds && !HasFailure(); ++number) round(number);
  world_.startDaemon();
  ASSERT_EQ(world_.sablectl({"dump"}).exitCode, 0);
  const json ledger = expectEverythingSent(world_);
  expectEachOnce();
  for (const char* end : {"unsent", "lostsending", "refused", "damaged", "unwritten", "bagdisabled"})
    EXPECT_EQ(ledger["ended"][end], 0) << end;
  if (HasFailure()) {
    std::cout << world_.sablectl({"ledger"}).output << world_.sablectl({"uploads"}).output;
  }
  if (wanted != nullptr || HasFailure())
    std::cout << fmt::format(
        "{} rounds: {} kills while flushing, {} while packing, {} with uploads under way, {} uploads "
        "repeated; {} of {} reported at the kill lost\n",
        rounds, figures_.flushing, figures_.packing, figures_.queued, figures_.repeated, figures_.lost,
        figures_.atOnce);
}

/// A world whose service is at fault once, and feedback on its way there.
class FaultyUpload {
 public:
  explicit FaultyUpload(World::Options options) : world(std::move(options)) {
    const auto caches = world.folder("caches") / "com.kestrel.sabled";
    waitForChange(caches, [&] { return std::filesystem::exists(caches / "bag.plist"); });
  }

  void send() const {
    EXPECT_EQ(world.sablectl({"report", "RKStartSearchFeedback", "input=precious"}).exitCode, 0);
    EXPECT_EQ(world.sablectl({"dump"}).exitCode, 0);
  }

  World world;
};

/// What the service took last is what the device's owner can read.
void expectShownToTheOwner(const World& world) {
  const json last = world.sablectlJSON({"uploads"}).back();
  EXPECT_EQ(last["state"], "ended");
  EXPECT_EQ(last["can_be_shown"], true);
  const auto shown =
      json::parse(world.sablectl({"--json", "uploads", "--show", last["id"].dump()}).output, nullptr, false);
  EXPECT_TRUE(std::ranges::any_of(world.requests("/feedback", 1), [&](const json& request) {
    return request["status"] == last["status"] && request.value("json", json()) == shown;
  })) << shown;
}

TEST(FaultsOfUploads, CostWhatTheServiceRefusesAndNothingElse) {
  const struct Fault {
    const char* name;
    std::vector<std::string> rules;
    int status;    // of the request that met the fault
    bool refused;  // its feedback is not sent again
    bool pauses;   // it is sent again after some seconds
  } faults[] = {
      {"a failure", {"status=500*1"}, 500, true, false},
      {"unavailable", {"status=503*1"}, 503, true, false},
      {"a slow reader", {"slow-body=1000*1"}, 200, false, false},
      {"a slow answer", {"latency=300*1"}, 200, false, false},
      {"unavailable for a second", {"status=503*1", "retry-after=1*1"}, 503, false, true},
      {"reset amid the body", {"reset-body=100*1"}, 400, false, false},
      {"reset instead of an answer", {"reset*1"}, 200, false, true},
      {"an answer cut short", {"truncate=1*1"}, 200, false, true},
  };
  const bool withPauses = std::getenv("SABLED_SLOW_FAULTS") != nullptr;
  std::list<std::pair<const Fault&, FaultyUpload>> uploads;
  for (const Fault& fault : faults) {
    if (fault.pauses && !withPauses) continue;
    World::Options options;
    for (const std::string& rule : fault.rules)
      options.serviceArguments.insert(options.serviceArguments.end(), {"--fault", "/feedback:" + rule});
    uploads.emplace_back(fault, options).second.send();
  }
  for (const auto& [fault, upload] : uploads) {
    SCOPED_TRACE(fault.name);
    const json ledger = expectEverythingSent(upload.world);
    EXPECT_EQ(ledger["ended"]["refused"] > 0, fault.refused) << ledger.dump(1);
    std::map<std::string, json> lastWith;  // by digest; what did not arrive whole has none
    bool metTheFault = false;
    for (const json& request : upload.world.requests("/feedback", 1)) {
      metTheFault = metTheFault || request["status"] == fault.status;
      if (request.contains("digest")) lastWith[request["digest"]] = request;
    }
    int precious = 0, refused = 0;
    for (const auto& [digest, request] : lastWith) {
      precious += request["json"].dump().find("precious") != std::string::npos;
      refused += request["status"] != 200;
    }
    EXPECT_EQ(precious, 1);
    EXPECT_EQ(refused, fault.refused ? 1 : 0);
    EXPECT_TRUE(metTheFault);
    expectShownToTheOwner(upload.world);
  }
}

/// A disk of its own for a folder, which nobody but this process and its children sees.
bool mountSmallDisk(const std::filesystem::path& folder) {
  return unshare(CLONE_NEWNS) == 0 && mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
         mount("tmpfs", folder.c_str(), "tmpfs", 0, "size=4m,mode=700") == 0;
}

TEST(FaultsOfUploads, WithoutRoomForTheUploadTheSessionStaysUntilThereIs) {
  World world({.startDaemon = false});
  const auto state = world.folder("state");
  if (!mountSmallDisk(state)) GTEST_SKIP() << "may not mount";
  world.startDaemon();
  const auto caches = world.folder("caches") / "com.kestrel.sabled";
  waitForChange(caches, [&] { return std::filesystem::exists(caches / "bag.plist"); });
  (void)world.sablectl({"report", "RKStartSearchFeedback", "input=precious"});
  ledgerWhen(world, [](const json& now) { return now["waiting"] == 0; });
  writeFile(state / "filler", std::string(4 << 20, 'x'));
  EXPECT_EQ(world.sablectl({"dump"}).exitCode, 0);
  world.waitForLog("Error creating Upload Task");
  std::filesystem::remove(state / "filler");
  EXPECT_EQ(world.sablectl({"dump"}).exitCode, 0);
  const json ledger = expectEverythingSent(world);
  EXPECT_EQ(ledger["ended"]["unsent"], 0) << ledger.dump(1);
  std::string texts;
  for (const json& request : world.requests("/feedback", 1)) texts += request["json"].dump();
  EXPECT_EQ(occurrences(texts, "precious"), 1u);
  world.killDaemon();
  (void)umount2(state.c_str(), MNT_DETACH);
}

}  // namespace
}  // namespace sable::test
