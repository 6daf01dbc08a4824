#include "platform/host/HostRelay.h"

#include <fmt/format.h>
#include <limits.h>
#include <unistd.h>

#include <cerrno>

#include "platform/host/HostRelayConnection.h"
#include "platform/host/HostRelayListener.h"
#include "platform/host/RelayAcceptor.h"
#include "platform/host/UnixSocket.h"

namespace sable::platform::host {

namespace {

bool isOwnUserOrRoot(uid_t uid) {
  return uid == ::geteuid() || uid == 0;
}

HostRelayConfiguration completed(HostRelayConfiguration configuration) {
  if (configuration.socketPath.empty())
    configuration.socketPath = configuration.runtimeFolder + "/relay.sock";
  if (!configuration.admits) configuration.admits = isOwnUserOrRoot;
  return configuration;
}

std::string endpointFolder(const HostRelayConfiguration& configuration) {
  if (!configuration.runtimeFolder.empty()) return configuration.runtimeFolder;
  const std::size_t slash = configuration.socketPath.find_last_of('/');
  return slash == std::string::npos ? "." : configuration.socketPath.substr(0, slash);
}

}  // namespace

HostRelay::HostRelay(HostRuntime& runtime, HostRelayConfiguration configuration)
    : runtime_(runtime), configuration_(completed(std::move(configuration))) {}

std::unique_ptr<RelayListener> HostRelay::namedListener(std::string_view) {
  return std::make_unique<HostRelayListener>(runtime_, HostRelayListener::Kind::named,
                                             configuration_.runtimeFolder, configuration_.socketPath,
                                             RelayAdmission{configuration_.quotas, configuration_.admits});
}

std::unique_ptr<RelayListener> HostRelay::anonymousListener() {
  return std::make_unique<HostRelayListener>(
      runtime_, HostRelayListener::Kind::anonymous, configuration_.runtimeFolder,
      fmt::format("{}/{}.sock", endpointFolder(configuration_), runtime_.uuid().string()),
      RelayAdmission{configuration_.quotas, configuration_.admits});
}

Expected<std::shared_ptr<RelayConnection>> HostRelay::connect(const RelayEndpoint& endpoint) {
  const auto path = pathOf(endpoint);
  if (!path) return tl::unexpected(path.error());
  auto socket = connectTo(*path);
  if (!socket) return tl::unexpected(std::move(socket.error()));
  const auto peer = peerOf(socket->number());
  if (!peer) return tl::unexpected(peer.error());
  return std::make_shared<HostRelayConnection>(runtime_, std::move(*socket), *peer, RelayBus::Side::client,
                                               configuration_.quotas);
}

Expected<std::string> HostRelay::executablePath(pid_t pid) {
  char target[PATH_MAX];
  const std::string link = fmt::format("/proc/{}/exe", pid);
  const ssize_t size = ::readlink(link.c_str(), target, sizeof target);
  if (size < 0) return tl::unexpected(posixError(errno, link));
  return std::string(target, static_cast<std::size_t>(size));
}

void HostRelay::setEventStreamHandler(std::string_view stream, std::shared_ptr<SerialQueue> queue,
                                      std::function<void(std::optional<std::string>)> handler) {
  const std::lock_guard lock(mutex_);
  EventStream& entry = eventStreams_[std::string(stream)];
  entry.queue = std::move(queue);
  entry.handler = std::move(handler);
  for (auto& name : std::exchange(entry.waiting, {})) deliver(entry, std::move(name));
}

void HostRelay::raiseEvent(std::string_view stream, std::optional<std::string> name) {
  const std::lock_guard lock(mutex_);
  EventStream& entry = eventStreams_[std::string(stream)];
  if (entry.handler) {
    deliver(entry, std::move(name));
  } else {
    entry.waiting.push_back(std::move(name));
  }
}

void HostRelay::deliver(const EventStream& stream, std::optional<std::string> name) {
  stream.queue->async(
      [handler = stream.handler, name = std::move(name)]() mutable { handler(std::move(name)); });
}

}  // namespace sable::platform::host
