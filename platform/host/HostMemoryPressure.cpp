#include "platform/host/HostMemoryPressure.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstdint>
#include <fstream>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/host/Descriptor.h"
#include "platform/host/FileWatcher.h"

namespace sable::platform::host {

namespace {

constexpr std::string_view kTrigger = "full 200000 2000000";  // stalled microseconds, of a window of so many

/// memory.events of the cgroup (version 2) that this process is in; empty when it is in none.
std::filesystem::path ownCgroupEvents() {
  std::ifstream groups("/proc/self/cgroup");
  for (std::string line; std::getline(groups, line);) {
    if (line.starts_with("0::/")) return "/sys/fs/cgroup" + line.substr(3) + "/memory.events";
  }
  return {};
}

/// How often the cgroup ran into a limit so far.
std::uint64_t limitHits(const std::filesystem::path& events) {
  std::ifstream file(events);
  std::uint64_t hits = 0;
  std::string name;
  for (std::uint64_t count = 0; file >> name >> count;) {
    if (name == "high" || name == "max" || name == "oom") hits += count;
  }
  return hits;
}

Descriptor openTrigger(const std::filesystem::path& stalls) {
  Descriptor descriptor(::open(stalls.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
  const bool set = descriptor && ::write(descriptor.number(), kTrigger.data(), kTrigger.size() + 1) > 0;
  return set ? std::move(descriptor) : Descriptor();
}

Descriptor openEvents(const std::filesystem::path& events) {
  Descriptor descriptor(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  const bool watched = descriptor && ::inotify_add_watch(descriptor.number(), events.c_str(), IN_MODIFY) >= 0;
  return watched ? std::move(descriptor) : Descriptor();
}

}  // namespace

/// What the host is asked while somebody listens.
class HostMemoryPressure::Sensors : public std::enable_shared_from_this<Sensors> {
 public:
  Sensors(const MemoryPressurePaths& paths, std::function<void()> raise)
      : events_(paths.events.empty() ? ownCgroupEvents() : paths.events), raise_(std::move(raise)) {
    trigger_ = openTrigger(paths.stalls);
    if (!trigger_ && !events_.empty()) inotify_ = openEvents(events_);
  }

  void start(Reactor& reactor, const std::filesystem::path& file) {
    if (inotify_) hits_ = limitHits(events_);
    if (trigger_ || inotify_) {
      watch_ =
          reactor.watch((trigger_ ? trigger_ : inotify_).number(), [weak = weak_from_this()](Events events) {
            if (const auto self = weak.lock()) self->handle(events);
          });
      arm();
    }
    if (!file.empty()) fileWatcher_ = std::make_unique<FileWatcher>(reactor, std::vector{file}, raise_);
  }

  std::string_view kind() const { return trigger_ ? "stall trigger" : inotify_ ? "cgroup events" : ""; }

 private:
  void arm() { watch_->arm(trigger_ ? EPOLLPRI : EPOLLIN); }

  void handle(Events events) {
    if (trigger_) {
      if ((events & EPOLLERR) != 0) return;  // the trigger is gone for good
      raise_();
    } else {
      std::array<char, 4096> ignored;
      while (::read(inotify_.number(), ignored.data(), ignored.size()) > 0) continue;
      const std::uint64_t hits = limitHits(events_);
      if (hits > std::exchange(hits_, hits)) raise_();
    }
    arm();
  }

  const std::filesystem::path events_;
  const std::function<void()> raise_;
  Descriptor trigger_;
  Descriptor inotify_;
  std::uint64_t hits_ = 0;  // the watch's handler's own
  std::unique_ptr<Reactor::Watch> watch_;
  std::unique_ptr<FileWatcher> fileWatcher_;
};

class HostMemoryPressure::Listeners : public std::enable_shared_from_this<Listeners> {
 public:
  struct Listener {
    Listener(std::shared_ptr<SerialQueue> onQueue, std::function<void()> handle)
        : queue(std::move(onQueue)), handler(std::move(handle)) {}

    std::shared_ptr<SerialQueue> queue;
    std::function<void()> handler;
    std::atomic<bool> alive = true;
  };

  Listeners(Reactor& reactor, MemoryPressurePaths paths) : reactor_(reactor), paths_(std::move(paths)) {}

  const MemoryPressurePaths& paths() const { return paths_; }

  void add(std::shared_ptr<Listener> listener) {
    const std::lock_guard sensing(sensorsMutex_);
    {
      const std::lock_guard lock(mutex_);
      listeners_.insert(std::move(listener));
    }
    if (sensors_ == nullptr) startSensors();
  }

  void remove(const std::shared_ptr<Listener>& listener) {
    listener->alive = false;
    const std::lock_guard sensing(sensorsMutex_);
    {
      const std::lock_guard lock(mutex_);
      listeners_.erase(listener);
      if (!listeners_.empty()) return;
    }
    sensors_ = nullptr;
  }

 private:
  void startSensors() {
    sensors_ = std::make_shared<Sensors>(paths_, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->raise();
    });
    sensors_->start(reactor_, paths_.file);
  }

  void raise() {
    const std::lock_guard lock(mutex_);
    for (const auto& listener : listeners_) {
      listener->queue->async([listener] {
        if (listener->alive) listener->handler();
      });
    }
  }

  Reactor& reactor_;
  const MemoryPressurePaths paths_;

  // Apart from the listeners, for ending the sensors waits for the handlers that call raise().
  std::mutex sensorsMutex_;
  std::shared_ptr<Sensors> sensors_;

  std::mutex mutex_;
  std::set<std::shared_ptr<Listener>> listeners_;
};

class HostMemoryPressure::ListeningSource final : public Source {
 public:
  ListeningSource(std::shared_ptr<Listeners> listeners, std::shared_ptr<Listeners::Listener> listener)
      : listeners_(std::move(listeners)), listener_(std::move(listener)) {
    listeners_->add(listener_);
  }
  ~ListeningSource() override { listeners_->remove(listener_); }
  ListeningSource(const ListeningSource&) = delete;
  ListeningSource& operator=(const ListeningSource&) = delete;

 private:
  const std::shared_ptr<Listeners> listeners_;
  const std::shared_ptr<Listeners::Listener> listener_;
};

HostMemoryPressure::HostMemoryPressure(Reactor& reactor, MemoryPressurePaths paths)
    : listeners_(std::make_shared<Listeners>(reactor, std::move(paths))) {}

HostMemoryPressure::~HostMemoryPressure() = default;

std::unique_ptr<MemoryPressure::Source> HostMemoryPressure::onCritical(std::shared_ptr<SerialQueue> queue,
                                                                       std::function<void()> handler) {
  return std::make_unique<ListeningSource>(
      listeners_, std::make_shared<Listeners::Listener>(std::move(queue), std::move(handler)));
}

Availability HostMemoryPressure::availability() const {
  const std::string kind(Sensors(listeners_->paths(), nullptr).kind());
  return {"MemoryPressure", !kind.empty(), kind.empty() ? "no stall information and no memory cgroup" : kind};
}

}  // namespace sable::platform::host
