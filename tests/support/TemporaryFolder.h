#pragma once

#include <sys/resource.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <string_view>

#include "platform/host/Folders.h"

namespace sable {

/// A folder of a test's own, gone with the test; its Folders lie below it.
class TemporaryFolder {
 public:
  explicit TemporaryFolder(const std::filesystem::path& parent = std::filesystem::temp_directory_path()) {
    std::string name = (parent / "sabled-test-XXXXXX").string();
    path_ = mkdtemp(name.data());
  }
  ~TemporaryFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;

  const std::filesystem::path& path() const { return path_; }
  std::filesystem::path operator/(std::string_view name) const { return path_ / name; }

  platform::host::Folders folders() const {
    platform::host::Folders folders;
    folders.runtime = path_ / "run";
    folders.userCaches = path_ / "cache";
    folders.caches = folders.userCaches / "com.kestrel.sabled";
    folders.state = path_ / "state";
    folders.config = path_ / "config";
    folders.profileSettings = path_ / "etc" / "defaults.toml";
    folders.systemFacts = path_ / "etc" / "facts.toml";
    return folders;
  }

 private:
  std::filesystem::path path_;
};

/// Writes a file, and the folders above it.
inline void writeFile(const std::filesystem::path& path, std::string_view text) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << text;
}

inline std::string readFile(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

/// What `work` returns on a disk that has room for files of so many bytes only.
auto withRoomFor(rlim_t bytes, const auto& work) {
  const auto ignored = std::signal(SIGXFSZ, SIG_IGN);
  rlimit old{};
  getrlimit(RLIMIT_FSIZE, &old);
  const rlimit small{bytes, old.rlim_max};
  setrlimit(RLIMIT_FSIZE, &small);
  auto result = work();
  setrlimit(RLIMIT_FSIZE, &old);
  std::signal(SIGXFSZ, ignored);
  return result;
}

}  // namespace sable
