#include "platform/host/HostReactor.h"

#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

#include "platform/Log.h"
#include "platform/ProgrammingError.h"

namespace sable::platform::host {

namespace {

constexpr std::uint64_t kWakeId = 0;
constexpr std::uint64_t kTimersId = 1;
constexpr std::uint64_t kNoId = 2;

constexpr std::size_t kMostThreads = 64;
constexpr std::size_t kSpareThreads =
    2;                             // above the wanted number, kept so that short waits start no threads
constexpr int kPostedInARow = 16;  // then descriptors get a look
constexpr std::size_t kLeftToOneThread = 6;  // more posted work than this is worth waking another
constexpr Duration kBackstop = std::chrono::milliseconds(2);

thread_local const HostReactor* poolOfThisThread = nullptr;

/// Signals go to who asks for them (HostProcess), never to a pool thread; only those that the
/// thread's own faults raise get through.
class SignalsBlocked {
 public:
  SignalsBlocked() {
    sigset_t blocked;
    ::sigfillset(&blocked);
    for (const int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS})
      ::sigdelset(&blocked, fault);
    ::pthread_sigmask(SIG_SETMASK, &blocked, &before_);
  }
  ~SignalsBlocked() { ::pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
  SignalsBlocked(const SignalsBlocked&) = delete;
  SignalsBlocked& operator=(const SignalsBlocked&) = delete;

 private:
  sigset_t before_{};
};

}  // namespace

/// A watched descriptor. `wanted_` is what its owner asks for; the kernel is told while no handler
/// runs, so that an arm() during the handler, from any thread, counts from the handler's end.
class HostReactor::Descriptor {
 public:
  Descriptor(int epoll, int descriptor, std::uint64_t id, std::function<void(Events)> handler)
      : epoll_(epoll), descriptor_(descriptor), id_(id), handler_(std::move(handler)) {}

  std::uint64_t id() const { return id_; }

  void arm(Events events) {
    const std::lock_guard lock(mutex_);
    wanted_ = events;
    if (!running_) tellKernel();
  }

  void serve(Events events) {
    std::unique_lock lock(mutex_);
    if (running_ || removed_ || wanted_ == 0) return;
    if ((events & (wanted_ | EPOLLERR | EPOLLHUP)) == 0)
      return tellKernel();  // an answer to an older question
    wanted_ = 0;
    running_ = true;
    lock.unlock();
    handler_(events);
    lock.lock();
    running_ = false;
    if (wanted_ != 0) tellKernel();
  }

  void remove() {
    const std::lock_guard lock(mutex_);
    wanted_ = 0;
    removed_ = true;
    tellKernel();
  }

 private:
  void tellKernel() {
    // Out of the set rather than in it without events: errors and hang-ups are reported unasked.
    if (wanted_ == 0 && !inSet_) return;
    if (removed_ && !inSet_) return;
    const int operation = wanted_ == 0 ? EPOLL_CTL_DEL : inSet_ ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
    epoll_event event{};
    event.events = wanted_ | EPOLLONESHOT;
    event.data.u64 = id_;
    if (::epoll_ctl(epoll_, operation, descriptor_, &event) == 0) {
      inSet_ = operation != EPOLL_CTL_DEL;
    } else if (operation != EPOLL_CTL_DEL) {
      platformLog().error("cannot watch descriptor {}: {}", descriptor_,
                          std::generic_category().message(errno));
    }
  }

  const int epoll_;
  const int descriptor_;
  const std::uint64_t id_;
  const std::function<void(Events)> handler_;

  std::mutex mutex_;  // guards what follows
  Events wanted_ = 0;
  bool inSet_ = false;
  bool running_ = false;
  bool removed_ = false;
};

class HostReactor::WatchHandle final : public Watch {
 public:
  WatchHandle(HostReactor& reactor, std::shared_ptr<Descriptor> descriptor)
      : reactor_(reactor), descriptor_(std::move(descriptor)) {}
  ~WatchHandle() override {
    descriptor_->remove();
    reactor_.forget(descriptor_->id());
  }
  void arm(Events events) override { descriptor_->arm(events); }

 private:
  HostReactor& reactor_;
  const std::shared_ptr<Descriptor> descriptor_;
};

HostReactor::HostReactor(unsigned threads)
    : epoll_(::epoll_create1(EPOLL_CLOEXEC)),
      wakeDescriptor_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)),
      wantedThreads_(threads != 0 ? threads : std::max(2U, std::thread::hardware_concurrency())),
      lastId_(kNoId) {
  if (epoll_ < 0 || wakeDescriptor_ < 0) programmingError("no epoll set");
  // Edge-triggered: each write and each expiry wakes one thread, and neither needs a read.
  add(wakeDescriptor_, kWakeId, EPOLLIN | EPOLLET);
  add(timers_.descriptor(), kTimersId, EPOLLIN | EPOLLET);
  const std::lock_guard lock(mutex_);
  while (threads_.size() < wantedThreads_) startThread();
}

HostReactor::~HostReactor() {
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;  // from now on no thread takes itself out of the list
  }
  epoll_event event{};
  event.events = EPOLLIN;  // level-triggered from now on: one write wakes them all
  event.data.u64 = kWakeId;
  ::epoll_ctl(epoll_, EPOLL_CTL_MOD, wakeDescriptor_, &event);
  ::eventfd_write(wakeDescriptor_, 1);
  for (auto& thread : threads_) thread.join();
  timers_.clear();
  // What is dropped may post in turn as it goes.
  while (takePosted()) continue;
  ::close(wakeDescriptor_);
  ::close(epoll_);
}

void HostReactor::add(int descriptor, std::uint64_t id, std::uint32_t events) {
  epoll_event event{};
  event.events = events;
  event.data.u64 = id;
  if (::epoll_ctl(epoll_, EPOLL_CTL_ADD, descriptor, &event) != 0)
    programmingError("cannot fill the epoll set");
}

std::unique_ptr<Reactor::Watch> HostReactor::watch(int descriptor, std::function<void(Events)> handler) {
  const std::lock_guard lock(descriptorsMutex_);
  // Ids are never used twice, so an event that a thread already holds cannot reach the next owner of
  // the descriptor's number.
  const std::uint64_t id = ++lastId_;
  auto state = std::make_shared<Descriptor>(epoll_, descriptor, id, std::move(handler));
  descriptors_.emplace(id, state);
  return std::make_unique<WatchHandle>(*this, std::move(state));
}

void HostReactor::forget(std::uint64_t id) {
  std::unique_lock lock(descriptorsMutex_);
  const auto node = descriptors_.extract(id);
  lock.unlock();
}

void HostReactor::dispatch(std::uint64_t id, Events events) {
  if (id == kWakeId) return;
  if (id == kTimersId) return timers_.fire();
  std::shared_ptr<Descriptor> descriptor;
  {
    const std::lock_guard lock(descriptorsMutex_);
    const auto found = descriptors_.find(id);
    if (found == descriptors_.end()) return;
    descriptor = found->second;
  }
  descriptor->serve(events);
}

bool HostReactor::onPoolThread() const {
  return poolOfThisThread == this;
}

void HostReactor::post(QualityOfService quality, Function<void()> work) {
  std::unique_lock lock(mutex_);
  posted_[static_cast<std::size_t>(quality)].push_back(std::move(work));
  ++postedCount_;
  if (onPoolThread()) return leaveToThisThread(lock);
  wakeOne(lock);
}

/// Called on a pool thread, which will come back for what is posted.
void HostReactor::leaveToThisThread(std::unique_lock<std::mutex>& lock) {
  if (postedCount_ == 0 || waitingThreads_ == 0) return;
  if (postedCount_ > kLeftToOneThread) return wakeOne(lock);
  if (!std::exchange(backstopSet_, true)) timers_.wakeBy(monotonicNow() + kBackstop);
}

void HostReactor::wakeOne(std::unique_lock<std::mutex>& lock) {
  // One at a time: who wakes sees to it that another follows, should there be enough to do.
  if (postedCount_ == 0 || waitingThreads_ == 0 || std::exchange(wakeOnItsWay_, true)) return;
  lock.unlock();
  ::eventfd_write(wakeDescriptor_, 1);
}

void HostReactor::serve(Threads::iterator self) {
  poolOfThisThread = this;
  for (;;) {
    runPosted();
    const Next next = prepareToWait(self);
    if (next == Next::end) return;
    epoll_event event{};
    // One event a thread: a second would wait behind the first one's handler.
    const bool woken = ::epoll_wait(epoll_, &event, 1, next == Next::wait ? -1 : 0) == 1;
    noteWoken(next, woken ? event.data.u64 : kNoId);
    if (woken) dispatch(event.data.u64, event.events);
  }
}

Function<void()> HostReactor::takePosted() {
  std::unique_lock lock(mutex_);
  if (postedCount_ == 0) return nullptr;
  auto& queue =
      *std::find_if(posted_.rbegin(), posted_.rend(), [](const auto& each) { return !each.empty(); });
  Function<void()> work = std::move(queue.front());
  queue.pop_front();
  --postedCount_;
  leaveToThisThread(lock);
  return work;
}

void HostReactor::runPosted() {
  for (int i = 0; i < kPostedInARow && !stopping_; ++i) {
    Function<void()> work = takePosted();
    if (!work) return;
    work();
  }
}

HostReactor::Next HostReactor::prepareToWait(Threads::iterator self) {
  const std::lock_guard lock(mutex_);
  if (stopping_) return Next::end;
  if (postedCount_ > 0) return Next::look;
  if (threads_.size() > wantedThreads_ + kSpareThreads + blockedThreads_) {
    self->detach();  // it only returns from here
    threads_.erase(self);
    return Next::end;
  }
  ++waitingThreads_;
  return Next::wait;
}

void HostReactor::noteWoken(Next waited, std::uint64_t id) {
  const std::lock_guard lock(mutex_);
  if (waited == Next::wait) --waitingThreads_;
  if (id == kWakeId) wakeOnItsWay_ = false;
  if (id == kTimersId) backstopSet_ = false;
}

void HostReactor::startThread() {
  const SignalsBlocked duringStart;
  const auto self = threads_.emplace(threads_.end());
  try {
    *self = std::thread([this, self] { serve(self); });
  } catch (const std::system_error& failure) {
    threads_.erase(self);
    platformLog().error("cannot start a thread: {}", failure.what());
  }
}

HostReactor::Blocking::Blocking(HostReactor& reactor)
    : reactor_(reactor.onPoolThread() ? &reactor : nullptr) {
  if (reactor_ == nullptr) return;
  std::unique_lock lock(reactor_->mutex_);
  ++reactor_->blockedThreads_;
  const std::size_t threads = reactor_->threads_.size();
  if (threads < reactor_->wantedThreads_ + reactor_->blockedThreads_ && threads < kMostThreads) {
    reactor_->startThread();
  } else {
    reactor_->wakeOne(lock);
  }
}

HostReactor::Blocking::~Blocking() {
  if (reactor_ == nullptr) return;
  const std::lock_guard lock(reactor_->mutex_);
  --reactor_->blockedThreads_;
}

}  // namespace sable::platform::host
