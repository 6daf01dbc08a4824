#include "platform/host/HostProcess.h"

#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <vector>

#include "platform/ProgrammingError.h"

namespace sable::platform::host {

namespace {

sigset_t setOf(TerminationSignal signal) {
  sigset_t set;
  ::sigemptyset(&set);
  ::sigaddset(&set, static_cast<int>(signal));
  return set;
}

}  // namespace

/// What listens to one signal: its descriptor waits in the reactor from the first resumed source on.
class HostProcess::Signal {
 public:
  struct Listener {
    Listener(Queue& onQueue, std::function<void()> handle) : queue(onQueue), handler(std::move(handle)) {}

    Queue& queue;
    std::function<void()> handler;
    std::atomic<bool> alive = true;
  };

  static std::shared_ptr<Signal> make(Reactor& reactor, TerminationSignal number) {
    auto signal = std::make_shared<Signal>(number);
    signal->watch_ = reactor.watch(signal->descriptor_, [weak = std::weak_ptr(signal)](Events) {
      if (const auto self = weak.lock()) self->deliver();
    });
    return signal;
  }

  explicit Signal(TerminationSignal number) {
    const sigset_t set = setOf(number);
    descriptor_ = ::signalfd(-1, &set, SFD_NONBLOCK | SFD_CLOEXEC);
    if (descriptor_ < 0) programmingError("no signal descriptor");
  }
  ~Signal() {
    watch_.reset();
    ::close(descriptor_);
  }
  Signal(const Signal&) = delete;
  Signal& operator=(const Signal&) = delete;

  void add(std::shared_ptr<Listener> listener) {
    const std::lock_guard lock(mutex_);
    listeners_.push_back(std::move(listener));
    watch_->arm(EPOLLIN);
  }

  void remove(const std::shared_ptr<Listener>& listener) {
    listener->alive = false;
    const std::lock_guard lock(mutex_);
    std::erase(listeners_, listener);
    if (listeners_.empty()) watch_->arm(0);
  }

 private:
  void deliver() {
    const std::lock_guard lock(mutex_);
    if (listeners_.empty()) return;
    signalfd_siginfo info{};
    while (::read(descriptor_, &info, sizeof info) == sizeof info) {
      for (const auto& listener : listeners_) {
        listener->queue.async([listener] {
          if (listener->alive) listener->handler();
        });
      }
    }
    watch_->arm(EPOLLIN);
  }

  int descriptor_ = -1;
  std::mutex mutex_;
  std::unique_ptr<Reactor::Watch> watch_;
  std::vector<std::shared_ptr<Listener>> listeners_;
};

class HostProcess::Source final : public SignalSource {
 public:
  Source(std::shared_ptr<Signal> signal, std::shared_ptr<Signal::Listener> listener)
      : signal_(std::move(signal)), listener_(std::move(listener)) {}
  ~Source() override {
    if (resumed_) signal_->remove(listener_);
  }

  void resume() override {
    if (!std::exchange(resumed_, true)) signal_->add(listener_);
  }

 private:
  const std::shared_ptr<Signal> signal_;
  const std::shared_ptr<Signal::Listener> listener_;
  bool resumed_ = false;
};

HostProcess::HostProcess(Reactor& reactor) : reactor_(reactor) {
  // A peer that has gone is a failed write, never the end of the process.
  ::signal(SIGPIPE, SIG_IGN);
}

HostProcess::~HostProcess() = default;

std::shared_ptr<HostProcess::Signal> HostProcess::signalFor(TerminationSignal signal) {
  const std::lock_guard lock(mutex_);
  auto& made = signal == TerminationSignal::interrupt ? interrupt_ : terminate_;
  if (made == nullptr) made = Signal::make(reactor_, signal);
  return made;
}

std::unique_ptr<Process::SignalSource> HostProcess::signalSource(TerminationSignal signal, Queue& queue,
                                                                 std::function<void()> handler) {
  auto listener = std::make_shared<Signal::Listener>(queue, std::move(handler));
  return std::make_unique<Source>(signalFor(signal), std::move(listener));
}

void HostProcess::ignoreSignal(TerminationSignal signal) {
  const sigset_t set = setOf(signal);
  ::pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

void HostProcess::runMainLoop() {
  std::unique_lock lock(mutex_);
  stopped_.wait(lock, [this] { return stopping_; });
}

void HostProcess::stop() {
  const std::lock_guard lock(mutex_);
  stopping_ = true;
  stopped_.notify_all();
}

void HostProcess::exit(int status) {
  ::_exit(status);
}

}  // namespace sable::platform::host
