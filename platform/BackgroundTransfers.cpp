#include "platform/BackgroundTransfers.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <map>

#include "platform/Log.h"
#include "platform/NotificationCenter.h"
#include "platform/TimedActivityScheduler.h"
#include "platform/TimerSet.h"
#include "platform/TransferRetry.h"

namespace sable::platform {
namespace {

// Of a session: after a long time without a network hundreds may be due together.
constexpr std::size_t kMostAtOnce = 4;

const char* name(HTTPBackgroundTaskKind kind) {
  return kind == HTTPBackgroundTaskKind::upload ? "upload" : "download";
}

}  // namespace

class BackgroundTransfers::Core : public std::enable_shared_from_this<Core> {
 public:
  Core(Runtime& runtime, std::unique_ptr<BackgroundTransferHost> host,
       HTTPBackgroundSessionConfiguration configuration, HTTPBackgroundSessionDelegate& delegate)
      : runtime_(runtime),
        configuration_(std::move(configuration)),
        delegate_(delegate),
        queue_(runtime.serialQueue(configuration_.identifier + ".transfers", QualityOfService::background)),
        callbackQueue_(runtime.serialQueue(configuration_.identifier)),
        host_(std::move(host)) {}

  SerialQueue& queue() { return *queue_; }
  SerialQueue& callbackQueue() { return *callbackQueue_; }

  void start(NotificationCenter& center);
  Expected<std::int64_t> accept(BackgroundTransfer transfer, std::string_view token,
                                const std::filesystem::path& body);
  bool hasAccepted(std::string_view token);
  void resume(std::int64_t identifier);
  void cancel(std::int64_t identifier);
  void tell(Function<void(std::vector<HTTPBackgroundTask>)> completion);
  void close();

 private:
  struct Entry {
    BackgroundTransfer transfer;
    bool resumed = false;
    MonotonicTime due{};        // the next attempt
    MonotonicTime windowEnd{};  // from here on no battery holds it
    MonotonicTime deadline{};
    std::shared_ptr<HTTPDataTask> attempt;  // null: none runs
  };

  Entry& add(BackgroundTransfer transfer);
  void goOn();
  void expire(Entry& entry);
  bool isHeld(const Entry& entry, const TransferConditions& conditions, MonotonicTime now) const;
  void begin(Entry& entry);
  void progressed(std::int64_t identifier, std::int64_t sent, std::int64_t expected);
  void finished(std::int64_t identifier, int attempts, HTTPResult result);
  void again(Entry& entry, Duration pause, const std::string& why);
  void end(Entry& entry, std::optional<Error> error);
  void report(const BackgroundTransfer& transfer);
  void tellDelegate(const BackgroundTransfer& transfer);
  void reported(const BackgroundTransfer& transfer);
  void callBy(MonotonicTime time);
  void rest();
  double chance();

  Runtime& runtime_;
  const HTTPBackgroundSessionConfiguration configuration_;
  HTTPBackgroundSessionDelegate& delegate_;
  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<SerialQueue> callbackQueue_;
  std::atomic<bool> closed_ = false;

  // The queue's.
  const std::unique_ptr<BackgroundTransferHost> host_;
  NotificationCenter::Token powerChanged_, costChanged_;
  std::map<std::int64_t, Entry> entries_;  // until their end has been reported
  Timer timer_;
};

void BackgroundTransfers::Core::start(NotificationCenter& center) {
  const auto look = [weak = weak_from_this(), queue = queue_](const Notification&) {
    queue->async([weak] {
      if (const auto self = weak.lock()) self->goOn();
    });
  };
  powerChanged_ = center.observe(std::string(kPowerSourceDidChangeNotification), look);
  costChanged_ = center.observe(std::string(kNetworkCostDidChangeNotification), look);
  queue_->async([self = shared_from_this()] {
    if (self->closed_) return;
    for (BackgroundTransfer& transfer : self->host_->unreported()) {
      Entry& entry = self->add(std::move(transfer));
      entry.resumed = true;
      if (entry.transfer.ended) self->report(entry.transfer);
    }
    self->rest();
    self->goOn();
  });
}

Expected<std::int64_t> BackgroundTransfers::Core::accept(BackgroundTransfer transfer, std::string_view token,
                                                         const std::filesystem::path& body) {
  if (auto error = invalidity(transfer.task.originalRequest)) return tl::unexpected(std::move(*error));
  transfer.accepted = runtime_.now();
  auto identifier = host_->accept(transfer, token, body);
  if (!identifier) {
    rest();
    return identifier;
  }
  transfer.task.identifier = *identifier;
  add(std::move(transfer));
  goOn();
  return identifier;
}

bool BackgroundTransfers::Core::hasAccepted(std::string_view token) {
  const bool accepted = host_->hasAccepted(token, runtime_.now() - configuration_.resourceTimeout);
  rest();
  return accepted;
}

BackgroundTransfers::Core::Entry& BackgroundTransfers::Core::add(BackgroundTransfer transfer) {
  const WallTime now = runtime_.now();
  const MonotonicTime ticks = runtime_.ticks();
  const Duration age = std::max(now - transfer.accepted, Duration{});
  const Duration waited = std::max(now - transfer.lastAttempt, Duration{});
  const Duration shortest = std::min(configuration_.requestTimeout, configuration_.resourceTimeout);
  Entry& entry = entries_[transfer.task.identifier];
  entry.deadline = later(ticks, std::max(configuration_.resourceTimeout - age, shortest));
  // A power cut stops many devices together: their pauses must not end together when it is over.
  const Duration left =
      waited < transfer.pause ? transfer.pause - waited : spreadPause(transfer.pause, chance());
  entry.due = age < configuration_.resourceTimeout ? later(ticks, left) : ticks;
  entry.windowEnd = transfer.window > Duration{} ? later(ticks, transfer.window - age) : MonotonicTime::max();
  entry.transfer = std::move(transfer);
  entry.transfer.running = false;
  return entry;
}

void BackgroundTransfers::Core::resume(std::int64_t identifier) {
  const auto found = entries_.find(identifier);
  if (found == entries_.end()) return;
  found->second.resumed = true;
  goOn();
}

void BackgroundTransfers::Core::goOn() {
  queue_->assertIsCurrent();
  if (closed_) return;
  const MonotonicTime now = runtime_.ticks();
  MonotonicTime next = MonotonicTime::max();
  std::size_t running = 0;
  for (auto& [identifier, entry] : entries_) {
    running += entry.attempt ? 1 : 0;
    if (entry.deadline <= now && !entry.transfer.ended) expire(entry);
  }
  std::optional<TransferConditions> conditions;  // asked for where somebody is ready
  for (auto& [identifier, entry] : entries_) {
    if (entry.transfer.ended) continue;
    next = std::min(next, entry.deadline);
    if (entry.attempt || !entry.resumed) continue;
    if (entry.due > now) {
      next = std::min(next, entry.due);
      continue;
    }
    if (!conditions) conditions = host_->conditions();
    if (isHeld(entry, *conditions, now)) {
      next = std::min(next, later(now, kConditionsLook));
      if (entry.windowEnd > now) next = std::min(next, entry.windowEnd);
    } else if (running < kMostAtOnce) {
      ++running;
      begin(entry);
    }
  }
  callBy(next);
}

bool BackgroundTransfers::Core::isHeld(const Entry& entry, const TransferConditions& conditions,
                                       MonotonicTime now) const {
  if (conditions.metered && !configuration_.allowsExpensiveNetworkAccess) return true;
  if (!configuration_.discretionary || now >= entry.windowEnd) return false;
  return conditions.metered || conditions.onBattery;
}

void BackgroundTransfers::Core::expire(Entry& entry) {
  if (entry.attempt) entry.attempt->cancel();
  entry.transfer.task.response.reset();  // of an attempt that broke off: it is no answer
  end(entry, httpError(HTTPErrorCode::timedOut, "not done within the time of the resource"));
}

void BackgroundTransfers::Core::begin(Entry& entry) {
  const std::int64_t identifier = entry.transfer.task.identifier;
  const int attempts = ++entry.transfer.attempts;
  entry.transfer.running = true;
  host_->note(entry.transfer);
  // Whoever calls these must not be the last to hold us: we hold him.
  entry.attempt = host_->attempt(
      entry.transfer,
      [weak = weak_from_this(), queue = queue_, identifier](std::int64_t sent, std::int64_t expected) {
        queue->async([weak, identifier, sent, expected] {
          if (const auto self = weak.lock()) self->progressed(identifier, sent, expected);
        });
      },
      [weak = weak_from_this(), queue = queue_, identifier, attempts](HTTPResult result) {
        queue->async([weak, identifier, attempts, result = std::move(result)]() mutable {
          if (const auto self = weak.lock()) self->finished(identifier, attempts, std::move(result));
        });
      });
  entry.attempt->resume();
}

void BackgroundTransfers::Core::progressed(std::int64_t identifier, std::int64_t sent,
                                           std::int64_t expected) {
  const auto found = entries_.find(identifier);
  if (found == entries_.end() || found->second.transfer.ended) return;
  callbackQueue_->async([self = shared_from_this(), task = found->second.transfer.task, sent, expected] {
    if (!self->closed_) self->delegate_.didSendBodyData(task, sent, expected);
  });
}

void BackgroundTransfers::Core::finished(std::int64_t identifier, int attempts, HTTPResult result) {
  const auto found = entries_.find(identifier);
  if (closed_ || found == entries_.end()) return;
  Entry& entry = found->second;
  if (entry.transfer.ended || entry.transfer.attempts != attempts) return;
  entry.attempt = nullptr;
  entry.transfer.running = false;
  if (result.response) entry.transfer.task.currentURL = result.response->url;
  const auto& response = entry.transfer.task.response = std::move(result.response);
  const auto asked = response ? retryAfter(*response, runtime_.now()) : std::nullopt;
  const Duration pause = asked ? retryPauseAsked(*asked, attempts, chance()) : Duration{};
  if (result.error) {
    if (!isWorthRetrying(*result.error)) return end(entry, std::move(result.error));
    return again(entry, std::max(pause, retryPause(attempts, chance())), result.error->description());
  }
  // Who is told to come back when it is too late takes that for the answer.
  if (!asked || later(runtime_.ticks(), pause) >= entry.deadline) return end(entry, std::nullopt);
  again(entry, pause, "status " + std::to_string(response->status));
}

void BackgroundTransfers::Core::again(Entry& entry, Duration pause, const std::string& why) {
  BackgroundTransfer& transfer = entry.transfer;
  transfer.lastAttempt = runtime_.now();
  transfer.pause = pause;
  entry.due = later(runtime_.ticks(), pause);
  platformLog().info("{} {}, attempt {}: {}; again in {:.0f} s", name(transfer.task.kind),
                     transfer.task.identifier, transfer.attempts, why, toSeconds(pause));
  host_->note(transfer);
  goOn();
}

void BackgroundTransfers::Core::end(Entry& entry, std::optional<Error> error) {
  entry.attempt = nullptr;
  entry.transfer.running = false;
  entry.transfer.ended = true;
  entry.transfer.error = std::move(error);
  entry.transfer.lastAttempt = runtime_.now();
  host_->note(entry.transfer);
  report(entry.transfer);
}

void BackgroundTransfers::Core::report(const BackgroundTransfer& transfer) {
  callbackQueue_->async([self = shared_from_this(), transfer] {
    if (self->closed_) return;
    self->tellDelegate(transfer);
    self->queue_->sync([&] { self->reported(transfer); });
  });
}

void BackgroundTransfers::Core::tellDelegate(const BackgroundTransfer& transfer) {
  if (transfer.task.kind == HTTPBackgroundTaskKind::download && !transfer.error) {
    const auto location = queue_->sync([&] { return host_->download(transfer.task.identifier); });
    if (!location.empty()) delegate_.didFinishDownloadingToURL(transfer.task, location);
  }
  delegate_.didCompleteWithError(transfer.task, transfer.error);
}

void BackgroundTransfers::Core::reported(const BackgroundTransfer& transfer) {
  host_->noteReported(transfer);
  entries_.erase(transfer.task.identifier);
  rest();
  goOn();  // one less runs
  if (!entries_.empty()) return;
  callbackQueue_->async([self = shared_from_this()] {
    if (!self->closed_) self->delegate_.didFinishEventsForBackgroundURLSession();
  });
}

void BackgroundTransfers::Core::cancel(std::int64_t identifier) {
  const auto found = entries_.find(identifier);
  if (closed_ || found == entries_.end() || found->second.transfer.ended) return;
  if (found->second.attempt) found->second.attempt->cancel();
  end(found->second, httpError(HTTPErrorCode::cancelled, "cancelled"));
}

void BackgroundTransfers::Core::tell(Function<void(std::vector<HTTPBackgroundTask>)> completion) {
  std::vector<HTTPBackgroundTask> tasks;
  for (const auto& [identifier, entry] : entries_) {
    if (!entry.transfer.ended) tasks.push_back(entry.transfer.task);
  }
  callbackQueue_->async([completion = std::move(completion), tasks = std::move(tasks)]() mutable {
    completion(std::move(tasks));
  });
}

void BackgroundTransfers::Core::callBy(MonotonicTime time) {
  timer_.cancel();
  if (time == MonotonicTime::max()) return;
  timer_ = queue_->after(time - runtime_.ticks(), [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->goOn();
  });
}

void BackgroundTransfers::Core::rest() {
  if (entries_.empty()) host_->rest();
}

double BackgroundTransfers::Core::chance() {
  constexpr double kSteps = 65536;
  std::array<std::byte, 2> bytes{};
  runtime_.randomBytes(bytes);
  return (std::to_integer<int>(bytes[0]) * 256 + std::to_integer<int>(bytes[1])) / kSteps;
}

void BackgroundTransfers::Core::close() {
  closed_ = true;
  timer_.cancel();
  powerChanged_.reset();
  costChanged_.reset();
  for (auto& [identifier, entry] : entries_) {
    if (entry.attempt) entry.attempt->cancel();
  }
  entries_.clear();
}

BackgroundTransfers::BackgroundTransfers(Runtime& runtime, NotificationCenter& center,
                                         std::unique_ptr<BackgroundTransferHost> host,
                                         HTTPBackgroundSessionConfiguration configuration,
                                         HTTPBackgroundSessionDelegate& delegate)
    : core_(std::make_shared<Core>(runtime, std::move(host), std::move(configuration), delegate)) {
  core_->start(center);
}

BackgroundTransfers::~BackgroundTransfers() {
  core_->queue().sync([this] { core_->close(); });
  core_->callbackQueue().sync([] {});
}

Expected<std::int64_t> BackgroundTransfers::uploadTask(const HTTPRequest& request,
                                                       const std::filesystem::path& body,
                                                       std::string description, std::string_view token) {
  BackgroundTransfer transfer;
  transfer.task.originalRequest = request;
  transfer.task.originalRequest.body = nullptr;
  transfer.task.currentURL = request.url;
  transfer.task.description = std::move(description);
  return core_->queue().sync([&] { return core_->accept(std::move(transfer), token, body); });
}

Expected<std::int64_t> BackgroundTransfers::downloadTask(const HTTPRequest& request, std::string description,
                                                         Duration window) {
  BackgroundTransfer transfer;
  transfer.task.kind = HTTPBackgroundTaskKind::download;
  transfer.task.originalRequest = request;
  transfer.task.currentURL = request.url;
  transfer.task.description = std::move(description);
  transfer.window = window;
  return core_->queue().sync([&] { return core_->accept(std::move(transfer), {}, {}); });
}

bool BackgroundTransfers::hasAccepted(std::string_view token) {
  return core_->queue().sync([&] { return core_->hasAccepted(token); });
}

void BackgroundTransfers::resume(std::int64_t identifier) {
  core_->queue().async([core = core_, identifier] { core->resume(identifier); });
}

void BackgroundTransfers::cancel(std::int64_t identifier) {
  core_->queue().async([core = core_, identifier] { core->cancel(identifier); });
}

void BackgroundTransfers::getAllTasks(Function<void(std::vector<HTTPBackgroundTask>)> completion) {
  core_->queue().async(
      [core = core_, completion = std::move(completion)]() mutable { core->tell(std::move(completion)); });
}

SerialQueue& BackgroundTransfers::callbackQueue() {
  return core_->callbackQueue();
}

}  // namespace sable::platform
