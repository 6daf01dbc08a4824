#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace sable {

/// A file that the bag wants kept on the device.
struct DownloadResource {
  std::string identifier;   ///< its key in the bag, and its file's name
  std::string url;          ///< of its last download, for comparison; empty before there was one
  std::string redirectUrl;  ///< where that download was sent, likewise; empty: nowhere else
};

/// Whether an identifier from the bag or a client can be a file's name among the daemon's own: one
/// plain name of 1 to 255 bytes, not hidden, without controls, and none that the daemon uses itself.
bool isResourceIdentifier(std::string_view identifier);

/// The URL as it is kept and compared: its query in the form that requests give it (one item a name,
/// the last, in the order of names) without "key", and no fragment. So neither another API key nor
/// another order of items makes another resource. nullopt for what is no URL.
std::optional<std::string> urlForCompare(std::string_view url);

/// The value of the first query item "version"; "" where there is none.
std::string versionFromURL(std::string_view url);

}  // namespace sable
