#include "platform/host/HostRelayListener.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <atomic>
#include <cerrno>
#include <filesystem>

#include "platform/Log.h"
#include "platform/UUID.h"
#include "platform/host/RelayAcceptor.h"
#include "platform/host/UnixSocket.h"

namespace sable::platform::host {

namespace {

tl::unexpected<Error> heldByAnother(const std::string& path) {
  return tl::unexpected(Error{std::string(kPOSIXErrorDomain), EADDRINUSE, "another daemon holds " + path});
}

/// The listening socket that the process was started with, once; -1 without one.
int takeActivationSocket() {
  static std::atomic_flag taken;
  if (taken.test_and_set()) return -1;
  const int count = sd_listen_fds(1);
  for (int i = 0; i < count; ++i) {
    const int socket = SD_LISTEN_FDS_START + i;
    if (sd_is_socket_unix(socket, SOCK_STREAM, 1, nullptr, 0) > 0) return socket;
  }
  return -1;
}

}  // namespace

HostRelayListener::HostRelayListener(HostRuntime& runtime, Kind kind, std::string folder, std::string path,
                                     RelayAdmission admission)
    : kind_(kind),
      folder_(std::move(folder)),
      path_(std::move(path)),
      acceptor_(std::make_shared<RelayAcceptor>(runtime, std::move(admission))) {}

HostRelayListener::~HostRelayListener() {
  acceptor_->stop();
  if (ownsFile_) ::unlink(path_.c_str());
}

void HostRelayListener::setAcceptHandler(AcceptHandler handler) {
  acceptor_->setHandler(std::move(handler));
}

RelayEndpoint HostRelayListener::endpoint() const {
  return endpointOf(path_);
}

Expected<void> HostRelayListener::resume() {
  if (kind_ == Kind::named) {
    if (const int activated = takeActivationSocket(); activated >= 0) return takeActivated(activated);
  }
  if (!folder_.empty() && path_.starts_with(folder_ + "/")) {
    if (auto made = makePrivateFolder(folder_); !made) return made;
  }
  if (kind_ == Kind::named) {
    if (auto locked = lock(); !locked) return locked;
    if (auto removed = removeStale(); !removed) return removed;
    removeDeadEndpoints();
  }
  auto socket = listenAt(path_);
  if (!socket) return tl::unexpected(std::move(socket.error()));
  ownsFile_ = true;
  acceptor_->start(std::move(*socket));
  return {};
}

Expected<void> HostRelayListener::takeActivated(int descriptor) {
  Descriptor socket(descriptor);
  sockaddr_un address{};
  socklen_t size = sizeof address;
  if (::getsockname(socket.number(), reinterpret_cast<sockaddr*>(&address), &size) != 0) {
    return tl::unexpected(posixError(errno, "getsockname"));
  }
  path_ = address.sun_path;
  removeDeadEndpoints();
  ::fcntl(socket.number(), F_SETFL, ::fcntl(socket.number(), F_GETFL) | O_NONBLOCK);
  acceptor_->start(std::move(socket));
  return {};
}

/// The lock decides between two daemons that start at once; it ends with its process, and its file
/// stays, for a file that is removed can be locked twice.
Expected<void> HostRelayListener::lock() {
  const std::string path = path_ + ".lock";
  lock_ = Descriptor(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!lock_) return tl::unexpected(posixError(errno, path));
  if (::flock(lock_.number(), LOCK_EX | LOCK_NB) == 0) return {};
  const int error = errno;
  lock_ = Descriptor();
  if (error == EWOULDBLOCK) return heldByAnother(path_);
  return tl::unexpected(posixError(error, path));
}

/// A daemon ends without a shut-down, and the name of an endpoint's socket never comes again. One
/// at which nobody listens belonged to a daemon that is gone.
void HostRelayListener::removeDeadEndpoints() const {
  std::error_code error;
  for (std::filesystem::directory_iterator entry(folder_, error), end; !error && entry != end;
       entry.increment(error)) {
    const std::filesystem::path path = entry->path();
    const auto isEndpoint = path.extension() == ".sock" && UUID::parse(path.stem().native());
    if (!isEndpoint || !entry->is_socket(error)) continue;
    const auto answers = connectTo(path);
    if (!answers && answers.error().code == ECONNREFUSED) ::unlink(path.c_str());
  }
}

/// A socket at the path is a dead daemon's when nobody answers there.
Expected<void> HostRelayListener::removeStale() {
  struct stat status {};
  if (::lstat(path_.c_str(), &status) != 0) {
    if (errno == ENOENT) return {};
    return tl::unexpected(posixError(errno, path_));
  }
  if (!S_ISSOCK(status.st_mode)) return tl::unexpected(posixError(ENOTSOCK, path_));
  if (connectTo(path_)) return heldByAnother(path_);
  if (::unlink(path_.c_str()) != 0) return tl::unexpected(posixError(errno, path_));
  return {};
}

}  // namespace sable::platform::host
