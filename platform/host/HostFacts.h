#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/NotificationCenter.h"
#include "platform/host/FactsFile.h"
#include "platform/host/FileWatcher.h"
#include "platform/host/Folders.h"

namespace sable::platform::host {

/// Posted when the table "location" becomes another, or comes or goes.
inline constexpr std::string_view kLocationFactsDidChangeNotification = "LocationFactsDidChange";

/// Where the facilities look for facts about the host; tests give others.
struct HostSources {
  Environment environment = processEnvironment;
  std::filesystem::path root = "/";  ///< holds etc, sys, proc, usr
};

/// The facts files, the user's over the system's, key by key. Both are watched, and the host's
/// time zone with them; when the answers of a facility become others, its notification is posted,
/// on the thread that noticed. A fact of the wrong type is reported with file, line and key, and
/// keeps the last good value it had. Any thread.
class HostFacts {
 public:
  HostFacts(const Folders& folders, HostSources sources, Reactor& reactor,
            NotificationCenter& notificationCenter);
  ~HostFacts();

  /// Whether the facts files could be read when they were last looked at.
  bool areReadable();

  std::optional<std::string> string(std::string_view key) const;
  std::optional<bool> boolean(std::string_view key) const;
  std::optional<std::int64_t> integer(std::string_view key) const;
  std::optional<double> number(std::string_view key) const;
  std::optional<std::vector<std::string>> strings(std::string_view key) const;
  /// Null when there is none.
  std::shared_ptr<const Dictionary> table(std::string_view key) const;
  /// Likewise, an array.
  std::shared_ptr<const Dictionary> tables(std::string_view key) const;

  // What several facilities are asked about: the fact, else the host's answer.
  std::string localeIdentifier() const;
  std::string countryCode() const;
  std::string timeZoneName() const;

  const HostSources& sources() const { return sources_; }

 private:
  void reload();
  std::shared_ptr<const Dictionary> facts() const;
  std::shared_ptr<const Dictionary> find(std::string_view key, bool (Dictionary::*is)() const noexcept) const;
  std::vector<std::string> answers() const;

  const HostSources sources_;
  NotificationCenter& notificationCenter_;

  std::mutex reloading_;
  FactsFile system_, user_;
  std::vector<std::string> answers_;

  mutable std::mutex mutex_;
  std::shared_ptr<const Dictionary> facts_;  ///< null until the first reading is done

  std::unique_ptr<FileWatcher> watcher_;
};

}  // namespace sable::platform::host
