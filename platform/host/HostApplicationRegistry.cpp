#include "platform/host/HostApplicationRegistry.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <nlohmann/json.hpp>
#include <set>
#include <sstream>

#include "platform/host/DesktopEntry.h"
#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

constexpr std::string_view kFact = "applications";
constexpr std::size_t kMaximumEntryBytes = 1u << 20;
constexpr std::size_t kMaximumMetadataBytes = 4u << 20;
constexpr std::array kMetadataFolders{"metainfo", "appdata"};  // the second is what the first was once called

std::string textOf(const Path& path, std::size_t maximumBytes) {
  const auto file = openTrustedFile(path, LastLink::follow);
  return file ? readWhole(*file, path, maximumBytes).value_or("") : "";
}

std::vector<InstalledApplication> applicationsOf(const Dictionary& fact) {
  std::vector<InstalledApplication> applications;
  for (const Dictionary& table : fact) {
    applications.push_back({stringMember(table, "bundle_id").value_or(""),  //
                            stringMember(table, "version").value_or("")});
  }
  return applications;
}

bool isExecutable(const Path& path) {
  return access(path.c_str(), X_OK) == 0;
}

}  // namespace

HostApplicationRegistry::HostApplicationRegistry(const Folders& folders, const HostFacts& facts,
                                                 Reactor& reactor, NotificationCenter& notificationCenter)
    : dataFolders_(folders.data),
      facts_(facts),
      watcher_(reactor, watchedFolders(), [this, &notificationCenter] {
        if (facts_.tables(kFact) != nullptr) return;
        notificationCenter.post({kApplicationsDidChangeNotification, this, {}});
      }) {}

std::vector<Path> HostApplicationRegistry::watchedFolders() const {
  std::vector<Path> watched;
  for (const Path& folder : dataFolders_) {
    watched.push_back(folder / "applications" / "");
    for (const char* metadata : kMetadataFolders) watched.push_back(folder / metadata / "");
  }
  return watched;
}

std::vector<InstalledApplication> HostApplicationRegistry::installedApplications() {
  if (const auto fact = facts_.tables(kFact)) return applicationsOf(*fact);
  const Versions versions = versionsByDesktopId();
  std::vector<InstalledApplication> applications;
  std::set<std::string> seen;
  for (const Path& folder : dataFolders_) {
    for (const auto& [id, path] : desktopFilesIn(folder / "applications")) {
      if (!seen.insert(id).second) continue;
      const DesktopEntry entry = parseDesktopEntry(textOf(path, kMaximumEntryBytes));
      if (!entry.isApplication || entry.isHidden || !isInstalled(entry.tryExec)) continue;
      const auto version = versions.find(id);
      applications.push_back(
          {Path(id).stem(), version == versions.end() ? entry.appVersion : version->second});
    }
  }
  return applications;
}

HostApplicationRegistry::Versions HostApplicationRegistry::versionsByDesktopId() const {
  Versions versions;
  for (const Path& folder : dataFolders_) {
    for (const char* metadata : kMetadataFolders) {
      std::error_code error;
      for (std::filesystem::directory_iterator at(folder / metadata, error), end; !error && at != end;
           at.increment(error)) {
        if (at->path().extension() != ".xml") continue;
        AppStreamComponent component = parseAppStream(textOf(at->path(), kMaximumMetadataBytes));
        if (!component.releasesFile.empty()) {
          const Path releases = folder / metadata / "releases" / component.releasesFile;
          component.version = newestRelease(textOf(releases, kMaximumMetadataBytes));
        }
        if (component.version.empty()) continue;
        for (const std::string& id : component.desktopIds) versions.try_emplace(id, component.version);
      }
    }
  }
  return versions;
}

bool HostApplicationRegistry::isInstalled(const std::string& tryExec) const {
  if (tryExec.empty()) return true;
  if (tryExec.starts_with('/')) return isExecutable(tryExec);
  std::istringstream folders(facts_.sources().environment("PATH").value_or("/usr/local/bin:/usr/bin:/bin"));
  for (std::string folder; std::getline(folders, folder, ':');) {
    if (isExecutable(Path(folder) / tryExec)) return true;
  }
  return false;
}

}  // namespace sable::platform::host
