// A keystroke that the prefix cache answers with 10 KB, against the same numbers of bytes through a
// bare socket, and against the same call and answer through a message bus, which is how D-Bus
// services are usually reached.
#include <fmt/core.h>
#include <unistd.h>

#include <list>
#include <mutex>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr const char* kTyped = "weather";
constexpr int kWarmUp = 500;
constexpr int kRounds = 4;  // of each start
constexpr int kCallsInARound = 250;
constexpr int kClients = 8;
constexpr int kThroughputRounds = 10;

struct Bounds {
  std::optional<double> raw;  ///< at most so many times the bare socket
  std::optional<double> bus;  ///< at most so much of the bus's time
};

void roundTrips(Placement placement, const Bounds& bounds, int argc, char** argv) {
  Rounds raw, bus, daemon;
  for (int start = 0; start < Rounds::kStarts; ++start) {
    placeServers(placement);
    World world;
    world.startDaemon();
    Client client(world.socket());
    client.search(kTyped, Client::Outcome::answer);
    const RawServer server(world.path("raw.sock"), client.sizes(kTyped, Client::Outcome::answer));
    const BusServer busServer(world.path(""), Service::kAnswerBytes);
    placeClient(placement);
    const int socket = server.connect();
    Client busClient(busServer);
    const auto call = [&] { server.call(socket); };
    const auto callOnBus = [&] { busClient.search(kTyped, Client::Outcome::answer); };
    const auto search = [&] { client.search(kTyped, Client::Outcome::answer); };
    Rounds warmUp;
    warmUp.measure(kWarmUp, call);
    warmUp.measure(kWarmUp, callOnBus);
    warmUp.measure(kWarmUp, search);
    for (int round = 0; round < kRounds; ++round) {
      raw.measure(kCallsInARound, call);
      bus.measure(kCallsInARound, callOnBus);
      daemon.measure(kCallsInARound, search);
    }
    ::close(socket);
    if (world.service().searches() != 1) fail("not the cache answered");
  }
  const auto name = fmt::format("cached_keystroke{}", suffix(placement));
  report({name, "us", daemon.typical(placement), raw.typical(placement), bounds.raw}, argc, argv);
  report({name + "_bus", "us", daemon.typical(placement), bus.typical(placement), bounds.bus}, argc, argv);
}

void throughput(double least, int argc, char** argv) {
  World world;
  world.startDaemon();
  Client first(world.socket());
  first.search(kTyped, Client::Outcome::answer);
  const RawServer server(world.path("raw.sock"), first.sizes(kTyped, Client::Outcome::answer), 1);
  // The end of a connection would empty the cache of the others.
  std::list<Client> clients;
  for (int i = 0; i < kClients; ++i) clients.emplace_back(world.socket());
  std::vector<double> raw, daemon;
  for (int round = 0; round < kThroughputRounds; ++round) {
    std::mutex mutex;
    auto next = clients.begin();
    raw.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      const int socket = server.connect();
      for (int i = 0; i < kCallsInARound; ++i) server.call(socket);
      ::close(socket);
    }));
    daemon.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      std::unique_lock lock(mutex);
      Client& client = *next++;
      lock.unlock();
      for (int i = 0; i < kCallsInARound; ++i) client.search(kTyped, Client::Outcome::answer);
    }));
  }
  report({.name = fmt::format("cached_keystroke_{}_clients", kClients),
          .unit = "calls/s",
          .median = median(daemon),
          .floor = median(raw),
          .bound = least,
          .moreIsBetter = true},
         argc, argv);
}

}  // namespace

int main(int argc, char** argv) {
  roundTrips(Placement::free, {1.5, 1 / 1.4}, argc, argv);
  throughput(0.45, argc, argv);
  roundTrips(Placement::twoProcessors, {1.5, std::nullopt}, argc, argv);
  roundTrips(Placement::oneProcessor, {2.6, 1 / 2.0}, argc, argv);
}
