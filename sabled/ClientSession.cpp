#include "sabled/ClientSession.h"

#include <algorithm>
#include <atomic>

#include "SableKit/SBLError.h"
#include "SableKit/messages/SKSession.pb.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/ClientNames.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/DownloadManager.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/FileContainer.h"
#include "sabled/ParsedMessage.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SableLogging.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableUserGUIDController.h"
#include "sabled/UserAgent.h"

namespace sable {

namespace {

/// A session that such feedback begins does not tell when it took place.
constexpr unsigned kBeaconResultFeatures = 20;

/// The clients whose first use of a day is noted, in the order in which the last match counts.
constexpr std::string_view kFirstUseClients[] = {"rover", "beacon", "lookup", "messages", "news", "vox"};

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategorySession);
}

/// The setting that holds the last first use of an agent's client; empty for an agent of no such.
std::string _getUserDefaultKey(std::string_view agent) {
  const std::string lower = lowercasedASCII(agent);
  std::string key;
  for (const std::string_view client : kFirstUseClients) {
    if (lower.find(client) != std::string::npos) key = std::string("SableFirstUseOfTheDay_").append(client);
  }
  return key;
}

std::shared_ptr<SableFeedback> feedbackFromError(Assembly& assembly, const Error& error,
                                                 std::optional<UUID> userGuid, std::string agent) {
  return std::make_shared<SableFeedback>(feedback::error(assembly.runtime.ticks(), error), 0, userGuid,
                                         std::move(agent));
}

}  // namespace

ClientSession::ClientSession(Assembly& assembly)
    : assembly_(assembly),
      sessionQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.clientSessionQueue")),
      dateQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.firstUseQueue")) {}

ClientSession::ClientSession(Assembly& assembly, const std::shared_ptr<SableFeedback>& feedback,
                             std::uint32_t previousSessionEndReason)
    : ClientSession(assembly) {
  previousSessionEndReason_ = previousSessionEndReason;
  begin(feedback.get());
  auto& storage = *assembly_.persistentStorage;
  storageHandle_ = feedback && feedback->feedback().customFeedbackType() == kCrowdsourcingFeedback
                       ? storage.createCrowdsourcingFileContainerForWriting()
                       : storage.createFileContainerForWriting();
  if (storageHandle_) storageHandle_->writeSessionHeader(*this);
  if (feedback) addFeedback(feedback);
}

ClientSession::~ClientSession() = default;

void ClientSession::begin(const SableFeedback* feedback) {
  if (feedback != nullptr) {
    agent_ = feedback->userAgent();
    if (feedback->userGuid()) setUserGuid(feedback->userGuid());
    removeTimestamps_ = feedback->type() == kBeaconResultFeatures;
  }
  setSessionStart(assembly_.runtime.now());
  if (const auto key = _getUserDefaultKey(agent_); !key.empty())
    firstUseDate_ = assembly_.userDefaults.date(key);
  if (!agent_.empty()) assembly_.tally.add(createTallyKey(agent_, "sessions"), 1);
  firstUseOfTheDay_ = _firstUseOfTheDay(agent_);
  if (assembly_.downloadManager != nullptr)
    setResourceVersions(assembly_.downloadManager->resourceVersions());
}

bool ClientSession::_firstUseOfTheDay(const std::string& agent) {
  return dateQueue_->sync([&] {
    const auto now = assembly_.runtime.now();
    const auto& locale = assembly_.platform.localeInfo();
    if (firstUseDate_ && locale.dayNumber(*firstUseDate_) == locale.dayNumber(now)) return false;
    return _updateFirstUseDate(now, agent);
  });
}

bool ClientSession::_updateFirstUseDate(platform::WallTime date, const std::string& agent) {
  dateQueue_->assertIsCurrent();
  firstUseDate_ = date;
  const auto key = _getUserDefaultKey(agent);
  if (key.empty()) {
    SableLogForCategory(SableLoggingCategoryFeedback)
        .debug("user default key not found for agent: {}", agent);
    return false;
  }
  assembly_.userDefaults.setDate(key, date);
  assembly_.userDefaults.synchronize();
  if (const auto name = extractClientNameFromString(key))
    assembly_.tally.add(createTallyKey(*name, "dailyactiveusers"), 1);
  return true;
}

std::shared_ptr<ClientSession> ClientSession::createFeedbackSessionFromError(const Error& error,
                                                                             Assembly& assembly) {
  return std::make_shared<ClientSession>(
      assembly, feedbackFromError(assembly, error, assembly.guidController->currentUserGUID(),
                                  sabledUserAgent(assembly.platform.deviceInfo())));
}

std::shared_ptr<ClientSession> ClientSession::initWithData(Assembly& assembly, std::string_view data) {
  messages::_SKClientSession message;
  if (!parseMessage(message, data)) return nullptr;
  std::shared_ptr<ClientSession> session(new ClientSession(assembly));
  session->agent_ = message.agent();
  session->userGuidString_ = message.user_guid_string();
  session->userGuid_ = UUID::parse(session->userGuidString_);
  session->removeTimestamps_ = message.remove_timestamps();
  if (message.has_session_start_since_1970())
    session->sessionStartSince1970_ = message.session_start_since_1970();
  for (const auto& resource : message.cp_resource_versions())
    session->cpResourceVersions_[resource.identifier()] = resource.version();
  session->previousSessionEndReason_ = message.previous_session_end_reason();
  session->firstUseOfTheDay_ = message.first_use_of_the_day();
  return session;
}

std::string ClientSession::data() const {
  messages::_SKClientSession message;
  if (!agent_.empty()) message.set_agent(agent_);
  if (!userGuidString_.empty()) message.set_user_guid_string(userGuidString_);
  message.set_remove_timestamps(removeTimestamps_);
  if (sessionStartSince1970_) message.set_session_start_since_1970(*sessionStartSince1970_);
  for (const auto& [identifier, version] : cpResourceVersions_) {
    auto& resource = *message.add_cp_resource_versions();
    resource.set_identifier(identifier);
    resource.set_version(version);
  }
  message.set_previous_session_end_reason(previousSessionEndReason_);
  message.set_first_use_of_the_day(firstUseOfTheDay_);
  return message.SerializeAsString();
}

void ClientSession::addFeedback(std::shared_ptr<SableFeedback> feedback) {
  if (!feedback) {
    log().debug("attempted to add a nil feedback");
    return;
  }
  if (agent_.empty()) agent_ = feedback->userAgent();
  _addFeedback(feedback);
  if (userGuidString_.empty() || userGuid() == feedback->userGuid()) return;
  // The feedback stays, ahead of what is wrong with it: the service sorts it out.
  _addFeedback(feedbackFromError(assembly_,
                                 makeSBLError(SBLErrorCode::daemonSide, "different guid in session"),
                                 std::nullopt, feedback->userAgent()));
}

void ClientSession::_addFeedback(const std::shared_ptr<SableFeedback>& feedback) {
  if (assembly_.flusherRelayListener)
    assembly_.flusherRelayListener->sendDataToReceivingStreamListener(feedback);
  ledger::take(assembly_.tally, *feedback);
  platform::Function<void()> done;
  if (assembly_.testFeedbacks) done = keepWhenWritten(feedback);
  if (storageHandle_) return storageHandle_->writeFeedback(feedback, std::move(done));
  ledger::count(assembly_.tally, SBLLedgerEntry::noFile);
  if (done) done();
}

/// Keeps the feedback once the marker that this returns has run. Readers wait for it; a marker that
/// is destroyed has not run and lets them go on without the feedback, which is in no file.
platform::Function<void()> ClientSession::keepWhenWritten(std::shared_ptr<SableFeedback> feedback) {
  struct Marker {
    std::unique_ptr<platform::Semaphore> destroyed;
    std::atomic<bool> hasRun = false;
  };
  const auto marker = std::make_shared<Marker>();
  marker->destroyed = assembly_.runtime.semaphore(0);
  sessionQueue_->async([marker, feedback = std::move(feedback), kept = sessionFeedbacks_] {
    const bool signalled = marker->destroyed->wait(platform::MonotonicTime::max());
    if (signalled && marker->hasRun) kept->push_back(feedback);
  });
  const std::shared_ptr<Marker> guard(marker.get(), [marker](Marker*) { marker->destroyed->signal(); });
  return [guard] { guard->hasRun = true; };
}

void ClientSession::sessionComplete() {
  sessionQueue_->sync([this] {
    if (storageHandle_) {
      assembly_.persistentStorage->closeSessionWithFileContainer(storageHandle_);
    } else {
      log().fault("Storage Handle nil major error");
    }
  });
}

SableFeedbacks ClientSession::getSessionFeedbacks() {
  return sessionQueue_->sync([this] {
    SableFeedbacks sorted = *sessionFeedbacks_;
    for (const auto& stored : storedFeedbacks_)
      sorted.push_back(std::make_shared<SableFeedback>(read(stored)));
    std::ranges::stable_sort(sorted, [](const auto& one, const auto& other) {
      return SableFeedback::timeStampComparator(*one, *other) < 0;
    });
    return sorted;
  });
}

std::size_t ClientSession::countOfSessionFeedbacks() {
  return sessionQueue_->sync([this] { return sessionFeedbacks_->size() + storedFeedbacks_.size(); });
}

void ClientSession::addSessionFeedbacks(std::string_view record, const SableFeedback& feedback) {
  storedFeedbacks_.push_back({record, feedback.feedback().timestamp(), feedback.feedback().hasIdentifiers()});
}

void ClientSession::setFile(std::unique_ptr<platform::ReadableFile> file) {
  file_ = std::move(file);
  std::ranges::stable_sort(storedFeedbacks_, {}, &StoredFeedback::timestamp);
}

/// It was read before, so it can be read.
SableFeedback ClientSession::read(const StoredFeedback& stored) const {
  auto feedback = SableFeedback::parse(stored.record);
  feedback->setUserAgent(agent_);
  feedback->setUserGuid(userGuid_);
  return *std::move(feedback);
}

void ClientSession::enumerateSessions(const std::function<void(ClientSession&, bool)>& callback) {
  callback(*this, true);
}

void ClientSession::setUserGuid(std::optional<UUID> userGuid) {
  userGuidString_ = userGuid ? userGuid->string() : "";
  userGuid_ = userGuid;
}

std::optional<platform::WallTime> ClientSession::sessionStart() const {
  if (!sessionStartSince1970_) return std::nullopt;
  return platform::wallTimeFromSecondsSince1970(*sessionStartSince1970_);
}

void ClientSession::setSessionStart(std::optional<platform::WallTime> date) {
  sessionStartSince1970_ = date ? std::optional(platform::secondsSince1970(*date)) : std::nullopt;
}

void ClientSession::setResourceVersions(std::map<std::string, std::string> versions) {
  cpResourceVersions_ = std::move(versions);
}

}  // namespace sable
