#include "platform/NotificationCenter.h"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <utility>
#include <vector>

namespace sable::platform {

struct NotificationCenter::Token::Observer {
  std::string name;
  Handler handler;
  std::weak_ptr<State> center;
  std::atomic<bool> observing = true;
};

struct NotificationCenter::State {
  using Observers = std::vector<std::shared_ptr<Token::Observer>>;

  std::mutex mutex;
  std::map<std::string, Observers, std::less<>> observers;

  Observers observersOf(std::string_view name) {
    const std::lock_guard lock(mutex);
    const auto found = observers.find(name);
    return found == observers.end() ? Observers() : found->second;
  }

  void remove(const std::shared_ptr<Token::Observer>& observer) {
    const std::lock_guard lock(mutex);
    const auto found = observers.find(observer->name);
    if (found == observers.end()) return;
    std::erase(found->second, observer);
    if (found->second.empty()) observers.erase(found);
  }
};

NotificationCenter::NotificationCenter() : state_(std::make_shared<State>()) {}

NotificationCenter::~NotificationCenter() = default;

NotificationCenter::Token& NotificationCenter::Token::operator=(Token&& other) noexcept {
  if (this != &other) {
    reset();
    observer_ = std::move(other.observer_);
  }
  return *this;
}

void NotificationCenter::Token::reset() {
  const auto observer = std::exchange(observer_, nullptr);
  if (observer == nullptr) return;
  observer->observing = false;
  if (const auto center = observer->center.lock()) center->remove(observer);
}

NotificationCenter::Token NotificationCenter::observe(std::string name, Handler handler) {
  Token token;
  token.observer_ = std::make_shared<Token::Observer>();
  token.observer_->name = std::move(name);
  token.observer_->handler = std::move(handler);
  token.observer_->center = state_;
  const std::lock_guard lock(state_->mutex);
  state_->observers[token.observer_->name].push_back(token.observer_);
  return token;
}

void NotificationCenter::post(const Notification& notification) {
  // Called outside the lock, from a copy: an observer may post, observe and end observations.
  for (const auto& observer : state_->observersOf(notification.name)) {
    if (observer->observing) observer->handler(notification);
  }
}

}  // namespace sable::platform
