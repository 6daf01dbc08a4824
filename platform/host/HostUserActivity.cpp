#include "platform/host/HostUserActivity.h"

#include <nlohmann/json.hpp>

#include "platform/Dictionary.h"

namespace sable::platform::host {

HostUserActivity::HostUserActivity(Runtime& runtime, UserDefaults& userDefaults, FileManager& fileManager,
                                   std::filesystem::path file)
    : runtime_(runtime),
      userDefaults_(userDefaults),
      file_(runtime, fileManager, std::move(file), "com.kestrel.sabled.userActivity", "interactions") {}

void HostUserActivity::donate(Interaction interaction) {
  if (!userDefaults_.boolean("SBLDonateInteractions").value_or(false)) return;
  file_.add([interaction = std::move(interaction), time = secondsSince1970(runtime_.now())] {
    return compactJSON({{"time", time},
                        {"domain", interaction.domain},
                        {"verb", interaction.verb},
                        {"parameters", {{interaction.parameter, interaction.value}}}});
  });
}

}  // namespace sable::platform::host
