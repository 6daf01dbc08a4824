// The price of the daemon's own part of a call: a search that is refused because it is shorter than
// the bag wants it, against the same numbers of bytes through a bare socket. In turns, since what
// else the machine does changes from second to second.
#include <fmt/core.h>
#include <unistd.h>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr const char* kTooShort = "";
constexpr int kWarmUp = 500;
constexpr int kRounds = 4;  // of each start
constexpr int kCallsInARound = 500;
constexpr int kClients = 8;
constexpr int kThroughputRounds = 10;

struct Setup {
  explicit Setup(unsigned threads = RawServer::kThreads) : server(world.path("raw.sock"), sizes(), threads) {}

  World world;
  RawServer server;

 private:
  Client::Sizes sizes() {
    world.startDaemon();
    return Client(world.socket()).sizes(kTooShort, Client::Outcome::nothing);
  }
};

void roundTrips(Placement placement, std::optional<double> bound, int argc, char** argv) {
  Rounds raw, daemon;
  for (int start = 0; start < Rounds::kStarts; ++start) {
    placeServers(placement);
    const Setup setup;
    placeClient(placement);
    const int socket = setup.server.connect();
    Client client(setup.world.socket());
    const auto call = [&] { setup.server.call(socket); };
    const auto search = [&] { client.search(kTooShort, Client::Outcome::nothing); };
    Rounds warmUp;
    warmUp.measure(kWarmUp, call);
    warmUp.measure(kWarmUp, search);
    for (int round = 0; round < kRounds; ++round) {
      raw.measure(kCallsInARound, call);
      daemon.measure(kCallsInARound, search);
    }
    ::close(socket);
  }
  report({fmt::format("refused_search{}", suffix(placement)), "us", daemon.typical(placement),
          raw.typical(placement), bound},
         argc, argv);
}

void throughput(const std::string& name, int argc, char** argv) {
  const Setup setup(1);
  std::vector<double> raw, daemon;
  for (int round = 0; round < kThroughputRounds; ++round) {
    raw.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      const int socket = setup.server.connect();
      for (int i = 0; i < kCallsInARound; ++i) setup.server.call(socket);
      ::close(socket);
    }));
    daemon.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      Client client(setup.world.socket());
      for (int i = 0; i < kCallsInARound; ++i) client.search(kTooShort, Client::Outcome::nothing);
    }));
  }
  report({name, "calls/s", median(daemon), median(raw), std::nullopt}, argc, argv);
}

}  // namespace

int main(int argc, char** argv) {
  roundTrips(Placement::free, 2.0, argc, argv);
  throughput(fmt::format("refused_search_{}_clients", kClients), argc, argv);
  roundTrips(Placement::twoProcessors, 2.0, argc, argv);
  roundTrips(Placement::oneProcessor, std::nullopt, argc, argv);
}
