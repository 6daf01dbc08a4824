#include "tests/support/World.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <stdexcept>

extern char** environ;

namespace sable::test {
namespace {

constexpr int kPatienceMilliseconds = 30'000;

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (std::string& string : strings) result.push_back(string.data());
  result.push_back(nullptr);
  return result;
}

std::vector<std::string> environmentWith(const std::map<std::string, std::string>& added) {
  std::vector<std::string> result;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    const std::string text = *entry;
    const std::string name = text.substr(0, text.find('='));
    if (!added.contains(name)) result.push_back(text);
  }
  for (const auto& [name, value] : added) result.push_back(name + "=" + value);
  return result;
}

/// Whether a socket at the path takes connections, told without making one.
bool isListening(const std::string& path) {
  constexpr unsigned kAcceptsConnections = 0x10000;  // __SO_ACCEPTCON in the kernel's column of flags
  std::ifstream sockets("/proc/net/unix");
  for (std::string line; std::getline(sockets, line);) {
    if (!line.ends_with(" " + path)) continue;
    std::istringstream fields(line);
    std::string number, references, protocol, flags;
    fields >> number >> references >> protocol >> flags;
    if ((std::stoul(flags, nullptr, 16) & kAcceptsConnections) != 0) return true;
  }
  return false;
}

}  // namespace

std::string readFile(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

std::size_t occurrences(std::string_view text, std::string_view part) {
  std::size_t count = 0;
  for (std::size_t at = 0; (at = text.find(part, at)) != std::string_view::npos; at += part.size()) ++count;
  return count;
}

void writeFile(const std::filesystem::path& path, std::string_view text) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << text;
}

void waitForChange(const std::filesystem::path& folder, const std::function<bool()>& holds) {
  const int watch = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  std::filesystem::create_directories(folder);
  inotify_add_watch(watch, folder.c_str(), IN_CREATE | IN_MODIFY | IN_MOVED_TO | IN_ATTRIB | IN_DELETE);
  while (!holds()) {
    pollfd descriptor{watch, POLLIN, 0};
    if (poll(&descriptor, 1, kPatienceMilliseconds) <= 0) {
      close(watch);
      throw std::runtime_error("waited in vain for a change in " + folder.string());
    }
    char events[4096];
    while (read(watch, events, sizeof events) > 0) {
    }
  }
  close(watch);
}

Program::Program(const std::vector<std::string>& arguments,
                 const std::map<std::string, std::string>& environment, const std::filesystem::path& errors) {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, ends[1], 1);
  posix_spawn_file_actions_addopen(&actions, 2, errors.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  std::vector<std::string> words = arguments, variables = environmentWith(environment);
  const int failure = posix_spawnp(&pid_, words[0].c_str(), &actions, nullptr, pointers(words).data(),
                                   pointers(variables).data());
  posix_spawn_file_actions_destroy(&actions);
  close(ends[1]);
  output_ = ends[0];
  if (failure != 0) throw std::runtime_error("cannot start " + words[0]);
}

Program::~Program() {
  if (!status_) {
    signal(SIGKILL);
    wait();
  }
  close(output_);
}

std::string Program::readLine() {
  for (;;) {
    if (const auto end = buffer_.find('\n'); end != std::string::npos) {
      std::string line = buffer_.substr(0, end);
      buffer_.erase(0, end + 1);
      return line;
    }
    char bytes[4096];
    const ssize_t count = read(output_, bytes, sizeof bytes);
    if (count <= 0) return std::exchange(buffer_, {});
    buffer_.append(bytes, static_cast<std::size_t>(count));
  }
}

std::string Program::readAll() {
  char bytes[65536];
  for (ssize_t count; (count = read(output_, bytes, sizeof bytes)) > 0;) {
    buffer_.append(bytes, static_cast<std::size_t>(count));
  }
  return std::exchange(buffer_, {});
}

void Program::signal(int number) const {
  if (!status_) kill(pid_, number);
}

int Program::wait() {
  if (!status_) {
    int status = 0;
    waitpid(pid_, &status, 0);
    status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  return *status_;
}

World::World(Options options) : environment_(std::move(options.environment)) {
  char folder[] = "/tmp/sabled-test-XXXXXX";
  if (mkdtemp(folder) == nullptr) throw std::runtime_error("mkdtemp");
  root_ = folder;
  for (const char* name : {"run", "caches", "state", "config", "record", "data"}) {
    std::filesystem::create_directory(root_ / name);
    chmod((root_ / name).c_str(), 0700);
  }
  if (options.bagURL.empty()) {
    startService(options.serviceArguments);
    options.bagURL = serviceURL_ + "/bag";
  }
  writeFile(root_ / "config" / "defaults.toml",
            "SBLDefaultBagURL = \"" + options.bagURL + "\"\n" + options.settings + "\n");
  writeFile(root_ / "config" / "facts.toml", options.facts);
  if (options.startDaemon) startDaemon();
}

World::~World() {
  daemon_.reset();
  service_.reset();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

std::map<std::string, std::string> World::environment() const {
  auto variables = environment_;
  variables.merge(std::map<std::string, std::string>{{"SABLED_RUNTIME_DIR", root_ / "run"},
                                                     {"SABLED_CACHES_DIR", root_ / "caches"},
                                                     {"SABLED_STATE_DIR", root_ / "state"},
                                                     {"SABLED_CONFIG_DIR", root_ / "config"},
                                                     {"SABLED_PROFILE", root_ / "profile.toml"},
                                                     {"LC_ALL", "C.UTF-8"},
                                                     {"DBUS_SESSION_BUS_ADDRESS", "disabled:"},
                                                     {"DBUS_SYSTEM_BUS_ADDRESS", "disabled:"}});
  return variables;
}

void World::startService(const std::vector<std::string>& arguments) {
  // One index for all tests: building it takes seconds.
  const auto data = std::filesystem::path(program("sable-service")).parent_path() / "service-data";
  std::vector<std::string> words{program("sable-service"), "--data", data, "--record", root_ / "record"};
  words.insert(words.end(), arguments.begin(), arguments.end());
  service_ = std::make_unique<Program>(words, std::map<std::string, std::string>{}, root_ / "service.err");
  serviceURL_ = service_->readLine();
  if (serviceURL_.empty()) throw std::runtime_error("sable-service: " + readFile(root_ / "service.err"));
}

void World::startDaemon(const std::vector<std::string>& arguments) {
  std::vector<std::string> words{program("sabled")};
  words.insert(words.end(), arguments.begin(), arguments.end());
  daemon_ = start(words);
  waitUntilDaemonListens();
}

void World::waitUntilDaemonListens() const {
  constexpr int kLookAgainMilliseconds = 10;  // no event tells that a socket that is there listens
  const int ended = static_cast<int>(syscall(SYS_pidfd_open, daemon_->pid(), 0));
  while (!isListening(socket())) {
    pollfd descriptor{ended, POLLIN, 0};
    if (poll(&descriptor, 1, kLookAgainMilliseconds) == 0) continue;
    close(ended);
    throw std::runtime_error("sabled ended: " + daemonErrors());
  }
  close(ended);
}

void World::killDaemon() {
  daemon_->signal(SIGKILL);
  daemon_->wait();
}

CommandResult World::run(const std::vector<std::string>& arguments) const {
  std::filesystem::remove(root_ / "command.err");
  Program command(arguments, environment(), root_ / "command.err");
  CommandResult result;
  result.output = command.readAll();
  result.exitCode = command.wait();
  result.errors = readFile(root_ / "command.err");
  return result;
}

std::unique_ptr<Program> World::start(const std::vector<std::string>& arguments) const {
  return std::make_unique<Program>(arguments, environment(), root_ / "sabled.err");
}

CommandResult World::sabled(std::vector<std::string> arguments) const {
  arguments.insert(arguments.begin(), program("sabled"));
  return run(arguments);
}

CommandResult World::sablectl(std::vector<std::string> arguments) const {
  arguments.insert(arguments.begin(), program("sablectl"));
  return run(arguments);
}

nlohmann::json World::sablectlJSON(std::vector<std::string> arguments) const {
  arguments.insert(arguments.begin(), "--json");
  return nlohmann::json::parse(sablectl(std::move(arguments)).output, nullptr, false);
}

std::vector<nlohmann::json> World::requests(std::string_view path, std::size_t count) const {
  std::vector<nlohmann::json> found;
  waitForChange(root_ / "record", [&] {
    found.clear();
    std::istringstream lines(readFile(root_ / "record" / "requests.jsonl"));
    for (std::string line; std::getline(lines, line);) {
      auto request = nlohmann::json::parse(line, nullptr, false);
      if (request.is_object() && request["path"] == path) found.push_back(std::move(request));
    }
    return found.size() >= count;
  });
  return found;
}

std::string World::daemonErrors() const {
  return readFile(root_ / "sabled.err");
}

void World::waitForLog(std::string_view text, std::size_t count) const {
  waitForChange(root_, [&] { return occurrences(daemonErrors(), text) >= count; });
}

std::string World::program(std::string_view name) {
  const char* folder = std::getenv("SABLED_PROGRAMS");
  return (std::filesystem::path(folder != nullptr ? folder : SABLED_PROGRAMS) / name).string();
}

}  // namespace sable::test
