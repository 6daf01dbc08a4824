#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <nlohmann/json.hpp>

#include "platform/PropertyList.h"

// Any bytes are read without harm, and what was read is written and read again as the same.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace sable;
  const auto value = platform::decodePropertyList({reinterpret_cast<const char*>(data), size});
  if (!value || value->is_null()) return 0;
  const auto written = platform::encodePropertyList(*value);
  if (!written &&
      written.error().code == static_cast<std::int64_t>(platform::PropertyListErrorCode::tooLarge))
    return 0;
  if (!written) std::abort();
  const auto again = platform::decodePropertyList(*written);
  if (!again || compactJSON(*value) != compactJSON(*again)) std::abort();
  return 0;
}
