#pragma once

#include <cstdint>

#include "sabled/OutputStream.h"

namespace sable {

/// Forgets its bytes and counts them. Never fails.
class NullStream final : public OutputStream {
 public:
  void open() override {}
  std::ptrdiff_t write(std::string_view bytes) override {
    bytesWritten_ += bytes.size();
    return static_cast<std::ptrdiff_t>(bytes.size());
  }
  void close() override {}
  StreamStatus streamStatus() const override { return StreamStatus::open; }
  std::optional<Error> streamError() const override { return std::nullopt; }

  std::uint64_t bytesWritten() const { return bytesWritten_; }

 private:
  std::uint64_t bytesWritten_ = 0;
};

}  // namespace sable
