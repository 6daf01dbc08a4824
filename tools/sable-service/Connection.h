#pragma once

#include <httplib.h>

#include <chrono>
#include <string>

#include "Faults.h"

namespace service {

/// One accepted connection, as the HTTP library reads and writes it. It belongs to the thread that serves it.
///
/// It goes beyond a plain socket stream in four ways: the head of the current request is kept as it came, so
/// that the order and spelling of its headers can be recorded; writes are gathered and leave in one segment;
/// waiting for the next request costs no wake-ups; and faults reach the socket (an RST, a pause that a
/// hang-up ends).
class Connection final : public httplib::Stream {
 public:
  static constexpr std::chrono::seconds kIdleLimit{300};

  /// Takes over the socket.
  explicit Connection(int socket);
  ~Connection() override;
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  /// The connection that the calling thread serves.
  static Connection& current();

  /// Sends what is gathered, then waits for the first byte of a request. False when the client has gone or
  /// was idle for 5 minutes.
  bool waitForRequest();
  /// The request line and headers of the current request, as they came, up to 64 KiB.
  const std::string& head() const { return head_; }

  bool flush();
  void closeAfterAnswer() { closing_ = true; }
  /// How the rest of the current request is to be read.
  void setReading(const ReadingPlan& plan) { reading_ = plan; }
  /// Drops what is gathered and sends an RST: the client sees the connection reset by its peer.
  void reset();
  /// Waits that long, or until the client hangs up (then false).
  bool pause(std::chrono::milliseconds duration);
  /// Ends reading and writing from another thread.
  void shutDown();

  bool is_readable() const override { return !broken_; }
  bool is_writable() const override { return !broken_; }
  ssize_t read(char* ptr, size_t size) override;
  ssize_t write(const char* ptr, size_t size) override;
  void get_remote_ip_and_port(std::string& ip, int& port) const override;
  void get_local_ip_and_port(std::string& ip, int& port) const override;
  socket_t socket() const override { return socket_; }

 private:
  /// Bounds the next piece of a request's body; false where there is to be none.
  bool mayRead(size_t& size);
  bool fill(std::chrono::milliseconds timeout);

  const int socket_;
  bool closing_ = false;
  bool broken_ = false;
  std::string incoming_;
  size_t consumed_ = 0;
  std::string outgoing_;
  std::string head_;
  bool headComplete_ = false;
  ReadingPlan reading_;
  size_t bodyRead_ = 0;
};

}  // namespace service
