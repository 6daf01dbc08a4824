#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "platform/Relay.h"
#include "platform/host/HostRelayConnection.h"

namespace sable::platform::host {

/// How those who connect are treated.
struct RelayAdmission {
  RelayQuotas quotas;
  /// Whether a user may connect, decided before a byte is read.
  std::function<bool(uid_t)> admits;
};

/// Accepts what comes to a listening socket, checks who it is, and hands the connections to a
/// handler on a queue of its own. Where the process or the system lacks the means (descriptors,
/// memory) those who wait stay in the backlog until a later attempt.
class RelayAcceptor final : public std::enable_shared_from_this<RelayAcceptor> {
 public:
  RelayAcceptor(HostRuntime& runtime, RelayAdmission admission);

  /// Before start().
  void setHandler(RelayListener::AcceptHandler handler) { handler_ = std::move(handler); }
  void start(Descriptor socket);
  /// Accepts nobody from now on; waits for the handler where it runs on another thread.
  void stop();

 private:
  void acceptAll();
  void admit(Descriptor socket);
  void retryLater(int error);
  void arm();

  HostRuntime& runtime_;
  const RelayAdmission admission_;
  const std::shared_ptr<HostQueue> queue_;

  RelayListener::AcceptHandler handler_;  // this and the next: on queue_
  bool stopped_ = false;

  std::mutex mutex_;  // guards what follows
  Descriptor socket_;
  std::unique_ptr<Reactor::Watch> watch_;
  Timer retry_;
  bool lacking_ = false;  // and the log says so
};

}  // namespace sable::platform::host
