#include "sabled/Lookup.h"

#include <fmt/core.h>

#include "platform/URL.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/SableLogging.h"
#include "sabled/SplitText.h"

namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryLookUp);
}

}  // namespace

Lookup::Lookup(Assembly& assembly)
    : assembly_(assembly), queue_(assembly.runtime.serialQueue("com.kestrel.sable.Lookup")) {}

bool Lookup::lookupEnabled() const {
  return !assembly_.userDefaults.sharedBoolean("com.kestrel.lookup.shared", "LookupSuggestionsDisabled")
              .value_or(false);
}

std::string Lookup::signatureFromURL(std::string_view url) {
  const auto parsed = platform::URL::parse(url);
  const auto parts = split(parsed ? parsed->path() : std::string(), '/');
  if (parts.size() > 4) return fmt::format("{}-{}-{}", parts[3], parts[4], parts[2]);
  log().error("invalid lookup hints url when processing signature: {}", url);
  return {};
}

void Lookup::_drainQueue() {
  queue_->sync([] {});
}

}  // namespace sable
