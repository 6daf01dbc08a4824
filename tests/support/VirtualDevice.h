#pragma once

#include <deque>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "platform/Relay.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedPlatform.h"
#include "sabled/SableDaemon.h"
#include "tests/support/Answer.h"

namespace sable::test {

using namespace std::chrono_literals;
using json = nlohmann::ordered_json;

class VirtualDevice;

/// An answer for the scripted service to give.
platform::simulated::Scripted answering(std::string body, int status = 200);
platform::simulated::Scripted failing(platform::HTTPErrorCode error);
platform::simulated::Scripted after(platform::Duration latency, platform::simulated::Scripted answer);
SBLSearchRequest searchFor(std::string text, std::uint64_t queryId = 1);
/// What a request says in the header or the query item of a name; "-" without it.
std::string sentValue(const platform::HTTPRequest& request, std::string_view name);

/// Holds an answer from the moment it is there.
using PendingAnswer = std::shared_ptr<std::optional<Answer>>;

/// An application on the virtual device: one raw connection to the daemon.
class VirtualClient {
 public:
  VirtualClient(VirtualDevice& device, platform::RelayEndpoint endpoint, pid_t pid);
  ~VirtualClient();

  /// Sends Configure; the answer, if any, is in endpoint().
  void configure(std::string identifier = "com.kestrel.beacon", std::string agent = "Beacon/1");
  const std::optional<std::string>& endpoint() const { return state_->endpoint; }

  /// Sends a request and goes on.
  PendingAnswer send(SBLAnyRequest request);
  /// Sends a search for `text` with the next query id and runs until it is answered.
  Answer search(std::string text);
  Answer ask(SBLAnyRequest request);
  /// Calls a method and runs until it is answered.
  Expected<platform::RelayArguments> call(const platform::RelayInterface& interface, std::size_t method,
                                          platform::RelayArguments arguments = {});

  struct PushedBag {
    json raw;
    std::string userAgent;
    std::optional<Error> error;
  };
  const std::vector<PushedBag>& bags() const { return state_->bags; }
  bool isConnected() const { return !state_->invalidated; }
  void disconnect() { connection_->invalidate(); }
  platform::RelayConnection& connection() { return *connection_; }

 private:
  struct State {
    std::optional<std::string> endpoint;
    std::vector<PushedBag> bags;
    bool invalidated = false;
  };

  VirtualDevice& device_;
  const std::shared_ptr<State> state_ = std::make_shared<State>();
  std::shared_ptr<platform::RelayConnection> connection_;
  std::uint64_t queryId_ = 0;
};

/// The whole daemon on a device in memory and virtual time, with a scripted service. Until a test
/// says otherwise the service offers a bag that enables everything and answers searches with one
/// result set that completes the query.
class VirtualDevice {
 public:
  explicit VirtualDevice(std::uint64_t seed = 1);
  ~VirtualDevice();

  /// Starts the daemon and lets it settle.
  void start();
  VirtualClient& startWithClient();
  /// Ends the daemon as kill -9 does, in the middle of what it is doing; files, settings and counters
  /// stay. All clients are gone, and their references with them.
  void killDaemon();

  /// Kills the daemon where it stands and starts another on the same device.
  void restart();

  platform::simulated::SimulatedPlatform platform;
  platform::simulated::SimulatedLog log;
  platform::simulated::ScriptedService& service = platform.httpSessions().service();
  /// What /bag answers; change it at any time.
  json bag;
  /// Gives the bag the next version, and has the daemon fetch it.
  void publishBag();

  SableDaemon& daemon() { return *daemon_; }
  Assembly& assembly() { return daemon_->assembly(); }

  void run() { platform.runtime().run(); }
  void advance(platform::Duration duration) { platform.runtime().advance(duration); }
  /// Runs until an answer is there, for 30 s at most.
  void await(const PendingAnswer& answer);

  /// A connection, not yet configured.
  VirtualClient& connect(pid_t pid = 100);
  /// A configured connection.
  VirtualClient& client(std::string identifier = "com.kestrel.beacon", std::string agent = "Beacon/1");

  std::size_t sent(std::string_view path) const { return service.requests(path).size(); }
  std::int64_t counter(const std::string& key) { return platform.tally().value("com.kestrel.sabled." + key); }
  /// The bytes of bag.plist; empty when there is none.
  std::string bagFile();

 private:
  std::unique_ptr<SableDaemon> daemon_;
  std::deque<VirtualClient> clients_;
};

}  // namespace sable::test
