#include "platform/host/RelayInlet.h"

#include <fcntl.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/host/RelayFraming.h"

namespace sable::platform::host {

namespace {

constexpr std::size_t kLookedAt = 8192;
constexpr std::size_t kFedAtOnce = 65536;
// Of the handshake (D-Bus specification, "Authentication Protocol").
constexpr std::size_t kLongestLine = 4096;
constexpr std::string_view kLineEnd = "\r\n";
constexpr std::string_view kLastLine = "BEGIN\r\n";

}  // namespace

int RelayInlet::start() {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) != 0) return -errno;
  toBus_ = Descriptor(ends[0]);
  input_ = ends[1];
  return input_;
}

int RelayInlet::detach() {
  if (!isAttached()) return 0;
  const int bus = input_;
  const Descriptor fromHere(start());
  input_ = bus;
  if (!fromHere) return fromHere.number();
  return ::dup3(fromHere.number(), bus, O_CLOEXEC) < 0 ? -errno : 0;
}

int RelayInlet::admit(std::size_t& messages) {
  if (begun_ && fixed_.empty() && messageLeft_ == 0) {
    const int result = look(messages);
    if (result < 0 || messages > 0) return result;
    if (result == 0) return 0;
  }
  return feed(messages);
}

/// 0: nothing has come.
int RelayInlet::receive(char* bytes, std::size_t size, int flags) const {
  iovec part{bytes, size};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  const ssize_t count = ::recvmsg(socket_, &message, MSG_DONTWAIT | flags);
  if (count < 0) return errno == EAGAIN || errno == EINTR ? 0 : -errno;
  if (count == 0) return -ECONNRESET;
  if ((message.msg_flags & MSG_CTRUNC) != 0) return -EOPNOTSUPP;
  return static_cast<int>(count);
}

/// Counts the whole plain calls at the socket's head and lets sd-bus read these from there.
int RelayInlet::look(std::size_t& messages) {
  char bytes[kLookedAt];
  const int count = receive(bytes, sizeof bytes, MSG_PEEK);
  if (count <= 0) return count;
  std::string_view rest(bytes, static_cast<std::size_t>(count));
  while (rest.size() >= kRelayFixedBytes) {
    const auto size = relayMessageSize(rest);
    if (!size || *size > rest.size() || *size > messageBytes_ || !isPlainRelayCall(rest.substr(0, *size)))
      break;
    rest.remove_prefix(*size);
    ++messages;
  }
  if (messages == 0) return count;
  if (isAttached()) return count;
  if (::dup3(socket_, input_, O_CLOEXEC) < 0) return -errno;
  toBus_ = Descriptor();
  return count;
}

int RelayInlet::feed(std::size_t& messages) {
  char bytes[kFedAtOnce];
  const int received = receive(bytes, sizeof bytes, 0);
  if (received <= 0) return received;
  if (const int error = detach(); error < 0) return error;
  const std::string_view read(bytes, static_cast<std::size_t>(received));
  if (const int error = count(read, messages); error < 0) return error;
  // The pair is empty, and has room for this much.
  const ssize_t sent = ::send(toBus_.number(), read.data(), read.size(), MSG_NOSIGNAL);
  if (sent < 0) return -errno;
  return sent == received ? received : -ENOBUFS;
}

int RelayInlet::count(std::string_view bytes, std::size_t& messages) {
  while (!bytes.empty()) {
    if (!begun_) {
      if (!countLine(bytes)) return -EBADMSG;
      continue;
    }
    if (messageLeft_ == 0) {
      const std::size_t taken = std::min(kRelayFixedBytes - fixed_.size(), bytes.size());
      fixed_ += bytes.substr(0, taken);
      bytes.remove_prefix(taken);
      if (fixed_.size() < kRelayFixedBytes) return 0;
      const auto size = relayMessageSize(std::exchange(fixed_, {}));
      if (!size) return -EBADMSG;
      if (*size > messageBytes_) return -EMSGSIZE;
      messageLeft_ = *size - kRelayFixedBytes;
    }
    const std::size_t taken = std::min(messageLeft_, bytes.size());
    bytes.remove_prefix(taken);
    messageLeft_ -= taken;
    if (messageLeft_ == 0) ++messages;
  }
  return 0;
}

/// False when the line is longer than any that makes sense.
bool RelayInlet::countLine(std::string_view& bytes) {
  const std::size_t size = std::min(bytes.find('\n'), bytes.size() - 1) + 1;
  line_ += bytes.substr(0, size);
  bytes.remove_prefix(size);
  if (line_.ends_with(kLineEnd)) {
    begun_ = line_ == kLastLine;
    line_.clear();
  }
  return line_.size() <= kLongestLine;
}

}  // namespace sable::platform::host
