#pragma once

#include <filesystem>
#include <memory>

#include "platform/FileManager.h"
#include "platform/Runtime.h"
#include "platform/UserActivity.h"
#include "platform/UserDefaults.h"

namespace sable::platform::host {

/// What the file may grow to; what comes after that is left out.
inline constexpr std::uint64_t kMaximumActivityBytes = 4u << 20;

/// Interactions as JSON lines {"time", "domain", "verb", "parameters"} at the end of a file (0600)
/// that readers may take away at any time; the next one begins a new file. Only while the setting
/// "SBLDonateInteractions" is true, which it is not by itself: the lines hold what the user typed.
class HostUserActivity final : public UserActivity {
 public:
  /// Also makes the file's folder when there is something to write.
  HostUserActivity(Runtime& runtime, UserDefaults& userDefaults, FileManager& fileManager,
                   std::filesystem::path file);
  ~HostUserActivity() override;

  void donate(Interaction interaction) override;

 private:
  struct Store;

  Runtime& runtime_;
  UserDefaults& userDefaults_;
  const std::shared_ptr<Store> store_;
  const std::shared_ptr<SerialQueue> queue_;
};

}  // namespace sable::platform::host
