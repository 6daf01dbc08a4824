#include "Server.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>

#include "Connection.h"
#include "ConnectionThreads.h"

namespace service {

namespace {

constexpr size_t kBodyLimit = 32U << 20U;
constexpr int kAcceptQueue = 1024;
// Only announced, in the Keep-Alive header: connections end when they were idle that long.
constexpr size_t kRequestsPerConnection = 1'000'000;

Pairs parseHeaders(std::string_view head) {
  Pairs headers;
  head.remove_prefix(std::min(head.size(), head.find("\r\n") + 2));
  while (!head.empty() && !head.starts_with("\r\n")) {
    const auto line = head.substr(0, head.find("\r\n"));
    head.remove_prefix(std::min(head.size(), line.size() + 2));
    const auto colon = line.find(':');
    if (colon == line.npos) continue;
    auto value = line.substr(colon + 1);
    value.remove_prefix(std::min(value.size(), value.find_first_not_of(" \t")));
    headers.emplace_back(line.substr(0, colon), value);
  }
  return headers;
}

Request translate(const httplib::Request& from) {
  Request request;
  request.method = from.method;
  request.target = from.target;
  request.headers = parseHeaders(Connection::current().head());
  request.body = from.body;
  readTarget(request);
  return request;
}

bool hasBody(const httplib::Request& request) {
  return request.has_header("Content-Length") || request.has_header("Transfer-Encoding");
}

}  // namespace

Server::Server(Handler handler, Reading reading)
    : handler_(std::move(handler)), reading_(std::move(reading)) {
  new_task_queue = [] { return new ConnectionThreads; };
  set_tcp_nodelay(true);
  set_payload_max_length(kBodyLimit);
  set_keep_alive_max_count(kRequestsPerConnection);
  set_keep_alive_timeout(Connection::kIdleLimit.count());
  // Without SO_REUSEPORT, which the library sets: two services on one port would share its clients.
  set_socket_options([](socket_t socket) {
    const int yes = 1;
    ::setsockopt(socket, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
  });
  set_pre_routing_handler([this](const httplib::Request& request, httplib::Response& response) {
    return prepare(const_cast<httplib::Request&>(request), response);
  });
  const auto answer = [this](const httplib::Request& request, httplib::Response& response) {
    handle(request, response);
  };
  Get(".*", answer);
  Post(".*", answer);
  // Called for every status from 400 on; those the handler gave have its Date already. The others are the
  // library's own, for requests it could not read to their end.
  set_error_handler([this](const httplib::Request& request, httplib::Response& response) {
    if (response.has_header("Date")) return;
    Connection::current().closeAfterAnswer();
    handle(request, response);
  });
}

Server::~Server() {
  stop();
}

// An upload is to be checked as it left the client, but the library decodes any body whose coding it knows
// (and takes "deflate" for the zlib format at that), and refuses forms of more than 8 KiB. It goes by its own
// list of headers, so hide them there; the handler reads them from the connection.
Server::HandlerResponse Server::prepare(httplib::Request& request, httplib::Response& response) {
  if (request.method != "GET" && request.method != "HEAD" && request.method != "POST") {
    if (hasBody(request)) Connection::current().closeAfterAnswer();
    handle(request, response);
    return HandlerResponse::Handled;
  }
  Connection::current().setReading(reading_(request.path));
  request.headers.erase("Content-Encoding");
  request.headers.erase("Content-Type");
  // The library reads a POST without a length until the connection closes; RFC 9112 (6.3) says it has no
  // body.
  if (request.method == "POST" && !hasBody(request)) request.headers.emplace("Content-Length", "0");
  // Its brotli runs at the highest level, which takes longer than the search itself.
  const bool gzip = request.get_header_value("Accept-Encoding").find("gzip") != std::string::npos;
  request.headers.erase("Accept-Encoding");
  if (gzip) request.headers.emplace("Accept-Encoding", "gzip");
  return HandlerResponse::Unhandled;
}

void Server::handle(const httplib::Request& request, httplib::Response& response) {
  handler_(translate(request), response);
}

bool Server::process_and_close_socket(socket_t socket) {
  Connection connection(socket);
  if (!admit(&connection)) return false;
  bool closing = false;
  while (!closing && connection.waitForRequest()) {
    if (!process_request(connection, false, closing, nullptr)) break;
  }
  connection.flush();
  const std::lock_guard lock(mutex_);
  connections_.erase(&connection);
  return true;
}

bool Server::admit(Connection* connection) {
  const std::lock_guard lock(mutex_);
  if (!stopping_) connections_.insert(connection);
  return !stopping_;
}

int Server::bind(int port) {
  if (port == 0)
    port = bind_to_any_port("127.0.0.1");
  else if (!bind_to_port("127.0.0.1", port))
    port = 0;
  // The library's accept queue of 5 would drop connections when many clients come at once.
  return port > 0 && ::listen(svr_sock_, kAcceptQueue) == 0 ? port : 0;
}

void Server::start() {
  listener_ = std::thread([this] { listen_after_bind(); });
  while (!is_running()) std::this_thread::yield();
}

void Server::stop() {
  if (!listener_.joinable()) return;
  httplib::Server::stop();
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;
    for (auto* connection : connections_) connection->shutDown();
  }
  listener_.join();
}

}  // namespace service
