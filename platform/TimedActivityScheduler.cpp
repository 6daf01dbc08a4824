#include "platform/TimedActivityScheduler.h"

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <span>
#include <utility>

#include "platform/NotificationCenter.h"
#include "platform/ProgrammingError.h"
#include "platform/TimerSet.h"

namespace sable::platform {

Duration firstRunAfter(const ActivityCriteria& criteria, WallTime now, std::optional<WallTime> lastRun,
                       double jitter) {
  Duration wait = criteria.delay;
  if (lastRun && *lastRun <= now) wait = std::max(wait, *lastRun + criteria.interval - now);
  return wait + std::chrono::duration_cast<Duration>(criteria.gracePeriod * jitter);
}

/// Everything that the scheduler knows, on its queue.
class TimedActivityScheduler::Schedule : public std::enable_shared_from_this<Schedule> {
 public:
  Schedule(Runtime& runtime, ActivityHost& host)
      : runtime_(runtime),
        host_(host),
        queue_(runtime.serialQueue("com.kestrel.sabled.activities", QualityOfService::background)) {}

  void observePower(NotificationCenter& center);
  SerialQueue& queue() { return *queue_; }

  void add(const std::string& identifier, const ActivityCriteria& criteria, Handler handler);
  void remove(std::string_view identifier);
  void ended(const std::string& identifier, std::uint64_t registration, ActivityState how);
  bool lacksPower(const ActivityCriteria& criteria) { return !criteria.allowBattery && host_.onBattery(); }

 private:
  struct Entry {
    ActivityCriteria criteria;
    Handler handler;                 ///< null: no longer registered
    std::uint64_t registration = 0;  ///< tells it from one it has replaced
    bool running = false;
    MonotonicTime due;
    std::optional<WallTime> lastRunBefore;  ///< what to note again when the run is deferred
    Timer timer;
  };

  void load();
  double chance();
  void wait(const std::string& identifier, Entry& entry, Duration duration);
  void setTimer(const std::string& identifier, Entry& entry, Duration duration);
  void timerFired(const std::string& identifier);
  void begin(const std::string& identifier, Entry& entry);
  Handler handlerOf(const std::string& identifier, std::uint64_t registration);
  void powerChanged();
  void note(const std::string& identifier, const ActivityTimes& times);

  Runtime& runtime_;
  ActivityHost& host_;
  const std::shared_ptr<SerialQueue> queue_;
  NotificationCenter::Token powerObservation_;

  bool loaded_ = false;
  std::uint64_t registrations_ = 0;
  ActivityRecord record_;
  std::map<std::string, Entry, std::less<>> entries_;
};

class TimedActivityScheduler::Run final : public Activity {
 public:
  Run(std::weak_ptr<Schedule> schedule, std::string identifier, std::uint64_t registration,
      const ActivityCriteria& criteria)
      : schedule_(std::move(schedule)),
        identifier_(std::move(identifier)),
        registration_(registration),
        criteria_(criteria) {}
  /// Nobody can end it any more.
  ~Run() override { Run::setState(ActivityState::done); }
  Run(const Run&) = delete;
  Run& operator=(const Run&) = delete;

  const std::string& identifier() const override { return identifier_; }
  ActivityState state() const override { return state_; }

  bool setState(ActivityState state) override {
    ActivityState before = state_;
    do {
      if (!allows(before, state)) return false;
    } while (!state_.compare_exchange_weak(before, state));
    if (state != ActivityState::continueRunning) tellEnd(state);
    return true;
  }

  bool shouldDefer() const override {
    const auto schedule = schedule_.lock();
    return schedule == nullptr || schedule->lacksPower(criteria_);
  }

  /// A null handler was unregistered before its turn came.
  void call(const Handler& handler, const std::shared_ptr<Run>& self) {
    if (!handler) return static_cast<void>(setState(ActivityState::defer));
    handler(self);
    if (state_ == ActivityState::run) setState(ActivityState::done);
  }

 private:
  static bool allows(ActivityState before, ActivityState after) {
    const bool ends = after == ActivityState::defer || after == ActivityState::done;
    if (before == ActivityState::run) return ends || after == ActivityState::continueRunning;
    return before == ActivityState::continueRunning && ends;
  }

  void tellEnd(ActivityState how) {
    const auto schedule = schedule_.lock();
    if (schedule == nullptr) return;
    schedule->queue().async([weak = schedule_, identifier = identifier_, registration = registration_, how] {
      if (const auto still = weak.lock()) still->ended(identifier, registration, how);
    });
  }

  const std::weak_ptr<Schedule> schedule_;
  const std::string identifier_;
  const std::uint64_t registration_;
  const ActivityCriteria criteria_;
  std::atomic<ActivityState> state_ = ActivityState::run;
};

void TimedActivityScheduler::Schedule::observePower(NotificationCenter& center) {
  powerObservation_ = center.observe(std::string(kPowerSourceDidChangeNotification),
                                     [weak = weak_from_this(), queue = queue_](const Notification&) {
                                       queue->async([weak] {
                                         if (const auto self = weak.lock()) self->powerChanged();
                                       });
                                     });
}

void TimedActivityScheduler::Schedule::load() {
  if (std::exchange(loaded_, true)) return;
  record_ = host_.load();
  // Who planned these runs is gone; who still wants them says so anew.
  for (auto& [identifier, times] : record_) times.nextRun.reset();
}

/// 0 to 1, each as likely.
double TimedActivityScheduler::Schedule::chance() {
  std::uint32_t bits = 0;
  runtime_.randomBytes(std::as_writable_bytes(std::span(&bits, 1)));
  return bits / 4294967296.0;
}

void TimedActivityScheduler::Schedule::add(const std::string& identifier, const ActivityCriteria& criteria,
                                           Handler handler) {
  load();
  Entry& entry = entries_[identifier];
  entry.criteria = criteria;
  entry.handler = std::move(handler);
  entry.registration = ++registrations_;
  wait(identifier, entry, firstRunAfter(criteria, runtime_.now(), record_[identifier].lastRun, chance()));
}

void TimedActivityScheduler::Schedule::remove(std::string_view identifier) {
  const auto found = entries_.find(identifier);
  if (found == entries_.end()) return;
  note(found->first, {record_[found->first].lastRun, std::nullopt});
  found->second.handler = nullptr;
  found->second.timer.cancel();
  if (!found->second.running) entries_.erase(found);
}

/// Plans the next run, and tells so.
void TimedActivityScheduler::Schedule::wait(const std::string& identifier, Entry& entry, Duration duration) {
  entry.due = later(runtime_.ticks(), duration);
  note(identifier, {record_[identifier].lastRun, runtime_.now() + std::max(duration, Duration::zero())});
  setTimer(identifier, entry, duration);
}

void TimedActivityScheduler::Schedule::setTimer(const std::string& identifier, Entry& entry,
                                                Duration duration) {
  entry.timer = queue_->after(duration, [weak = weak_from_this(), identifier] {
    if (const auto self = weak.lock()) self->timerFired(identifier);
  });
}

void TimedActivityScheduler::Schedule::timerFired(const std::string& identifier) {
  const auto found = entries_.find(identifier);
  if (found == entries_.end() || found->second.running) return;
  Entry& entry = found->second;
  if (lacksPower(entry.criteria)) return setTimer(identifier, entry, kActivityRetryPause);
  begin(identifier, entry);
}

void TimedActivityScheduler::Schedule::powerChanged() {
  const MonotonicTime now = runtime_.ticks();
  for (const auto& [identifier, entry] : entries_) {
    if (entry.due <= now) timerFired(identifier);
  }
}

void TimedActivityScheduler::Schedule::begin(const std::string& identifier, Entry& entry) {
  const WallTime now = runtime_.now();
  entry.running = true;
  entry.timer.cancel();
  entry.lastRunBefore = record_[identifier].lastRun;
  std::optional<WallTime> next;
  if (entry.criteria.repeating) {
    entry.due = later(runtime_.ticks(), entry.criteria.interval);
    next = now + entry.criteria.interval;
  }
  note(identifier, {now, next});
  runtime_.globalQueue(QualityOfService::background)
      .async([weak = weak_from_this(), identifier, registration = entry.registration,
              run = std::make_shared<Run>(weak_from_this(), identifier, entry.registration, entry.criteria)] {
        Handler handler;
        if (const auto self = weak.lock()) handler = self->handlerOf(identifier, registration);
        run->call(handler, run);
      });
}

ActivityScheduler::Handler TimedActivityScheduler::Schedule::handlerOf(const std::string& identifier,
                                                                       std::uint64_t registration) {
  return queue_->sync([&] {
    const auto found = entries_.find(identifier);
    if (found == entries_.end() || found->second.registration != registration) return Handler();
    return found->second.handler;
  });
}

void TimedActivityScheduler::Schedule::ended(const std::string& identifier, std::uint64_t registration,
                                             ActivityState how) {
  const auto found = entries_.find(identifier);
  if (found == entries_.end()) return;
  Entry& entry = found->second;
  entry.running = false;
  const bool deferred = how == ActivityState::defer;
  if (deferred) note(identifier, {entry.lastRunBefore, record_[identifier].nextRun});
  if (!entry.handler) return static_cast<void>(entries_.erase(found));
  // One that replaced it has its own plan, which may have come due meanwhile.
  if (entry.registration != registration || (entry.criteria.repeating && !deferred))
    return setTimer(identifier, entry, entry.due - runtime_.ticks());
  if (deferred) return wait(identifier, entry, kActivityRetryPause);
  entries_.erase(found);
}

void TimedActivityScheduler::Schedule::note(const std::string& identifier, const ActivityTimes& times) {
  ActivityTimes& noted = record_[identifier];
  if (noted == times) return;
  noted = times;
  host_.save(record_);
}

TimedActivityScheduler::TimedActivityScheduler(Runtime& runtime, NotificationCenter& center,
                                               ActivityHost& host)
    : schedule_(std::make_shared<Schedule>(runtime, host)) {
  schedule_->observePower(center);
}

TimedActivityScheduler::~TimedActivityScheduler() = default;

void TimedActivityScheduler::registerActivity(std::string identifier, const ActivityCriteria& criteria,
                                              Handler handler) {
  if (criteria.repeating && criteria.interval <= Duration::zero())
    programmingError("a repeating activity needs an interval");
  schedule_->queue().async(
      [schedule = schedule_, identifier = std::move(identifier), criteria,
       handler = std::move(handler)]() mutable { schedule->add(identifier, criteria, std::move(handler)); });
}

void TimedActivityScheduler::unregister(std::string_view identifier) {
  schedule_->queue().sync([&] { schedule_->remove(identifier); });
}

}  // namespace sable::platform
