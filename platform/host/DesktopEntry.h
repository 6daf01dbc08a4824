#pragma once

#include <filesystem>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace sable::platform::host {

/// What a .desktop file says of an application (Desktop Entry Specification 1.5).
struct DesktopEntry {
  bool isApplication = false;
  bool isHidden = false;   ///< as if there were no such file, nor one of the same name further down
  std::string tryExec;     ///< the application is there when this program is; empty: it is
  std::string appVersion;  ///< of an AppImage; empty for all others
};

/// Reads any text; what is not understood is passed over.
DesktopEntry parseDesktopEntry(std::string_view text);

/// The desktop entries in a folder "applications" and those below it, by desktop file id: the path
/// from there, '/' replaced by '-'. Empty where there is no such folder.
std::map<std::string, std::filesystem::path> desktopFilesIn(const std::filesystem::path& folder);

/// What an AppStream metainfo file says of an application (AppStream 1.0, sections 2.1 and 2.2).
struct AppStreamComponent {
  std::vector<std::string> desktopIds;  ///< of the entries that start it
  std::string version;                  ///< of the newest release; empty when none is told
  std::string releasesFile;  ///< in the folder "releases" beside it, that tells it instead; or empty
};

/// Without ids when the text is no such file.
AppStreamComponent parseAppStream(std::string_view text);

/// The version of the newest release in such a file of releases (AppStream 1.0, "Release information"); empty
/// when none is told.
std::string newestRelease(std::string_view text);

}  // namespace sable::platform::host
