#include "platform/LocalRandomizer.h"

#include <openssl/evp.h>

#include <array>
#include <string>

#include "platform/ProgrammingError.h"

namespace sable::platform {
namespace {

// One part in two is honest; the other is spread evenly over the other buckets.
constexpr unsigned kLies = kRandomizerBuckets - 1;
constexpr unsigned kOutcomes = 2 * kLies;

std::uint64_t randomSeed(Runtime& runtime) {
  std::uint64_t seed = 0;
  runtime.randomBytes(std::as_writable_bytes(std::span(&seed, 1)));
  return seed;
}

}  // namespace

unsigned bucketUnderSeed(std::uint64_t seed, std::string_view text) {
  std::string input;
  for (int shift = 56; shift >= 0; shift -= 8) input += static_cast<char>(seed >> shift & 0xff);
  input += text;
  std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
  if (EVP_Digest(input.data(), input.size(), digest.data(), nullptr, EVP_sha256(), nullptr) != 1) {
    programmingError("SHA-256 is not there");
  }
  return digest[0] % kRandomizerBuckets;
}

unsigned uniformBelow(Runtime& runtime, unsigned bound) {
  // Of the 256 values of a byte as many count as divide evenly.
  const unsigned usable = 256 - 256 % bound;
  for (;;) {
    std::byte drawn{};
    runtime.randomBytes(std::span(&drawn, 1));
    if (const auto value = std::to_integer<unsigned>(drawn); value < usable) return value % bound;
  }
}

RandomizedAnswer randomizedAnswer(Runtime& runtime, std::string_view answer) {
  const std::uint64_t seed = randomSeed(runtime);
  const unsigned own = bucketUnderSeed(seed, answer), outcome = uniformBelow(runtime, kOutcomes);
  const unsigned distance = outcome < kLies ? 0 : outcome - kLies + 1;
  return {seed, (own + distance) % kRandomizerBuckets};
}

}  // namespace sable::platform
