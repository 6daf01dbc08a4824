#pragma once

#include <httplib.h>

#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "Faults.h"
#include "Message.h"

namespace service {

class Connection;

/// HTTP/1.1 on 127.0.0.1: the library parses and writes the messages; connections, threads and the accept
/// queue are kept here so that some hundred kept-alive clients cost a thread each, no wake-ups while idle,
/// and no lost SYN.
class Server : private httplib::Server {
 public:
  /// Called on the connection's thread for every request, to fill in the response. A request that was refused
  /// as no proper HTTP, or too large, comes with that status set, and its connection is closed afterwards.
  using Handler = std::function<void(const Request&, httplib::Response&)>;

  /// Called before the body of a request to that path is read.
  using Reading = std::function<ReadingPlan(const std::string& path)>;

  Server(Handler handler, Reading reading);
  ~Server() override;

  /// Port 0 picks a free one. The port, or 0 when it cannot be had. Clients that come now wait for start().
  int bind(int port);
  void start();
  /// Closes every connection and waits for their threads.
  void stop();

 private:
  bool process_and_close_socket(socket_t socket) override;
  HandlerResponse prepare(httplib::Request& request, httplib::Response& response);
  void handle(const httplib::Request& request, httplib::Response& response);
  bool admit(Connection* connection);

  const Handler handler_;
  const Reading reading_;
  std::thread listener_;
  std::mutex mutex_;
  std::set<Connection*> connections_;
  bool stopping_ = false;
};

}  // namespace service
