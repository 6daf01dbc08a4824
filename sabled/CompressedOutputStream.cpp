#include "sabled/CompressedOutputStream.h"

#include <fmt/format.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <limits>

namespace sable {

namespace {

constexpr std::size_t kDestBufferBytes = 4096;
/// The compressor's window: it fills two of them and then moves the second one down. When nothing is
/// left to come out it takes whatever does not reach across the end of a window at once.
constexpr std::size_t kWindowBytes = 1u << MAX_WBITS;

}  // namespace

struct CompressedOutputStream::Compressor {
  Compressor() {
    // Negative window bits: raw data, without zlib's header and trailer.
    usable = sha512 && EVP_DigestInit_ex(sha512.get(), EVP_sha512(), nullptr) == 1 &&
             deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -MAX_WBITS, MAX_MEM_LEVEL - 1,
                          Z_DEFAULT_STRATEGY) == Z_OK;
  }
  ~Compressor() { deflateEnd(&stream); }
  Compressor(const Compressor&) = delete;
  Compressor& operator=(const Compressor&) = delete;

  const std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> sha512{EVP_MD_CTX_new(), EVP_MD_CTX_free};
  z_stream stream{};
  std::array<char, kDestBufferBytes> destBuffer;
  bool usable = false;
};

CompressedOutputStream::CompressedOutputStream()
    : CompressedOutputStream(std::make_unique<MemoryOutputStream>()) {}

CompressedOutputStream::CompressedOutputStream(std::unique_ptr<OutputStream> outputStream)
    : outputStream_(std::move(outputStream)),
      compressor_(std::make_unique<Compressor>()),
      status_(compressor_->usable ? running : failed) {}

CompressedOutputStream::~CompressedOutputStream() = default;

void CompressedOutputStream::open() {
  outputStream_->open();
}

std::ptrdiff_t CompressedOutputStream::write(std::string_view bytes) {
  if (status_ != running) return -1;
  bytes = bytes.substr(0, std::numeric_limits<uInt>::max());
  z_stream& stream = compressor_->stream;
  stream.next_in =
      reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));  // NOLINT(*-const-cast): read only
  stream.avail_in = static_cast<uInt>(bytes.size());
  do {
    // Once a step, not once a byte: peers depend on it.
    EVP_DigestUpdate(compressor_->sha512.get(), bytes.data(), bytes.size());
    step(Z_NO_FLUSH);
  } while (status_ == running && stream.avail_in > 0);
  const std::size_t consumed = bytes.size() - stream.avail_in;
  bytesRead_ += consumed;
  return static_cast<std::ptrdiff_t>(consumed);
}

/// Compresses what the buffer has room for and passes it on.
void CompressedOutputStream::step(int flush) {
  auto& [sha512, stream, buffer, usable] = *compressor_;
  stream.next_out = reinterpret_cast<Bytef*>(buffer.data());
  stream.avail_out = kDestBufferBytes;
  const int result = deflate(&stream, flush);
  // Having had nothing to do is no failure.
  if (result == Z_STREAM_END) status_ = finished;
  if (result != Z_STREAM_END && result != Z_OK && result != Z_BUF_ERROR) status_ = failed;
  bufferWasFull_ = stream.avail_out == 0;
  const std::string_view output(buffer.data(), kDestBufferBytes - stream.avail_out);
  if (!output.empty() && outputStream_->write(output) != static_cast<std::ptrdiff_t>(output.size()))
    status_ = failed;
}

bool CompressedOutputStream::writeOnce(std::string_view bytes) {
  while (status_ == running && !bytes.empty()) {
    // What is still to come out could fill the buffer again, and then the next bytes would wait.
    while (status_ == running && bufferWasFull_) write({});
    const auto piece = bytes.substr(0, kWindowBytes - bytesRead_ % kWindowBytes);
    bytes.remove_prefix(piece.size());
    write(piece);
  }
  return status_ == running;
}

void CompressedOutputStream::close() {
  if (!compressor_) return;
  compressor_->stream.avail_in = 0;
  while (status_ == running) step(Z_FINISH);
  EVP_DigestFinal_ex(compressor_->sha512.get(), digest_.data(), nullptr);
  compressor_.reset();
  outputStream_->close();
  if (outputStream_->streamError()) status_ = failed;
}

StreamStatus CompressedOutputStream::streamStatus() const {
  switch (status_) {
    case failed:
      return StreamStatus::error;
    case running:
      return StreamStatus::open;
    case finished:
      return StreamStatus::atEnd;
  }
  return StreamStatus::notOpen;
}

std::optional<Error> CompressedOutputStream::streamError() const {
  if (status_ != failed) return std::nullopt;
  if (auto error = outputStream_->streamError()) return error;
  return posixError(EIO, "compression");
}

std::string CompressedOutputStream::dataDigestForStream() const {
  return fmt::format("{:02x}", fmt::join(digest_, ""));
}

std::optional<std::string> decompressed(std::string_view compressed, std::uint64_t size) {
  constexpr std::uint64_t kMost = std::numeric_limits<uInt>::max();
  z_stream stream{};
  if (size > kMost || compressed.size() > kMost || inflateInit2(&stream, -MAX_WBITS) != Z_OK)
    return std::nullopt;
  const std::unique_ptr<z_stream, int (*)(z_stream*)> end(&stream, inflateEnd);
  std::string text(size, '\0');
  stream.next_in =
      reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));  // NOLINT(*-const-cast): read only
  stream.avail_in = static_cast<uInt>(compressed.size());
  stream.next_out = reinterpret_cast<Bytef*>(text.data());
  stream.avail_out = static_cast<uInt>(size);
  if (inflate(&stream, Z_FINISH) != Z_STREAM_END || stream.avail_out != 0) return std::nullopt;
  return text;
}

}  // namespace sable
