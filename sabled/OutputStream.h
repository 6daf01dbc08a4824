#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace sable {

enum class StreamStatus { notOpen, open, atEnd, error };

/// Takes bytes in order, until it is closed or fails. One thread at a time.
class OutputStream {
 public:
  virtual ~OutputStream() = default;

  virtual void open() = 0;
  /// How many of the bytes were taken; -1 when the stream has failed, or takes no more.
  virtual std::ptrdiff_t write(std::string_view bytes) = 0;
  virtual void close() = 0;

  virtual StreamStatus streamStatus() const = 0;
  /// Of kPOSIXErrorDomain, where the status is `error`.
  virtual std::optional<Error> streamError() const = 0;
};

/// Keeps its bytes in memory. Never fails.
class MemoryOutputStream final : public OutputStream {
 public:
  void open() override {}
  std::ptrdiff_t write(std::string_view bytes) override {
    bytes_ += bytes;
    return static_cast<std::ptrdiff_t>(bytes.size());
  }
  void close() override {}
  StreamStatus streamStatus() const override { return StreamStatus::open; }
  std::optional<Error> streamError() const override { return std::nullopt; }

  const std::string& bytes() const { return bytes_; }

 private:
  std::string bytes_;
};

}  // namespace sable
