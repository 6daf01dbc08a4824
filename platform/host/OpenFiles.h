#pragma once

#include <sys/types.h>

#include <filesystem>

#include "platform/FileManager.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

/// 0, or the errno value for why a file of this mode is not for reading and writing.
int refusalOf(mode_t mode);

/// What statx(2) says of the file `name` in `folder`, or with AT_EMPTY_PATH of `folder` itself; `path`
/// names it in errors. What is no regular file is an error.
Expected<FileAttributes> attributesAt(int folder, const char* name, int flags,
                                      const std::filesystem::path& path);

class HostAppendableFile final : public AppendableFile {
 public:
  /// `file` is open with O_APPEND; `path` names it in errors.
  HostAppendableFile(Descriptor file, std::filesystem::path path)
      : file_(std::move(file)), path_(std::move(path)) {}

  Expected<std::uint64_t> size() override;
  Expected<void> append(std::string_view head, std::string_view body) override;

 private:
  const Descriptor file_;
  const std::filesystem::path path_;
};

/// Maps the file under a read lease (fcntl(2), F_SETLEASE): while that is held, whoever opens the
/// file for writing, or truncates it, waits until it is given back, and no page of the mapping can
/// go away under its reader (SIGBUS). The system lets them wait for /proc/sys/fs/lease-break-time,
/// 45 s, thousands of times what a reading takes. Where no lease can be had (somebody has the file
/// open for writing, the file system knows no leases) the bytes are copied instead.
class HostReadableFile final : public ReadableFile {
 public:
  HostReadableFile(Descriptor file, std::filesystem::path path)
      : file_(std::move(file)), path_(std::move(path)) {}
  ~HostReadableFile() override;
  HostReadableFile(const HostReadableFile&) = delete;
  HostReadableFile& operator=(const HostReadableFile&) = delete;

  Expected<FileAttributes> attributes() override;
  Expected<std::shared_ptr<const int>> descriptor() override;
  Expected<std::string_view> map(std::size_t maximumBytes) override;

 private:
  Expected<std::string_view> copy(std::size_t maximumBytes);

  const Descriptor file_;
  const std::filesystem::path path_;
  void* mapping_ = nullptr;
  std::size_t mappedBytes_ = 0;
  std::string copy_;
};

}  // namespace sable::platform::host
