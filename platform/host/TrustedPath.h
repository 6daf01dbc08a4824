#pragma once

#include <sys/types.h>

#include <cstddef>
#include <filesystem>
#include <string>

#include "platform/Error.h"
#include "platform/host/Descriptor.h"

/// Opening files by paths that other users may have prepared. A path is walked component by
/// component, and a symbolic link on the way is followed only when this user or root owns it;
/// else the walk fails with ELOOP. Errors are of kPOSIXErrorDomain and name the path.
namespace sable::platform::host {

enum class MissingFolders { fail, create };  ///< create: with permissions 0700

/// The folder `path`, opened to be a base of openat() and its kin.
Expected<Descriptor> openTrustedFolder(const std::filesystem::path& path, MissingFolders missing);

enum class LastLink { refuse, follow };  ///< what to do when the file itself is a symbolic link

/// Opens a regular file for reading. Never waits, not on a FIFO either.
Expected<Descriptor> openTrustedFile(const std::filesystem::path& path, LastLink link);

/// Reads an open regular file whole; EFBIG when it is longer than `maximumBytes`.
Expected<std::string> readWhole(const Descriptor& file, const std::filesystem::path& path,
                                std::size_t maximumBytes);

}  // namespace sable::platform::host
