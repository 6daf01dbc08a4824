// A keystroke that the prefix cache answers with 10 KB, against the same numbers of bytes through a
// bare socket, and against the same call and answer through a message bus, which is how D-Bus
// services are usually reached.
#include <fmt/core.h>
#include <unistd.h>

#include <thread>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr const char* kTyped = "weather";
constexpr int kWarmUp = 500;
constexpr int kRounds = 40;
constexpr int kCallsInARound = 250;
constexpr int kClients = 8;

struct Bounds {
  std::optional<double> raw;  ///< at most so many times the bare socket
  std::optional<double> bus;  ///< at most so much of the bus's time
};

void roundTrips(Placement placement, const Bounds& bounds, int argc, char** argv) {
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

  Microseconds ignored, raw, bus, daemon;
  for (int round = -1; round < kRounds; ++round) {
    const int calls = round < 0 ? kWarmUp : kCallsInARound;
    const auto into = [&](Microseconds& times) -> Microseconds& { return round < 0 ? ignored : times; };
    measure(calls, into(raw), [&] { server.call(socket); });
    measure(calls, into(bus), [&] { busClient.search(kTyped, Client::Outcome::answer); });
    measure(calls, into(daemon), [&] { client.search(kTyped, Client::Outcome::answer); });
  }
  ::close(socket);
  if (world.service().searches() != 1) fail("not the cache answered");
  const auto name = fmt::format("cached_keystroke{}", suffix(placement));
  report({name, "us", median(daemon), median(raw), bounds.raw}, argc, argv);
  report({name + "_bus", "us", median(daemon), median(bus), bounds.bus}, argc, argv);
}

void throughput(double least, int argc, char** argv) {
  World world;
  world.startDaemon();
  Client first(world.socket());
  first.search(kTyped, Client::Outcome::answer);
  const RawServer server(world.path("raw.sock"), first.sizes(kTyped, Client::Outcome::answer));
  std::vector<double> raw, daemon;
  for (int round = 0; round < kRounds / 4; ++round) {
    raw.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      const int socket = server.connect();
      for (int i = 0; i < kCallsInARound; ++i) server.call(socket);
      ::close(socket);
    }));
    daemon.push_back(callsPerSecond(kClients, kCallsInARound, [&] {
      Client client(world.socket());
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
