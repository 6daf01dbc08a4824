#pragma once

#include <filesystem>

#include "platform/DifferentialPrivacy.h"
#include "platform/UserDefaults.h"
#include "platform/host/LineFile.h"

namespace sable::platform::host {

/// Reports as JSON lines {"key", "seed" (16 hexadecimal digits), "bucket"} in a file, for whoever collects
/// them; without a time, which would tell more than the answer may. Only while the setting
/// "SBLKeepPrivateReports" is true, which it is not by itself.
class HostDifferentialPrivacy final : public DifferentialPrivacy {
 public:
  HostDifferentialPrivacy(Runtime& runtime, UserDefaults& userDefaults, FileManager& fileManager,
                          std::filesystem::path file);

  void record(PrivateReport report) override;

 private:
  UserDefaults& userDefaults_;
  LineFile file_;
};

}  // namespace sable::platform::host
