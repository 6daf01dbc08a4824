#pragma once

#include <filesystem>
#include <map>
#include <set>
#include <string>

#include "platform/FileManager.h"

namespace sable::platform::simulated {

/// Files in memory; they outlive a simulated daemon that is given the same manager again.
class SimulatedFileManager final : public FileManager {
 public:
  Expected<std::filesystem::path> cachesDirectory() override;
  Expected<void> createDirectory(const std::filesystem::path& path) override;
  Expected<std::string> read(const std::filesystem::path& path, std::size_t maximumBytes) override;
  Expected<void> writeAtomically(const std::filesystem::path& path, std::string_view bytes) override;
  Expected<void> remove(const std::filesystem::path& path) override;

  /// From now on every operation fails with this errno value; 0 ends that.
  void failWith(int number) { failure_ = number; }

  const std::map<std::filesystem::path, std::string>& files() const { return files_; }
  const std::set<std::filesystem::path>& directories() const { return directories_; }

 private:
  Expected<void> check(const std::filesystem::path& path) const;

  std::map<std::filesystem::path, std::string> files_;
  std::set<std::filesystem::path> directories_{"/"};
  int failure_ = 0;
};

}  // namespace sable::platform::simulated
