#include "platform/host/HostTransactions.h"

#include <fcntl.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <chrono>
#include <system_error>

#include "platform/Log.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

namespace {

constexpr Duration kLinger = std::chrono::seconds(1);  // so that a burst of work asks logind once
constexpr std::uint64_t kAnswerMicroseconds = 5'000'000;

int callInhibit(sd_bus* bus, sd_bus_message** reply) {
  sd_bus_message* call = nullptr;
  int result =
      ::sd_bus_message_new_method_call(bus, &call, "org.freedesktop.login1", "/org/freedesktop/login1",
                                       "org.freedesktop.login1.Manager", "Inhibit");
  if (result >= 0)
    result = ::sd_bus_message_append(call, "ssss", "shutdown", "sabled", "Work in flight", "delay");
  if (result >= 0) result = ::sd_bus_message_set_auto_start(call, 0);
  if (result >= 0) result = ::sd_bus_call(bus, call, kAnswerMicroseconds, nullptr, reply);
  ::sd_bus_message_unref(call);
  return result;
}

/// The descriptor that keeps the inhibitor, or a negative errno value.
int takeInhibitor() {
  sd_bus* bus = nullptr;
  sd_bus_message* reply = nullptr;
  int descriptor = -1;
  int result = ::sd_bus_open_system(&bus);
  if (result >= 0) result = callInhibit(bus, &reply);
  if (result >= 0) result = ::sd_bus_message_read(reply, "h", &descriptor);
  if (result >= 0) {
    result = ::fcntl(descriptor, F_DUPFD_CLOEXEC, 0);  // the message closes its own
    if (result < 0) result = -errno;
  }
  ::sd_bus_message_unref(reply);
  ::sd_bus_close_unref(bus);
  return result;
}

}  // namespace

class HostTransactions::State : public std::enable_shared_from_this<State> {
 public:
  explicit State(HostRuntime& runtime)
      : reactor_(runtime.reactor()),
        queue_(runtime.serialQueue("com.kestrel.sabled.transactions", QualityOfService::background)) {}

  std::size_t openCount() const { return openCount_; }

  void opened() {
    if (openCount_.fetch_add(1) == 0) update();
  }
  void closed() {
    if (openCount_.fetch_sub(1) == 1) update();
  }

 private:
  void update() {
    if (withoutLogind_) return;
    queue_->async([self = shared_from_this()] { self->openCount_ > 0 ? self->hold() : self->linger(); });
  }

  void hold() {
    drop_.cancel();
    if (inhibitor_ || withoutLogind_) return;
    const HostReactor::Blocking untilLogindAnswers(reactor_);
    const int result = takeInhibitor();
    if (result >= 0) {
      inhibitor_ = Descriptor(result);
    } else {
      withoutLogind_ = true;
      platformLog().info("shutdown does not wait for work in flight: {}",
                         std::generic_category().message(-result));
    }
  }

  void linger() {
    if (!inhibitor_) return;
    drop_ = queue_->after(kLinger, [weak = weak_from_this()] {
      const auto self = weak.lock();
      if (self != nullptr && self->openCount_ == 0) self->inhibitor_ = Descriptor();
    });
  }

  HostReactor& reactor_;
  const std::shared_ptr<SerialQueue> queue_;
  std::atomic<std::size_t> openCount_ = 0;
  std::atomic<bool> withoutLogind_ = false;

  // On queue_.
  Descriptor inhibitor_;
  Timer drop_;
};

class HostTransactions::Open final : public Transaction {
 public:
  explicit Open(std::shared_ptr<State> state) : state_(std::move(state)) { state_->opened(); }
  ~Open() override { state_->closed(); }
  Open(const Open&) = delete;
  Open& operator=(const Open&) = delete;

 private:
  const std::shared_ptr<State> state_;
};

HostTransactions::HostTransactions(HostRuntime& runtime) : state_(std::make_shared<State>(runtime)) {}

HostTransactions::~HostTransactions() = default;

std::shared_ptr<Transaction> HostTransactions::open(std::string_view) {
  return std::make_shared<Open>(state_);
}

std::size_t HostTransactions::openCount() const {
  return state_->openCount();
}

}  // namespace sable::platform::host
