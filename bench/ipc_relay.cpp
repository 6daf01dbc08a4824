// The price of a Relay call against a raw Unix socket that carries the same bytes, measured in
// alternating rounds of one run. A small request, a reply of 4 KiB; once as the scheduler likes,
// once with both ends on one processor.

#include <fcntl.h>
#include <fmt/core.h>
#include <sched.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/UnixSocket.h"

using namespace sable;
using namespace sable::platform;

namespace {

constexpr std::size_t kRequestSize = 300;
constexpr std::size_t kReplySize = 4096;
constexpr int kWarmUp = 500;
constexpr int kRounds = 5;

constexpr RelayMethod kMethods[] = {{"Fetch", "ay", "ay"}};
constexpr RelayInterface kInterface{"com.kestrel.Bench", "/com/kestrel/bench", kMethods};

void pinTo(int processor) {
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(static_cast<std::size_t>(processor), &set);
  sched_setaffinity(0, sizeof set, &set);
}

double microseconds(std::chrono::steady_clock::duration duration) {
  return std::chrono::duration<double, std::micro>(duration).count();
}

double processorMicroseconds(pid_t process) {
  clockid_t clock{};
  timespec time{};
  if (clock_getcpuclockid(process, &clock) != 0 || clock_gettime(clock, &time) != 0) return 0;
  return static_cast<double>(time.tv_sec) * 1e6 + static_cast<double>(time.tv_nsec) / 1e3;
}

/// A server in a process of its own, as long as this lives.
class Server {
 public:
  template <class Run>
  explicit Server(bool pinned, Run run) {
    int ready[2];
    if (pipe(ready) != 0) std::abort();
    process_ = fork();
    if (process_ == 0) {
      if (pinned) pinTo(0);
      run([&] { [[maybe_unused]] const auto written = write(ready[1], "r", 1); });
      _exit(0);
    }
    close(ready[1]);
    char byte = 0;
    if (read(ready[0], &byte, 1) != 1) std::exit(1);
    close(ready[0]);
  }
  ~Server() {
    kill(process_, SIGKILL);
    waitpid(process_, nullptr, 0);
  }
  pid_t process() const { return process_; }

 private:
  pid_t process_;
};

/// The floor: a one-shot epoll loop that reads the request and writes the reply.
template <class Ready>
void serveRaw(const std::string& path, Ready ready) {
  const auto listener = host::listenAt(path);
  const int epoll = epoll_create1(EPOLL_CLOEXEC);
  epoll_event event{EPOLLIN, {.fd = listener->number()}};
  epoll_ctl(epoll, EPOLL_CTL_ADD, listener->number(), &event);
  ready();
  epoll_wait(epoll, &event, 1, -1);
  const int socket = accept4(listener->number(), nullptr, nullptr, SOCK_NONBLOCK);
  epoll_event next{EPOLLIN | EPOLLONESHOT, {.fd = socket}};
  epoll_ctl(epoll, EPOLL_CTL_ADD, socket, &next);
  std::vector<char> buffer(kReplySize);
  while (epoll_wait(epoll, &event, 1, -1) == 1) {
    if (read(socket, buffer.data(), kRequestSize) <= 0) return;
    [[maybe_unused]] const auto written = write(socket, buffer.data(), kReplySize);
    epoll_ctl(epoll, EPOLL_CTL_MOD, socket, &next);
  }
}

template <class Ready>
void serveRelay(const std::string& path, Ready ready) {
  host::HostRuntime runtime;
  host::HostRelayConfiguration configuration;
  configuration.socketPath = path;
  host::HostRelay relay(runtime, configuration);
  const Data reply = makeData(std::string(kReplySize, 'x'));
  std::vector<std::shared_ptr<RelayConnection>> connections;
  const auto listener = relay.namedListener("bench");
  listener->setAcceptHandler([&](std::shared_ptr<RelayConnection> connection) {
    connection->exportObject(kInterface, [reply](RelayCall call) { call.reply(reply); });
    connection->resume();
    connections.push_back(std::move(connection));
    return true;
  });
  if (const auto resumed = listener->resume(); !resumed) {
    fmt::print(stderr, "{}\n", resumed.error().description());
    std::exit(1);
  }
  ready();
  pause();
}

struct Figures {
  double median;
  double p99;
  double server;  ///< processor time a call
};

template <class Call>
Figures measure(const Server& server, int calls, Call call) {
  for (int i = 0; i < kWarmUp; ++i) call();
  std::vector<double> times;
  times.reserve(static_cast<std::size_t>(calls));
  const double spent = processorMicroseconds(server.process());
  for (int i = 0; i < calls; ++i) {
    const auto start = std::chrono::steady_clock::now();
    call();
    times.push_back(microseconds(std::chrono::steady_clock::now() - start));
  }
  const double cost = (processorMicroseconds(server.process()) - spent) / calls;
  std::ranges::sort(times);
  return {times[times.size() / 2], times[times.size() * 99 / 100], cost};
}

Figures raw(const std::string& path, bool pinned, int calls) {
  unlink(path.c_str());
  const Server server(pinned, [&](auto ready) { serveRaw(path, ready); });
  const auto socket = host::connectTo(path);
  std::vector<char> buffer(kReplySize);
  return measure(server, calls, [&] {
    [[maybe_unused]] const auto written = write(socket->number(), buffer.data(), kRequestSize);
    for (std::size_t got = 0; got < kReplySize;) {
      const ssize_t size = read(socket->number(), buffer.data() + got, kReplySize - got);
      if (size <= 0) std::abort();
      got += static_cast<std::size_t>(size);
    }
  });
}

Figures relayed(const std::string& path, bool pinned, int calls) {
  unlink(path.c_str());
  const Server server(pinned, [&](auto ready) { serveRelay(path, ready); });
  sd_bus* bus = nullptr;
  sd_bus_new(&bus);
  sd_bus_set_address(bus, host::endpointOf(path).c_str());
  if (sd_bus_start(bus) < 0) std::abort();
  const std::string request(kRequestSize, 'q');
  const Figures figures = measure(server, calls, [&] {
    sd_bus_message* call = nullptr;
    sd_bus_message* reply = nullptr;
    sd_bus_message_new_method_call(bus, &call, nullptr, "/com/kestrel/bench", "com.kestrel.Bench", "Fetch");
    sd_bus_message_append_array(call, 'y', request.data(), request.size());
    const void* bytes = nullptr;
    std::size_t size = 0;
    if (sd_bus_call(bus, call, 0, nullptr, &reply) < 0 ||
        sd_bus_message_read_array(reply, 'y', &bytes, &size) < 0 || size != kReplySize) {
      std::abort();
    }
    sd_bus_message_unref(call);
    sd_bus_message_unref(reply);
  });
  sd_bus_flush_close_unref(bus);
  return figures;
}

double median(std::vector<double> values) {
  std::ranges::sort(values);
  return values[values.size() / 2];
}

void compare(const char* placement, const std::string& path, bool pinned, int calls) {
  std::vector<double> ratios;
  std::vector<double> floors;
  std::vector<double> medians;
  std::vector<double> costs;
  for (int round = 0; round < kRounds; ++round) {
    const Figures floor = raw(path, pinned, calls);
    const Figures relay = relayed(path, pinned, calls);
    floors.push_back(floor.median);
    medians.push_back(relay.median);
    ratios.push_back(relay.median / floor.median);
    costs.push_back(relay.server / floor.server);
  }
  fmt::print("{:<10} raw {:6.1f} us   relay {:6.1f} us   ratio {:.2f}   server processor time ratio {:.2f}\n",
             placement, median(floors), median(medians), median(ratios), median(costs));
}

}  // namespace

int main(int argc, char** argv) {
  const int calls = argc > 1 ? std::atoi(argv[1]) : 20000;
  const char* folder = std::getenv("TMPDIR");
  const std::string path = fmt::format("{}/ipc_relay.{}", folder == nullptr ? "/tmp" : folder, getpid());
  cpu_set_t all;
  sched_getaffinity(0, sizeof all, &all);
  compare("free", path, false, calls);
  pinTo(0);
  compare("one cpu", path, true, calls);
  sched_setaffinity(0, sizeof all, &all);
  unlink(path.c_str());
  unlink((path + ".lock").c_str());
}
