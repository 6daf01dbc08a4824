#pragma once

#include <poll.h>

#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "platform/host/Reactor.h"

namespace sable {

/// A reactor that serves its descriptors when a test says so, on the test's thread.
class ManualReactor final : public platform::host::Reactor {
 public:
  std::unique_ptr<Watch> watch(int descriptor, std::function<void(platform::host::Events)> handler) override {
    entries_.push_back(std::make_shared<Entry>(Entry{descriptor, std::move(handler), 0}));
    return std::make_unique<ManualWatch>(entries_.back());
  }

  /// Serves what is ready, until nothing is; how many events that were.
  int run() {
    int served = 0;
    for (bool again = true; again;) {
      again = false;
      for (const auto& entry : std::vector(entries_)) {
        pollfd ready{entry->descriptor, static_cast<short>(entry->events), 0};
        if (entry->events == 0 || poll(&ready, 1, 0) != 1) continue;
        entry->events = 0;
        entry->handler(static_cast<platform::host::Events>(ready.revents));
        ++served;
        again = true;
      }
    }
    return served;
  }

 private:
  struct Entry {
    int descriptor;
    std::function<void(platform::host::Events)> handler;
    platform::host::Events events;
  };
  struct ManualWatch final : Watch {
    explicit ManualWatch(std::shared_ptr<Entry> entry) : entry_(std::move(entry)) {}
    ~ManualWatch() override { entry_->events = 0; }
    void arm(platform::host::Events events) override { entry_->events = events; }
    std::shared_ptr<Entry> entry_;
  };

  std::vector<std::shared_ptr<Entry>> entries_;
};

}  // namespace sable
