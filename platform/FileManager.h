#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/Runtime.h"

namespace sable::platform {

/// A regular file open for adding to its end; closed with the object. One thread at a time.
class AppendableFile {
 public:
  virtual ~AppendableFile() = default;
  /// Bytes in the file.
  virtual Expected<std::uint64_t> size() = 0;
  /// Adds both texts in one go, so that a process killed meanwhile leaves at most these torn. They
  /// reach the disk in the system's own time. After a failure some of them may be there.
  virtual Expected<void> append(std::string_view head, std::string_view body) = 0;
};

struct FileAttributes {
  std::uint64_t size = 0;  ///< bytes
  /// When the file came to be; for a copy that kept its time of change, that time, and so too
  /// where the file system does not know better.
  WallTime creationDate;
  bool isOwn = true;  ///< it belongs to the user that the daemon runs as
};

/// A regular file open for reading; closed with the object. One thread at a time.
class ReadableFile {
 public:
  virtual ~ReadableFile() = default;
  /// Of this very file, whatever stands under its name by now.
  virtual Expected<FileAttributes> attributes() = 0;
  /// A descriptor of it, open for reading only and set to its beginning, to be handed to another
  /// program; closed with its last holder.
  virtual Expected<std::shared_ptr<const int>> descriptor() = 0;
  /// All bytes of the file, fetched when they are looked at and valid as long as this object:
  /// nobody can take them away meanwhile by cutting the file. EFBIG when it is longer than
  /// `maximumBytes`. Once.
  virtual Expected<std::string_view> map(std::size_t maximumBytes) = 0;
};

/// Files of the daemon. Errors are of kPOSIXErrorDomain. May block on the disk. Any thread.
class FileManager {
 public:
  virtual ~FileManager() = default;

  /// The user's caches directory, created (0700) when missing.
  virtual Expected<std::filesystem::path> cachesDirectory() = 0;

  /// Creates a directory (0700) and its parents when missing.
  virtual Expected<void> createDirectory(const std::filesystem::path& path) = 0;

  /// Reads a regular file whole; EFBIG when it is longer than `maximumBytes`. Never follows a
  /// symbolic link, never waits on a FIFO.
  virtual Expected<std::string> read(const std::filesystem::path& path, std::size_t maximumBytes) = 0;

  /// Replaces the file whole, with permissions 0600: readers see the old bytes or the new ones,
  /// also after a power cut, never a mixture.
  virtual Expected<void> writeAtomically(const std::filesystem::path& path, std::string_view bytes) = 0;

  /// Moves the regular file `replacement` to `path`, whatever stood there, with permissions 0600: readers
  /// see the old bytes or the new ones, also after a power cut or a kill, never a mixture. Between file
  /// systems it is copied first. On failure `path` is as it was, and `replacement` is still there.
  virtual Expected<void> replaceItem(const std::filesystem::path& path,
                                     const std::filesystem::path& replacement) = 0;

  virtual Expected<void> remove(const std::filesystem::path& path) = 0;

  /// The folder for files that nobody misses after the process, created (0700) when missing.
  virtual Expected<std::filesystem::path> temporaryDirectory() = 0;
  /// Makes an empty file, 0600, and returns its path: `path` with its last six letters, "XXXXXX",
  /// replaced so that nothing had the name (POSIX, mkstemp).
  virtual Expected<std::filesystem::path> createUniqueFile(const std::filesystem::path& path) = 0;

  /// Makes an empty file, 0600; EEXIST where the name is taken, be it by a link or a folder.
  virtual Expected<void> createFile(const std::filesystem::path& path) = 0;

  // A symbolic link is refused by these three with ELOOP, a folder with EISDIR, and what is no
  // regular file either with another error; none waits on a FIFO.
  virtual Expected<std::unique_ptr<AppendableFile>> openForAppending(const std::filesystem::path& path) = 0;
  virtual Expected<std::unique_ptr<ReadableFile>> openForReading(const std::filesystem::path& path) = 0;
  virtual Expected<FileAttributes> attributes(const std::filesystem::path& path) = 0;

  /// The names in a folder, of whatever they are, sorted.
  virtual Expected<std::vector<std::string>> list(const std::filesystem::path& path) = 0;
};

}  // namespace sable::platform
