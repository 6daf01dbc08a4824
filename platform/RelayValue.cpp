#include "platform/RelayValue.h"

#include <algorithm>
#include <limits>

namespace sable::platform {

RelayRecord::RelayRecord() = default;
RelayRecord::RelayRecord(const RelayRecord&) = default;
RelayRecord::RelayRecord(RelayRecord&&) noexcept = default;
RelayRecord& RelayRecord::operator=(const RelayRecord&) = default;
RelayRecord& RelayRecord::operator=(RelayRecord&&) noexcept = default;
RelayRecord::~RelayRecord() = default;

void RelayRecord::add(std::string name, RelayValue value) {
  members_.push_back({std::move(name), std::move(value)});
}

const RelayValue* RelayRecord::find(std::string_view name) const {
  const auto found = std::ranges::find(members_, name, &RelayMember::name);
  return found == members_.end() ? nullptr : &found->value;
}

bool RelayRecord::empty() const {
  return members_.empty();
}

namespace {

template <class T>
const T* member(const RelayRecord& record, std::string_view name) {
  const RelayValue* value = record.find(name);
  return value == nullptr ? nullptr : std::get_if<T>(value);
}

}  // namespace

std::optional<std::string> RelayRecord::string(std::string_view name) const {
  const auto* text = member<std::string>(*this, name);
  return text == nullptr ? std::nullopt : std::optional(*text);
}

std::optional<std::uint64_t> RelayRecord::unsignedInteger(std::string_view name) const {
  if (const auto* value = member<std::uint64_t>(*this, name)) return *value;
  if (const auto* value = member<std::int64_t>(*this, name); value != nullptr && *value >= 0) {
    return static_cast<std::uint64_t>(*value);
  }
  return std::nullopt;
}

std::optional<std::int64_t> RelayRecord::signedInteger(std::string_view name) const {
  if (const auto* value = member<std::int64_t>(*this, name)) return *value;
  if (const auto* value = member<std::uint64_t>(*this, name);
      value != nullptr && *value <= std::uint64_t{std::numeric_limits<std::int64_t>::max()}) {
    return static_cast<std::int64_t>(*value);
  }
  return std::nullopt;
}

std::optional<double> RelayRecord::number(std::string_view name) const {
  if (const auto* value = member<double>(*this, name)) return *value;
  if (const auto* value = member<std::int64_t>(*this, name)) return static_cast<double>(*value);
  if (const auto* value = member<std::uint64_t>(*this, name)) return static_cast<double>(*value);
  return std::nullopt;
}

std::optional<bool> RelayRecord::boolean(std::string_view name) const {
  const auto* value = member<bool>(*this, name);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

}  // namespace sable::platform
