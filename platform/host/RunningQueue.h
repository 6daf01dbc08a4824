#pragma once

namespace sable::platform::host {

/// Marks, as long as it lives, that the calling thread runs work of a queue; they nest as sync
/// calls do.
class RunningQueue {
 public:
  explicit RunningQueue(const void* queue) : queue_(queue), outer_(innermost_) { innermost_ = this; }
  ~RunningQueue() { innermost_ = outer_; }
  RunningQueue(const RunningQueue&) = delete;
  RunningQueue& operator=(const RunningQueue&) = delete;

  /// Whether the calling thread runs work of `queue`, be it further out.
  static bool onThisThread(const void* queue) {
    const RunningQueue* running = innermost_;
    while (running != nullptr && running->queue_ != queue) running = running->outer_;
    return running != nullptr;
  }

 private:
  const void* const queue_;
  const RunningQueue* const outer_;
  static inline thread_local const RunningQueue* innermost_ = nullptr;
};

}  // namespace sable::platform::host
