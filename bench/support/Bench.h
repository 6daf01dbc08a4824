#pragma once

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

struct sd_bus;

/// What the benchmarks share: the real daemon in folders of its own with a service that always gives
/// the same answer, a plain client of it, the floor that it is held against, and the line a measure
/// ends in. A step that fails ends the program with a text.
namespace sable::bench {

[[noreturn]] void fail(const std::string& what);

using Microseconds = std::vector<double>;
double median(std::vector<double> values);

/// Times `count` calls one by one.
template <class Call>
void measure(int count, Microseconds& times, Call call) {
  for (int i = 0; i < count; ++i) {
    const auto start = std::chrono::steady_clock::now();
    call();
    const std::chrono::duration<double, std::micro> time = std::chrono::steady_clock::now() - start;
    times.push_back(time.count());
  }
}

/// Where the two sides of a call run. Left to itself, the scheduler has them either share a processor or
/// keep one each, sticks to it for thousands of calls, and changes a call's time by three to six that way:
/// chance decides between floor and daemon. So both are measured with the same places as well, and where
/// they are free, over many starts.
enum class Placement { free, twoProcessors, oneProcessor };

/// What calls took, in rounds that alternate with those of the rival: what else the machine does changes
/// from second to second.
class Rounds {
 public:
  /// How often a comparison starts its servers anew.
  static constexpr int kStarts = 20;

  template <class Call>
  void measure(int count, Call call) {
    Microseconds times;
    bench::measure(count, times, call);
    medians_.push_back(median(times));
  }
  /// The median of the rounds' medians. With free placement their mean: of two modes, the median would
  /// be either.
  double typical(Placement placement) const;

 private:
  std::vector<double> medians_;
};

/// Calls per second of all of `clients` threads together, each of which makes `calls` calls.
double callsPerSecond(int clients, int calls, const std::function<void()>& run);

/// With a floor the bound is one of the ratio, else of the median: the most that it may be, or the
/// least where more is better.
struct Measure {
  std::string name, unit;
  double median;
  std::optional<double> floor, bound;
  bool moreIsBetter = false;
};
/// Prints `name  median  floor  ratio  bound  ok|short`; with "--json" among the arguments as JSON.
void report(const Measure& measure, int argc, char** argv);

/// A forked process; killed with its object, and with its parent.
class Child {
 public:
  Child() = default;
  explicit Child(const std::function<void()>& run);
  ~Child();
  Child(Child&& other) noexcept : pid_(std::exchange(other.pid_, -1)) {}
  Child& operator=(Child&& other) noexcept {
    std::swap(pid_, other.pid_);
    return *this;
  }
  pid_t pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
};

/// Answers a search with the same 10 KB of JSON, on connections that stay open.
class Service {
 public:
  static constexpr std::size_t kAnswerBytes = 10240;
  static constexpr const char* kCompletedQuery = "weatherglass";

  /// Searches wait for `latency` before they are answered.
  explicit Service(std::chrono::milliseconds latency);
  const std::string& url() const { return url_; }
  /// The head of the last search request.
  std::string lastSearch() const;
  int searches() const;  ///< so far

 private:
  struct Shared;
  std::string url_;
  Shared* shared_;
  Child process_;
};

/// sabled and its service.
class World {
 public:
  enum class QueryCache { on, off };
  explicit World(QueryCache queryCache = QueryCache::on,
                 std::chrono::milliseconds latency = std::chrono::milliseconds(0));
  ~World();
  World(const World&) = delete;
  World& operator=(const World&) = delete;

  void startDaemon();
  void killDaemon() { daemon_ = Child(); }
  pid_t daemon() const { return daemon_.pid(); }
  std::string path(const char* name) const { return (root_ / name).string(); }
  std::string socket() const { return path("run/relay.sock"); }
  const Service& service() const { return service_; }

 private:
  std::filesystem::path root_;
  Service service_;
  Child daemon_;
};

/// The rival of a call: the same call and an answer with as much data, through a message bus.
class BusServer {
 public:
  static constexpr const char* kName = "com.kestrel.sabled";

  /// `folder` ends in '/'.
  BusServer(const std::string& folder, std::size_t answerBytes);
  const std::string& address() const { return address_; }

 private:
  void serve(std::string body, int ready) const;
  static void awaitLine(int descriptor);

  std::string address_;
  Child bus_, server_;
};

/// A connection to the daemon, or to its rival, with the D-Bus library alone.
class Client {
 public:
  enum class Outcome { nothing, answer };

  /// Returns when Configure is answered.
  explicit Client(const std::string& socket, const char* identifier = "bench");
  explicit Client(const BusServer& rival);
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  /// A search with a query id of its own; fails unless it ends in `wanted`.
  void search(const char* text, Outcome wanted);
  /// The sizes of such a call's messages on the socket.
  struct Sizes {
    std::size_t request, reply;
  };
  Sizes sizes(const char* text, Outcome wanted);

 private:
  void configure(const char* identifier);

  sd_bus* bus_ = nullptr;
  const char* destination_ = nullptr;
  std::uint64_t queryId_ = 0;
};

/// A socket connected to a Unix one; -1 when nobody listens there.
int connectTo(const std::string& path);

/// The floor of a call: the same numbers of bytes through a Unix socket, served by raw_server.
class RawServer {
 public:
  /// For round trips as many threads as the daemon has, so that the scheduler places both alike. The
  /// calls of many clients are held against the plainest server, with one.
  static constexpr unsigned kThreads = 2;

  RawServer(std::string path, Client::Sizes sizes, unsigned threads = kThreads);
  pid_t pid() const { return process_.pid(); }
  int connect() const;
  /// One call.
  void call(int socket) const;

 private:
  std::string path_;
  Client::Sizes sizes_;
  int listener_;
  Child process_;
};

/// "", "_two_cpus", "_one_cpu", behind a measure's name.
const char* suffix(Placement placement);
/// For what is started from now on.
void placeServers(Placement placement);
/// For this thread, once the servers are there.
void placeClient(Placement placement);

}  // namespace sable::bench
