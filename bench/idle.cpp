// How often the daemon's threads run in a minute without a client. Each is asleep in a system call,
// so a thread that has not been on a processor has made none; what a tracer would show, but nobody
// has to be allowed to trace.
#include <fmt/core.h>
#include <unistd.h>

#include <fstream>
#include <map>

#include "bench/support/Bench.h"

namespace {

using namespace sable::bench;

// A connection to the service that nothing uses is closed after 10 s.
constexpr unsigned kSecondsToRest = 15;
constexpr unsigned kSeconds = 60;

using Switches = std::map<std::string, double>;

/// By thread, how often it gave up the processor or lost it.
Switches contextSwitches(pid_t process) {
  Switches switches;
  for (const auto& task : std::filesystem::directory_iterator(fmt::format("/proc/{}/task", process))) {
    std::ifstream status(task.path() / "status");
    for (std::string line; std::getline(status, line);) {
      if (line.find("ctxt_switches:") == std::string::npos) continue;
      switches[task.path().filename()] += std::stod(line.substr(line.find(':') + 1));
    }
  }
  return switches;
}

}  // namespace

int main(int argc, char** argv) {
  World world;
  world.startDaemon();
  {
    Client client(world.socket());
    client.search("weather", Client::Outcome::answer);
  }
  ::sleep(kSecondsToRest);
  Switches before = contextSwitches(world.daemon());
  ::sleep(kSeconds);
  double count = 0;
  for (const auto& [task, switches] : contextSwitches(world.daemon())) count += switches - before[task];
  report({"idle", "wakes", count, std::nullopt, 0.0}, argc, argv);
}
