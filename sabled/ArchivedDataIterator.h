#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <tl/expected.hpp>

namespace sable {

/// Bytes before a record's payload: its length, unsigned, in the byte order of the machine.
inline constexpr std::uint64_t kArchivedLengthBytes = 8;

/// Walks the records of a session file (see FileContainer). The bytes stay where they are; only
/// lengths are read. One thread at a time.
class ArchivedDataIterator {
 public:
  explicit ArchivedDataIterator(std::string_view data) : data_(data) {}

  /// The payload of the next record; nothing, and a log line, when there is none that is whole.
  std::optional<std::string_view> readNextObject();

  /// Passes over the next record; false when there is none that is whole. Logs nothing.
  bool skipNextObject() { return next().has_value(); }

  /// Whether a length could follow. Its payload, which may be missing, is not looked at: then
  /// readNextObject() tells.
  bool hasMore() const { return data_.size() - position_ >= kArchivedLengthBytes; }

  std::uint64_t position() const { return position_; }

 private:
  tl::expected<std::string_view, std::string_view> next();

  const std::string_view data_;
  std::uint64_t position_ = 0;  ///< never past the end
};

}  // namespace sable
