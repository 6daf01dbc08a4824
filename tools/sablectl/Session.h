#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "SableKit/SBLClient.h"
#include "tools/sablectl/Host.h"

namespace sable::sablectl {

/// What became of one request.
struct Answer {
  std::uint64_t queryId = 0;
  std::optional<SBLReply> reply;
  std::optional<Error> error;
  bool verbose = false;  ///< whether the request asked where the reply came from
  double milliseconds = 0;
};

struct Bag {
  std::string json;
  std::string userAgent;
};

/// One client's connection to the daemon, and waiting for what it answers. Main thread; every
/// operation blocks until the answer is there, or `timeout` has passed: that is an error of
/// kRelayErrorDomain.
class Session {
 public:
  Session(Host& host, SBLSessionConfiguration configuration, platform::Duration timeout);
  ~Session();

  /// Opens and configures the connection. An error of kPOSIXErrorDomain: nobody listens there.
  Expected<void> connect();
  Answer request(const SBLAnyRequest& request);
  Answer request(const std::string& className, const platform::RelayRecord& record);
  Expected<Bag> bag();
  /// Loads images; the daemon has the time-out to do so, and a second more to say what has come.
  Expected<SBLClient::Images> loadImages(const std::vector<SBLImageDescription>& descriptions);
  /// Any other method that the daemon exports.
  Expected<platform::RelayArguments> call(const platform::RelayInterface& interface, std::size_t method,
                                          platform::RelayArguments arguments);

 private:
  template <class Result, class Start>
  std::optional<Result> await(Start start, platform::Duration grace = {});

  platform::Runtime& runtime_;
  const platform::Duration timeout_;
  const std::shared_ptr<SBLClient> client_;
};

/// Exit codes; scripts tell them apart.
enum ExitCode {
  kExitSuccess = 0,
  kExitError = 1,     ///< the daemon answered with an error
  kExitUsage = 2,     ///< the command line is none
  kExitNoDaemon = 3,  ///< nobody listens
  kExitTimeout = 4,   ///< no answer in time
};

/// The exit code for the error of a call on an open connection.
ExitCode exitCodeFor(const Error& error);

}  // namespace sable::sablectl
