#pragma once

#include <filesystem>
#include <string>
#include <string_view>

#include "platform/Error.h"

/// Images that a command got: what they are, and where they may be written.
namespace sable::sablectl {

/// What the first bytes say an image is: "png", "jpeg", "gif", "webp", "avif", "bmp", "ico", "svg";
/// "?" for anything else.
std::string_view imageType(std::string_view bytes);

/// A plain file name for the image behind a URL or an identifier: its last word, of letters, digits
/// and "._-" only, neither hidden nor longer than 100 bytes; "image" where nothing is left.
std::string imageFileName(std::string_view urlOrIdentifier);

/// Writes a new file (0600) of that name into a folder, which is made (0700) where it is missing; a
/// name that is taken gets a number before its extension. Nothing is overwritten, no link followed.
/// The result is the path.
Expected<std::filesystem::path> saveImage(const std::filesystem::path& folder, const std::string& name,
                                          std::string_view bytes);

}  // namespace sable::sablectl
