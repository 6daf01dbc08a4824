#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

/// The run-length code in which the bitmap of installed applications travels. Multi-byte fields are
/// big-endian, bits count from the most significant one. A blob:
///
///     offset  size       field
///     0       4          the last four bytes of the MD5 (RFC 1321) of the bitmap
///     4       2          N, the number of runs
///     6       N          each run's length in bits minus one
///     6 + N   ceil(N/8)  a bit a run: whether it consists of set bits; the rest is zero
///
/// Where runs take no fewer bytes than the bitmap, the bitmap itself follows the first field.
namespace sable {

inline constexpr std::size_t kBlobDigestBytes = 4;

/// Lengths in bytes travel in 16 bits: no bitmap is longer.
inline constexpr std::size_t kMaximumBitmapBytes = 0xffff;

/// The runs of a bitmap so far, as they go into a blob.
struct EncodedRuns {
  std::vector<std::uint8_t> lengths;     ///< minus one
  std::vector<std::uint8_t> polarities;  ///< eight runs a byte
};

/// Closes a run of 1 to 256 bits.
void saveRun(EncodedRuns& runs, unsigned length, bool polarity);

/// Appends the bitmap, of at most kMaximumBitmapBytes, in the shorter of its two forms; true when it
/// was run-length coded.
bool encodeRun(std::span<const std::uint8_t> bitmap, std::vector<std::uint8_t>& out);

/// Appends a blob; likewise.
bool rle_compress(std::span<const std::uint8_t> bitmap, std::vector<std::uint8_t>& out);

/// A run's length minus one.
unsigned getRunLength(std::uint8_t byte);

/// The inverse: fills `out`, which is as long as the bitmap was, from a blob of any origin in
/// `buffer`. `start` and `length` say where in it the field N and all that follows lie; for a blob
/// that is not `compressed` they do not matter. False when the lengths contradict each other.
bool rle_expand(std::span<const std::uint8_t> buffer, std::size_t start, std::size_t length,
                std::span<std::uint8_t> out, bool compressed);

}  // namespace sable
