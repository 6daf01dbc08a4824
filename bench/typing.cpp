// A word of twelve letters, typed at a service that takes 80 ms to answer: the first letter asks it, and
// what it completes answers the others. What 99 of 100 of these take at most.
#include <algorithm>
#include <string>

#include "bench/support/Bench.h"

using namespace sable::bench;

int main(int argc, char** argv) {
  constexpr int kWords = 60;
  World world(World::QueryCache::on, std::chrono::milliseconds(80));
  world.startDaemon();
  const std::string word = Service::kCompletedQuery;
  Microseconds keystrokes;
  for (int i = 0; i < kWords; ++i) {
    Client client(world.socket(), ("typist-" + std::to_string(i)).c_str());
    client.search(word.substr(0, 1).c_str(), Client::Outcome::answer);
    for (std::size_t typed = 2; typed <= word.size(); ++typed) {
      const std::string text = word.substr(0, typed);
      measure(1, keystrokes, [&] { client.search(text.c_str(), Client::Outcome::answer); });
    }
  }
  if (world.service().searches() != kWords) fail("more than a request a word");
  std::ranges::sort(keystrokes);
  report({"typing_p99", "us", keystrokes[keystrokes.size() * 99 / 100], std::nullopt, 1000}, argc, argv);
}
