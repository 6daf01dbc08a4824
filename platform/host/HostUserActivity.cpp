#include "platform/host/HostUserActivity.h"

#include <cerrno>
#include <nlohmann/json.hpp>

#include "platform/Dictionary.h"
#include "platform/Log.h"

namespace sable::platform::host {

/// The file, on the queue.
struct HostUserActivity::Store {
  FileManager& fileManager;
  const std::filesystem::path file;
  bool failureLogged = false;

  void append(const std::string& line) {
    const auto added = add(line);
    if (!added && !std::exchange(failureLogged, true)) {
      platformLog().error("interactions are not kept: {}", added.error().description());
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
    if (*size + line.size() >= kMaximumActivityBytes) return tl::unexpected(posixError(EFBIG, file.string()));
    return (*open)->append(line, "\n");
  }

  Expected<void> makeFile() {
    if (auto made = fileManager.createDirectory(file.parent_path()); !made) return made;
    return fileManager.createFile(file);
  }
};

HostUserActivity::HostUserActivity(Runtime& runtime, UserDefaults& userDefaults, FileManager& fileManager,
                                   std::filesystem::path file)
    : runtime_(runtime),
      userDefaults_(userDefaults),
      store_(std::make_shared<Store>(Store{fileManager, std::move(file)})),
      queue_(runtime.serialQueue("com.kestrel.sabled.userActivity", QualityOfService::background)) {}

HostUserActivity::~HostUserActivity() = default;

void HostUserActivity::donate(Interaction interaction) {
  if (!userDefaults_.boolean("SBLDonateInteractions").value_or(false)) return;
  queue_->async(
      [store = store_, interaction = std::move(interaction), time = secondsSince1970(runtime_.now())] {
        const Dictionary line{{"time", time},
                              {"domain", interaction.domain},
                              {"verb", interaction.verb},
                              {"parameters", {{interaction.parameter, interaction.value}}}};
        store->append(compactJSON(line));
      });
}

}  // namespace sable::platform::host
