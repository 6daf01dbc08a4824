#include "platform/host/RelayAcceptor.h"

#include <sys/epoll.h>
#include <sys/socket.h>

#include <cerrno>

#include "platform/Log.h"
#include "platform/host/UnixSocket.h"

namespace sable::platform::host {

namespace {

constexpr Duration kRetryDelay = std::chrono::milliseconds(100);

}  // namespace

RelayAcceptor::RelayAcceptor(HostRuntime& runtime, RelayAdmission admission)
    : runtime_(runtime),
      admission_(std::move(admission)),
      queue_(std::static_pointer_cast<HostQueue>(runtime.serialQueue("relay.accept"))) {}

void RelayAcceptor::start(Descriptor socket) {
  const std::lock_guard lock(mutex_);
  socket_ = std::move(socket);
  watch_ = runtime_.reactor().watch(socket_.number(), [weak = weak_from_this()](Events) {
    if (const auto self = weak.lock()) self->acceptAll();
  });
  watch_->arm(EPOLLIN);
}

void RelayAcceptor::stop() {
  {
    const std::lock_guard lock(mutex_);
    retry_.cancel();
    watch_.reset();
    socket_ = Descriptor();
  }
  if (queue_->isCurrent()) {
    stopped_ = true;
  } else {
    queue_->sync([this] { stopped_ = true; });
  }
}

void RelayAcceptor::acceptAll() {
  for (;;) {
    Descriptor accepted;
    {
      const std::lock_guard lock(mutex_);
      if (!watch_) return;
      accepted = Descriptor(::accept4(socket_.number(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
      if (!accepted) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno != EAGAIN) return retryLater(errno);
        watch_->arm(EPOLLIN);
        return;
      }
      lacking_ = false;
    }
    admit(std::move(accepted));
  }
}

void RelayAcceptor::retryLater(int error) {
  if (!std::exchange(lacking_, true)) {
    platformLog().error("Relay cannot accept connections: {}", posixError(error, "accept").description());
  }
  retry_ = queue_->after(kRetryDelay, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->acceptAll();
  });
}

void RelayAcceptor::admit(Descriptor socket) {
  const auto peer = peerOf(socket.number());
  if (!peer) return;
  if (!admission_.admits(peer->uid)) {
    platformLog().error("Relay refused process {} of user {}", peer->pid, peer->uid);
    return;
  }
  auto connection = std::make_shared<HostRelayConnection>(runtime_, std::move(socket), *peer,
                                                          RelayBus::Side::server, admission_.quotas);
  Function<void()> offer = [self = shared_from_this(), connection = std::move(connection)]() mutable {
    if (self->handler_ && !self->stopped_) self->handler_(std::move(connection));
  };
  if (!queue_->tryRunInline(offer)) queue_->async(std::move(offer));
}

}  // namespace sable::platform::host
