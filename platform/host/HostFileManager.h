#pragma once

#include "platform/FileManager.h"
#include "platform/host/Folders.h"

namespace sable::platform::host {

/// Files on disk, reached through TrustedPath. A replacement is written to ".NAME.new" beside its
/// target, synchronised, renamed over it, and the folder synchronised. Writers of one target take
/// turns by a lock on that file, also between processes; what a killed writer left is used again.
class HostFileManager final : public FileManager {
 public:
  explicit HostFileManager(Folders folders) : folders_(std::move(folders)) {}

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

 private:
  const Folders folders_;
};

}  // namespace sable::platform::host
