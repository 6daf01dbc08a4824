// The price of the daemon's own part of a call: a search that is refused because it is shorter than
// the bag wants it, against the same numbers of bytes through a bare socket. In turns, since what
// else the machine does changes from second to second.
#include <fmt/core.h>
#include <unistd.h>

#include <memory>
#include <thread>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr const char* kTooShort = "we";
constexpr int kWarmUp = 500;
constexpr int kRounds = 40;
constexpr int kCallsInARound = 500;
constexpr int kClients = 8;

class Comparison {
 public:
  Comparison() : server_(world_.path("raw.sock"), sizes()), socket_(server_.connect()) {
    client_ = std::make_unique<Client>(world_.socket());
  }

  void roundTrips(const char* name, std::optional<double> bound, int argc, char** argv) {
    Microseconds ignored, raw, daemon;
    for (int round = -1; round < kRounds; ++round) {
      const int calls = round < 0 ? kWarmUp : kCallsInARound;
      measure(calls, round < 0 ? ignored : raw, [this] { server_.call(socket_); });
      measure(calls, round < 0 ? ignored : daemon,
              [this] { client_->search(kTooShort, Client::Outcome::nothing); });
    }
    report({name, "us", median(daemon), median(raw), bound}, argc, argv);
  }

  void onOneProcessor(int processor) {
    for (const pid_t process : {0, server_.pid(), world_.daemon()}) pin(process, processor);
  }

  void throughput(int argc, char** argv) {
    std::vector<double> raw, daemon;
    for (int round = 0; round < kRounds / 4; ++round) {
      raw.push_back(callsPerSecond([this] {
        const int socket = server_.connect();
        for (int i = 0; i < kCallsInARound; ++i) server_.call(socket);
        ::close(socket);
      }));
      daemon.push_back(callsPerSecond([this] {
        Client client(world_.socket());
        for (int i = 0; i < kCallsInARound; ++i) client.search(kTooShort, Client::Outcome::nothing);
      }));
    }
    report({fmt::format("refused_search_{}_clients", kClients), "calls/s", median(daemon), median(raw),
            std::nullopt},
           argc, argv);
  }

 private:
  Client::Sizes sizes() {
    world_.startDaemon();
    return Client(world_.socket()).sizes(kTooShort, Client::Outcome::nothing);
  }

  template <class Run>
  static double callsPerSecond(Run run) {
    const auto start = std::chrono::steady_clock::now();
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) threads.emplace_back(run);
    for (auto& thread : threads) thread.join();
    const std::chrono::duration<double> time = std::chrono::steady_clock::now() - start;
    return kClients * kCallsInARound / time.count();
  }

  World world_;
  RawServer server_;
  int socket_;
  std::unique_ptr<Client> client_;
};

}  // namespace

int main(int argc, char** argv) {
  Comparison comparison;
  comparison.roundTrips("refused_search", 2.0, argc, argv);
  comparison.onOneProcessor(0);
  comparison.roundTrips("refused_search_one_cpu", std::nullopt, argc, argv);
  comparison.onOneProcessor(-1);
  comparison.throughput(argc, argv);
}
