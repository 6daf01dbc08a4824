#include "sabled/BackgroundActivitiesManager.h"

#include <charconv>
#include <utility>

#include "platform/FileManager.h"
#include "platform/Tally.h"
#include "platform/Transaction.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/FileContainer.h"
#include "sabled/SableFeedbackFlusher.h"
#include "sabled/SableFlusherRelay.h"
#include "sabled/SableLogging.h"
#include "sabled/SablePersistentStorage.h"
#include "sabled/SableRelayActivity.h"
#include "sabled/SableRelayCriteria.h"

namespace sable {

namespace {

using platform::ActivityState;

constexpr std::string_view kActivity = "com.kestrel.sabled.flusher.background";
constexpr double kDelay = 300, kInterval = 600, kGracePeriod = 300;  // seconds
constexpr int kFeedbacks = 1;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryFlusher);
}

void setState(ActivityState state, const SableRelayActivity::Activity& activity) {
  const ActivityState current = SableRelayActivity::getStateForActivity(activity);
  if (SableRelayActivity::setState(state, activity)) return;
  log().fault("State transition from {} to {} invalid", static_cast<long>(current), static_cast<long>(state));
}

/// The number of records that an upload carries, as the flusher has noted it.
std::int64_t countIn(const std::string& description) {
  std::int64_t count = 0;
  std::from_chars(description.data(), description.data() + description.size(), count);
  return count;
}

}  // namespace

struct BackgroundActivitiesManager::State {
  explicit State(Assembly& all)
      : assembly(all),
        queueFlusher(all.runtime.serialQueue("com.kestrel.sabled.backgrondActivitiesManagerQueue",
                                             platform::QualityOfService::background)),
        feedbackFlusher(std::make_unique<SableFeedbackFlusher>(all, kFeedbacks)) {}

  using Containers = std::vector<std::shared_ptr<FileContainer>>;

  void _flusherActivity();
  void flushFiles(const Containers& containers, SableFeedbackFlusher& flusher);
  std::shared_ptr<FileContainer> holdFirst(Containers::const_iterator& rest, Containers::const_iterator end);
  std::shared_ptr<ClientSession> _readFeedbackFromDisk(const std::shared_ptr<FileContainer>& container);
  void flushToWire(SableFeedbackFlusher& flusher);
  void adoptEarlierRuns();
  void removeTemporaryFiles();
  std::int64_t takeCount(const platform::HTTPBackgroundTask& task);

  Assembly& assembly;
  const std::shared_ptr<platform::SerialQueue> queueFlusher;
  const std::unique_ptr<SableFeedbackFlusher> feedbackFlusher;
  std::atomic<bool> stopFlushing{false};
};

BackgroundActivitiesManager::BackgroundActivitiesManager(Assembly& assembly)
    : assembly_(assembly), state_(std::make_shared<State>(assembly)) {
  assembly.uploadSessionDelegate = this;
  registerActivity();
  startupObservation_ = assembly.notificationCenter.observe("SBLStartup", [state = state_](const auto&) {
    state->queueFlusher->async([state] { state->adoptEarlierRuns(); });
  });
}

BackgroundActivitiesManager::~BackgroundActivitiesManager() {
  SableRelayActivity::unregister(assembly_.platform.activityScheduler(), kActivity);
}

void BackgroundActivitiesManager::registerActivity() {
  auto criteria = SableRelayCriteria::createCriteria();
  SableRelayCriteria::setDelay(kDelay, criteria);
  SableRelayCriteria::setRepeating(true, criteria);
  SableRelayCriteria::setInterval(kInterval, criteria);
  SableRelayCriteria::setGracePeriod(kGracePeriod, criteria);
  SableRelayCriteria::setAllowBatteryUsage(true, criteria);
  SableRelayActivity::registerActivityWithIdentifier(
      assembly_.platform.activityScheduler(), std::string(kActivity), criteria,
      [weak = std::weak_ptr(state_)](const SableRelayActivity::Activity& activity) {
        const auto state = weak.lock();
        if (!state) return;
        if (state->stopFlushing) {
          log().standard("flushing has been stopped, will start again with dump command");
          return setState(ActivityState::done, activity);
        }
        log().standard("scheduled flush feedbacks to wire {}", kActivity);
        setState(ActivityState::continueRunning, activity);
        state->queueFlusher->async([state, activity] {
          state->_flusherActivity();
          setState(ActivityState::done, activity);
        });
      });
  log().standard("started flush to wire in the background {} with interval {:f} seconds", kActivity,
                 kInterval);
}

bool BackgroundActivitiesManager::stopFlushing() const {
  return state_->stopFlushing;
}

void BackgroundActivitiesManager::setStopFlushing(bool stop) {
  state_->stopFlushing = stop;
}

void BackgroundActivitiesManager::insertFlushActivity(int) {
  state_->queueFlusher->async([state = state_] { state->_flusherActivity(); });
}

void BackgroundActivitiesManager::State::_flusherActivity() {
  queueFlusher->assertIsCurrent();
  const auto transaction = assembly.platform.transactions().open("_flusherActivity");
  flushFiles(assembly.persistentStorage->getAvailableSessionHandles(), *feedbackFlusher);
  if (!assembly.crowdsourcingFeedbackFlusher) return;
  flushFiles(assembly.persistentStorage->getAvailableCrowdsourcingHandles(),
             *assembly.crowdsourcingFeedbackFlusher);
  flushToWire(*assembly.crowdsourcingFeedbackFlusher);
}

/// One session at a time is packed; the next is read meanwhile. What cannot be read is dropped: it will not
/// be readable later.
void BackgroundActivitiesManager::State::flushFiles(const Containers& containers,
                                                    SableFeedbackFlusher& flusher) {
  auto rest = containers.begin();
  auto held = holdFirst(rest, containers.end());
  while (held) {
    const auto container = std::move(held);
    auto session = _readFeedbackFromDisk(container);
    held = holdFirst(rest, containers.end());
    if (held) held->readAhead();
    if (session) {
      flusher.flushSyncFromArray({std::move(session)});
      flushToWire(flusher);
    } else {
      assembly.persistentStorage->deleteSessionWithFileContainer(container);
    }
  }
}

/// The first of the rest that can be held, or null.
std::shared_ptr<FileContainer> BackgroundActivitiesManager::State::holdFirst(Containers::const_iterator& rest,
                                                                             Containers::const_iterator end) {
  while (rest != end) {
    const auto& container = *rest++;
    if (assembly.persistentStorage->holdSessionWithFileContainer(container)) return container;
  }
  return nullptr;
}

std::shared_ptr<ClientSession> BackgroundActivitiesManager::State::_readFeedbackFromDisk(
    const std::shared_ptr<FileContainer>& container) {
  auto session = container->read();
  if (session) session->setStorageHandle(container);
  return session;
}

void BackgroundActivitiesManager::State::flushToWire(SableFeedbackFlusher& flusher) {
  auto* listener = assembly.flusherRelayListener.get();
  auto envelopes = flusher.flushToWireSync(listener != nullptr && listener->hasSendingStreamListener());
  if (!envelopes.empty()) listener->sendDataToSendingStreamListener(std::move(envelopes));
}

/// Goes on with what earlier processes have left: uploads, sessions that they were about to upload, and
/// the files in which they packed them. Once, when the listener is open: no other daemon runs then.
void BackgroundActivitiesManager::State::adoptEarlierRuns() {
  queueFlusher->assertIsCurrent();
  auto& uploads = assembly.uploadURLSession();
  assembly.persistentStorage->adoptHeldSessions(
      [&](const std::string& token) { return uploads.hasAccepted(token); });
  removeTemporaryFiles();
  const auto settled = assembly.runtime.semaphore(0);
  uploads.getAllTasks([&](const std::vector<platform::HTTPBackgroundTask>& tasks) {
    std::int64_t sending = 0;
    for (const auto& task : tasks) sending += countIn(task.description);
    ledger::settleSending(assembly.tally, sending);
    settled->signal();
  });
  // A session handed over before that would count as lost.
  (void)settled->wait(platform::MonotonicTime::max());
}

void BackgroundActivitiesManager::State::removeTemporaryFiles() {
  auto& fileManager = assembly.fileManager;
  const auto folder = fileManager.temporaryDirectory();
  const auto names = folder ? fileManager.list(*folder) : tl::unexpected(folder.error());
  if (!names) return;
  for (const std::string& name : *names) {
    if (name.starts_with("flusher_")) (void)fileManager.remove(*folder / name);  // the next start tries again
  }
}

/// How many records the upload carried; the note of it is dropped.
std::int64_t BackgroundActivitiesManager::State::takeCount(const platform::HTTPBackgroundTask& task) {
  for (auto* flusher : {feedbackFlusher.get(), assembly.crowdsourcingFeedbackFlusher.get()}) {
    const auto count = flusher == nullptr ? std::nullopt : flusher->getFeedbackCountForTask(task.identifier);
    if (!count) continue;
    flusher->removeFeedbacksForTask(task.identifier);
    return *count;
  }
  return countIn(task.description);
}

void BackgroundActivitiesManager::didSendBodyData(const platform::HTTPBackgroundTask&, std::int64_t sent,
                                                  std::int64_t expected) {
  log().debug("data transfer {:f} of {:f}", static_cast<double>(sent), static_cast<double>(expected));
}

void BackgroundActivitiesManager::didCompleteWithError(const platform::HTTPBackgroundTask& task,
                                                       const std::optional<Error>& error) {
  log().standard("URLSession:task:didCompleteWithError: id={}, error={}", task.identifier,
                 error ? error->description() : "(null)");
  constexpr auto kTimedOut = static_cast<std::int64_t>(platform::HTTPErrorCode::timedOut);
  auto& tally = assembly_.tally;
  if (error && error->domain == platform::kHTTPErrorDomain && error->code == kTimedOut)
    tally.add("com.kestrel.sabled.fbrequesttimedout", 1);
  const std::int64_t count = state_->takeCount(task);
  constexpr int kOK = 200;
  if (task.response && task.response->status == kOK) {
    tally.add("com.kestrel.sabled.feedbacksent", count);
    return ledger::count(tally, SBLLedgerEntry::uploaded, count);
  }
  log().fault("response error {}", task.response ? task.response->description() : "(null)");
  tally.add("com.kestrel.sabled.feedbacknotsent", count);
  ledger::count(tally, SBLLedgerEntry::refused, count);
}

void BackgroundActivitiesManager::didBecomeInvalidWithError(const std::optional<Error>& error) {
  log().error("Session became invalid with error {}", error ? error->description() : "(null)");
}

void BackgroundActivitiesManager::didFinishEventsForBackgroundURLSession() {
  log().standard("URLSessionDidFinishEventsForBackgroundURLSession called");
}

}  // namespace sable
