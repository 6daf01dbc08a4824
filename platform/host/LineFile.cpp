#include "platform/host/LineFile.h"

#include <cerrno>

#include "platform/Log.h"

namespace sable::platform::host {

/// The file, on the queue.
struct LineFile::Store {
  FileManager& fileManager;
  const std::filesystem::path file;
  const std::string what;
  bool failureLogged = false;

  void append(const std::string& line) {
    const auto added = add(line);
    if (!added && !std::exchange(failureLogged, true)) {
      platformLog().error("{} are not kept: {}", what, added.error().description());
    }
  }

  Expected<void> add(const std::string& line) {
    auto open = fileManager.openForAppending(file);
    if (!open && open.error().code == ENOENT) {
      if (auto made = makeFile(); !made) return made;
      open = fileManager.openForAppending(file);
    }
    if (!open) return tl::unexpected(open.error());
    const auto size = (*open)->size();
    if (!size) return tl::unexpected(size.error());
    if (*size + line.size() >= kMaximumBytes) return tl::unexpected(posixError(EFBIG, file.string()));
    return (*open)->append(line, "\n");
  }

  Expected<void> makeFile() {
    if (auto made = fileManager.createDirectory(file.parent_path()); !made) return made;
    return fileManager.createFile(file);
  }
};

LineFile::LineFile(Runtime& runtime, FileManager& fileManager, std::filesystem::path file,
                   std::string queueLabel, std::string what)
    : store_(std::make_shared<Store>(Store{fileManager, std::move(file), std::move(what)})),
      queue_(runtime.serialQueue(std::move(queueLabel), QualityOfService::background)) {}

LineFile::~LineFile() = default;

void LineFile::add(Function<std::string()> make) {
  queue_->async([store = store_, make = std::move(make)]() mutable { store->append(make()); });
}

}  // namespace sable::platform::host
