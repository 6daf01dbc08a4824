#include "platform/host/OpenFiles.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/uio.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>

#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

iovec vectorOf(std::string_view text) {
  return {const_cast<char*>(text.data()),
          text.size()};  // NOLINT(*-const-cast): POSIX has one iovec for both ways
}

/// Who runs into the lease is announced with a signal; this one is ignored unless asked for, and
/// the reading is over soon anyhow.
bool takeReadLease(int file) {
  return fcntl(file, F_SETSIG, SIGURG) == 0 && fcntl(file, F_SETLEASE, F_RDLCK) == 0;
}

WallTime timeOf(const struct statx_timestamp& time) {
  return WallTime(std::chrono::seconds(time.tv_sec) + std::chrono::nanoseconds(time.tv_nsec));
}

}  // namespace

int refusalOf(mode_t mode) {
  if (S_ISREG(mode)) return 0;
  return S_ISLNK(mode) ? ELOOP : S_ISDIR(mode) ? EISDIR : EINVAL;
}

Expected<FileAttributes> attributesAt(int folder, const char* name, int flags,
                                      const std::filesystem::path& path) {
  struct statx status {};
  if (statx(folder, name, flags, STATX_TYPE | STATX_UID | STATX_SIZE | STATX_MTIME | STATX_BTIME, &status) !=
      0)
    return tl::unexpected(posixError(errno, path.native()));
  if (const int number = refusalOf(status.stx_mode); number != 0)
    return tl::unexpected(posixError(number, path.native()));
  WallTime created = timeOf(status.stx_mtime);
  if ((status.stx_mask & STATX_BTIME) != 0) created = std::min(created, timeOf(status.stx_btime));
  return FileAttributes{status.stx_size, created, status.stx_uid == geteuid()};
}

Expected<std::uint64_t> HostAppendableFile::size() {
  struct stat status {};
  if (fstat(file_.number(), &status) != 0) return tl::unexpected(posixError(errno, path_.native()));
  return static_cast<std::uint64_t>(status.st_size);
}

Expected<void> HostAppendableFile::append(std::string_view head, std::string_view body) {
  while (!head.empty() || !body.empty()) {
    const std::array parts{vectorOf(head), vectorOf(body)};
    const ssize_t count = writev(file_.number(), parts.data(), parts.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return tl::unexpected(posixError(errno, path_.native()));
    const auto written = static_cast<std::size_t>(count);
    const std::size_t ofHead = std::min(written, head.size());
    head.remove_prefix(ofHead);
    body.remove_prefix(written - ofHead);
  }
  return {};
}

HostReadableFile::~HostReadableFile() {
  if (mapping_ != nullptr) munmap(mapping_, mappedBytes_);
}

Expected<FileAttributes> HostReadableFile::attributes() {
  return attributesAt(file_.number(), "", AT_EMPTY_PATH, path_);
}

Expected<std::shared_ptr<const int>> HostReadableFile::descriptor() {
  Descriptor own(fcntl(file_.number(), F_DUPFD_CLOEXEC, 0));
  if (!own) return tl::unexpected(posixError(errno, path_.native()));
  if (lseek(own.number(), 0, SEEK_SET) < 0) return tl::unexpected(posixError(errno, path_.native()));
  return sharedDescriptor(std::move(own));
}

Expected<std::string_view> HostReadableFile::map(std::size_t maximumBytes) {
  if (!takeReadLease(file_.number())) return copy(maximumBytes);
  // Only now, when it cannot change any more, is the size worth asking for.
  struct stat status {};
  if (fstat(file_.number(), &status) != 0) return tl::unexpected(posixError(errno, path_.native()));
  const auto size = static_cast<std::size_t>(status.st_size);
  if (size > maximumBytes) return tl::unexpected(posixError(EFBIG, path_.native()));
  if (size == 0) return std::string_view();
  void* mapping = mmap(nullptr, size, PROT_READ, MAP_PRIVATE, file_.number(), 0);
  if (mapping == MAP_FAILED) return tl::unexpected(posixError(errno, path_.native()));
  mapping_ = mapping;
  mappedBytes_ = size;
  return std::string_view(static_cast<const char*>(mapping), size);
}

Expected<std::string_view> HostReadableFile::copy(std::size_t maximumBytes) {
  auto bytes = readWhole(file_, path_, maximumBytes);
  if (!bytes) return tl::unexpected(std::move(bytes.error()));
  copy_ = *std::move(bytes);
  return std::string_view(copy_);
}

}  // namespace sable::platform::host
