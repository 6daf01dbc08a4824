#include "sabled/RunLengthCode.h"

#include <openssl/evp.h>

#include <algorithm>
#include <array>

namespace sable {
namespace {

constexpr unsigned kLongestRun = 256;  // bits
constexpr std::size_t kCountBytes = 2;
constexpr unsigned kHighestBit = 0x80;

std::size_t polarityBytes(std::size_t runs) {
  return (runs + 7) / 8;
}

bool bitAt(std::span<const std::uint8_t> bytes, std::size_t bit) {
  return (bytes[bit / 8] & (kHighestBit >> (bit % 8))) != 0;
}

EncodedRuns runsOf(std::span<const std::uint8_t> bitmap) {
  EncodedRuns runs;
  unsigned length = 0;
  bool polarity = false;
  for (std::size_t bit = 0; bit < bitmap.size() * 8; ++bit) {
    const bool isSet = bitAt(bitmap, bit);
    if (length == kLongestRun || (length > 0 && isSet != polarity)) {
      saveRun(runs, length, polarity);
      length = 0;
    }
    polarity = isSet;
    ++length;
  }
  if (length > 0) saveRun(runs, length, polarity);
  return runs;
}

}  // namespace

void saveRun(EncodedRuns& runs, unsigned length, bool polarity) {
  const std::size_t place = runs.lengths.size() % 8;
  runs.lengths.push_back(static_cast<std::uint8_t>(length - 1));
  if (place == 0) runs.polarities.push_back(0);
  if (polarity) runs.polarities.back() |= static_cast<std::uint8_t>(kHighestBit >> place);
}

bool encodeRun(std::span<const std::uint8_t> bitmap, std::vector<std::uint8_t>& out) {
  const EncodedRuns runs = runsOf(bitmap);
  const std::size_t count = runs.lengths.size();
  if (kCountBytes + count + polarityBytes(count) >= bitmap.size()) {
    out.insert(out.end(), bitmap.begin(), bitmap.end());
    return false;
  }
  out.push_back(static_cast<std::uint8_t>(count >> 8));
  out.push_back(static_cast<std::uint8_t>(count));
  out.insert(out.end(), runs.lengths.begin(), runs.lengths.end());
  out.insert(out.end(), runs.polarities.begin(), runs.polarities.end());
  return true;
}

bool rle_compress(std::span<const std::uint8_t> bitmap, std::vector<std::uint8_t>& out) {
  std::array<std::uint8_t, EVP_MAX_MD_SIZE> digest{};
  unsigned length = kBlobDigestBytes;
  EVP_Digest(bitmap.data(), bitmap.size(), digest.data(), &length, EVP_md5(), nullptr);
  const auto end = digest.begin() + length;
  out.insert(out.end(), end - kBlobDigestBytes, end);
  return encodeRun(bitmap, out);
}

unsigned getRunLength(std::uint8_t byte) {
  return byte;
}

bool rle_expand(std::span<const std::uint8_t> buffer, std::size_t start, std::size_t length,
                std::span<std::uint8_t> out, bool compressed) {
  if (!compressed) {
    if (buffer.size() < kBlobDigestBytes || buffer.size() - kBlobDigestBytes < out.size()) return false;
    std::ranges::copy(buffer.subspan(kBlobDigestBytes, out.size()), out.begin());
    return true;
  }
  if (start > buffer.size() || length > buffer.size() - start || length < kCountBytes) return false;
  const auto coded = buffer.subspan(start, length);
  const std::size_t count = static_cast<std::size_t>(coded[0]) << 8 | coded[1];
  if (kCountBytes + count + polarityBytes(count) != length) return false;
  const auto lengths = coded.subspan(kCountBytes, count), polarities = coded.subspan(kCountBytes + count);

  std::ranges::fill(out, std::uint8_t{0});
  std::size_t bit = 0;
  for (std::size_t run = 0; run < count; ++run) {
    const bool polarity = bitAt(polarities, run);
    for (unsigned left = getRunLength(lengths[run]) + 1; left > 0; --left, ++bit) {
      // Peers keep this index in eight bits: what is beyond 256 bytes lies over the beginning again.
      const auto index = static_cast<std::uint8_t>(bit / 8);
      if (index >= out.size()) return false;
      if (polarity) out[index] |= static_cast<std::uint8_t>(kHighestBit >> (bit % 8));
    }
  }
  return true;
}

}  // namespace sable
