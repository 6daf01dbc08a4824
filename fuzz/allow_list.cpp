#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/ApplicationRegistry.h"
#include "sabled/AppWhitelist.h"
#include "sabled/RunLengthCode.h"

namespace {

using namespace sable;

class Registry final : public platform::ApplicationRegistry {
 public:
  std::vector<platform::InstalledApplication> installedApplications() override {
    return {{"a", "1"}, {"b", "1"}, {"org.example.Mail", "3.2"}};
  }
};

void sign(std::string_view list) {
  Registry registry;
  const auto signature = processWhitelist(list, registry);
  constexpr std::size_t kLongest = (8 + kBlobDigestBytes + kMaximumBitmapBytes + 2) / 3 * 4;
  if (!signature) return;
  const std::size_t size = signature->text.size();
  if (size % 4 != 0 || size < 16 || size > kLongest || signature->applications.empty()) std::abort();
}

/// The list's inner text alone, which hardly any change of an escaped one leaves whole.
void signInner(std::string_view text) {
  nlohmann::ordered_json list{{"compression", "RLE"}, {"encoding", "bitmap"}};
  list["apps"] = text;
  using nlohmann::ordered_json;
  sign(list.dump(-1, ' ', false, ordered_json::error_handler_t::replace));
}

/// Whatever was compressed comes back, as far as its index goes.
void roundTrip(std::span<const std::uint8_t> bytes) {
  const auto bitmap = bytes.first(std::min<std::size_t>(bytes.size(), 256));
  std::vector<std::uint8_t> blob, expanded(bitmap.size());
  const bool compressed = rle_compress(bitmap, blob);
  const bool good = rle_expand(blob, kBlobDigestBytes, blob.size() - kBlobDigestBytes, expanded, compressed);
  if (!good || !std::ranges::equal(expanded, bitmap)) std::abort();
}

/// A blob from anywhere: the first bytes say where it is taken to lie, and how long it was.
void expand(std::span<const std::uint8_t> bytes) {
  if (bytes.size() < 4) return;
  std::vector<std::uint8_t> out(static_cast<std::size_t>(bytes[0]) << (bytes[1] % 8));
  const auto blob = bytes.subspan(4);
  const std::size_t start = std::min<std::size_t>(bytes[2], blob.size());
  rle_expand(blob, bytes[2], bytes[3], out, true);
  rle_expand(blob, start, blob.size() - start, out, true);
  rle_expand(blob, bytes[2], bytes[3], out, false);
}

}  // namespace

// An allow-list, and a signature's blob, are read without harm whatever is in them.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  sign(text);
  signInner(text);
  roundTrip({data, size});
  expand({data, size});
  return 0;
}
