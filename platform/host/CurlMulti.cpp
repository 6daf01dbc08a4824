#include "platform/host/CurlMulti.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <unistd.h>

namespace sable::platform::host {
namespace {

Events eventsFor(int what) {
  Events events = 0;
  if ((what & CURL_POLL_IN) != 0) events |= EPOLLIN;
  if ((what & CURL_POLL_OUT) != 0) events |= EPOLLOUT;
  return events;
}

// An error is left for the read or write to find: libcurl then says which one it was.
int actionFor(Events events) {
  int action = 0;
  if ((events & (EPOLLIN | EPOLLERR | EPOLLHUP)) != 0) action |= CURL_CSELECT_IN;
  if ((events & (EPOLLOUT | EPOLLERR)) != 0) action |= CURL_CSELECT_OUT;
  return action;
}

}  // namespace

class CurlMulti::Duplicate {
 public:
  // In two steps, for the thread sanitizer does not know the one: it would hold the number's last
  // owner against this one. Nothing starts a program in between.
  explicit Duplicate(int original) : descriptor_(::dup(original)) {
    ::fcntl(descriptor_, F_SETFD, FD_CLOEXEC);
  }
  ~Duplicate() {
    if (descriptor_ >= 0) ::close(descriptor_);
  }
  Duplicate(const Duplicate&) = delete;
  Duplicate& operator=(const Duplicate&) = delete;

  int descriptor() const { return descriptor_; }

 private:
  const int descriptor_;
};

void enter(HostQueue& queue, Function<void()> work) {
  if (!queue.tryRunInline(work)) queue.async(std::move(work));
}

CurlMulti::CurlMulti(Reactor& reactor, std::shared_ptr<HostQueue> queue, bool multiplex, Finished finished)
    : reactor_(reactor), queue_(std::move(queue)), finished_(std::move(finished)), multi_(curl_multi_init()) {
  curl_multi_setopt(multi_, CURLMOPT_SOCKETFUNCTION, &CurlMulti::socketChanged);
  curl_multi_setopt(multi_, CURLMOPT_SOCKETDATA, this);
  curl_multi_setopt(multi_, CURLMOPT_TIMERFUNCTION, &CurlMulti::timerChanged);
  curl_multi_setopt(multi_, CURLMOPT_TIMERDATA, this);
  curl_multi_setopt(multi_, CURLMOPT_PIPELINING, multiplex ? CURLPIPE_MULTIPLEX : CURLPIPE_NOTHING);
}

CurlMulti::~CurlMulti() {
  curl_multi_cleanup(multi_);
}

void CurlMulti::add(CURL* easy) {
  curl_easy_setopt(easy, CURLOPT_SOCKOPTFUNCTION, &CurlMulti::socketOpened);
  curl_easy_setopt(easy, CURLOPT_SOCKOPTDATA, this);
  curl_easy_setopt(easy, CURLOPT_CLOSESOCKETFUNCTION, &CurlMulti::socketClosed);
  curl_easy_setopt(easy, CURLOPT_CLOSESOCKETDATA, this);
  if (curl_multi_add_handle(multi_, easy) != CURLM_OK) return finished_(easy, CURLE_FAILED_INIT);
  settle();
}

void CurlMulti::remove(CURL* easy) {
  curl_multi_remove_handle(multi_, easy);
  settle();
}

int CurlMulti::socketChanged(CURL*, curl_socket_t descriptor, int what, void* context, void*) {
  auto* self = static_cast<CurlMulti*>(context);
  const bool ends = what == CURL_POLL_REMOVE;
  Socket& socket = self->socketFor(descriptor);
  socket.wanted = ends ? 0 : eventsFor(what);
  // Reading is asked for only when a connection stands.
  if (socket.isConnection && (socket.wanted & EPOLLIN) != 0) socket.isConnected = true;
  if (ends && !socket.isConnected) {
    self->sockets_.erase(descriptor);
  } else {
    self->changed_.push_back(descriptor);
  }
  return 0;
}

int CurlMulti::timerChanged(CURLM*, long milliseconds, void* context) {
  auto* self = static_cast<CurlMulti*>(context);
  self->wantedMilliseconds_ = milliseconds;
  self->timerChanged_ = true;
  return 0;
}

int CurlMulti::socketOpened(void* context, curl_socket_t descriptor, curlsocktype) {
  auto* self = static_cast<CurlMulti*>(context);
  self->sockets_.erase(descriptor);  // one whose end was not told
  Socket& socket = self->socketFor(descriptor);
  socket.isConnection = true;
  return socket.watch ? CURL_SOCKOPT_OK : CURL_SOCKOPT_ERROR;
}

int CurlMulti::socketClosed(void* context, curl_socket_t descriptor) {
  static_cast<CurlMulti*>(context)->sockets_.erase(descriptor);
  return ::close(descriptor);
}

CurlMulti::Socket& CurlMulti::socketFor(curl_socket_t descriptor) {
  Socket& socket = sockets_[descriptor];
  if (socket.watch) return socket;
  const auto id = socket.id = ++lastId_;
  socket.duplicate = std::make_unique<Duplicate>(descriptor);
  if (socket.duplicate->descriptor() < 0) return socket;
  socket.watch = reactor_.watch(socket.duplicate->descriptor(),
                                [weak = weak_from_this(), queue = queue_, descriptor, id](Events events) {
                                  enter(*queue, [weak, descriptor, events, id] {
                                    if (const auto self = weak.lock()) self->ready(descriptor, id, events);
                                  });
                                });
  return socket;
}

void CurlMulti::ready(curl_socket_t descriptor, std::uint64_t id, Events events) {
  // The descriptor may have been closed, and its number used anew, on the way here.
  const auto found = sockets_.find(descriptor);
  if (found == sockets_.end() || found->second.id != id) return;
  found->second.armed = 0;
  changed_.push_back(descriptor);
  act(descriptor, actionFor(events));
  settle();
}

void CurlMulti::timeOut() {
  timer_.detach();
  act(CURL_SOCKET_TIMEOUT, 0);
  settle();
}

void CurlMulti::act(curl_socket_t descriptor, int events) {
  int running = 0;
  curl_multi_socket_action(multi_, descriptor, events, &running);
}

void CurlMulti::settle() {
  // A transfer that has just been added, or has much to do, asks to be called at once.
  constexpr int kRoundsInARow = 16;
  for (int round = 0; wantedMilliseconds_ == 0 && round < kRoundsInARow; ++round) {
    wantedMilliseconds_ = -1;
    act(CURL_SOCKET_TIMEOUT, 0);
  }
  readFinished();
  armSockets();
  setTimer();
}

void CurlMulti::readFinished() {
  int left = 0;
  while (const CURLMsg* message = curl_multi_info_read(multi_, &left)) {
    if (message->msg != CURLMSG_DONE) continue;
    CURL* const easy = message->easy_handle;
    const CURLcode code = message->data.result;
    curl_multi_remove_handle(multi_, easy);
    finished_(easy, code);
  }
}

void CurlMulti::armSockets() {
  for (const curl_socket_t descriptor : changed_) {
    const auto found = sockets_.find(descriptor);
    if (found == sockets_.end()) continue;
    Socket& socket = found->second;
    if (socket.watch && socket.wanted != socket.armed) socket.watch->arm(socket.armed = socket.wanted);
  }
  changed_.clear();
}

void CurlMulti::setTimer() {
  if (!std::exchange(timerChanged_, false)) return;
  timer_.cancel();
  if (wantedMilliseconds_ < 0) return;
  timer_ = queue_->after(std::chrono::milliseconds(wantedMilliseconds_), [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->timeOut();
  });
}

}  // namespace sable::platform::host
