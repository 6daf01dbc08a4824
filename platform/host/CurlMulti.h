#pragma once

#include <curl/curl.h>

#include <functional>
#include <memory>
#include <unordered_map>
#include <vector>

#include "platform/host/HostQueue.h"
#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// Runs `work` on the calling thread when the queue is idle, otherwise later.
void enter(HostQueue& queue, Function<void()> work);

/// libcurl's multi-socket interface on the reactor: which descriptors it waits for and when it wants
/// to be called. Lives on one queue; the thread that a descriptor wakes enters it at once when it is
/// idle.
///
///     descriptor ready --enter--> curl_multi_socket_action --> finished(easy, code)
///         ^                               |
///         '------ arm <------ what libcurl waits for now
///
/// A connection's watch outlives the transfer, for the next one on that connection, and is not armed
/// in between: an idle connection wakes nobody. What is watched is a duplicate, for libcurl closes
/// some descriptors, such as that of a connection in the making, before it says so; by then the
/// number may be somebody else's.
class CurlMulti : public std::enable_shared_from_this<CurlMulti> {
 public:
  /// Called on the queue when a transfer has ended and is out of the multi handle. It must not add
  /// transfers.
  using Finished = std::function<void(CURL*, CURLcode)>;

  CurlMulti(Reactor& reactor, std::shared_ptr<HostQueue> queue, bool multiplex, Finished finished);
  /// Closes all connections. No transfer may be left.
  ~CurlMulti();
  CurlMulti(const CurlMulti&) = delete;
  CurlMulti& operator=(const CurlMulti&) = delete;

  /// Starts a transfer that is set up; finished() may come before this returns.
  void add(CURL* easy);
  /// Takes a transfer out unfinished.
  void remove(CURL* easy);

 private:
  class Duplicate;
  struct Socket {
    std::uint64_t id = 0;
    std::unique_ptr<Duplicate> duplicate;
    std::unique_ptr<Reactor::Watch> watch;  // of the duplicate; null when there is none
    Events wanted = 0;
    Events armed = 0;
    bool isConnection = false;
    bool isConnected = false;  // from now on its end is told through socketClosed()
  };

  static int socketChanged(CURL*, curl_socket_t descriptor, int what, void* self, void*);
  static int timerChanged(CURLM*, long milliseconds, void* self);
  static int socketOpened(void* self, curl_socket_t descriptor, curlsocktype);
  static int socketClosed(void* self, curl_socket_t descriptor);

  Socket& socketFor(curl_socket_t descriptor);
  void ready(curl_socket_t descriptor, std::uint64_t id, Events events);
  void timeOut();
  void act(curl_socket_t descriptor, int events);
  void settle();
  void readFinished();
  void armSockets();
  void setTimer();

  Reactor& reactor_;
  const std::shared_ptr<HostQueue> queue_;
  const Finished finished_;
  CURLM* const multi_;

  std::unordered_map<curl_socket_t, Socket> sockets_;
  std::vector<curl_socket_t> changed_;
  std::uint64_t lastId_ = 0;
  long wantedMilliseconds_ = -1;  // until libcurl wants to be called, -1 for never
  bool timerChanged_ = false;
  Timer timer_;
};

}  // namespace sable::platform::host
