#pragma once

#include <cstddef>
#include <string>

namespace sable::test {

/// The `size` bytes at most that a whole raw DEFLATE stream (RFC 1951) holds, by zlib's own reader.
std::string inflated(const std::string& raw, std::size_t size);

/// SHA-512 of the bytes, fed `times` times, in lower-case hexadecimal.
std::string sha512(const std::string& bytes, std::size_t times = 1);

}  // namespace sable::test
