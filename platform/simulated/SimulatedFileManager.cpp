#include "platform/simulated/SimulatedFileManager.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>

namespace sable::platform::simulated {

namespace {

using Path = std::filesystem::path;

tl::unexpected<Error> failed(int number, const Path& path) {
  return tl::unexpected(posixError(number, path.native()));
}

}  // namespace

/// What is appended to a file that has been removed meanwhile is gone, as on a disk.
class SimulatedFileManager::Appendable final : public AppendableFile {
 public:
  Appendable(SimulatedFileManager& files, const Path& path) : files_(files), path_(path) {}

  Expected<std::uint64_t> size() override {
    const auto file = files_.find(path_);
    if (!file) return tl::unexpected(file.error());
    return (*file)->size();
  }
  Expected<void> append(std::string_view head, std::string_view body) override {
    if (auto checked = files_.check(path_, true); !checked) return checked;
    const auto file = files_.find(path_);
    if (file) (*file)->append(head).append(body);
    if (!file && file.error().code != ENOENT) return tl::unexpected(file.error());
    return {};
  }

 private:
  SimulatedFileManager& files_;
  const Path path_;
};

class SimulatedFileManager::Readable final : public ReadableFile {
 public:
  Readable(std::string bytes, WallTime created, const Path& path)
      : bytes_(std::move(bytes)), created_(created), path_(path) {}

  Expected<FileAttributes> attributes() override { return FileAttributes{bytes_.size(), created_}; }
  /// Of the system's own: who is handed it reads it with the system's means.
  Expected<std::shared_ptr<const int>> descriptor() override {
    const int memory = memfd_create("simulated", MFD_CLOEXEC | MFD_ALLOW_SEALING);
    const std::shared_ptr<const int> held(new int(memory), [](const int* number) {
      close(*number);
      delete number;
    });
    if (memory < 0 || pwrite(memory, bytes_.data(), bytes_.size(), 0) < 0 ||
        fcntl(memory, F_ADD_SEALS, F_SEAL_WRITE) != 0)
      return failed(errno, path_);
    return held;
  }
  Expected<std::string_view> map(std::size_t maximumBytes) override {
    if (bytes_.size() > maximumBytes) return failed(EFBIG, path_);
    return std::string_view(bytes_);
  }

 private:
  const std::string bytes_;
  const WallTime created_;
  const Path path_;
};

Expected<void> SimulatedFileManager::check(const Path& path, bool needsRoom) const {
  if (failure_ == 0 || (failure_ == ENOSPC && !needsRoom)) return {};
  if (operationsLeft_ == 0) return failed(failure_, path);
  --operationsLeft_;
  return {};
}

Expected<std::string*> SimulatedFileManager::find(const Path& path) {
  if (auto checked = check(path, false); !checked) return tl::unexpected(checked.error());
  const Path file = path.lexically_normal();
  if (const auto found = files_.find(file); found != files_.end()) return &found->second;
  return failed(directories_.contains(file) ? EISDIR : ENOENT, path);
}

Expected<Path> SimulatedFileManager::cachesDirectory() {
  const Path path = "/home/user/.cache";
  if (auto created = createDirectory(path); !created) return tl::unexpected(created.error());
  return path;
}

Expected<void> SimulatedFileManager::createDirectory(const Path& path) {
  if (auto checked = check(path, true); !checked) return checked;
  Path folder;
  for (const Path& component : path.lexically_normal()) {
    folder /= component;
    if (files_.contains(folder)) return failed(ENOTDIR, path);
    if (!component.empty()) directories_.insert(folder);
  }
  return {};
}

Expected<std::string> SimulatedFileManager::read(const Path& path, std::size_t maximumBytes) {
  const auto file = find(path);
  if (!file) return tl::unexpected(file.error());
  if ((*file)->size() > maximumBytes) return failed(EFBIG, path);
  return **file;
}

Expected<void> SimulatedFileManager::writeAtomically(const Path& path, std::string_view bytes) {
  if (auto checked = check(path, true); !checked) return checked;
  const Path file = path.lexically_normal();
  if (directories_.contains(file)) return failed(EISDIR, path);
  if (!directories_.contains(file.parent_path())) return failed(ENOENT, path);
  files_.insert_or_assign(file, std::string(bytes));
  creationDates_.insert_or_assign(file, clock_.now());
  return {};
}

Expected<void> SimulatedFileManager::replaceItem(const Path& path, const Path& replacement) {
  const auto from = find(replacement);
  if (!from) return tl::unexpected(from.error());
  const Path source = replacement.lexically_normal(), target = path.lexically_normal();
  if (directories_.contains(target)) return failed(EISDIR, path);
  if (!directories_.contains(target.parent_path())) return failed(ENOENT, path);
  if (source == target) return {};
  // At once, as a rename: whoever is killed has done all of it or nothing.
  creationDates_.insert_or_assign(target, creationDates_.at(source));
  files_.insert_or_assign(target, std::move(**from));
  files_.erase(source);
  return {};
}

Expected<void> SimulatedFileManager::remove(const Path& path) {
  if (auto checked = check(path, false); !checked) return checked;
  const Path file = path.lexically_normal();
  if (directories_.contains(file)) return failed(EISDIR, path);
  if (files_.erase(file) == 0) return failed(ENOENT, path);
  return {};
}

Expected<Path> SimulatedFileManager::temporaryDirectory() {
  const Path path = "/home/user/.cache/com.kestrel.sabled/temporary";
  if (auto created = createDirectory(path); !created) return tl::unexpected(created.error());
  return path;
}

Expected<Path> SimulatedFileManager::createUniqueFile(const Path& path) {
  std::string name = path;
  const std::string number = std::to_string(1'000'000 + uniqueNames_++).substr(1);
  name.replace(name.size() - number.size(), number.size(), number);
  if (auto created = createFile(name); !created) return tl::unexpected(created.error());
  return name;
}

Expected<void> SimulatedFileManager::createFile(const Path& path) {
  const auto file = find(path);
  if (file || file.error().code == EISDIR) return failed(EEXIST, path);
  if (file.error().code != ENOENT) return tl::unexpected(file.error());
  return writeAtomically(path, "");
}

Expected<std::unique_ptr<AppendableFile>> SimulatedFileManager::openForAppending(const Path& path) {
  if (const auto file = find(path); !file) return tl::unexpected(file.error());
  return std::make_unique<Appendable>(*this, path);
}

Expected<std::unique_ptr<ReadableFile>> SimulatedFileManager::openForReading(const Path& path) {
  const auto file = find(path);
  if (!file) return tl::unexpected(file.error());
  return std::make_unique<Readable>(**file, creationDates_.at(path.lexically_normal()), path);
}

Expected<FileAttributes> SimulatedFileManager::attributes(const Path& path) {
  const auto file = find(path);
  if (!file) return tl::unexpected(file.error());
  return FileAttributes{(*file)->size(), creationDates_.at(path.lexically_normal())};
}

Expected<std::vector<std::string>> SimulatedFileManager::list(const Path& path) {
  if (auto checked = check(path, false); !checked) return tl::unexpected(checked.error());
  const Path folder = path.lexically_normal();
  if (!directories_.contains(folder)) return failed(files_.contains(folder) ? ENOTDIR : ENOENT, path);
  std::set<std::string> names;
  for (const auto& [file, bytes] : files_) {
    if (file.parent_path() == folder) names.insert(file.filename());
  }
  for (const Path& directory : directories_) {
    if (directory.parent_path() == folder && directory != folder) names.insert(directory.filename());
  }
  return std::vector<std::string>(names.begin(), names.end());
}

}  // namespace sable::platform::simulated
