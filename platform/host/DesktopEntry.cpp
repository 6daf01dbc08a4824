#include "platform/host/DesktopEntry.h"

#include <algorithm>
#include <pugixml.hpp>
#include <system_error>

namespace sable::platform::host {

namespace {

constexpr std::string_view kSuffix = ".desktop";
constexpr std::size_t kMaximumFiles = 16384;  ///< in a folder

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kBlanks = " \t\r";
  const auto begin = std::min(text.find_first_not_of(kBlanks), text.size());
  return text.substr(begin, text.find_last_not_of(kBlanks) + 1 - begin);
}

void take(DesktopEntry& entry, std::string_view key, std::string_view value) {
  if (key == "Type") entry.isApplication = value == "Application";
  if (key == "Hidden") entry.isHidden = value == "true";
  if (key == "TryExec") entry.tryExec = value;
  if (key == "X-AppImage-Version") entry.appVersion = value;
}

/// The first release of a list is the newest.
std::string newestOf(const pugi::xml_node& releases) {
  return releases.child("release").attribute("version").value();
}

}  // namespace

DesktopEntry parseDesktopEntry(std::string_view text) {
  DesktopEntry entry;
  for (bool isInGroup = false; !text.empty();) {
    const auto end = std::min(text.find('\n'), text.size());
    const std::string_view line = trimmed(text.substr(0, end));
    text.remove_prefix(std::min(end + 1, text.size()));
    if (line.starts_with('[')) isInGroup = line == "[Desktop Entry]";
    const auto sign = line.find('=');
    if (!isInGroup || sign == line.npos || line.starts_with('#')) continue;
    take(entry, trimmed(line.substr(0, sign)), trimmed(line.substr(sign + 1)));
  }
  return entry;
}

std::map<std::string, std::filesystem::path> desktopFilesIn(const std::filesystem::path& folder) {
  std::map<std::string, std::filesystem::path> files;
  std::error_code error;
  for (std::filesystem::recursive_directory_iterator at(folder, error), end;
       !error && at != end && files.size() < kMaximumFiles; at.increment(error)) {
    if (at->path().extension() != kSuffix) continue;
    std::string id = at->path().lexically_relative(folder);
    std::ranges::replace(id, '/', '-');
    files.try_emplace(std::move(id), at->path());
  }
  return files;
}

AppStreamComponent parseAppStream(std::string_view text) {
  pugi::xml_document document;
  if (!document.load_buffer(text.data(), text.size())) return {};
  const pugi::xml_node component = document.child("component");
  AppStreamComponent found;
  for (const pugi::xml_node launchable : component.children("launchable")) {
    if (launchable.attribute("type").value() != std::string_view("desktop-id")) continue;
    found.desktopIds.emplace_back(trimmed(launchable.child_value()));
  }
  const std::string name(trimmed(component.child_value("id")));
  const pugi::xml_node releases = component.child("releases");
  if (releases.attribute("type").value() == std::string_view("external") && name.find('/') == name.npos) {
    found.releasesFile = name + ".releases.xml";
  } else {
    found.version = newestOf(releases);
  }
  // Without a launchable the component is named after the desktop entry, with or without its suffix.
  if (found.desktopIds.empty() && !name.empty()) {
    found.desktopIds.push_back(name.ends_with(kSuffix) ? name : name + std::string(kSuffix));
  }
  return found;
}

std::string newestRelease(std::string_view text) {
  pugi::xml_document document;
  return document.load_buffer(text.data(), text.size()) ? newestOf(document.child("releases")) : "";
}

}  // namespace sable::platform::host
