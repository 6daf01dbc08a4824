#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <string>

#include "sabled/OutputStream.h"

namespace sable {

/// Compresses what it is given (raw DEFLATE, RFC 1951: no header, no checksum) into another stream,
/// and takes a SHA-512 digest (FIPS 180-4) of what comes in.
///
///     made --write, write, ...--> close --> the digest is there
///          --the compressor or the other stream fails--> error, whatever follows
class CompressedOutputStream final : public OutputStream {
 public:
  CompressedOutputStream();  ///< into memory
  explicit CompressedOutputStream(std::unique_ptr<OutputStream> outputStream);
  ~CompressedOutputStream() override;

  void open() override;
  /// Compresses in steps of at most 4096 bytes of output. Bytes that take several steps enter the
  /// digest once with each: only those of writeOnce() are sure to enter it once.
  std::ptrdiff_t write(std::string_view bytes) override;
  /// Writes all the bytes so that the digest of a stream written by nothing else is the SHA-512 of
  /// what was written; false when the stream fails.
  bool writeOnce(std::string_view bytes);
  /// Ends the compressed data and closes the other stream.
  void close() override;

  bool hasSpaceAvailable() const { return true; }
  StreamStatus streamStatus() const override;
  std::optional<Error> streamError() const override;

  /// 128 lower-case hexadecimal characters; all 0 before close().
  std::string dataDigestForStream() const;
  std::uint64_t bytesRead() const { return bytesRead_; }  ///< what came in
  OutputStream& outputStream() const { return *outputStream_; }

 private:
  enum Status : std::int32_t { failed = -1, running = 0, finished = 1 };
  struct Compressor;

  void step(int flush);

  const std::unique_ptr<OutputStream> outputStream_;
  std::unique_ptr<Compressor> compressor_;  ///< null when closed
  Status status_ = running;
  bool bufferWasFull_ = false;  ///< after the last step: there may be more output to come
  std::uint64_t bytesRead_ = 0;
  std::array<std::uint8_t, 64> digest_{};
};

/// What a CompressedOutputStream has compressed from `size` bytes; nothing when it is not that.
std::optional<std::string> decompressed(std::string_view compressed, std::uint64_t size);

}  // namespace sable
