#include "sabled/ArchivedDataIterator.h"

#include <cstring>

#include "sabled/SableLogging.h"

namespace sable {

using namespace std::string_view_literals;

std::optional<std::string_view> ArchivedDataIterator::readNextObject() {
  const auto payload = next();
  if (payload) return *payload;
  SableLogForCategory(SableLoggingCategoryFeedbackStorage).error("{}", payload.error());
  return std::nullopt;
}

/// The payload of the next record, or what to say when there is none that is whole.
tl::expected<std::string_view, std::string_view> ArchivedDataIterator::next() {
  const std::uint64_t left = data_.size() - position_;
  if (left <= kArchivedLengthBytes) return tl::unexpected("out of range"sv);
  std::uint64_t length = 0;
  std::memcpy(&length, data_.data() + position_, sizeof length);
  if (length == 0) return tl::unexpected("empty data file"sv);
  if (length > left - kArchivedLengthBytes) return tl::unexpected("broken version string in file"sv);
  const auto payload = data_.substr(position_ + kArchivedLengthBytes, length);
  position_ += kArchivedLengthBytes + length;
  return payload;
}

}  // namespace sable
