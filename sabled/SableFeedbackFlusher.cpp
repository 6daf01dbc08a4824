#include "sabled/SableFeedbackFlusher.h"

#include <algorithm>
#include <iterator>
#include <utility>

#include "SableKit/SBLBag.h"
#include "platform/FileManager.h"
#include "platform/HTTPBackgroundSession.h"
#include "platform/URL.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/CompressedOutputStream.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/FileContainer.h"
#include "sabled/FileOutputStream.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableEnumerations.h"
#include "sabled/SableLogging.h"
#include "sabled/SablePersistentStorage.h"

namespace sable {

namespace {

constexpr double kUploadTimeout = 300;  // seconds
/// So many pieces of an envelope may wait for their compression: one would leave it idle while threads wake.
constexpr unsigned kPiecesAhead = 2;
constexpr int kCrowdsourcing = 0, kFeedbacks = 1;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryFlusher);
}

const platform::LogHandle& sessionLog() {
  return SableLogForCategory(SableLoggingCategorySession);
}

}  // namespace

struct SableFeedbackFlusher::Packed {
  std::string digest;      ///< of the JSON
  std::uint64_t size = 0;  ///< of the JSON, in bytes
  std::int64_t count = 0;  ///< feedback of the session
};

SableFeedbackFlusher::SableFeedbackFlusher(Assembly& assembly, int identifier)
    : assembly_(assembly),
      identifier_(identifier),
      queueBuffer_(assembly.runtime.serialQueue("com.kestrel.sabled.sableDataBufferQueue",
                                                platform::QualityOfService::background)),
      queueCompression_(assembly.runtime.serialQueue("com.kestrel.sabled.sableDataCompressionQueue",
                                                     platform::QualityOfService::background)),
      feedbackCountQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.feedbackCountQueue")) {
  bagObservation_ = assembly.notificationCenter.observe(
      std::string(kSBLBagChangeNotification),
      [this](const platform::Notification& notification) { bagChangeNotification(notification); });
  if (assembly.bagController) _fetchEndpointFromBag(assembly.bagController->inMemoryBag().get());
  log().standard("Initialize flusher for {}", convertIdentifierToString(identifier));
}

SableFeedbackFlusher::~SableFeedbackFlusher() = default;

std::optional<std::string> SableFeedbackFlusher::getServerEndpointForFeedback(
    const std::optional<std::string>& url) {
  auto endpoint = url ? platform::URL::parse(*url) : std::nullopt;
  if (!endpoint) return std::nullopt;
  endpoint->setQueryItems({{"v", "2"}});
  return endpoint->string();
}

void SableFeedbackFlusher::bagChangeNotification(const platform::Notification& notification) {
  log().standard("bag change notification received");
  _fetchEndpointFromBag(bagFromNotification(notification).get());
}

void SableFeedbackFlusher::_fetchEndpointFromBag(const SBLBag* bag) {
  if (bag == nullptr || !bag->feedbackEnabled()) return setEndpoint(std::nullopt);
  switch (identifier_) {
    case kCrowdsourcing:
      return setEndpoint(getServerEndpointForFeedback(bag->crowdsourcingURL()));
    case kFeedbacks:
      return setEndpoint(getServerEndpointForFeedback(bag->feedbackURL()));
    default:
      return setEndpoint(std::nullopt);
  }
}

void SableFeedbackFlusher::setEndpoint(std::optional<std::string> url) {
  queueBuffer_->async([this, url = std::move(url)]() mutable {
    log().standard("new endpoint: {}", url.value_or("(null)"));
    serverEndpoint_ = std::move(url);
  });
}

void SableFeedbackFlusher::flush(std::shared_ptr<ClientSession> session,
                                 platform::Function<void()> callback) {
  queueBuffer_->async([this, session = std::move(session), callback = std::move(callback)]() mutable {
    _flush(std::move(session));
    if (callback) callback();
  });
}

void SableFeedbackFlusher::_flush(std::shared_ptr<ClientSession> session) {
  queueBuffer_->assertIsCurrent();
  sessionBuffer_.push_back(std::move(session));
}

void SableFeedbackFlusher::flushSyncFromArray(std::vector<std::shared_ptr<ClientSession>> sessions) {
  queueBuffer_->sync([&] { std::ranges::move(sessions, std::back_inserter(sessionBuffer_)); });
}

void SableFeedbackFlusher::dropFeedbacks() {
  queueBuffer_->async([this] { sessionBuffer_.clear(); });
}

void SableFeedbackFlusher::flushToWireAsync() {
  queueBuffer_->async([this] { flushToWireWithObjectsReturned(false); });
}

std::vector<std::string> SableFeedbackFlusher::flushToWireSync(bool returnObjects) {
  return queueBuffer_->sync([&] { return flushToWireWithObjectsReturned(returnObjects); });
}

std::size_t SableFeedbackFlusher::countOfDatabuffer() const {
  return queueBuffer_->sync([this] { return sessionBuffer_.size(); });
}

std::vector<std::shared_ptr<ClientSession>> SableFeedbackFlusher::sessionBuffer() const {
  return queueBuffer_->sync([this] { return sessionBuffer_; });
}

void SableFeedbackFlusher::setFeedbacksPerTask(std::int64_t task, std::int64_t count) {
  feedbackCountQueue_->sync([&] { feedbacksPerTask_[task] = count; });
}

std::optional<std::int64_t> SableFeedbackFlusher::getFeedbackCountForTask(std::int64_t task) const {
  return feedbackCountQueue_->sync([&]() -> std::optional<std::int64_t> {
    const auto found = feedbacksPerTask_.find(task);
    if (found == feedbacksPerTask_.end()) return std::nullopt;
    return found->second;
  });
}

void SableFeedbackFlusher::removeFeedbacksForTask(std::int64_t task) {
  feedbackCountQueue_->sync([&] { feedbacksPerTask_.erase(task); });
}

std::vector<std::string> SableFeedbackFlusher::flushToWireWithObjectsReturned(bool returnObjects) {
  queueBuffer_->assertIsCurrent();
  log().debug("Sessions Flushed {}", sessionBuffer_.size());
  if (!serverEndpoint_) log().error("Server endpoint not set, data can't be sent to server");
  std::vector<std::string> objects;
  for (const auto& session : std::exchange(sessionBuffer_, {})) {
    const Outcome outcome = send(*session, returnObjects ? &objects : nullptr);
    settle(*session, outcome);
  }
  return objects;
}

SableFeedbackFlusher::Outcome SableFeedbackFlusher::send(ClientSession& session,
                                                         std::vector<std::string>* objects) {
  const auto file = temporaryFile();
  if (file.empty()) return Outcome::kept;
  const Outcome outcome = packAndUpload(session, file, objects);
  removeTemporaryFile(file);
  return outcome;
}

/// Empty when there can be none, which is logged.
std::filesystem::path SableFeedbackFlusher::temporaryFile() {
  auto& fileManager = assembly_.fileManager;
  const auto folder = fileManager.temporaryDirectory();
  auto file = folder ? fileManager.createUniqueFile(*folder / "flusher_XXXXXX") : folder;
  if (!file) {
    log().error("Error creating file to write feedbacks to disk");
    return {};
  }
  log().debug("flushing to {}", file->native());
  return *std::move(file);
}

void SableFeedbackFlusher::removeTemporaryFile(const std::filesystem::path& file) {
  if (const auto removed = assembly_.fileManager.remove(file); !removed) {
    log().error("error unlinking fpath {} error {}", file.native(), removed.error().reason);
  } else {
    log().debug("File removed {}", file.native());
  }
}

SableFeedbackFlusher::Outcome SableFeedbackFlusher::packAndUpload(ClientSession& session,
                                                                  const std::filesystem::path& file,
                                                                  std::vector<std::string>* objects) {
  const auto packed = pack(session, file);
  if (!packed) {
    sessionLog().error("Invalid JSON Object {} error {}", session.agent(), packed.error().description());
    return Outcome::kept;
  }
  if (objects != nullptr) {
    const auto opened = assembly_.fileManager.openForReading(file);
    const auto bytes = opened ? (*opened)->map(SIZE_MAX) : tl::unexpected(opened.error());
    auto envelope = bytes ? decompressed(*bytes, packed->size) : std::nullopt;
    if (!envelope) {
      sessionLog().error("error mapping tmp file {}", file.native());
      return Outcome::kept;
    }
    objects->push_back(*std::move(envelope));
  }
  const Outcome outcome = serverEndpoint_ ? upload(session, file, *packed) : Outcome::dropped;
  // It will be told of when it is sent.
  if (outcome == Outcome::kept && objects != nullptr) objects->pop_back();
  return outcome;
}

Expected<SableFeedbackFlusher::Packed> SableFeedbackFlusher::pack(ClientSession& session,
                                                                  const std::filesystem::path& file) {
  CompressedOutputStream stream(std::make_unique<FileOutputStream>(assembly_.fileManager, file));
  stream.open();
  // Pieces of the JSON are compressed while the next ones are made of the records.
  const auto room = assembly_.runtime.semaphore(kPiecesAhead);
  session.writeFeedbacksToSend([&](std::string_view json) {
    static_cast<void>(room->wait(platform::MonotonicTime::max()));
    queueCompression_->async([&, piece = std::string(json)] {
      stream.writeOnce(piece);
      room->signal();
    });
  });
  queueCompression_->sync([&] { stream.close(); });
  if (auto error = stream.streamError()) return tl::unexpected(*std::move(error));
  return Packed{stream.dataDigestForStream(), stream.bytesRead(),
                static_cast<std::int64_t>(session.countOfSessionFeedbacks())};
}

SableFeedbackFlusher::Outcome SableFeedbackFlusher::upload(const ClientSession& session,
                                                           const std::filesystem::path& file,
                                                           const Packed& packed) {
  const auto request =
      assembly_.requestFactory->flusherUploadRequest(*serverEndpoint_, kUploadTimeout, packed.digest);
  auto& uploads = assembly_.uploadURLSession();
  const std::string token = session.storageHandle() ? session.storageHandle()->token() : "";
  // The count goes with the task: who hears of its end may be another process.
  const auto task = uploads.uploadTask(request, file, std::to_string(packed.count), token);
  if (!task) {
    log().error("Error creating Upload Task. Exception {} occurred for reason {}", task.error().domain,
                task.error().reason);
    return task.error().domain == platform::kHTTPErrorDomain ? Outcome::dropped : Outcome::kept;
  }
  setFeedbacksPerTask(*task, packed.count);
  uploads.resume(*task);
  return Outcome::accepted;
}

void SableFeedbackFlusher::settle(ClientSession& session, Outcome outcome) {
  const auto& container = session.storageHandle();
  if (!container) return;
  if (outcome == Outcome::kept)
    return assembly_.persistentStorage->releaseSessionWithFileContainer(container);
  assembly_.persistentStorage->deleteSessionWithFileContainer(container);
  if (outcome == Outcome::dropped) {
    ledger::count(assembly_.tally, SBLLedgerEntry::unsent,
                  static_cast<std::int64_t>(session.countOfSessionFeedbacks()));
  }
}

}  // namespace sable
