#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/URL.h"
#include "sabled/DeepLinkTarget.h"

// The first line is an application, the rest its link. Whatever is told is short, holds no path, query
// or user, and where another parser finds a host in a universal link, it is the same.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace sable;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto end = text.find('\n');
  if (end == std::string_view::npos) return 0;
  const platform::DeepLink link{std::string(text.substr(0, end)), std::string(text.substr(end + 1))};
  const auto target = deepLinkTarget(link);
  if (!target) return 0;
  if (target->size() > 512 || target->find_first_of("/?#@%\\") != std::string::npos) std::abort();
  if (target->back() == ':') return 0;
  const auto url = platform::URL::parse(link.url);
  if (url && link.bundleIdentifier + " " + url->host() != *target) std::abort();
  return 0;
}
