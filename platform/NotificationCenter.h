#pragma once

#include <any>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

namespace sable::platform {

struct Notification {
  std::string_view name;
  const void* object = nullptr;              ///< who posted it, where that matters
  std::map<std::string, std::any> userInfo;  ///< keys are the poster's contract
};

/// In-process notifications by name. post() calls every observer on the posting thread, in order
/// of registration, before it returns. Any thread.
class NotificationCenter {
 public:
  NotificationCenter();
  ~NotificationCenter();

  /// An observation ends with its token. An observer that is being called on another thread at
  /// that moment may still finish, so handlers hold their owner weakly or outlive their token.
  class Token {
   public:
    Token() = default;
    Token(Token&&) noexcept = default;
    Token& operator=(Token&&) noexcept;
    ~Token() { reset(); }
    void reset();
    explicit operator bool() const { return observer_ != nullptr; }

   private:
    friend class NotificationCenter;
    struct Observer;
    std::shared_ptr<Observer> observer_;
  };

  using Handler = std::function<void(const Notification&)>;

  [[nodiscard]] Token observe(std::string name, Handler handler);
  void post(const Notification& notification);

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace sable::platform
