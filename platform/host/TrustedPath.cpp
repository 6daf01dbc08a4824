#include "platform/host/TrustedPath.h"

#include <fcntl.h>
#include <fmt/core.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <climits>
#include <deque>

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

constexpr int kMaximumLinks = 40;  // as the kernel's own walk (path_resolution(7))

class Walk {
 public:
  Walk(const Path& path, MissingFolders missing) : path_(path), missing_(missing) {
    push(path.empty() ? Path(".") : path);
  }

  /// Goes on until `keep` components are left.
  Expected<void> advance(std::size_t keep) {
    while (pending_.size() > keep) {
      if (auto step = enter(); !step) return step;
    }
    return {};
  }

  /// The folder reached so far, or AT_FDCWD.
  int base() const { return folder_ ? folder_.number() : AT_FDCWD; }
  Descriptor takeFolder() { return std::move(folder_); }
  const std::string& next() const { return pending_.front(); }

  /// When the next component is a link: puts what it points to in its place, if it can be trusted.
  Expected<bool> followLink() {
    struct stat status {};
    if (fstatat(base(), next().c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) return failed(errno);
    if (!S_ISLNK(status.st_mode)) return false;
    if (status.st_uid != geteuid() && status.st_uid != 0) return failed(ELOOP);
    if (++links_ > kMaximumLinks) return failed(ELOOP);
    std::array<char, PATH_MAX> target{};
    const ssize_t length = readlinkat(base(), next().c_str(), target.data(), target.size());
    if (length < 0) return failed(errno);
    pending_.pop_front();
    push(std::string(target.data(), static_cast<std::size_t>(length)));
    return true;
  }

  tl::unexpected<Error> failed(int number) const {
    return tl::unexpected(posixError(number, path_.native()));
  }

 private:
  /// An absolute path begins with the component "/", which leads back to the root.
  void push(const Path& path) {
    std::deque<std::string> components;
    for (const Path& component : path) {
      if (!component.empty()) components.push_back(component.native());
    }
    pending_.insert(pending_.begin(), components.begin(), components.end());
  }

  Expected<void> enter() {
    Descriptor next(openat(base(), this->next().c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (next) {
      pending_.pop_front();
      folder_ = std::move(next);
      return {};
    }
    if (errno == ENOENT && missing_ == MissingFolders::create) {
      if (mkdirat(base(), this->next().c_str(), S_IRWXU) != 0 && errno != EEXIST) return failed(errno);
      return {};
    }
    if (errno != ENOTDIR && errno != ELOOP) return failed(errno);
    const auto followed = followLink();
    if (!followed) return tl::unexpected(followed.error());
    if (!*followed) return failed(ENOTDIR);
    return {};
  }

  const Path& path_;
  const MissingFolders missing_;
  Descriptor folder_;
  std::deque<std::string> pending_;
  int links_ = 0;
};

}  // namespace

Expected<Descriptor> openTrustedFolder(const Path& path, MissingFolders missing) {
  Walk walk(path, missing);
  if (auto done = walk.advance(0); !done) return tl::unexpected(std::move(done.error()));
  return walk.takeFolder();
}

Expected<Descriptor> openTrustedFile(const Path& path, LastLink link) {
  Walk walk(path, MissingFolders::fail);
  for (;;) {
    if (auto done = walk.advance(1); !done) return tl::unexpected(std::move(done.error()));
    Descriptor file(openat(walk.base(), walk.next().c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (file) {
      struct stat status {};
      if (fstat(file.number(), &status) != 0) return walk.failed(errno);
      if (!S_ISREG(status.st_mode)) return walk.failed(S_ISDIR(status.st_mode) ? EISDIR : EINVAL);
      return file;
    }
    if (errno != ELOOP || link == LastLink::refuse) return walk.failed(errno);
    if (const auto followed = walk.followLink(); !followed) return tl::unexpected(followed.error());
  }
}

Expected<std::string> readWhole(const Descriptor& file, const Path& path, std::size_t maximumBytes) {
  struct stat status {};
  if (fstat(file.number(), &status) != 0) return tl::unexpected(posixError(errno, path.native()));
  if (static_cast<std::size_t>(status.st_size) > maximumBytes) {
    return tl::unexpected(posixError(EFBIG, path.native()));
  }
  // One byte more than it had, so that the end is seen without growing; it may still grow meanwhile.
  std::string bytes(static_cast<std::size_t>(status.st_size) + 1, '\0');
  std::size_t length = 0;
  for (;;) {
    const ssize_t count = ::read(file.number(), bytes.data() + length, bytes.size() - length);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return tl::unexpected(posixError(errno, path.native()));
    if (count == 0) break;
    length += static_cast<std::size_t>(count);
    if (length > maximumBytes) return tl::unexpected(posixError(EFBIG, path.native()));
    if (length == bytes.size()) bytes.resize(bytes.size() * 2);
  }
  bytes.resize(length);
  return bytes;
}

}  // namespace sable::platform::host
