#pragma once

#include <filesystem>
#include <memory>
#include <string>

#include "platform/FileManager.h"
#include "platform/Runtime.h"

namespace sable::platform::host {

/// A file of lines (0600) that readers may take away at any time; the next line begins a new one, and
/// its folder where that is missing. Lines beyond the maximum are left out. Any thread; who adds a line
/// does not wait for the disk. The first failure is logged.
class LineFile {
 public:
  static constexpr std::uint64_t kMaximumBytes = 4u << 20;

  /// `queueLabel` names the queue that the file is written on, `what` its lines, in the log.
  LineFile(Runtime& runtime, FileManager& fileManager, std::filesystem::path file, std::string queueLabel,
           std::string what);
  ~LineFile();

  /// Adds the line that `make` answers with, which is called on the file's queue.
  void add(Function<std::string()> make);

 private:
  struct Store;

  const std::shared_ptr<Store> store_;
  const std::shared_ptr<SerialQueue> queue_;
};

}  // namespace sable::platform::host
