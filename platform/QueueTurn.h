#pragma once

#include <memory>
#include <utility>

namespace sable::platform {

/// A queue's turn to run: calls drain() on it. A turn that is dropped instead, because the runtime
/// ends, calls discard(), which drops the queued work: that work may be all that holds the queue.
template <class Queue>
class QueueTurn {
 public:
  explicit QueueTurn(std::shared_ptr<Queue> queue) : queue_(std::move(queue)) {}
  QueueTurn(QueueTurn&&) noexcept = default;
  QueueTurn& operator=(QueueTurn&&) = delete;
  ~QueueTurn() {
    if (queue_ != nullptr) queue_->discard();
  }

  void operator()() { std::exchange(queue_, nullptr)->drain(); }

 private:
  std::shared_ptr<Queue> queue_;
};

}  // namespace sable::platform
