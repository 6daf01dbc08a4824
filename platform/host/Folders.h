#pragma once

#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace sable::platform::host {

/// Looks an environment variable up; nullopt when it is not set, or empty.
using Environment = std::function<std::optional<std::string>(const char* name)>;

/// The variables of this process.
std::optional<std::string> processEnvironment(const char* name);

/// Where the daemon and its tools find their files. Paths are absolute; nothing is created here.
struct Folders {
  std::filesystem::path runtime;     ///< sockets (0700); gone after a reboot
  std::filesystem::path userCaches;  ///< of all programs
  std::filesystem::path caches;      ///< ours below it (0700)
  std::filesystem::path state;       ///< what must survive (0700)
  std::filesystem::path config;      ///< what the user writes
  /// Where programs put what others may read, the more important first.
  std::vector<std::filesystem::path> data;

  std::filesystem::path profileSettings;  ///< a file, as are all below
  std::filesystem::path systemFacts;

  /// Ours rather than everybody's: a daemon that is confined may write nowhere else.
  std::filesystem::path temporary() const { return caches / "temporary"; }
  std::filesystem::path socket() const { return runtime / "relay.sock"; }
  std::filesystem::path userSettings() const { return config / "defaults.toml"; }
  std::filesystem::path sharedSettings(std::string_view domain) const { return (config / domain) += ".toml"; }
  std::filesystem::path ownSettings() const { return state / "defaults.toml"; }
  std::filesystem::path userFacts() const { return config / "facts.toml"; }
  std::filesystem::path counters() const { return state / "counters.tally"; }
  std::filesystem::path interactions() const { return state / "activity" / "interactions.jsonl"; }
  std::filesystem::path activityRuns() const { return state / "activity" / "runs.json"; }
  std::filesystem::path privateReports() const { return state / "privacy" / "reports.jsonl"; }
  std::filesystem::path deepLinks() const {
    return state / "deeplinks";
  }  ///< a folder that applications fill

  std::filesystem::path hints() const { return state / "hints"; }  ///< a folder, as are these
  std::filesystem::path systemSubscriptions() const { return systemFacts.parent_path() / "subscriptions.d"; }
  std::filesystem::path userSubscriptions() const { return config / "subscriptions.d"; }

  /// Each folder is the first that is set of: its own variable (SABLED_RUNTIME_DIR, SABLED_CACHES_DIR,
  /// SABLED_STATE_DIR, SABLED_CONFIG_DIR; SABLED_PROFILE for the profile's file), the XDG variable
  /// (where absolute: XDG Base Directory Specification), the usual place below the home folder. Data
  /// folders are those of XDG_DATA_HOME and XDG_DATA_DIRS.
  static Folders fromEnvironment(const Environment& environment = processEnvironment);
};

}  // namespace sable::platform::host
