#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <vector>

#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// Tells when one of a few files is written, replaced, appears or goes, by inotify(7) on their
/// folders; a folder that is missing is waited for in the nearest one above it. A path that ends in
/// a slash stands for all files in that folder and in those below it. Costs nothing while nothing
/// happens. Where the kernel grants no inotify instance, that is logged and the files count as they
/// were at the start.
class FileWatcher {
 public:
  /// Calls `changed` on a pool thread, never twice at a time, also when a file turns out to be as it
  /// was. `changed` must not destroy the watcher.
  FileWatcher(Reactor& reactor, std::vector<std::filesystem::path> files, std::function<void()> changed);
  /// Waits for a call of `changed` that is under way.
  ~FileWatcher();
  FileWatcher(const FileWatcher&) = delete;
  FileWatcher& operator=(const FileWatcher&) = delete;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace sable::platform::host
