#pragma once

#include <filesystem>

#include "platform/UserActivity.h"
#include "platform/UserDefaults.h"
#include "platform/host/LineFile.h"

namespace sable::platform::host {

/// Interactions as JSON lines {"time", "domain", "verb", "parameters"} in a file. Only while the setting
/// "SBLDonateInteractions" is true, which it is not by itself: the lines hold what the user typed.
class HostUserActivity final : public UserActivity {
 public:
  /// Also makes the file's folder when there is something to write.
  HostUserActivity(Runtime& runtime, UserDefaults& userDefaults, FileManager& fileManager,
                   std::filesystem::path file);

  void donate(Interaction interaction) override;

 private:
  Runtime& runtime_;
  UserDefaults& userDefaults_;
  LineFile file_;
};

}  // namespace sable::platform::host
