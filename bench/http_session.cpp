// A session's GET of 10 KB of JSON on a kept-alive connection, against libcurl's easy interface with
// one reused handle, in turns against the same server. The server is a child process, so that both
// pay the way through the kernel and neither pays for the server's work.
#include <arpa/inet.h>
#include <curl/curl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/host/HostHTTPSession.h"

namespace {

using sable::platform::Duration;
using sable::platform::HTTPResult;
using sable::platform::MonotonicTime;

constexpr int kRounds = 5;
constexpr int kCallsInARound = 4000;
constexpr int kWarmUp = 500;
constexpr std::size_t kBodyBytes = 10240;

using Clock = std::chrono::steady_clock;

double microsecondsSince(Clock::time_point start) {
  return std::chrono::duration<double, std::micro>(Clock::now() - start).count();
}

[[noreturn]] void serve(int listener) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  const std::string body = "[\"" + std::string(kBodyBytes - 4, 'j') + "\"]";
  const std::string reply =
      "HTTP/1.1 200 OK\r\nContent-Type: application/json\r\nContent-Length: " + std::to_string(body.size()) +
      "\r\n\r\n" + body;
  for (;;) {
    const int connection = ::accept(listener, nullptr, nullptr);
    if (::fork() != 0) {
      ::close(connection);
      continue;
    }
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    std::array<char, 4096> buffer;
    std::string request;
    for (ssize_t count; (count = ::recv(connection, buffer.data(), buffer.size(), 0)) > 0;) {
      request.append(buffer.data(), static_cast<std::size_t>(count));
      if (!request.ends_with("\r\n\r\n")) continue;
      request.clear();
      if (::send(connection, reply.data(), reply.size(), MSG_NOSIGNAL) < 0) break;
    }
    ::_exit(0);
  }
}

std::string startServer() {
  const int listener = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  if (::bind(listener, reinterpret_cast<sockaddr*>(&address), length) != 0 || ::listen(listener, 8) != 0)
    std::exit(1);
  ::getsockname(listener, reinterpret_cast<sockaddr*>(&address), &length);
  if (::fork() == 0) serve(listener);
  ::close(listener);
  return "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port)) + "/search?q=weather";
}

class EasyClient {
 public:
  explicit EasyClient(const std::string& url) : easy_(curl_easy_init()) {
    curl_easy_setopt(easy_, CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy_, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy_, CURLOPT_ACCEPT_ENCODING, "");
    curl_easy_setopt(
        easy_, CURLOPT_WRITEFUNCTION, +[](char* bytes, std::size_t, std::size_t count, void* body) {
          static_cast<std::string*>(body)->append(bytes, count);
          return count;
        });
    curl_easy_setopt(easy_, CURLOPT_WRITEDATA, &body_);
  }
  ~EasyClient() { curl_easy_cleanup(easy_); }
  EasyClient(const EasyClient&) = delete;
  EasyClient& operator=(const EasyClient&) = delete;

  std::size_t get() {
    body_.clear();
    return curl_easy_perform(easy_) == CURLE_OK ? body_.size() : 0;
  }

 private:
  CURL* easy_;
  std::string body_;
};

/// Starts each request from the completion before it, as the daemon does from the reactor's threads.
class SessionClient {
 public:
  explicit SessionClient(const std::string& url)
      : url_(url),
        sessions_(runtime_, {}),
        session_(sessions_.session({.label = "bench"})),
        done_(runtime_.semaphore(0)) {}

  void run(int calls, std::vector<double>* microseconds) {
    left_ = calls;
    microseconds_ = microseconds;
    next();
    static_cast<void>(done_->wait(MonotonicTime::max()));
  }

  /// One request for which the calling thread waits.
  std::size_t get() {
    std::size_t size = 0;
    start([&](HTTPResult result) {
      size = sizeOf(result);
      done_->signal();
    });
    static_cast<void>(done_->wait(MonotonicTime::max()));
    return size;
  }

 private:
  static std::size_t sizeOf(const HTTPResult& result) { return result.error ? 0 : result.data->size(); }

  void start(sable::platform::HTTPSession::Completion completion) {
    sable::platform::HTTPRequest request;
    request.url = url_;
    session_->dataTask(std::move(request), std::move(completion))->resume();
  }

  void next() {
    if (left_-- == 0) return done_->signal();
    start([this, started = Clock::now()](HTTPResult result) {
      if (sizeOf(result) != kBodyBytes) std::exit(1);
      if (microseconds_ != nullptr) microseconds_->push_back(microsecondsSince(started));
      next();
    });
  }

  const std::string url_;
  sable::platform::host::HostRuntime runtime_;
  sable::platform::host::HostHTTPSessions sessions_;
  std::unique_ptr<sable::platform::HTTPSession> session_;
  std::unique_ptr<sable::platform::Semaphore> done_;
  int left_ = 0;
  std::vector<double>* microseconds_ = nullptr;
};

template <class Client>
void measure(Client& client, int calls, std::vector<double>* microseconds) {
  for (int i = 0; i < calls; ++i) {
    const auto start = Clock::now();
    if (client.get() != kBodyBytes) std::exit(1);
    if (microseconds != nullptr) microseconds->push_back(microsecondsSince(start));
  }
}

double quantile(std::vector<double> values, double part) {
  const auto place =
      values.begin() + static_cast<std::ptrdiff_t>(part * static_cast<double>(values.size() - 1));
  std::nth_element(values.begin(), place, values.end());
  return *place;
}

}  // namespace

int main() {
  const std::string url = startServer();
  EasyClient easy(url);
  SessionClient session(url);
  std::vector<double> easyTimes, chainedTimes, waitedTimes;
  measure(easy, kWarmUp, nullptr);
  session.run(kWarmUp, nullptr);
  for (int round = 0; round < kRounds; ++round) {
    measure(easy, kCallsInARound, &easyTimes);
    session.run(kCallsInARound, &chainedTimes);
    measure(session, kCallsInARound, &waitedTimes);
  }
  const double floor = quantile(easyTimes, 0.5);
  const auto print = [&](const char* name, const std::vector<double>& times) {
    const double median = quantile(times, 0.5);
    std::printf("%-34s p50 %6.1f us  p99 %6.1f us  ratio %.2f\n", name, median, quantile(times, 0.99),
                median / floor);
  };
  print("curl easy, reused", easyTimes);
  print("session, from a completion", chainedTimes);
  print("session, for a thread that waits", waitedTimes);
}
