#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/ApplicationRegistry.h"
#include "platform/NotificationCenter.h"
#include "platform/host/FileWatcher.h"
#include "platform/host/Folders.h"
#include "platform/host/HostFacts.h"

namespace sable::platform::host {

/// The fact "applications"; without it the desktop entries of the data folders, each with its id
/// less ".desktop" for a bundle identifier, and with the version that its AppStream metadata, or an
/// AppImage's entry itself, tells. An entry whose TryExec is not there, or that is hidden, does not
/// count; one that menus do not show does. Nothing is kept and nothing is read before it is asked
/// for; the folders are watched.
class HostApplicationRegistry final : public ApplicationRegistry {
 public:
  HostApplicationRegistry(const Folders& folders, const HostFacts& facts, Reactor& reactor,
                          NotificationCenter& notificationCenter);

  std::vector<InstalledApplication> installedApplications() override;

 private:
  using Versions = std::map<std::string, std::string, std::less<>>;

  std::vector<std::filesystem::path> watchedFolders() const;
  Versions versionsByDesktopId() const;
  bool isInstalled(const std::string& tryExec) const;

  const std::vector<std::filesystem::path> dataFolders_;
  const HostFacts& facts_;
  FileWatcher watcher_;
};

}  // namespace sable::platform::host
