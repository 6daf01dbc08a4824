#pragma once

#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Relay.h"
#include "platform/host/Descriptor.h"

/// Unix stream sockets with a path, for Relay.
namespace sable::platform::host {

/// A listening socket (non-blocking, mode 0600) at `path`, where nothing may stand yet.
Expected<Descriptor> listenAt(const std::string& path);

/// A connected socket. Blocks while the listener's backlog is full.
Expected<Descriptor> connectTo(const std::string& path);

/// Process and user at the other end, as they were when it connected or began to listen.
Expected<RelayPeer> peerOf(int socket);

/// "unix:path=..." (D-Bus specification, "Server Addresses") and back; an address of another kind
/// is an error that says so.
RelayEndpoint endpointOf(std::string_view path);
Expected<std::string> pathOf(std::string_view endpoint);

/// Makes the folder, and what is missing above it, with mode 0700. An existing one must belong to
/// this user, and loses the permissions that others have on it.
Expected<void> makePrivateFolder(const std::string& path);

}  // namespace sable::platform::host
