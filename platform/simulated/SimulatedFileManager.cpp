#include "platform/simulated/SimulatedFileManager.h"

#include <cerrno>

namespace sable::platform::simulated {

namespace {

using Path = std::filesystem::path;

tl::unexpected<Error> failed(int number, const Path& path) {
  return tl::unexpected(posixError(number, path.native()));
}

}  // namespace

Expected<void> SimulatedFileManager::check(const Path& path) const {
  if (failure_ != 0) return failed(failure_, path);
  return {};
}

Expected<Path> SimulatedFileManager::cachesDirectory() {
  const Path path = "/home/user/.cache";
  if (auto created = createDirectory(path); !created) return tl::unexpected(created.error());
  return path;
}

Expected<void> SimulatedFileManager::createDirectory(const Path& path) {
  if (auto checked = check(path); !checked) return checked;
  Path folder;
  for (const Path& component : path.lexically_normal()) {
    folder /= component;
    if (files_.contains(folder)) return failed(ENOTDIR, path);
    if (!component.empty()) directories_.insert(folder);
  }
  return {};
}

Expected<std::string> SimulatedFileManager::read(const Path& path, std::size_t maximumBytes) {
  if (auto checked = check(path); !checked) return tl::unexpected(checked.error());
  const auto found = files_.find(path.lexically_normal());
  if (found == files_.end())
    return failed(directories_.contains(path.lexically_normal()) ? EISDIR : ENOENT, path);
  if (found->second.size() > maximumBytes) return failed(EFBIG, path);
  return found->second;
}

Expected<void> SimulatedFileManager::writeAtomically(const Path& path, std::string_view bytes) {
  if (auto checked = check(path); !checked) return checked;
  const Path file = path.lexically_normal();
  if (directories_.contains(file)) return failed(EISDIR, path);
  if (!directories_.contains(file.parent_path())) return failed(ENOENT, path);
  files_.insert_or_assign(file, std::string(bytes));
  return {};
}

Expected<void> SimulatedFileManager::remove(const Path& path) {
  if (auto checked = check(path); !checked) return checked;
  const Path file = path.lexically_normal();
  if (directories_.contains(file)) return failed(EISDIR, path);
  if (files_.erase(file) == 0) return failed(ENOENT, path);
  return {};
}

}  // namespace sable::platform::simulated
