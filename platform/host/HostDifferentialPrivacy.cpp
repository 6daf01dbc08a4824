#include "platform/host/HostDifferentialPrivacy.h"

#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "platform/Dictionary.h"

namespace sable::platform::host {

HostDifferentialPrivacy::HostDifferentialPrivacy(Runtime& runtime, UserDefaults& userDefaults,
                                                 FileManager& fileManager, std::filesystem::path file)
    : userDefaults_(userDefaults),
      file_(runtime, fileManager, std::move(file), "com.kestrel.sabled.differentialPrivacy",
            "private reports") {}

void HostDifferentialPrivacy::record(PrivateReport report) {
  if (!userDefaults_.boolean("SBLKeepPrivateReports").value_or(false)) return;
  file_.add([report = std::move(report)] {
    return compactJSON({{"key", report.key},
                        {"seed", fmt::format("{:016x}", report.answer.seed)},
                        {"bucket", report.answer.bucket}});
  });
}

}  // namespace sable::platform::host
