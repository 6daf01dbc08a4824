#include "tests/support/LoopbackServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cctype>
#include <cerrno>
#include <list>
#include <stdexcept>

namespace sable::tests {

using platform::host::Events;
using platform::host::HostRuntime;
using Watch = platform::host::Reactor::Watch;

/// Everything below lives on one queue.
class LoopbackServer::State : public std::enable_shared_from_this<State> {
 public:
  explicit State(HostRuntime& runtime) : runtime_(runtime), queue_(runtime.serialQueue("loopback server")) {
    listener_ = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (::bind(listener_, reinterpret_cast<sockaddr*>(&address), length) != 0 || ::listen(listener_, 64) != 0)
      throw std::runtime_error("no listening socket on the loopback interface");
    ::getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &length);
    port_ = ntohs(address.sin_port);
  }
  ~State() { ::close(listener_); }

  void start() {
    watch_ = runtime_.reactor().watch(listener_, [weak = weak_from_this()](Events) {
      if (const auto self = weak.lock()) self->queue_->async([self] { self->acceptAll(); });
    });
    watch_->arm(EPOLLIN);
  }
  void stop() {
    connections_.clear();
    watch_ = nullptr;
  }

  LoopbackServer::Reply answer(const std::string& request) {
    requests_.push_back(request);
    const auto start = request.find(' ') + 1;
    const auto path = request.substr(start, request.find_first_of(" ?", start) - start);
    const auto handler = handlers_.find(path);
    if (handler == handlers_.end()) return {"HTTP/1.1 404 Not Found\r\nContent-Length: 0\r\n\r\n"};
    return handler->second(request);
  }

  void acceptAll();
  void forget(Connection* connection);

  HostRuntime& runtime_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  std::uint16_t port_ = 0;
  std::map<std::string, LoopbackServer::Handler> handlers_;
  std::vector<std::string> requests_;
  std::list<std::shared_ptr<Connection>> connections_;
  int accepted_ = 0;
  std::function<void()> noneIsOpen_;

 private:
  int listener_ = -1;
  std::unique_ptr<Watch> watch_;
};

class LoopbackServer::Connection : public std::enable_shared_from_this<Connection> {
 public:
  Connection(State& server, int descriptor) : server_(server), descriptor_(descriptor) {}
  ~Connection() {
    watch_ = nullptr;
    ::close(descriptor_);
  }

  void start() {
    watch_ = server_.runtime_.reactor().watch(descriptor_,
                                              [weak = weak_from_this(), queue = server_.queue_](Events) {
                                                queue->async([weak] {
                                                  if (const auto self = weak.lock()) self->go();
                                                });
                                              });
    go();
  }

 private:
  void go() {
    if (!write() || !read()) return server_.forget(this);
    watch_->arm(EPOLLIN | (outbox_.empty() ? 0U : EPOLLOUT));
  }

  bool read() {
    std::array<char, 65536> buffer;
    for (;;) {
      const auto count = ::recv(descriptor_, buffer.data(), buffer.size(), 0);
      if (count < 0) return errno == EAGAIN;
      if (count == 0) return false;
      inbox_.append(buffer.data(), static_cast<std::size_t>(count));
      if (std::isalpha(static_cast<unsigned char>(inbox_.front())) == 0) {
        // Not HTTP: TLS, or another protocol that a client mistook us for.
        outbox_ = "HTTP/1.1 400 Bad Request\r\n\r\n";
        then_ = Reply::Then::close;
        return write();
      }
      while (const std::size_t size = requestSize()) {
        const std::string request = inbox_.substr(0, size);
        inbox_.erase(0, size);
        if (then_ != Reply::Then::keep) continue;
        Reply reply = server_.answer(request);
        outbox_ += reply.bytes;
        then_ = reply.then;
        if (!write()) return false;
      }
    }
  }

  // 0 while the request is not complete.
  std::size_t requestSize() const {
    const auto end = inbox_.find("\r\n\r\n");
    if (end == std::string::npos) return 0;
    const auto length = inbox_.find("Content-Length: ");
    const std::size_t body = length < end ? std::stoul(inbox_.substr(length + 16)) : 0;
    return inbox_.size() < end + 4 + body ? 0 : end + 4 + body;
  }

  bool write() {
    while (!outbox_.empty()) {
      const auto count = ::send(descriptor_, outbox_.data(), outbox_.size(), MSG_NOSIGNAL);
      if (count < 0) return errno == EAGAIN;
      outbox_.erase(0, static_cast<std::size_t>(count));
    }
    if (then_ == Reply::Then::reset) {
      const linger hard{1, 0};
      ::setsockopt(descriptor_, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
    }
    return then_ == Reply::Then::keep || then_ == Reply::Then::stall;
  }

  State& server_;
  const int descriptor_;
  std::unique_ptr<Watch> watch_;
  std::string inbox_, outbox_;
  Reply::Then then_ = Reply::Then::keep;
};

void LoopbackServer::State::acceptAll() {
  for (;;) {
    const int descriptor = ::accept4(listener_, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (descriptor < 0) break;
    ++accepted_;
    connections_.push_back(std::make_shared<Connection>(*this, descriptor));
    const auto connection = connections_.back();
    connection->start();
  }
  watch_->arm(EPOLLIN);
}

void LoopbackServer::State::forget(Connection* connection) {
  connections_.remove_if([&](const auto& each) { return each.get() == connection; });
  if (connections_.empty() && noneIsOpen_) std::exchange(noneIsOpen_, nullptr)();
}

LoopbackServer::LoopbackServer(HostRuntime& runtime) : state_(std::make_shared<State>(runtime)) {
  state_->start();
}

LoopbackServer::~LoopbackServer() {
  state_->queue_->sync([this] { state_->stop(); });
}

void LoopbackServer::on(const std::string& path, Handler handler) {
  state_->queue_->sync([&] { state_->handlers_[path] = std::move(handler); });
}

std::string LoopbackServer::url(const std::string& path) const {
  return "http://127.0.0.1:" + std::to_string(port()) + path;
}

std::uint16_t LoopbackServer::port() const {
  return state_->port_;
}

std::vector<std::string> LoopbackServer::requests() const {
  return state_->queue_->sync([this] { return state_->requests_; });
}

int LoopbackServer::connections() const {
  return state_->queue_->sync([this] { return state_->accepted_; });
}

void LoopbackServer::waitUntilNoneIsOpen() {
  const auto none = state_->runtime_.semaphore(0);
  state_->queue_->sync([&] {
    state_->noneIsOpen_ = [&] { none->signal(); };
    state_->forget(nullptr);
  });
  static_cast<void>(none->wait(platform::MonotonicTime::max()));
}

std::string LoopbackServer::ok(const std::string& body, const std::string& headerLines) {
  return "HTTP/1.1 200 OK\r\n" + headerLines + "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" +
         body;
}

}  // namespace sable::tests
