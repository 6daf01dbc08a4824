#include "platform/host/FactsFile.h"

#include "platform/Log.h"
#include "platform/host/ConfigurationSchema.h"

namespace sable::platform::host {

bool FactsFile::reload() {
  if (!file_.reload()) return false;
  TOMLContent good = file_.content();
  for (const auto& [name, value] : file_.content()) {
    const KnownKey* key = findKey(knownFacts(), name);
    if (key == nullptr || hasType(value, key->type)) continue;
    platformLog().error("{}:{}:{}: {} is not {}; its last good value stays", file_.path().native(),
                        value.line, value.column, name, typeName(key->type));
    const auto before = facts_.find(name);
    if (before == facts_.end()) {
      good.erase(name);
    } else {
      good.insert_or_assign(name, before->second);
    }
  }
  facts_ = std::move(good);
  return true;
}

}  // namespace sable::platform::host
