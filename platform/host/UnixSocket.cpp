#include "platform/host/UnixSocket.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <charconv>
#include <cstring>

namespace sable::platform::host {

namespace {

constexpr std::string_view kPathKey = "unix:path=";

tl::unexpected<Error> failure(int code, std::string_view what) {
  return tl::unexpected(posixError(code, what));
}

Expected<sockaddr_un> addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) {
    return failure(ENAMETOOLONG, fmt::format("A socket at \"{}\"", path));
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  return address;
}

const sockaddr* generic(const sockaddr_un& address) {
  return reinterpret_cast<const sockaddr*>(&address);
}

/// Characters that stand for themselves in an address.
bool isPlain(char c) {
  return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
         std::strchr("-_/.\\*", c) != nullptr;
}

/// 0 or an errno value.
int makeFolders(const std::string& path) {
  if (::mkdir(path.c_str(), 0700) == 0 || errno == EEXIST) return 0;
  const std::size_t slash = path.find_last_of('/');
  if (errno != ENOENT || slash == std::string::npos || slash == 0) return errno;
  if (const int error = makeFolders(path.substr(0, slash)); error != 0) return error;
  return ::mkdir(path.c_str(), 0700) == 0 || errno == EEXIST ? 0 : errno;
}

}  // namespace

Expected<Descriptor> listenAt(const std::string& path) {
  const auto address = addressOf(path);
  if (!address) return tl::unexpected(address.error());
  Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket) return failure(errno, "socket");
  // The file gets the socket's mode at bind: it is never there with a wider one.
  if (::fchmod(socket.number(), 0600) != 0) return failure(errno, "fchmod");
  if (::bind(socket.number(), generic(*address), sizeof *address) != 0) return failure(errno, "bind " + path);
  if (::listen(socket.number(), SOMAXCONN) != 0) return failure(errno, "listen " + path);
  return socket;
}

Expected<Descriptor> connectTo(const std::string& path) {
  const auto address = addressOf(path);
  if (!address) return tl::unexpected(address.error());
  Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!socket) return failure(errno, "socket");
  int result = 0;
  do {
    result = ::connect(socket.number(), generic(*address), sizeof *address);
  } while (result != 0 && errno == EINTR);
  if (result != 0) return failure(errno, "connect " + path);
  return socket;
}

Expected<RelayPeer> peerOf(int socket) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
    return failure(errno, "SO_PEERCRED");
  }
  return RelayPeer{credentials.pid, credentials.uid};
}

RelayEndpoint endpointOf(std::string_view path) {
  std::string endpoint(kPathKey);
  for (const char c : path) {
    if (isPlain(c)) {
      endpoint += c;
    } else {
      endpoint += fmt::format("%{:02x}", static_cast<unsigned char>(c));
    }
  }
  return endpoint;
}

Expected<std::string> pathOf(std::string_view endpoint) {
  const auto bad = [endpoint] { return failure(EINVAL, fmt::format("Address \"{}\"", endpoint)); };
  if (!endpoint.starts_with(kPathKey)) return bad();
  const std::string_view escaped = endpoint.substr(kPathKey.size(), endpoint.find(',') - kPathKey.size());
  std::string path;
  for (std::size_t i = 0; i < escaped.size(); ++i) {
    if (escaped[i] != '%') {
      path += escaped[i];
      continue;
    }
    const std::string_view digits = escaped.substr(i + 1, 2);
    unsigned char byte = 0;
    const auto parsed = std::from_chars(digits.data(), digits.data() + digits.size(), byte, 16);
    if (digits.size() != 2 || parsed.ptr != digits.data() + 2) return bad();
    path += static_cast<char>(byte);
    i += 2;
  }
  return path;
}

Expected<void> makePrivateFolder(const std::string& path) {
  if (const int error = makeFolders(path); error != 0) return failure(error, "mkdir " + path);
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) return failure(errno, "lstat " + path);
  if (!S_ISDIR(status.st_mode)) return failure(ENOTDIR, path);
  if (status.st_uid != ::geteuid()) return failure(EPERM, path + " belongs to another user");
  if ((status.st_mode & 0077) != 0 && ::chmod(path.c_str(), 0700) != 0)
    return failure(errno, "chmod " + path);
  return {};
}

}  // namespace sable::platform::host
