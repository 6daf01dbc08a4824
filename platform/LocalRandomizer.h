#pragma once

#include <cstdint>
#include <string_view>

#include "platform/Runtime.h"

/// A local randomiser for answers out of a set that nobody can list: optimised local hashing (Wang,
/// Blocki, Li, Jha: Locally Differentially Private Protocols for Frequency Estimation, USENIX Security
/// 2017, section 4.4).
///
/// The device draws a seed, which picks a hash function from text to one of 8 buckets, and tells the
/// seed and a bucket: the answer's own with probability 1/2, each of the other seven with 1/14. So of
/// any two answers none makes a report more than 7 times as likely as the other: epsilon is
/// ln 7 = 1.946 a report, and reports of one device add up. The probabilities are drawn as whole
/// numbers, without a rounding that could tell more.
///
/// A collector asks of N reports how many name the bucket that a candidate text has under their seed,
/// and of that number C estimates (C - N/8) / (1/2 - 1/8) devices with that answer, with a standard
/// deviation of at most sqrt(N) * 4/3.
namespace sable::platform {

inline constexpr unsigned kRandomizerBuckets = 8;

struct RandomizedAnswer {
  std::uint64_t seed = 0;
  unsigned bucket = 0;  ///< below kRandomizerBuckets
};

/// The bucket of `text` under a seed: of the SHA-256 digest (FIPS 180-4) of the seed, 8 bytes, highest
/// first, and the text, the lowest three bits of the first byte. Collectors compute the same.
unsigned bucketUnderSeed(std::uint64_t seed, std::string_view text);

/// What may be told of an answer; all chance comes from the runtime.
RandomizedAnswer randomizedAnswer(Runtime& runtime, std::string_view answer);

/// A number below `bound` (1 to 256), each as likely as the others.
unsigned uniformBelow(Runtime& runtime, unsigned bound);

}  // namespace sable::platform
