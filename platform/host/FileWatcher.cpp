#include "platform/host/FileWatcher.h"

#include <sys/epoll.h>
#include <sys/inotify.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <set>
#include <string>

#include "platform/Error.h"
#include "platform/Log.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

constexpr std::uint32_t kMask = IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE |
                                IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
constexpr std::uint32_t kFolderGone = IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT;

/// A new file is complete when its writer closes it, which is an event of its own; a new link is
/// complete at once.
bool isBeingWritten(const Path& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && status.st_nlink == 1;
}

}  // namespace

struct FileWatcher::State {
  struct Folder {
    Path path;
    std::set<std::string, std::less<>> names;  ///< what in it is of interest; "": everything
  };

  /// Takes watches so that every file's folder, or what is there of the way to it, is covered.
  void cover() {
    std::map<int, Folder> covered;
    for (const Path& file : files) coverFile(file, covered);
    for (const auto& [number, folder] : folders) {
      if (!covered.contains(number)) inotify_rm_watch(inotify.number(), number);
    }
    folders = std::move(covered);
  }

  void coverFile(const Path& file, std::map<int, Folder>& covered) {
    Path below = file;
    int attempts = 3;
    while (below.has_relative_path()) {
      const Path folder = below.parent_path();
      const int number = inotify_add_watch(inotify.number(), folder.c_str(), kMask);
      if (number >= 0) {
        covered.try_emplace(number, Folder{folder, {}}).first->second.names.insert(below.filename());
        // What was missing a moment ago may have appeared before the watch was taken.
        std::error_code ignored;
        if (below == file && !file.has_filename()) coverFoldersIn(folder, covered);
        if (below == file || --attempts == 0 || !std::filesystem::is_directory(below, ignored)) return;
        below = file;
      } else {
        below = folder;
      }
    }
  }

  void coverFoldersIn(const Path& folder, std::map<int, Folder>& covered) {
    std::error_code error;
    for (std::filesystem::recursive_directory_iterator at(folder, error), end; !error && at != end;
         at.increment(error)) {
      std::error_code ignored;
      if (at->is_symlink(ignored) || !at->is_directory(ignored)) continue;
      const int number = inotify_add_watch(inotify.number(), at->path().c_str(), kMask);
      if (number >= 0) covered.try_emplace(number, Folder{at->path(), {""}});
    }
  }

  bool concerns(const inotify_event& event) const {
    if ((event.mask & IN_Q_OVERFLOW) != 0) return true;
    const auto folder = folders.find(event.wd);
    if (folder == folders.end()) return false;  // a watch that was given back says so once more
    if ((event.mask & kFolderGone) != 0) return true;
    if (event.len == 0) return false;
    const std::string_view name = static_cast<const char*>(event.name);
    const auto& names = folder->second.names;
    if (!names.contains(name) && !names.contains("")) return false;
    return (event.mask & IN_CREATE) == 0 || !isBeingWritten(folder->second.path / name);
  }

  /// Takes all waiting events; whether one of them matters.
  bool takeEvents() {
    bool relevant = false;
    alignas(inotify_event) std::array<char, 4096> buffer;
    for (;;) {
      const ssize_t length = ::read(inotify.number(), buffer.data(), buffer.size());
      if (length <= 0) return relevant;
      for (std::size_t at = 0; at < static_cast<std::size_t>(length);) {
        const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + at);
        relevant = concerns(*event) || relevant;
        at += sizeof(inotify_event) + event->len;
      }
    }
  }

  void handle() {
    const std::lock_guard lock(mutex);
    if (!changed) return;
    if (takeEvents()) {
      cover();
      changed();
    }
    watch->arm(EPOLLIN);
  }

  std::mutex mutex;
  std::vector<Path> files;
  std::function<void()> changed;
  Descriptor inotify;
  std::map<int, Folder> folders;
  std::unique_ptr<Reactor::Watch> watch;
};

FileWatcher::FileWatcher(Reactor& reactor, std::vector<Path> files, std::function<void()> changed)
    : state_(std::make_shared<State>()) {
  const std::lock_guard lock(state_->mutex);
  state_->files = std::move(files);
  state_->changed = std::move(changed);
  state_->inotify = Descriptor(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!state_->inotify) {
    platformLog().error("changes of files go unseen: {}", posixError(errno, "inotify").reason);
    return;
  }
  state_->cover();
  state_->watch = reactor.watch(state_->inotify.number(), [state = std::weak_ptr(state_)](Events) {
    if (const auto alive = state.lock()) alive->handle();
  });
  state_->watch->arm(EPOLLIN);
}

FileWatcher::~FileWatcher() {
  const std::lock_guard lock(state_->mutex);
  state_->changed = nullptr;
  state_->watch.reset();
}

}  // namespace sable::platform::host
