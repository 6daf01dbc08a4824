// From exec to the first answered call, with a bag on disk and everything in the page cache; and
// the memory that the daemon takes after its first search.
#include <fmt/core.h>

#include <fstream>
#include <sstream>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

constexpr int kStarts = 40;

/// Proportional set size in MiB.
double memory(pid_t process) {
  std::ifstream file(fmt::format("/proc/{}/smaps_rollup", process));
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with("Pss:")) return std::stod(line.substr(4)) / 1024;
  }
  fail("smaps_rollup tells no Pss");
}

}  // namespace

int main(int argc, char** argv) {
  World world;
  std::vector<double> milliseconds, mebibytes;
  for (int i = -1; i < kStarts; ++i) {
    world.killDaemon();
    const auto start = std::chrono::steady_clock::now();
    world.startDaemon();
    Client client(world.socket());
    const std::chrono::duration<double, std::milli> time = std::chrono::steady_clock::now() - start;
    client.search("weather", Client::Outcome::answer);
    if (i < 0) continue;  // the bag was not there yet
    milliseconds.push_back(time.count());
    mebibytes.push_back(memory(world.daemon()));
  }
  report({"start", "ms", median(milliseconds), std::nullopt, 25.0}, argc, argv);
  report({"memory", "MiB", median(mebibytes), std::nullopt, 15.0}, argc, argv);
}
