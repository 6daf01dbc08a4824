// Feedback on its way into session files and out of them: records a second from addSableFeedback to the
// file, against bare writes of the same bytes; the translation of a session; what ten million records
// leave in memory. On one processor, in its time.
#include <fcntl.h>
#include <fmt/core.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "SableKit/messages/MessageJSON.h"
#include "bench/support/Bench.h"
#include "platform/Log.h"
#include "platform/host/HostPlatform.h"
#include "sabled/Assembly.h"
#include "sabled/BagCacheFile.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/FileContainer.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableFeedback.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableUserGUIDController.h"

namespace {

using namespace sable::bench;

constexpr int kBatch = 4000;  ///< records that fit into a session's file
constexpr int kBatches = 2500, kComparedBatches = 300, kTranslations = 50;
constexpr int kTranslatedRecords = 1000;
constexpr double kLeastRate = 150000, kLeastRatio = 0.7, kLongestTranslation = 10;  // the last in ms
/// Bytes a session: what its timer holds for ten minutes.
constexpr double kMostGrowth = 512;

/// Shows what the daemon shows unless told otherwise, to nobody.
class UnreadLog : public sable::platform::LogSink {
 public:
  bool shows(sable::platform::LogLevel level, std::string_view) const override {
    return level >= sable::platform::LogLevel::standard;
  }
  void write(const sable::platform::LogRecord&) override {}
};

/// The host's platform wants folders; these go with the program.
class Folders {
 public:
  Folders() {
    char folder[] = "/tmp/sabled-bench-XXXXXX";
    if (::mkdtemp(folder) == nullptr) fail("mkdtemp");
    root_ = folder;
    for (const char* name : {"SABLED_RUNTIME_DIR", "SABLED_CACHES_DIR", "SABLED_STATE_DIR",
                             "SABLED_CONFIG_DIR", "SABLED_PROFILE"})
      ::setenv(name, (root_ / name).c_str(), 1);
  }
  ~Folders() {
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }
  Folders(const Folders&) = delete;
  Folders& operator=(const Folders&) = delete;
  const std::filesystem::path& root() const { return root_; }

 private:
  std::filesystem::path root_;
};

/// What a client reports in a search: it begins, results are shown, one is taken.
struct Report {
  std::string className, bytes;
};

std::vector<Report> reports() {
  const auto report = [](const char* className, const char* json) {
    const auto bytes = sable::messageFromJSON(className, json);
    if (!bytes) fail(bytes.error().reason);
    return Report{className, *bytes};
  };
  return {
      report("RKStartSearchFeedback",
             R"({"timestamp": 1000, "input": "weather in the mountains", "triggerEvent": 3, "queryId": 7})"),
      report("RKVisibleResultsFeedback",
             R"({"timestamp": 2000, "triggerEvent": 2, "queryId": 7, "results": [
                     {"identifier": "result-0123456789", "fbr": "Gk4SDHdlYXRoZXJnbGFzcxoGcm92ZXIx", "rankingScore": 0.75},
                     {"identifier": "result-1234567890", "fbr": "Gk4SDHdlYXRoZXJnbGFzcxoGcm92ZXIx", "rankingScore": 0.75},
                     {"identifier": "result-2345678901", "fbr": "Gk4SDHdlYXRoZXJnbGFzcxoGcm92ZXIx", "rankingScore": 0.75}]})"),
      report("RKResultEngagementFeedback",
             R"({"timestamp": 3000, "triggerEvent": 2, "result":
                     {"identifier": "result-1234567890", "fbr": "Gk4SDHdlYXRoZXJnbGFzcxoGcm92ZXIx", "rankingScore": 0.75}})")};
}

/// Records a second of the processor's time, whatever else the machine does.
template <class Work>
double rate(std::size_t records, Work work) {
  const auto now = [] {
    timespec time{};
    ::clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
  };
  const double start = now();
  work();
  return static_cast<double>(records) / (now() - start);
}

using Feedbacks = std::vector<std::shared_ptr<sable::SableFeedback>>;

Feedbacks feedbacks(int count) {
  static const std::vector<Report> kinds = reports();
  Feedbacks made;
  for (int i = 0; i < count; ++i) {
    const Report& kind = kinds[static_cast<std::size_t>(i) % kinds.size()];
    auto message = sable::FeedbackMessage::parse(kind.className, kind.bytes);
    if (!message) fail(message.error().reason);
    made.push_back(
        std::make_shared<sable::SableFeedback>(std::move(*message), i, std::nullopt, "Beacon/1", 3));
  }
  return made;
}

/// The part of the daemon that feedback passes through.
class Recorder {
 public:
  Recorder() : assembly(device_) {
    assembly.sharedSession = true;
    sable::BagCacheFile(assembly.fileManager).write({{"feedback_enabled", true}, {"__refresh_disabled", 1}});
    assembly.requestFactory = std::make_unique<sable::SBLNetworkRequestFactory>(assembly);
    assembly.persistentStorage = std::make_unique<sable::SablePersistentStorage>(assembly);
    assembly.bagController = std::make_unique<sable::SableBagController>(assembly);
    assembly.guidController = std::make_unique<sable::SableUserGUIDController>(assembly);
    assembly.clientSessionManager =
        std::make_unique<sable::ClientSessionManager>(assembly, *assembly.guidController, "bench");
    if (assembly.bagController->inMemoryBag() == nullptr) fail("there is no bag");
  }

  /// Returns when all are in the file; says how many a second that is.
  double record(Feedbacks batch) {
    return rate(batch.size(), [&] {
      const auto added = assembly.runtime.semaphore(0);
      client_->async([&] {
        for (auto& feedback : batch) assembly.clientSessionManager->addSableFeedback(std::move(feedback));
        added->signal();
      });
      added->wait(sable::platform::MonotonicTime::max());
      awaitFile();
    });
  }

  /// Ends the session; its file, which is deleted with the next.
  std::shared_ptr<sable::ClientSession> end(double expected) {
    assembly.clientSessionManager->flushSession([] {});
    awaitFile();
    const auto files = assembly.persistentStorage->getAvailableSessionHandles();
    if (files.size() != 1) fail("a batch should be one session");
    auto session = expected > 0 ? files.front()->read() : nullptr;
    if (session && static_cast<double>(session->getSessionFeedbacks().size()) != expected + 1)
      fail("records are missing");
    assembly.persistentStorage->deleteSessionWithFileContainer(files.front());
    return session;
  }

 private:
  /// Each queue on the way has handed on what it had.
  void awaitFile() {
    if (const auto session = assembly.clientSessionManager->session()) session->userGuid();
    assembly.persistentStorage->getAvailableSessionHandles();
  }

  sable::platform::host::HostPlatform device_;

 public:
  sable::Assembly assembly;

 private:
  /// The daemon's callers, too, are on threads of the pool.
  const std::shared_ptr<sable::platform::SerialQueue> client_ =
      assembly.runtime.serialQueue("com.kestrel.sabled.bench");
};

/// Records a second of the same bytes with one `write` each.
double bareWrites(const std::filesystem::path& path, const Feedbacks& batch) {
  std::vector<std::string> records;
  for (const auto& feedback : batch) {
    const std::string data = feedback->data();
    const std::uint64_t length = data.size();
    std::string& record = records.emplace_back(sizeof length, '\0');
    std::memcpy(record.data(), &length, sizeof length);
    record += data;
  }
  const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
  const double perSecond = rate(records.size(), [&] {
    for (const std::string& record : records) {
      if (::write(file, record.data(), record.size()) != static_cast<ssize_t>(record.size())) fail("write");
    }
  });
  ::close(file);
  std::filesystem::remove(path);
  return perSecond;
}

double bytesInUse() {
  return static_cast<double>(::mallinfo2().uordblks);
}

}  // namespace

int main(int argc, char** argv) {
  UnreadLog log;
  sable::platform::installLogSink(&log);
  const Folders folders;
  placeServers(Placement::oneProcessor);
  placeClient(Placement::oneProcessor);
  {
    Recorder recorder;
    std::vector<double> rates, floors;
    double before = 0;
    for (int i = 0; i < kBatches; ++i) {
      if (i == kBatches / 10) before = bytesInUse();
      Feedbacks batch = feedbacks(kBatch);
      if (i < kComparedBatches) floors.push_back(bareWrites(folders.root() / "bare", batch));
      rates.push_back(recorder.record(std::move(batch)));
      recorder.end(i == 0 ? kBatch : 0);
    }
    constexpr int kSessions = kBatches - kBatches / 10;  // after queues and tables have grown
    report({"recording_growth", "B/sess.", (bytesInUse() - before) / kSessions, std::nullopt, kMostGrowth},
           argc, argv);
    report({"recording_rate", "/s", median(rates), std::nullopt, kLeastRate, true}, argc, argv);
    rates.resize(kComparedBatches);
    report({"recording_vs_write", "/s", median(rates), median(floors), kLeastRatio, true}, argc, argv);

    Microseconds times;
    for (int i = 0; i < kTranslations; ++i) {
      recorder.record(feedbacks(kTranslatedRecords));
      const auto session = recorder.end(kTranslatedRecords);
      measure(1, times, [&] {
        std::size_t bytes = 0;
        session->writeFeedbacksToSend([&](std::string_view json) { bytes += json.size(); });
        if (bytes < kTranslatedRecords) fail("records are missing");
      });
    }
    report({"session_translation", "ms", median(times) / 1e3, std::nullopt, kLongestTranslation}, argc, argv);
  }
  sable::platform::installLogSink(nullptr);
}
