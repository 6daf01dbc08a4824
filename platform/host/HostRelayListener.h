#pragma once

#include <memory>
#include <string>

#include "platform/Relay.h"
#include "platform/host/Descriptor.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

class RelayAcceptor;
struct RelayAdmission;

/// A listening Unix socket. Destroying it takes the socket's file away, and
/// waits for an accept handler that runs on another thread.
class HostRelayListener final : public RelayListener {
 public:
  enum class Kind {
    named,     ///< one daemon at a time holds the path, by a lock on `path`.lock
    anonymous  ///< the path is this listener's alone
  };

  /// A path in `folder` has the folder made, for this user alone.
  HostRelayListener(HostRuntime& runtime, Kind kind, std::string folder, std::string path,
                    RelayAdmission admission);
  ~HostRelayListener() override;

  void setAcceptHandler(AcceptHandler handler) override;
  /// A named listener takes the socket that socket activation handed to the process, where there is
  /// one (sd_listen_fds(3)). It also clears its folder of the endpoints of daemons that were killed.
  Expected<void> resume() override;
  RelayEndpoint endpoint() const override;

 private:
  Expected<void> takeActivated(int socket);
  Expected<void> lock();
  Expected<void> removeStale();
  void removeDeadEndpoints() const;

  const Kind kind_;
  const std::string folder_;
  std::string path_;
  bool ownsFile_ = false;
  Descriptor lock_;
  const std::shared_ptr<RelayAcceptor> acceptor_;
};

}  // namespace sable::platform::host
