#include "sabled/ArchivedDataIterator.h"

#include <cstring>

#include "sabled/SableLogging.h"

namespace sable {

std::optional<std::string_view> ArchivedDataIterator::readNextObject() {
  const auto& log = SableLogForCategory(SableLoggingCategoryFeedbackStorage);
  const std::uint64_t left = data_.size() - position_;
  if (left <= kArchivedLengthBytes) {
    log.error("out of range");
    return std::nullopt;
  }
  std::uint64_t length = 0;
  std::memcpy(&length, data_.data() + position_, sizeof length);
  if (length == 0) {
    log.error("empty data file");
    return std::nullopt;
  }
  if (length > left - kArchivedLengthBytes) {
    log.error("broken version string in file");
    return std::nullopt;
  }
  const auto payload = data_.substr(position_ + kArchivedLengthBytes, length);
  position_ += kArchivedLengthBytes + length;
  return payload;
}

}  // namespace sable
