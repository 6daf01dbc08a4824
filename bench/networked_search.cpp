// A search that the service answers with 10 KB, against the sum of what it cannot do without: the
// same HTTP request on a kept-alive connection, made with libcurl and nothing else, and the same
// numbers of bytes through a bare socket.
#include <curl/curl.h>
#include <fmt/core.h>
#include <unistd.h>

#include <sstream>
#include <string>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr const char* kQuery = "weather";
constexpr int kWarmUp = 300;
constexpr int kRounds = 4;  // of each start
constexpr int kCallsInARound = 200;

/// Repeats a request whose head it is given.
class DirectRequest {
 public:
  DirectRequest(const std::string& service, const std::string& head) : easy_(curl_easy_init()) {
    std::istringstream lines(head);
    std::string method, target, line;
    lines >> method >> target;
    std::getline(lines, line);
    while (std::getline(lines, line) && line != "\r") {
      line.pop_back();
      headers_ = curl_slist_append(headers_, line.c_str());
    }
    curl_easy_setopt(easy_, CURLOPT_URL, (service + target).c_str());
    curl_easy_setopt(easy_, CURLOPT_HTTPHEADER, headers_);
    curl_easy_setopt(easy_, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(
        easy_, CURLOPT_WRITEFUNCTION, +[](char* bytes, std::size_t, std::size_t count, void* body) {
          static_cast<std::string*>(body)->append(bytes, count);
          return count;
        });
    curl_easy_setopt(easy_, CURLOPT_WRITEDATA, &body_);
  }
  ~DirectRequest() {
    curl_easy_cleanup(easy_);
    curl_slist_free_all(headers_);
  }
  DirectRequest(const DirectRequest&) = delete;
  DirectRequest& operator=(const DirectRequest&) = delete;

  void perform() {
    body_.clear();
    if (curl_easy_perform(easy_) != CURLE_OK || body_.size() != Service::kAnswerBytes)
      fail("the direct request");
  }

 private:
  CURL* easy_;
  curl_slist* headers_ = nullptr;
  std::string body_;
};

void compare(Placement placement, std::optional<double> bound, int argc, char** argv) {
  Rounds raw, http, daemon;
  for (int start = 0; start < Rounds::kStarts; ++start) {
    placeServers(placement);
    World world(World::QueryCache::off);
    world.startDaemon();
    Client client(world.socket());
    const auto search = [&] { client.search(kQuery, Client::Outcome::answer); };
    const RawServer server(world.path("raw.sock"), client.sizes(kQuery, Client::Outcome::answer));
    const int socket = server.connect();
    placeClient(placement);
    DirectRequest request(world.service().url(), world.service().lastSearch());
    const auto call = [&] { server.call(socket); };
    const auto perform = [&] { request.perform(); };
    Rounds warmUp;
    warmUp.measure(kWarmUp, call);
    warmUp.measure(kWarmUp, perform);
    warmUp.measure(kWarmUp, search);
    for (int round = 0; round < kRounds; ++round) {
      raw.measure(kCallsInARound, call);
      http.measure(kCallsInARound, perform);
      daemon.measure(kCallsInARound, search);
    }
    ::close(socket);
  }
  report({fmt::format("networked_search{}", suffix(placement)), "us", daemon.typical(placement),
          raw.typical(placement) + http.typical(placement), bound},
         argc, argv);
}

}  // namespace

int main(int argc, char** argv) {
  compare(Placement::free, 1.35, argc, argv);
  compare(Placement::twoProcessors, 1.35, argc, argv);
  compare(Placement::oneProcessor, std::nullopt, argc, argv);
}
