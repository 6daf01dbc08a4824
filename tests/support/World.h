#pragma once

#include <sys/types.h>

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace sable::test {

/// A program that runs until it is ended, at the latest with its object.
class Program {
 public:
  /// Starts `arguments` (the program's path first) with `environment` added; its standard output
  /// comes through a pipe, its standard error goes into the file `errors`.
  Program(const std::vector<std::string>& arguments, const std::map<std::string, std::string>& environment,
          const std::filesystem::path& errors);
  ~Program();
  Program(const Program&) = delete;
  Program& operator=(const Program&) = delete;

  pid_t pid() const { return pid_; }
  /// The next line of standard output; waits for it. Empty at the end.
  std::string readLine();
  /// The rest of standard output; waits for its end.
  std::string readAll();
  /// Sends a signal, if it still runs.
  void signal(int number) const;
  /// Waits for its end: the exit code, or 128 plus the signal that ended it.
  int wait();

 private:
  pid_t pid_ = -1;
  int output_ = -1;
  std::string buffer_;
  std::optional<int> status_;
};

struct CommandResult {
  int exitCode;
  std::string output;
  std::string errors;
};

/// The real programs in folders of their own: sable-service, sabled and whatever talks to them.
class World {
 public:
  struct Options {
    std::vector<std::string> serviceArguments = {};  ///< added to sable-service's
    std::string settings = {};                       ///< added to the user's defaults.toml
    std::string facts = "locale = \"en_GB\"\ncountry_code = \"GB\"\n";
    std::string bagURL = {};  ///< of another service: sable-service is not started then
    std::map<std::string, std::string> environment = {};  ///< set over the daemon's usual variables
    bool startDaemon = true;
  };

  explicit World(Options options);
  World() : World(Options()) {}
  ~World();

  /// Starts it and waits until it listens; throws what it said when it ends before.
  void startDaemon(const std::vector<std::string>& arguments = {"--log-level", "info"});
  void killDaemon();
  Program& daemon() { return *daemon_; }

  std::string socket() const { return (root_ / "run" / "relay.sock").string(); }
  std::string address() const { return "unix:path=" + socket(); }
  std::filesystem::path folder(std::string_view name) const { return root_ / name; }
  const std::string& serviceURL() const { return serviceURL_; }

  /// Runs a program to its end.
  CommandResult run(const std::vector<std::string>& arguments) const;
  CommandResult sabled(std::vector<std::string> arguments) const;
  /// Starts a program that writes its errors into the daemon's log.
  std::unique_ptr<Program> start(const std::vector<std::string>& arguments) const;
  CommandResult sablectl(std::vector<std::string> arguments) const;
  /// Runs sablectl --json and reads what it prints.
  nlohmann::json sablectlJSON(std::vector<std::string> arguments) const;

  /// What the service has recorded for a path; waits until there are `count` of them.
  std::vector<nlohmann::json> requests(std::string_view path, std::size_t count) const;
  /// What the daemon has logged.
  std::string daemonErrors() const;
  /// Waits until it has logged `text`, `count` times.
  void waitForLog(std::string_view text, std::size_t count = 1) const;

  /// Where a program built with the tests stands.
  static std::string program(std::string_view name);

 private:
  std::map<std::string, std::string> environment() const;
  void waitUntilDaemonListens() const;
  void startService(const std::vector<std::string>& arguments);

  const std::map<std::string, std::string> environment_;
  std::filesystem::path root_;
  std::string serviceURL_;
  std::unique_ptr<Program> service_, daemon_;
};

std::string readFile(const std::filesystem::path& path);
/// How often `part` stands in `text`.
std::size_t occurrences(std::string_view text, std::string_view part);
void writeFile(const std::filesystem::path& path, std::string_view text);

/// Waits until `holds` does, asking again whenever something in `folder` changes; fails the process
/// after 30 s.
void waitForChange(const std::filesystem::path& folder, const std::function<bool()>& holds);

}  // namespace sable::test
