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
  /// `clock` tells when files are created.
  explicit SimulatedFileManager(const Runtime& clock) : clock_(clock) {}

  Expected<std::filesystem::path> cachesDirectory() override;
  Expected<void> createDirectory(const std::filesystem::path& path) override;
  Expected<std::string> read(const std::filesystem::path& path, std::size_t maximumBytes) override;
  Expected<void> writeAtomically(const std::filesystem::path& path, std::string_view bytes) override;
  Expected<void> replaceItem(const std::filesystem::path& path,
                             const std::filesystem::path& replacement) override;
  Expected<void> remove(const std::filesystem::path& path) override;
  Expected<std::filesystem::path> temporaryDirectory() override;
  Expected<std::filesystem::path> createUniqueFile(const std::filesystem::path& path) override;
  Expected<void> createFile(const std::filesystem::path& path) override;
  Expected<std::unique_ptr<AppendableFile>> openForAppending(const std::filesystem::path& path) override;
  Expected<std::unique_ptr<ReadableFile>> openForReading(const std::filesystem::path& path) override;
  Expected<FileAttributes> attributes(const std::filesystem::path& path) override;
  Expected<std::vector<std::string>> list(const std::filesystem::path& path) override;

  /// From now on every operation fails with this errno value, or, with ENOSPC, every one that needs room;
  /// 0 ends that.
  void failWith(int number) { failAfter(0, number); }
  /// The same, but `operations` more are done before.
  void failAfter(int operations, int number) {
    operationsLeft_ = operations;
    failure_ = number;
  }
  /// Whether an operation has failed for that.
  bool hasFailed() const { return failure_ != 0 && operationsLeft_ == 0; }

  const std::map<std::filesystem::path, std::string>& files() const { return files_; }
  const std::set<std::filesystem::path>& directories() const { return directories_; }

 private:
  class Appendable;
  class Readable;

  Expected<void> check(const std::filesystem::path& path, bool needsRoom) const;
  Expected<std::string*> find(const std::filesystem::path& path);

  const Runtime& clock_;
  std::map<std::filesystem::path, std::string> files_;
  std::map<std::filesystem::path, WallTime> creationDates_;
  std::set<std::filesystem::path> directories_{"/"};
  int failure_ = 0;
  mutable int operationsLeft_ = 0;  ///< that are still done before
  unsigned uniqueNames_ = 0;
};

}  // namespace sable::platform::simulated
