#include "platform/host/HostFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <functional>

#include "platform/host/OpenFiles.h"
#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

tl::unexpected<Error> failed(int number, const Path& path) {
  return tl::unexpected(posixError(number, path.native()));
}

/// Of a name that leaves no room for more, only the beginning: files that share it take turns.
std::string replacementName(const std::string& name) {
  constexpr std::string_view kAround = "..new";
  return "." + name.substr(0, NAME_MAX - kAround.size()) + ".new";
}

/// 0, or an errno value.
int lockExclusively(int file) {
  while (flock(file, LOCK_EX) != 0) {
    if (errno != EINTR) return errno;
  }
  return 0;
}

/// Opens the replacement file and waits for its lock. Who held the lock before may have renamed
/// the file away: then it is no longer the one of this name, and the next one is tried.
Expected<Descriptor> openReplacement(int folder, const std::string& name, const Path& path) {
  for (;;) {
    Descriptor file(openat(folder, name.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                           S_IRUSR | S_IWUSR));
    if (!file) return failed(errno, path);
    if (const int number = lockExclusively(file.number()); number != 0) return failed(number, path);
    struct stat opened {
    }, named{};
    if (fstat(file.number(), &opened) != 0) return failed(errno, path);
    if (fstatat(folder, name.c_str(), &named, AT_SYMLINK_NOFOLLOW) != 0) {
      if (errno == ENOENT) continue;
      return failed(errno, path);
    }
    if (opened.st_ino != named.st_ino || opened.st_dev != named.st_dev) continue;
    if (!S_ISREG(opened.st_mode) || opened.st_uid != geteuid() || opened.st_nlink != 1) {
      return failed(EPERM, path);
    }
    if (fchmod(file.number(), S_IRUSR | S_IWUSR) != 0) return failed(errno, path);
    return file;
  }
}

/// 0, or an errno value.
int writeAll(int file, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::write(file, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return 0;
}

/// 0, or an errno value.
int copyAll(int from, int to) {
  std::array<char, 65536> bytes;
  for (;;) {
    const ssize_t count = ::read(from, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    if (count == 0) return 0;
    if (const int number = writeAll(to, {bytes.data(), static_cast<std::size_t>(count)}); number != 0)
      return number;
  }
}

int synchronize(int file) {
  return fsync(file) == 0 ? 0 : errno;
}

int synchronizeFolder(int folder) {
  const Descriptor readable(openat(folder, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return readable && fsync(readable.number()) == 0 ? 0 : errno;
}

/// Replaces the file `path` by what `write` puts into an empty one; it returns 0 or an errno value.
Expected<void> replaceWith(const Path& path, const std::function<int(int file)>& write) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  const std::string name = path.filename();
  const std::string newName = replacementName(name);
  const auto file = openReplacement(folder->number(), newName, path);
  if (!file) return tl::unexpected(file.error());

  int number = ftruncate(file->number(), 0) == 0 ? write(file->number()) : errno;
  if (number == 0) number = synchronize(file->number());
  if (number == 0 && renameat(folder->number(), newName.c_str(), folder->number(), name.c_str()) != 0) {
    number = errno;
  }
  if (number != 0) {
    unlinkat(folder->number(), newName.c_str(), 0);
    return failed(number, path);
  }
  if (number = synchronizeFolder(folder->number()); number != 0) return failed(number, path);
  return {};
}

}  // namespace

Expected<Path> HostFileManager::cachesDirectory() {
  if (auto created = createDirectory(folders_.userCaches); !created) {
    return tl::unexpected(std::move(created.error()));
  }
  return folders_.userCaches;
}

Expected<void> HostFileManager::createDirectory(const Path& path) {
  if (auto folder = openTrustedFolder(path, MissingFolders::create); !folder) {
    return tl::unexpected(std::move(folder.error()));
  }
  return {};
}

Expected<std::string> HostFileManager::read(const Path& path, std::size_t maximumBytes) {
  const auto file = openTrustedFile(path, LastLink::refuse);
  if (!file) return tl::unexpected(file.error());
  return readWhole(*file, path, maximumBytes);
}

Expected<void> HostFileManager::writeAtomically(const Path& path, std::string_view bytes) {
  return replaceWith(path, [bytes](int file) { return writeAll(file, bytes); });
}

Expected<void> HostFileManager::replaceItem(const Path& path, const Path& replacement) {
  const auto file = openTrustedFile(replacement, LastLink::refuse);
  if (!file) return tl::unexpected(file.error());
  const auto source = openTrustedFolder(replacement.parent_path(), MissingFolders::fail);
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!source || !folder) return tl::unexpected(source ? folder.error() : source.error());
  if (fchmod(file->number(), S_IRUSR | S_IWUSR) != 0) return failed(errno, replacement);
  if (const int number = synchronize(file->number()); number != 0) return failed(number, replacement);
  const std::string oldName = replacement.filename(), newName = path.filename();
  if (renameat(source->number(), oldName.c_str(), folder->number(), newName.c_str()) == 0) {
    const int number = synchronizeFolder(folder->number());
    return number == 0 ? Expected<void>() : failed(number, path);
  }
  if (errno != EXDEV) return failed(errno, path);
  auto copied = replaceWith(path, [&file](int to) { return copyAll(file->number(), to); });
  if (copied) unlinkat(source->number(), oldName.c_str(), 0);
  return copied;
}

Expected<void> HostFileManager::remove(const Path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  const std::string name = path.filename();
  if (unlinkat(folder->number(), name.c_str(), 0) != 0) return failed(errno, path);
  return {};
}

Expected<Path> HostFileManager::temporaryDirectory() {
  if (auto created = createDirectory(folders_.temporary()); !created) {
    return tl::unexpected(std::move(created.error()));
  }
  return folders_.temporary();
}

Expected<Path> HostFileManager::createUniqueFile(const Path& path) {
  // Refuses a folder that somebody else has prepared; nobody else can change it afterwards.
  if (const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail); !folder) {
    return tl::unexpected(folder.error());
  }
  std::string name = path;
  const Descriptor file(mkostemp(name.data(), O_CLOEXEC));
  if (!file) return failed(errno, path);
  return name;
}

Expected<void> HostFileManager::createFile(const Path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  const Descriptor file(openat(folder->number(), path.filename().c_str(),
                               O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!file || fchmod(file.number(), S_IRUSR | S_IWUSR) != 0) return failed(errno, path);
  return {};
}

Expected<std::unique_ptr<AppendableFile>> HostFileManager::openForAppending(const Path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  Descriptor file(openat(folder->number(), path.filename().c_str(),
                         O_WRONLY | O_APPEND | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat status {};
  if (!file || fstat(file.number(), &status) != 0) return failed(errno, path);
  if (const int number = refusalOf(status.st_mode); number != 0) return failed(number, path);
  return std::make_unique<HostAppendableFile>(std::move(file), path);
}

Expected<std::unique_ptr<ReadableFile>> HostFileManager::openForReading(const Path& path) {
  auto file = openTrustedFile(path, LastLink::refuse);
  if (!file) return tl::unexpected(std::move(file.error()));
  return std::make_unique<HostReadableFile>(*std::move(file), path);
}

Expected<FileAttributes> HostFileManager::attributes(const Path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  return attributesAt(folder->number(), path.filename().c_str(), AT_SYMLINK_NOFOLLOW, path);
}

Expected<std::vector<std::string>> HostFileManager::list(const Path& path) {
  const auto folder = openTrustedFolder(path, MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  const int readable = openat(folder->number(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(readable < 0 ? nullptr : fdopendir(readable), closedir);
  if (!stream) return failed(errno, path);
  std::vector<std::string> names;
  errno = 0;
  while (const dirent* entry = readdir(stream.get())) {  // NOLINT(concurrency-mt-unsafe): own stream
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") names.emplace_back(name);
  }
  if (errno != 0) return failed(errno, path);
  std::ranges::sort(names);
  return names;
}

}  // namespace sable::platform::host
