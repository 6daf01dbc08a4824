#include "platform/host/Folders.h"

#include <pwd.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <sstream>

#include "platform/Subsystem.h"

namespace sable::platform::host {

namespace {

constexpr std::string_view kName = kSubsystem;

using Path = std::filesystem::path;

std::optional<Path> absolute(const std::optional<std::string>& text) {
  if (!text) return std::nullopt;
  std::error_code error;
  Path path = std::filesystem::absolute(*text, error);
  return error ? std::nullopt : std::optional(std::move(path));
}

std::optional<Path> xdgFolder(const Environment& environment, const char* name) {
  auto value = environment(name);
  if (!value || value->front() != '/') return std::nullopt;
  return Path(*std::move(value));
}

Path homeFolder(const Environment& environment) {
  if (auto home = xdgFolder(environment, "HOME")) return *home;
  std::array<char, 4096> buffer{};
  passwd entry{};
  passwd* found = nullptr;
  if (getpwuid_r(getuid(), &entry, buffer.data(), buffer.size(), &found) == 0 && found != nullptr) {
    return found->pw_dir;
  }
  return "/";
}

std::vector<Path> dataFolders(const Environment& environment, const Path& home) {
  std::vector<Path> folders{xdgFolder(environment, "XDG_DATA_HOME").value_or(home / ".local" / "share")};
  std::istringstream list(environment("XDG_DATA_DIRS").value_or("/usr/local/share:/usr/share"));
  for (std::string folder; std::getline(list, folder, ':');) {
    if (folder.starts_with('/')) folders.emplace_back(std::move(folder));
  }
  return folders;
}

}  // namespace

std::optional<std::string> processEnvironment(const char* name) {
  const char* value = std::getenv(name);  // NOLINT(concurrency-mt-unsafe): nobody sets variables
  if (value == nullptr || *value == '\0') return std::nullopt;
  return value;
}

Folders Folders::fromEnvironment(const Environment& environment) {
  const auto given = [&](const char* name) { return absolute(environment(name)); };
  const auto below = [&](const char* xdg, const Path& usual) {
    return xdgFolder(environment, xdg).value_or(usual);
  };
  const Path home = homeFolder(environment);
  const Path etc = Path("/etc") / kName;

  Folders folders;
  folders.runtime =
      given("SABLED_RUNTIME_DIR")
          .value_or(below("XDG_RUNTIME_DIR", Path("/run/user") / std::to_string(getuid())) / kName);
  folders.userCaches = given("SABLED_CACHES_DIR").value_or(below("XDG_CACHE_HOME", home / ".cache"));
  folders.caches = folders.userCaches / kName;
  folders.state =
      given("SABLED_STATE_DIR").value_or(below("XDG_STATE_HOME", home / ".local" / "state") / kName);
  folders.config = given("SABLED_CONFIG_DIR").value_or(below("XDG_CONFIG_HOME", home / ".config") / kName);
  folders.data = dataFolders(environment, home);
  folders.profileSettings = given("SABLED_PROFILE").value_or(etc / "defaults.toml");
  folders.systemFacts = etc / "facts.toml";
  return folders;
}

}  // namespace sable::platform::host
