#pragma once

#include <httplib.h>

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace service {

/// A thread for every connection that is open at the same time: kept for the next one, added when none is
/// idle.
class ConnectionThreads final : public httplib::TaskQueue {
 public:
  void enqueue(std::function<void()> task) override {
    const std::lock_guard lock(mutex_);
    tasks_.push_back(std::move(task));
    if (tasks_.size() > idle_)
      threads_.emplace_back([this] { run(); });
    else
      wake_.notify_one();
  }

  void shutdown() override {
    {
      const std::lock_guard lock(mutex_);
      ending_ = true;
    }
    wake_.notify_all();
    for (auto& thread : threads_) thread.join();
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    while (true) {
      ++idle_;
      wake_.wait(lock, [this] { return ending_ || !tasks_.empty(); });
      --idle_;
      if (tasks_.empty()) return;
      const auto task = std::move(tasks_.front());
      tasks_.pop_front();
      lock.unlock();
      task();
      lock.lock();
    }
  }

  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<std::function<void()>> tasks_;
  std::vector<std::thread> threads_;
  size_t idle_ = 0;
  bool ending_ = false;
};

}  // namespace service
