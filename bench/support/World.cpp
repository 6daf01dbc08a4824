#include <fcntl.h>
#include <fmt/core.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <thread>

#include "bench/support/Bench.h"

namespace sable::bench {
namespace {

std::string searchAnswer() {
  std::string answer =
      fmt::format(R"([{{"query": "{}", "completion_score": 0.5, "max_age": 0, "status": "OK", "results": [)",
                  Service::kCompletedQuery);
  const std::string end = "]}]";
  for (int i = 0; answer.size() + 300 < Service::kAnswerBytes; ++i) {
    answer += fmt::format(
        R"({{"id": "result-{}", "title": "Weather report number {}", "url": "https://weather.example/report/{}", )"
        R"("score": 0.{}, "image": {{"id": "section.noun"}}}}, )",
        i, i, i, 99 - i);
  }
  const std::string last = R"({"id": "last", "title": ""})";
  const std::size_t padding = Service::kAnswerBytes - answer.size() - last.size() - end.size();
  return answer + last.substr(0, last.size() - 2) + std::string(padding, '.') + "\"}" + end;
}

std::string response(const std::string& body) {
  return fmt::format("HTTP/1.1 200 OK\r\nContent-Type: application/json\r\nContent-Length: {}\r\n\r\n{}",
                     body.size(), body);
}

bool isListening(const std::string& path) {
  const int socket = connectTo(path);
  if (socket < 0) return false;
  ::close(socket);
  return true;
}

}  // namespace

struct Service::Shared {
  char head[8192];
  int searches;
};

Service::Service(std::chrono::milliseconds latency) {
  shared_ = static_cast<Shared*>(
      ::mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
  const int listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  if (::bind(listener, reinterpret_cast<sockaddr*>(&address), length) != 0 || ::listen(listener, 16) != 0) {
    fail("the service cannot listen");
  }
  ::getsockname(listener, reinterpret_cast<sockaddr*>(&address), &length);
  url_ = fmt::format("http://127.0.0.1:{}", ntohs(address.sin_port));

  const std::string search = response(searchAnswer());
  const std::string bag = response(fmt::format(
      R"({{"version": "1", "enabled": true, "minimum_query_length": 1, "search_url": "{}/search"}})", url_));
  const auto serve = [&](int connection) {
    const int on = 1;
    ::setsockopt(connection, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    char buffer[sizeof(Shared::head)];
    std::string request;
    for (ssize_t count; (count = ::recv(connection, buffer, sizeof buffer, 0)) > 0;) {
      request.append(buffer, static_cast<std::size_t>(count));
      if (!request.ends_with("\r\n\r\n")) continue;
      const bool isSearch = request.starts_with("GET /search");
      if (isSearch) {
        std::strncpy(shared_->head, request.c_str(), sizeof shared_->head - 1);
        ++shared_->searches;
        std::this_thread::sleep_for(latency);
      }
      const std::string& answer = isSearch ? search : bag;
      if (::send(connection, answer.data(), answer.size(), MSG_NOSIGNAL) < 0) return;
      request.clear();
    }
  };
  process_ = Child([&] {
    ::signal(SIGCHLD, SIG_IGN);
    for (;;) {
      const int connection = ::accept(listener, nullptr, nullptr);
      if (::fork() == 0) {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        serve(connection);
        ::_exit(0);
      }
      ::close(connection);
    }
  });
  ::close(listener);
}

std::string Service::lastSearch() const {
  return shared_->head;
}

int Service::searches() const {
  return shared_->searches;
}

World::World(QueryCache queryCache, std::chrono::milliseconds latency) : service_(latency) {
  char folder[] = "/tmp/sabled-bench-XXXXXX";
  if (::mkdtemp(folder) == nullptr) fail("mkdtemp");
  root_ = folder;
  for (const char* name : {"run", "caches", "state", "config"}) {
    std::filesystem::create_directory(root_ / name);
    std::filesystem::permissions(root_ / name, std::filesystem::perms::owner_all);
  }
  std::ofstream(root_ / "config" / "defaults.toml")
      << "SBLDefaultBagURL = \"" << service_.url() << "/bag\"\n"
      << "SBLNoQueryCache = " << (queryCache == QueryCache::on ? "false" : "true") << "\n";
}

World::~World() {
  killDaemon();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void World::startDaemon() {
  killDaemon();
  std::filesystem::remove(socket());
  const int watch = ::inotify_init1(IN_CLOEXEC);
  ::inotify_add_watch(watch, path("run").c_str(), IN_CREATE | IN_MOVED_TO);
  daemon_ = Child([this] {
    for (const auto& [variable, name] : {std::pair{"SABLED_RUNTIME_DIR", "run"},
                                         {"SABLED_CACHES_DIR", "caches"},
                                         {"SABLED_STATE_DIR", "state"},
                                         {"SABLED_CONFIG_DIR", "config"},
                                         {"SABLED_PROFILE", "profile.toml"}}) {
      ::setenv(variable, path(name).c_str(), 1);
    }
    ::setenv("LC_ALL", "C.UTF-8", 1);
    ::setenv("DBUS_SESSION_BUS_ADDRESS", "disabled:", 1);
    const int errors = ::open(path("sabled.err").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    ::dup2(errors, STDERR_FILENO);
    ::execl(SABLED_PROGRAM, "sabled", nullptr);
  });
  char events[4096];
  while (!std::filesystem::exists(socket())) {
    pollfd descriptor{watch, POLLIN, 0};
    if (::poll(&descriptor, 1, 10'000) != 1) fail("sabled did not start");
    [[maybe_unused]] const auto count = ::read(watch, events, sizeof events);
  }
  ::close(watch);
  // Bound is not yet listening.
  while (!isListening(socket())) ::sched_yield();
}

}  // namespace sable::bench
