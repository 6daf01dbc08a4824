#include "tests/support/Deflate.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <array>
#include <memory>

namespace sable::test {

std::string inflated(const std::string& raw, std::size_t size) {
  z_stream stream{};
  EXPECT_EQ(inflateInit2(&stream, -MAX_WBITS), Z_OK);
  std::string bytes(size + 1, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(raw.data()));
  stream.avail_in = static_cast<uInt>(raw.size());
  stream.next_out = reinterpret_cast<Bytef*>(bytes.data());
  stream.avail_out = static_cast<uInt>(bytes.size());
  EXPECT_EQ(inflate(&stream, Z_FINISH), Z_STREAM_END);
  EXPECT_EQ(stream.avail_in, 0u);
  bytes.resize(stream.total_out);
  inflateEnd(&stream);
  return bytes;
}

std::string sha512(const std::string& bytes, std::size_t times) {
  const std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  EVP_DigestInit_ex(context.get(), EVP_sha512(), nullptr);
  while (times-- > 0) EVP_DigestUpdate(context.get(), bytes.data(), bytes.size());
  std::array<unsigned char, 64> digest{};
  EVP_DigestFinal_ex(context.get(), digest.data(), nullptr);
  std::string text;
  for (const unsigned char byte : digest) {
    text += "0123456789abcdef"[byte >> 4];
    text += "0123456789abcdef"[byte & 15];
  }
  return text;
}

}  // namespace sable::test
