#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "bench/support/Bench.h"

namespace sable::bench {
namespace {

constexpr const char* kPath = "/com/kestrel/sabled";
constexpr const char* kInterface = "com.kestrel.SBLDaemonRelay";

void check(int result, const char* what) {
  if (result < 0) fail(std::string(what) + ": " + std::strerror(-result));
}

sd_bus_message* searchCall(sd_bus* bus, const char* destination, std::uint64_t queryId, const char* text) {
  sd_bus_message* call = nullptr;
  check(sd_bus_message_new_method_call(bus, &call, destination, kPath, kInterface, "Request"), "Request");
  check(sd_bus_message_append(call, "sa{sv}", "SBLSearchRequest", 2, "queryId", "t", queryId, "queryString",
                              "s", text),
        "Request");
  return call;
}

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return address;
}

std::size_t waitingBytes(int socket) {
  pollfd descriptor{socket, POLLIN, 0};
  if (::poll(&descriptor, 1, 10'000) != 1) fail("no message came");
  int bytes = 0;
  ::ioctl(socket, FIONREAD, &bytes);
  return static_cast<std::size_t>(bytes);
}

/// What the call takes on a socket, seen on one whose other end is this process too.
std::size_t requestSize(const char* text) {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) != 0) fail("socketpair");
  sd_bus *client = nullptr, *server = nullptr;
  sd_bus_new(&client);
  sd_bus_new(&server);
  sd_bus_set_fd(client, ends[0], ends[0]);
  sd_bus_set_fd(server, ends[1], ends[1]);
  sd_bus_set_server(server, 1, SD_ID128_MAKE(01, 23, 45, 67, 89, ab, cd, ef, 01, 23, 45, 67, 89, ab, cd, ef));
  check(sd_bus_start(server), "start");
  check(sd_bus_start(client), "start");
  while (sd_bus_is_ready(client) == 0 || sd_bus_is_ready(server) == 0) {
    check(sd_bus_process(client, nullptr), "client");
    check(sd_bus_process(server, nullptr), "server");
  }
  sd_bus_message* call = searchCall(client, nullptr, 1, text);
  std::uint64_t cookie = 0;  // asking for it asks for a reply
  check(sd_bus_send(client, call, &cookie), "send");
  check(sd_bus_flush(client), "flush");
  const std::size_t size = waitingBytes(ends[1]);
  sd_bus_message_unref(call);
  sd_bus_close_unref(client);
  sd_bus_close_unref(server);
  return size;
}

}  // namespace

Client::Client(const std::string& socket, const char* identifier) {
  sd_bus_new(&bus_);
  check(sd_bus_set_address(bus_, ("unix:path=" + socket).c_str()), "address");
  check(sd_bus_start(bus_), "connect");
  configure(identifier);
}

Client::Client(const BusServer& rival) : destination_(BusServer::kName) {
  sd_bus_new(&bus_);
  check(sd_bus_set_address(bus_, rival.address().c_str()), "address");
  sd_bus_set_bus_client(bus_, 1);
  check(sd_bus_start(bus_), "connect");
  configure("bench");
}

void Client::configure(const char* identifier) {
  check(sd_bus_call_method(bus_, destination_, kPath, kInterface, "Configure", nullptr, nullptr, "a{sv}", 2,
                           "identifier", "s", identifier, "userAgent", "s", "bench/1.0"),
        "Configure");
}

Client::~Client() {
  sd_bus_close_unref(bus_);
}

void Client::search(const char* text, Outcome wanted) {
  sd_bus_message* call = searchCall(bus_, destination_, ++queryId_, text);
  sd_bus_message* reply = nullptr;
  check(sd_bus_call(bus_, call, 0, nullptr, &reply), "Request");
  check(sd_bus_message_skip(reply, "t"), "Request");
  check(sd_bus_message_enter_container(reply, 'a', "{sv}"), "Request");
  const auto outcome = sd_bus_message_at_end(reply, 0) > 0 ? Outcome::nothing : Outcome::answer;
  if (outcome != wanted) fail("not the answer that was to be measured");
  sd_bus_message_unref(call);
  sd_bus_message_unref(reply);
}

Client::Sizes Client::sizes(const char* text, Outcome wanted) {
  // The daemon also tells its clients of the bag: by the second reply that is done.
  for (int i = 0; i < 2; ++i) search(text, wanted);
  while (sd_bus_process(bus_, nullptr) > 0) continue;
  sd_bus_message* call = searchCall(bus_, destination_, ++queryId_, text);
  std::uint64_t cookie = 0;
  check(sd_bus_send(bus_, call, &cookie), "send");
  check(sd_bus_flush(bus_), "flush");
  const Sizes sizes{requestSize(text), waitingBytes(sd_bus_get_fd(bus_))};
  sd_bus_message_unref(call);
  while (sd_bus_process(bus_, nullptr) > 0) continue;
  return sizes;
}

int connectTo(const std::string& path) {
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const sockaddr_un address = addressOf(path);
  if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return socket;
  ::close(socket);
  return -1;
}

RawServer::RawServer(std::string path, Client::Sizes sizes, unsigned threads)
    : path_(std::move(path)), sizes_(sizes), listener_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  const sockaddr_un address = addressOf(path_);
  if (::bind(listener_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener_, 16) != 0) {
    fail("the floor's server cannot listen");
  }
  process_ = Child([this, threads] {
    ::dup2(listener_, STDIN_FILENO);
    ::execl(RAW_SERVER_PROGRAM, "raw_server", std::to_string(sizes_.request).c_str(),
            std::to_string(sizes_.reply).c_str(), std::to_string(threads).c_str(), nullptr);
  });
  ::close(listener_);
}

int RawServer::connect() const {
  const int socket = connectTo(path_);
  if (socket < 0) fail("connect");
  return socket;
}

void RawServer::call(int socket) const {
  char buffer[65536];
  if (::send(socket, buffer, sizes_.request, 0) < 0) fail("send");
  for (std::size_t got = 0; got < sizes_.reply;) {
    const ssize_t count = ::recv(socket, buffer, sizeof buffer, 0);
    if (count <= 0) fail("the floor's server has gone");
    got += static_cast<std::size_t>(count);
  }
}

}  // namespace sable::bench
