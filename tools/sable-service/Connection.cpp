#include "Connection.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace service {

namespace {

using std::chrono::milliseconds;

constexpr milliseconds kStallLimit = std::chrono::seconds(30);
constexpr size_t kHeadLimit = 65536;
constexpr size_t kGatherLimit = 65536;

thread_local Connection* currentConnection = nullptr;

/// The events that came, 0 at the time-out.
short waitFor(int socket, short events, milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (true) {
    const auto left = std::chrono::ceil<milliseconds>(deadline - std::chrono::steady_clock::now());
    pollfd descriptor{socket, events, 0};
    const int ready = ::poll(&descriptor, 1, static_cast<int>(std::max(left, milliseconds(0)).count()));
    if (ready > 0) return descriptor.revents;
    if (ready == 0 || errno != EINTR) return 0;
  }
}

template <typename Getter>
void addressOf(Getter getter, int socket, std::string& ip, int& port) {
  sockaddr_in address{};
  socklen_t length = sizeof address;
  std::array<char, INET_ADDRSTRLEN> text{};
  if (getter(socket, reinterpret_cast<sockaddr*>(&address), &length) != 0) return;
  if (inet_ntop(AF_INET, &address.sin_addr, text.data(), text.size()) == nullptr) return;
  ip = text.data();
  port = ntohs(address.sin_port);
}

}  // namespace

Connection::Connection(int socket) : socket_(socket) {
  currentConnection = this;
}

Connection::~Connection() {
  currentConnection = nullptr;
  ::close(socket_);
}

Connection& Connection::current() {
  return *currentConnection;
}

bool Connection::waitForRequest() {
  head_.clear();
  headComplete_ = false;
  reading_ = {};
  bodyRead_ = 0;
  return flush() && !closing_ && (consumed_ < incoming_.size() || fill(kIdleLimit));
}

bool Connection::fill(milliseconds timeout) {
  if (waitFor(socket_, POLLIN, timeout) == 0) return false;
  incoming_.resize(16384);
  consumed_ = 0;
  const ssize_t count = ::recv(socket_, incoming_.data(), incoming_.size(), 0);
  incoming_.resize(count > 0 ? static_cast<size_t>(count) : 0);
  return count > 0;
}

bool Connection::mayRead(size_t& size) {
  if (reading_.resetAfter) {
    if (bodyRead_ >= *reading_.resetAfter) {
      reset();
      return false;
    }
    size = std::min(size, *reading_.resetAfter - bodyRead_);
  }
  if (!reading_.bytesPerSecond) return true;
  size = std::min(size, std::max<size_t>(1, *reading_.bytesPerSecond / 10));
  return pause(milliseconds(size * 1000 / *reading_.bytesPerSecond));
}

ssize_t Connection::read(char* ptr, size_t size) {
  if (headComplete_ && !mayRead(size)) return 0;
  // A client may be waiting for "100 Continue" before it sends the rest.
  if (consumed_ == incoming_.size() && (!flush() || !fill(kStallLimit))) return 0;
  const size_t count = std::min(size, incoming_.size() - consumed_);
  std::memcpy(ptr, incoming_.data() + consumed_, count);
  consumed_ += count;
  if (headComplete_) {
    bodyRead_ += count;
  } else {
    head_.append(ptr, count);
    headComplete_ = head_.ends_with("\r\n\r\n") || head_.size() > kHeadLimit;
  }
  return static_cast<ssize_t>(count);
}

ssize_t Connection::write(const char* ptr, size_t size) {
  if (broken_) return -1;
  outgoing_.append(ptr, size);
  return outgoing_.size() < kGatherLimit || flush() ? static_cast<ssize_t>(size) : -1;
}

bool Connection::flush() {
  size_t sent = 0;
  while (sent < outgoing_.size()) {
    const ssize_t count = ::send(socket_, outgoing_.data() + sent, outgoing_.size() - sent, MSG_NOSIGNAL);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) {
      broken_ = true;
      break;
    }
    sent += static_cast<size_t>(count);
  }
  outgoing_.clear();
  return !broken_;
}

void Connection::reset() {
  outgoing_.clear();
  broken_ = true;
  // Closing with a zero linger time discards what is queued and sends an RST (socket(7)).
  const linger immediately{1, 0};
  ::setsockopt(socket_, SOL_SOCKET, SO_LINGER, &immediately, sizeof immediately);
}

bool Connection::pause(milliseconds duration) {
  return waitFor(socket_, POLLRDHUP, duration) == 0;
}

void Connection::shutDown() {
  ::shutdown(socket_, SHUT_RDWR);
}

void Connection::get_remote_ip_and_port(std::string& ip, int& port) const {
  addressOf(::getpeername, socket_, ip, port);
}

void Connection::get_local_ip_and_port(std::string& ip, int& port) const {
  addressOf(::getsockname, socket_, ip, port);
}

}  // namespace service
