#include "bench/support/Bench.h"

#include <fmt/core.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <numeric>
#include <string_view>
#include <thread>

namespace sable::bench {

void fail(const std::string& what) {
  fmt::print(stderr, "bench: {}\n", what);
  std::exit(1);
}

double median(std::vector<double> values) {
  const auto middle = values.begin() + static_cast<std::ptrdiff_t>(values.size() / 2);
  std::nth_element(values.begin(), middle, values.end());
  return *middle;
}

double Rounds::typical(Placement placement) const {
  if (placement != Placement::free) return median(medians_);
  return std::accumulate(medians_.begin(), medians_.end(), 0.0) / static_cast<double>(medians_.size());
}

double callsPerSecond(int clients, int calls, const std::function<void()>& run) {
  const auto start = std::chrono::steady_clock::now();
  std::vector<std::thread> threads;
  for (int i = 0; i < clients; ++i) threads.emplace_back(run);
  for (auto& thread : threads) thread.join();
  const std::chrono::duration<double> time = std::chrono::steady_clock::now() - start;
  return clients * calls / time.count();
}

void report(const Measure& measure, int argc, char** argv) {
  const auto ratio = measure.floor ? std::optional(measure.median / *measure.floor) : std::nullopt;
  const char* verdict = !measure.bound                                                              ? "-"
                        : measure.moreIsBetter == (ratio.value_or(measure.median) > *measure.bound) ? "ok"
                                                                                                    : "short";
  const auto number = [](std::optional<double> value, const char* absent) {
    return value ? fmt::format("{:.2f}", *value) : std::string(absent);
  };
  const bool json = std::any_of(argv, argv + argc, [](std::string_view word) { return word == "--json"; });
  if (json) {
    fmt::print(
        R"({{"name": "{}", "unit": "{}", "median": {:.2f}, "floor": {}, "ratio": {}, "bound": {}, "verdict": "{}"}})"
        "\n",
        measure.name, measure.unit, measure.median, number(measure.floor, "null"), number(ratio, "null"),
        number(measure.bound, "null"), verdict);
  } else {
    fmt::print("{:<28} {:>10.2f} {:<8} floor {:>9}  ratio {:>6}  bound {:>6}  {}\n", measure.name,
               measure.median, measure.unit, number(measure.floor, "-"), number(ratio, "-"),
               number(measure.bound, "-"), verdict);
  }
  std::fflush(stdout);
}

Child::Child(const std::function<void()>& run) {
  std::fflush(stdout);
  pid_ = ::fork();
  if (pid_ < 0) fail("fork");
  if (pid_ > 0) return;
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  run();
  ::_exit(0);
}

Child::~Child() {
  if (pid_ < 0) return;
  ::kill(pid_, SIGKILL);
  ::waitpid(pid_, nullptr, 0);
}

const char* suffix(Placement placement) {
  switch (placement) {
    case Placement::twoProcessors:
      return "_two_cpus";
    case Placement::oneProcessor:
      return "_one_cpu";
    default:
      return "";
  }
}

namespace {

void useProcessor(int number) {
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(static_cast<std::size_t>(number), &set);
  ::sched_setaffinity(0, sizeof set, &set);
}

}  // namespace

void placeServers(Placement placement) {
  if (placement != Placement::free) useProcessor(placement == Placement::twoProcessors ? 1 : 0);
}

void placeClient(Placement placement) {
  if (placement != Placement::free) useProcessor(0);
}

}  // namespace sable::bench
