#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <nlohmann/json.hpp>

#include "platform/Dictionary.h"

// Our reading, which bounds depth and merges repeated keys in linear time, agrees with the
// library's on every text that is not too deep.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace sable;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto ours = parseJSON(text, 1u << 20);
  if (!ours && ours.error().code != static_cast<std::int64_t>(JSONErrorCode::malformed)) return 0;
  const Dictionary theirs = Dictionary::parse(text.begin(), text.end(), nullptr, false);
  if (ours.has_value() == theirs.is_discarded()) std::abort();
  if (ours && compactJSON(*ours) != compactJSON(theirs)) std::abort();
  return 0;
}
